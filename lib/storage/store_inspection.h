// What one slot of a dual-file store holds, looked at without changing
// anything: no directory is made, no check file removed, no link followed
// below the target's directory (which, like the store's, may itself be a
// link), no FIFO waited on. Validity and the current copy come from the
// store's own rules (copy_check.h), so a report agrees with what a
// DualFileTarget opened on the same tree would serve. The locks of a
// change in progress are only tried, never waited on (slot_lock.h).
#pragma once

#include <array>
#include <cstdint>
#include <ctime>
#include <filesystem>
#include <string>

#include "lib/storage/copy_check.h"
#include "lib/storage/slot_lock.h"

namespace Storage {

enum class EntryKind { kMissing, kFile, kDirectory, kLink, kFifo, kSocket, kDevice };

// "missing", "file", "directory", "link", "fifo", "socket", "device".
const char* entryKindName(EntryKind kind);

// One entry of a copy directory, as lstat sees it.
struct EntryInfo {
    EntryKind kind = EntryKind::kMissing;
    int64_t size = 0;
    struct timespec modified {};
};

struct CopyInspection {
    CopyCheck check;  // the store's judgement
    // The first directory on the way to the copy's files that is not a
    // directory ("0", "0/1", "1", relative to the target's directory), and
    // what it is; empty `blockedAt` when the way is clear or only missing.
    std::string blockedAt;
    EntryKind blockedKind = EntryKind::kMissing;
    EntryInfo data;
    EntryInfo checkFile;
    EntryInfo transient;  // the ".tmp" of an interrupted commit
    // The data file's CRC-32, when it is a regular file that read whole;
    // else dataError holds the errno.
    bool crcKnown = false;
    uint32_t crc32 = 0;
    int dataError = 0;
    // A change holds the copy's lock: it is being rewritten, and what looks
    // damaged is the change's half-made copy.
    bool beingRewritten = false;

    // Any store entry (data, check or ".tmp" file, or something planted on
    // the way) is there.
    bool hasEntries() const;
};

enum class SlotState {
    kPresent,     // the current copy is valid and has a data file
    kAbsentBlob,  // the current copy is valid without a data file: a committed erase
    kEmpty,       // nothing was ever written
    kLost,        // entries exist but the current copy is not valid
};

// "present", "absent-blob", "empty", "lost".
const char* slotStateName(SlotState state);

struct SlotInspection {
    std::array<CopyInspection, 2> copies;
    unsigned current = 0;  // the copy that reads see, 0 or 1
    SlotState state = SlotState::kEmpty;
    bool changeInProgress = false;  // a change holds the slot's lock
};

// Shared locks on the copies that no change was rewriting, tried once each
// and held while both are judged: no change rewrites those copies
// meanwhile, so the judgement is of one moment. Held on by a dump until
// its last byte, they keep it true.
struct InspectionLocks {
    std::array<SlotLock, 2> copies;
};

// Inspects slot `index` of the dual-file target at `targetPath` with
// `slotCount` slots. A target directory that does not exist holds empty
// slots. Returns 0, or the errno when the target's directory exists but
// cannot be opened (then `slot` is left as it was). With `keep`, the
// copies' locks stay held in it.
[[nodiscard]] int inspectSlot(const std::filesystem::path& targetPath, size_t slotCount, size_t index,
                              SlotInspection& slot, InspectionLocks* keep = nullptr);

// Writes the data of copy `copy` of the slot to `out` whole, reaching it as
// reads of the store do; the locks an inspection kept make it the copy
// that inspection judged. 0, or the errno of the failing open, read or
// write.
[[nodiscard]] int copySlotData(const std::filesystem::path& targetPath, size_t slotCount, size_t index, unsigned copy,
                               int out);

}  // namespace Storage
