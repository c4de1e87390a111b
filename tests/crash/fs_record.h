// The record the fault-injection shim writes under FAULT_RECORD (see
// tests/fault_injection/fault_injection_shim.c): one file-system operation
// per line, in the order the program made them.
#pragma once

#include <cstdint>
#include <ctime>
#include <filesystem>
#include <string>
#include <vector>

namespace crash {

enum class FsOpKind { kCreate, kTruncate, kWrite, kUnlink, kRmdir, kMkdir, kRename, kUtimens, kFsync, kSyncfs, kChmod };

// The fields a line of its kind carries; the others keep their defaults.
struct FsOp {
    FsOpKind kind;
    std::string path;            // unescaped; the source of a rename
    std::string toPath;          // rename
    uint64_t inode = 0;          // all but rmdir, mkdir, syncfs
    uint64_t replacedInode = 0;  // rename: what toPath named before, 0 for nothing
    int64_t offset = 0;          // write
    uint64_t size = 0;           // truncate
    std::vector<uint8_t> data;   // write
    struct timespec mtime {};    // create, truncate, write, utimens
};

// Every line of `text`, which must end in a newline unless empty. Throws
// std::runtime_error naming the line (number and text) when one is
// malformed: an unknown kind, a missing or extra field, a number out of
// range, a bad escape, hex of odd length or "?" for bytes not read back.
std::vector<FsOp> parseFsRecord(const std::string& text);

// parseFsRecord of the file; an empty list when it does not exist. Throws
// std::runtime_error when it exists but cannot be read.
std::vector<FsOp> readFsRecord(const std::filesystem::path& file);

// The record line of `op` without its newline (what parseFsRecord reads
// back into `op`), for failure messages.
std::string describe(const FsOp& op);

}  // namespace crash
