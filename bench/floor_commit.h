// The floor of a one-shot write: the system calls of the dual-file store's
// commit and nothing else. The copy's check file is removed, the data file is
// truncated, written and synced, an 8-byte check file is written under a
// temporary name and renamed over the check file, and the file system is
// synced. No checksum is computed (the check file holds the size only),
// nothing is read back, validated or re-timed. Whatever the store spends
// above this is its own cost.
#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <string>

namespace bench {

// The three file names of one copy, named as the store names them:
// "<directory>/data", "<directory>/data.chk" and "<directory>/data.chk.tmp".
// The directory must exist.
struct FloorCopy {
    explicit FloorCopy(const std::filesystem::path& directory);

    std::string data;
    std::string check;
    std::string tmp;
};

// Writes `size` bytes at `data` as `copy` with ten system calls: unlink (the
// check file), open, write, fsync, close (the data file), open, write,
// rename, syncfs, close (the new check file). Returns 0, or the errno of the
// first call that failed (EIO for a short write).
int floorCommit(const FloorCopy& copy, const uint8_t* data, size_t size);

}  // namespace bench
