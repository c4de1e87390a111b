// The log that the kernel's log-writes device-mapper target keeps of every
// write to the device it sits on, in the order the writes reached stable
// storage (a write is logged only after a flush covered it).
//
// Layout, all integers little-endian, in units of the log's sector size:
// sector 0 holds the super block (magic, version 1, number of entries,
// sector size); the entries follow from sector 1, each a header sector
// (sector, number of sectors, flags, length of the inline text), the text
// of a mark right after the header in the same sector, and for a write
// its data in the sectors after the header. A discard carries no data.
#pragma once

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

namespace replay {

constexpr uint64_t kWriteLogMagic = 0x6a736677736872;
constexpr uint64_t kWriteLogVersion = 1;

enum EntryFlag : uint64_t {
    kFlush = 1,
    kFua = 2,
    kDiscard = 4,
    kMark = 8,
    kMetadata = 16,  // a write the file system marked as its metadata
};

struct LogEntry {
    uint64_t sector = 0;  // first sector written, in the log's sector size
    uint64_t sectorCount = 0;
    uint64_t flags = 0;
    std::string mark;           // a mark's text
    std::vector<uint8_t> data;  // a write's bytes, sectorCount sectors

    bool isMark() const { return (flags & kMark) != 0; }
    bool isDiscard() const { return (flags & kDiscard) != 0; }
    // A flush or a forced-unit-access write: what came before it is on the
    // medium when it completes.
    bool isBarrier() const { return (flags & (kFlush | kFua)) != 0; }
    // Changes the device's bytes.
    bool writes() const { return !isMark() && sectorCount > 0; }
};

struct WriteLog {
    uint32_t sectorSize = 512;
    std::vector<LogEntry> entries;
};

// The log in `bytes` (the log device's contents, or a file of them).
// Throws std::runtime_error naming what is wrong: a bad magic or version, a
// sector size that is not a power of two from 512 on, an unknown flag, an
// entry or its data beyond the end.
WriteLog parseWriteLog(const std::vector<uint8_t>& bytes);

// parseWriteLog of the file or block device `path`, read only as far as
// the log goes.
WriteLog readWriteLog(const std::filesystem::path& path);

// The log as the target would have written it (for tests and for cutting
// a log down to a part of it).
std::vector<uint8_t> encodeWriteLog(const WriteLog& log);

}  // namespace replay
