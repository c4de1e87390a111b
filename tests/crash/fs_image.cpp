#include "fs_image.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <stdexcept>
#include <string_view>
#include <system_error>

#include "files.h"

namespace crash {

namespace fs = std::filesystem;

void FsImage::dropName(const std::string& path) {
    const auto found = names.find(path);
    if (found == names.end()) return;
    const uint64_t inode = found->second;
    names.erase(found);
    for (const auto& [name, other] : names) {
        if (other == inode) return;
    }
    files.erase(inode);
}

FsImage snapshotTree(const fs::path& root) {
    FsImage image;
    for (const fs::directory_entry& entry : fs::recursive_directory_iterator(root)) {
        const std::string relative = entry.path().lexically_relative(root).string();
        struct stat status {};
        if (::lstat(entry.path().c_str(), &status) != 0) {
            throw std::system_error(errno, std::generic_category(), "lstat " + entry.path().string());
        }
        if (S_ISDIR(status.st_mode)) {
            image.directories.insert(relative);
        } else if (S_ISREG(status.st_mode)) {
            image.names[relative] = status.st_ino;
            image.files[status.st_ino] = FileNode{testing_support::readBytes(entry.path()), status.st_mtim};
        } else {
            throw std::runtime_error("unexpected file type in a store: " + entry.path().string());
        }
    }
    return image;
}

void materialise(const FsImage& image, const fs::path& root) {
    fs::create_directory(root);
    for (const std::string& directory : image.directories) fs::create_directories(root / directory);
    for (const auto& [name, inode] : image.names) {
        const FileNode& file = image.files.at(inode);
        const fs::path path = root / name;
        testing_support::writeBytes(path, file.data);
        const timespec times[2] = {file.mtime, file.mtime};
        if (::utimensat(AT_FDCWD, path.c_str(), times, 0) != 0) {
            throw std::system_error(errno, std::generic_category(), "utimensat " + path.string());
        }
    }
}

std::string fingerprint(const FsImage& image) {
    std::string text;
    for (const std::string& directory : image.directories) text += "d " + directory + '\n';
    for (const auto& [name, inode] : image.names) {
        const FileNode& file = image.files.at(inode);
        const std::string_view data(reinterpret_cast<const char*>(file.data.data()), file.data.size());
        text += "f " + name + ' ' + std::to_string(file.mtime.tv_sec) + '.' + std::to_string(file.mtime.tv_nsec) + ' ' +
                std::to_string(file.data.size()) + ' ' + std::to_string(std::hash<std::string_view>{}(data)) + '\n';
    }
    return text;
}

}  // namespace crash
