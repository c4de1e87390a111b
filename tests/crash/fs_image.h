// A directory tree as plain data: what a crash leaves behind, built from a
// snapshot and a record of operations, written out again for the store to
// open. Paths are relative to the tree's root; files are keyed by inode so
// that renames and writes through open descriptors land on the right file.
#pragma once

#include <cstdint>
#include <ctime>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <vector>

namespace crash {

using Bytes = std::vector<uint8_t>;

struct FileNode {
    Bytes data;
    timespec mtime{};
};

struct FsImage {
    std::set<std::string> directories;
    std::map<std::string, uint64_t> names;  // path -> inode
    std::map<uint64_t, FileNode> files;     // inode -> contents

    // Removes `path`, and its file once no other name refers to it.
    void dropName(const std::string& path);
};

// The directories and regular files below `root` (not `root` itself), with
// their inode numbers, contents and modification times.
FsImage snapshotTree(const std::filesystem::path& root);

// Creates `root` (which must not exist) holding exactly `image`, with the
// files' modification times set as recorded.
void materialise(const FsImage& image, const std::filesystem::path& root);

// A canonical text of the tree: names, times, sizes and a 64-bit hash of
// each file's contents, not inodes. Two images with the same fingerprint
// look the same to any reader, short of a hash collision.
std::string fingerprint(const FsImage& image);

}  // namespace crash
