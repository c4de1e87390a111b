// Planting what a less trusted program could leave where a store keeps its
// files, and checking that nothing outside the store was touched.
#pragma once

#include <filesystem>
#include <string>
#include <vector>

namespace testing_support {

// What gets planted.
enum class Plant {
    kLinkToFile,       // a symbolic link to the victim file
    kLinkToDirectory,  // a symbolic link to the victim directory
    kDanglingLink,     // a symbolic link to a name beside the victims that does not exist
    kLinkLoop,         // a symbolic link to itself
    kFifo,
    kSocket,
    kDirectory,   // a directory holding a file, so that it cannot be removed
    kDeviceNode,  // a character device with the numbers of /dev/zero
    // Hard links, which no open can tell from the file's own name: a
    // hard link to
    kHardLinkToFile,          // the victim file (of another owner when made as root)
    kHardLinkToRootOnlyFile,  // a file of mode 0600
    kHardLinkToStoreFile,     // another store's data file
};

const std::vector<Plant>& allPlants();
// A hard link is a regular file to every open; the others are not.
bool isHardLink(Plant plant);
// "link_to_file", "fifo", ...: usable in test names.
std::string plantName(Plant plant);

// Files and a directory (holding a file) outside the store, with fixed
// contents, modes and times, that no planted link may let a store touch.
class Victims {
public:
    // Made in `directory` (which must not exist yet).
    explicit Victims(const std::filesystem::path& directory);

    // Owned by "nobody" (65534) when made as root.
    const std::filesystem::path& file() const { return file_; }
    const std::filesystem::path& rootOnlyFile() const { return rootOnlyFile_; }
    const std::filesystem::path& storeFile() const { return storeFile_; }
    const std::filesystem::path& directory() const { return directory_; }
    // The name a dangling link points to.
    const std::filesystem::path& missing() const { return missing_; }

private:
    std::filesystem::path file_;
    std::filesystem::path rootOnlyFile_;
    std::filesystem::path storeFile_;
    std::filesystem::path directory_;
    std::filesystem::path missing_;
};

// Puts `plant` at `where`, after removing whatever is there; its parent is
// made when missing. Returns false, saying why in `reason`, when this
// process may not make it (a device node needs CAP_MKNOD; a hard link, the
// victims on the same file system).
bool plantAt(const std::filesystem::path& where, Plant plant, const Victims& victims, std::string& reason);

// One line per entry below `root`, sorted, none followed: kind, path,
// mode, owner, modification time in nanoseconds, and the bytes of a file or the
// target of a link. Entries whose path starts with one of `skipped` (paths
// below `root`) are left out, with everything in them.
std::string snapshotTree(const std::filesystem::path& root, const std::vector<std::filesystem::path>& skipped = {});

}  // namespace testing_support
