#include "hostile_tree.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/un.h>
#include <unistd.h>
#include <algorithm>
#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "enum_names.h"
#include "files.h"

namespace testing_support {
namespace fs = std::filesystem;
namespace {

// Fixed, clearly past times: any write or creation would move them.
constexpr time_t kVictimTime = 1262304000;  // 2010-01-01
constexpr uid_t kNobody = 65534;

void setTimes(const fs::path& path) {
    const struct timespec times[2] = {{kVictimTime, 0}, {kVictimTime, 0}};
    if (::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) {
        throw std::runtime_error("cannot date " + path.string() + ": " + std::strerror(errno));
    }
}

void check(bool done, const std::string& what, const fs::path& path) {
    if (!done) throw std::runtime_error(what + " " + path.string() + ": " + std::strerror(errno));
}

void makeSocket(const fs::path& where) {
    const int listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    check(listener >= 0, "socket for", where);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (where.string().size() >= sizeof address.sun_path) {
        ::close(listener);
        throw std::runtime_error("socket path too long: " + where.string());
    }
    std::strcpy(address.sun_path, where.c_str());
    const bool bound = ::bind(listener, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
    ::close(listener);  // the socket file stays; nobody listens on it
    check(bound, "bind", where);
}

bool hardLink(const fs::path& target, const fs::path& where, std::string& reason) {
    if (::link(target.c_str(), where.c_str()) == 0) return true;
    reason = "link " + where.string() + " to " + target.string() + ": " + std::strerror(errno);
    return false;
}

std::string entryLine(const fs::path& path, const std::string& relative) {
    struct stat status {};
    check(::lstat(path.c_str(), &status) == 0, "lstat", path);
    std::string line = relative + " mode=" + std::to_string(status.st_mode) +
                       " owner=" + std::to_string(status.st_uid) + ":" + std::to_string(status.st_gid) +
                       " mtime=" + std::to_string(status.st_mtim.tv_sec) + "." + std::to_string(status.st_mtim.tv_nsec);
    if (S_ISREG(status.st_mode)) line += " bytes=" + hex(readBytes(path));
    if (S_ISLNK(status.st_mode)) line += " target=" + fs::read_symlink(path).string();
    if (S_ISCHR(status.st_mode) || S_ISBLK(status.st_mode)) line += " rdev=" + std::to_string(status.st_rdev);
    return line;
}

}  // namespace

// Every plant with its name, in the order the sweeps meet them.
constexpr EnumName<Plant> kPlantNames[] = {{Plant::kLinkToFile, "link_to_file"},
                                           {Plant::kLinkToDirectory, "link_to_directory"},
                                           {Plant::kDanglingLink, "dangling_link"},
                                           {Plant::kLinkLoop, "link_loop"},
                                           {Plant::kFifo, "fifo"},
                                           {Plant::kSocket, "socket"},
                                           {Plant::kDirectory, "directory"},
                                           {Plant::kDeviceNode, "device_node"},
                                           {Plant::kHardLinkToFile, "hard_link_to_file"},
                                           {Plant::kHardLinkToRootOnlyFile, "hard_link_to_root_only_file"},
                                           {Plant::kHardLinkToStoreFile, "hard_link_to_store_file"}};

const std::vector<Plant>& allPlants() {
    static const std::vector<Plant> plants = [] {
        std::vector<Plant> all;
        for (const EnumName<Plant>& entry : kPlantNames) all.push_back(entry.first);
        return all;
    }();
    return plants;
}

bool isHardLink(Plant plant) {
    return plant == Plant::kHardLinkToFile || plant == Plant::kHardLinkToRootOnlyFile ||
           plant == Plant::kHardLinkToStoreFile;
}

std::string plantName(Plant plant) { return nameIn(kPlantNames, plant); }

Victims::Victims(const fs::path& directory)
    : file_(directory / "victim-file"),
      rootOnlyFile_(directory / "root-only-file"),
      storeFile_(directory / "other-store" / "1" / "data"),
      directory_(directory / "victim-directory"),
      missing_(directory / "missing") {
    fs::create_directory(directory);
    writeText(file_, "victim bytes\n");
    if (::geteuid() == 0) check(::chown(file_.c_str(), kNobody, kNobody) == 0, "chown", file_);
    writeText(rootOnlyFile_, "only root reads these bytes\n");
    fs::permissions(rootOnlyFile_, fs::perms::owner_read | fs::perms::owner_write);
    fs::create_directories(storeFile_.parent_path());
    writeText(storeFile_, "another store's blob\n");
    fs::create_directory(directory_);
    writeText(directory_ / "inside", "inside the victim directory\n");
    for (const fs::path& path : {directory_ / "inside", file_, rootOnlyFile_, storeFile_, storeFile_.parent_path(),
                                 storeFile_.parent_path().parent_path(), directory_, directory}) {
        setTimes(path);
    }
}

bool plantAt(const fs::path& where, Plant plant, const Victims& victims, std::string& reason) {
    fs::remove_all(where);
    fs::create_directories(where.parent_path());
    switch (plant) {
        case Plant::kLinkToFile:
            fs::create_symlink(victims.file(), where);
            break;
        case Plant::kLinkToDirectory:
            fs::create_directory_symlink(victims.directory(), where);
            break;
        case Plant::kDanglingLink:
            fs::create_symlink(victims.missing(), where);
            break;
        case Plant::kLinkLoop:
            fs::create_symlink(where.filename(), where);
            break;
        case Plant::kFifo:
            check(::mkfifo(where.c_str(), 0666) == 0, "mkfifo", where);
            break;
        case Plant::kSocket:
            makeSocket(where);
            break;
        case Plant::kDirectory:
            fs::create_directory(where);
            writeText(where / "planted", "planted\n");
            break;
        case Plant::kDeviceNode:
            if (::mknod(where.c_str(), S_IFCHR | 0666, makedev(1, 5)) != 0) {
                reason = std::string("mknod: ") + std::strerror(errno) + " (needs CAP_MKNOD)";
                return false;
            }
            break;
        case Plant::kHardLinkToFile:
            return hardLink(victims.file(), where, reason);
        case Plant::kHardLinkToRootOnlyFile:
            return hardLink(victims.rootOnlyFile(), where, reason);
        case Plant::kHardLinkToStoreFile:
            return hardLink(victims.storeFile(), where, reason);
    }
    return true;
}

std::string snapshotTree(const fs::path& root, const std::vector<fs::path>& skipped) {
    std::vector<std::string> lines = {entryLine(root, ".")};
    for (auto it = fs::recursive_directory_iterator(root); it != fs::recursive_directory_iterator(); ++it) {
        const fs::path relative = it->path().lexically_relative(root);
        const bool skip = std::any_of(skipped.begin(), skipped.end(), [&](const fs::path& prefix) {
            const auto mismatch = std::mismatch(prefix.begin(), prefix.end(), relative.begin(), relative.end());
            return mismatch.first == prefix.end();
        });
        if (skip) {
            it.disable_recursion_pending();
            continue;
        }
        lines.push_back(entryLine(it->path(), relative.string()));
    }
    std::sort(lines.begin(), lines.end());
    std::string text;
    for (const auto& line : lines) text += line + "\n";
    return text;
}

}  // namespace testing_support
