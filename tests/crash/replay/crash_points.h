// The states of a device that a power cut can leave, given the log of the
// writes that reached it (write_log.h): the points of the log at which to
// cut, and how to lay each one onto a copy of the device.
//
// Writes are logged in the order they completed, and only once a flush
// covered them; a flush entry closes an epoch. Before that flush
// completes, the epoch's writes may sit in the device's volatile cache, so
// a cut can keep any subset of them, but for a forced-unit-access write:
// it was on the medium when it completed. A write that was being programmed
// when the power failed may land in part: each of its sectors old, new,
// all zeros or all 0xFF (an erased flash block).
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "write_log.h"

namespace replay {

enum class CrashKind {
    kBarrier,    // after a flush or forced-unit-access entry
    kPrefix,     // after any entry, in completion order
    kReordered,  // an epoch's prefix plus a subset of its writes
    kTorn,       // a prefix, then the next write in part
};

enum class SectorFate : uint8_t { kOld, kNew, kZeros, kErased };

struct CrashPoint {
    CrashKind kind = CrashKind::kPrefix;
    size_t prefix = 0;              // the log's first `prefix` entries applied in order
    std::vector<size_t> extra;      // kReordered: further entries applied, ascending
    size_t torn = 0;                // kTorn: the entry landed in part
    std::vector<SectorFate> fates;  // kTorn: one per sector of that entry

    // The last entry whose effect the point includes, plus one: the marks
    // before it tell what had been acknowledged.
    size_t reach() const;
    std::string describe() const;
};

struct CrashPointChoice {
    bool barriers = true;
    bool prefixes = true;
    // Subsets of an epoch's writes (never none, never all): every one when
    // they number no more than this, else this many, seeded.
    size_t subsetsPerEpoch = 20;
    // Torn variants of every write, seeded.
    size_t tornPerWrite = 4;
    uint64_t seed = 1;
};

// Every crash point of `log` the choice asks for, each kind in log order.
std::vector<CrashPoint> crashPoints(const WriteLog& log, const CrashPointChoice& choice);

// The sectors (in the log's sector size) that a point gives new bytes,
// each with its bytes; every other sector keeps what it held when the log
// started.
using SectorOverlay = std::map<uint64_t, std::vector<uint8_t>>;

// What `point` lays onto a device of `deviceSectors` sectors. Throws
// std::out_of_range when an entry lies beyond the device.
SectorOverlay crashOverlay(const WriteLog& log, const CrashPoint& point, uint64_t deviceSectors);

// Lays `point` onto `device`, the device's bytes when the log started.
// Throws std::out_of_range when an entry lies beyond the device.
void applyCrashPoint(const WriteLog& log, const CrashPoint& point, std::vector<uint8_t>& device);

}  // namespace replay
