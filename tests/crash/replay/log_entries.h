// Log entries made by hand, for the tests of the log reader and of the
// crash points.
#pragma once

#include <cstdint>
#include <string>

#include "write_log.h"

namespace replay {

// A write of `count` sectors, every byte `fill`.
inline LogEntry writeEntry(uint64_t sector, uint64_t count, uint8_t fill, uint64_t flags = 0,
                           uint32_t sectorSize = 512) {
    LogEntry entry;
    entry.sector = sector;
    entry.sectorCount = count;
    entry.flags = flags;
    entry.data.assign(count * sectorSize, fill);
    return entry;
}

inline LogEntry flushEntry() {
    LogEntry entry;
    entry.flags = kFlush;
    return entry;
}

inline LogEntry markEntry(const std::string& text) {
    LogEntry entry;
    entry.flags = kMark;
    entry.mark = text;
    return entry;
}

inline LogEntry discardEntry(uint64_t sector, uint64_t count) {
    LogEntry entry;
    entry.sector = sector;
    entry.sectorCount = count;
    entry.flags = kDiscard;
    return entry;
}

}  // namespace replay
