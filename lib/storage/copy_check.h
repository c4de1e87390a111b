// The rules by which opening a dual-file slot judges its two copies and
// picks the one that reads see, shared by the store and by read-only
// inspection. Nothing here changes a file.
#pragma once

#include <sys/stat.h>
#include <cstdint>

#include "lib/storage/check_value.h"

namespace Storage {

class SlotDirectories;

// What a copy's check file was when it was last judged, as lstat sees it.
// Every commit renames a new file there whose time is later than any
// before it, and every change first removes the old one, so a check file
// whose identity is unchanged vouches for the same data as when it was
// judged.
struct CheckIdentity {
    enum class Kind { kMissing, kRegular, kOther };
    Kind kind = Kind::kMissing;
    dev_t device = 0;  // these three for a regular file only
    ino_t inode = 0;
    struct timespec modified {};
};

bool operator==(const CheckIdentity& a, const CheckIdentity& b);
inline bool operator!=(const CheckIdentity& a, const CheckIdentity& b) { return !(a == b); }

// The identity of the entry whose lstat (or, for a regular file, fstat) is
// `status`.
CheckIdentity checkIdentityOf(const struct stat& status);

// Why a copy is not valid, in the order the check meets them.
enum class CopyFault {
    kNone,             // valid: the check file vouches for the data
    kNoCheckFile,      // the check file, or a directory above it, does not exist
    kCheckUnopenable,  // error: ELOOP or ENOTDIR for a link on the way, EISDIR or ENXIO for
                       // something that is not a regular file, else the open's errno
    kCheckSize,        // the check file does not hold exactly 8 bytes; checkSize says how many
    kCheckUnreadable,  // error: the check file's read failed
    kNoDataFile,       // the check value names a blob but there is no data file
    kDataUnreadable,   // error: the data file could not be opened (as above) or read
    kSizeDiffers,      // the data's size is not the one in the check value
    kCrcDiffers,       // the data's CRC-32 is not the one in the check value
};

struct CopyCheck {
    CopyFault fault = CopyFault::kNoCheckFile;
    int error = 0;           // the errno, for the faults that name one
    int64_t checkSize = 0;   // kCheckSize
    CheckTime checkTime;     // the check file's, whenever it opened
    CheckIdentity identity;  // the check file's, as judged

    bool valid() const { return fault == CopyFault::kNone; }
};

// The copy's check or data file could not be opened or read for a cause
// below the store's tree (a failing card, the file system, permissions)
// rather than for what the tree holds there (a link, something that is not
// a regular file). Such a copy is not valid like any other, but the cause
// is worth a log line.
bool failedToRead(const CopyCheck& check);

// Judges copy 0 or 1 by its check file and data file. The stored value is
// read first: data that no check file vouches for is not read.
CopyCheck checkCopy(SlotDirectories& directories, unsigned copy);

// The copy that reads see: copy 1 when it is valid and its check file is
// strictly later than copy 0's (or copy 0 is invalid and copy 1's time is
// known); copy 0 in every other case, equal times included.
unsigned currentCopy(const CopyCheck& copy0, const CopyCheck& copy1);

}  // namespace Storage
