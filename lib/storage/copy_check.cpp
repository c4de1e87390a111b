#include "lib/storage/copy_check.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <cerrno>

#include "lib/storage/slot_directories.h"

namespace Storage {
namespace {

// The data half of the judgement, once the stored value is known.
CopyCheck judgeData(SlotDirectories& directories, unsigned copy, uint64_t stored, CopyCheck result) {
    struct stat status {};
    const UniqueFd data = directories.openForReading(copy, kDataName, status);
    if (!data) {
        const int error = errno;
        if (error != ENOENT) {
            result.fault = CopyFault::kDataUnreadable;
            result.error = error;
        } else {
            // A committed absent blob has no data file.
            result.fault = stored == kAbsentBlobCheckValue ? CopyFault::kNone : CopyFault::kNoDataFile;
        }
        return result;
    }
    switch (compareCheckValue(data.get(), status, stored)) {
        case CheckMatch::kMatches:
            result.fault = CopyFault::kNone;
            break;
        case CheckMatch::kSizeDiffers:
            result.fault = CopyFault::kSizeDiffers;
            break;
        case CheckMatch::kCrcDiffers:
            result.fault = CopyFault::kCrcDiffers;
            break;
        case CheckMatch::kUnreadable:
            result.fault = CopyFault::kDataUnreadable;
            result.error = errno;
            break;
    }
    return result;
}

}  // namespace

bool operator==(const CheckIdentity& a, const CheckIdentity& b) {
    return a.kind == b.kind && a.device == b.device && a.inode == b.inode && a.modified.tv_sec == b.modified.tv_sec &&
           a.modified.tv_nsec == b.modified.tv_nsec;
}

CheckIdentity checkIdentityOf(const struct stat& status) {
    CheckIdentity identity;
    if (!S_ISREG(status.st_mode)) {
        identity.kind = CheckIdentity::Kind::kOther;
        return identity;
    }
    identity.kind = CheckIdentity::Kind::kRegular;
    identity.device = status.st_dev;
    identity.inode = status.st_ino;
    identity.modified = status.st_mtim;
    return identity;
}

CopyCheck checkCopy(SlotDirectories& directories, unsigned copy) {
    CopyCheck result;
    struct stat status {};
    const UniqueFd check = directories.openForReading(copy, kCheckName, status);
    if (!check) {
        const int error = errno;
        if (error != ENOENT) {
            result.fault = CopyFault::kCheckUnopenable;
            result.error = error;
            result.identity.kind = CheckIdentity::Kind::kOther;
        }
        return result;
    }
    result.checkTime = checkTimeOf(status);
    result.identity = checkIdentityOf(status);
    uint64_t stored = 0;
    if (readCheckValue(check.get(), status, stored) != STATUS_OK) {
        const int error = errno;
        if (status.st_size != static_cast<off_t>(kCheckValueSize)) {
            result.fault = CopyFault::kCheckSize;
            result.checkSize = status.st_size;
        } else {
            result.fault = CopyFault::kCheckUnreadable;
            result.error = error;
        }
        return result;
    }
    return judgeData(directories, copy, stored, result);
}

bool failedToRead(const CopyCheck& check) {
    switch (check.fault) {
        case CopyFault::kCheckUnopenable:
        case CopyFault::kCheckUnreadable:
        case CopyFault::kDataUnreadable:
            return check.error != ELOOP && check.error != ENOTDIR && check.error != EISDIR && check.error != ENXIO;
        default:
            return false;
    }
}

unsigned currentCopy(const CopyCheck& copy0, const CopyCheck& copy1) {
    return copy1.valid() && isLater(copy1.checkTime, copy0.valid() ? copy0.checkTime : CheckTime{}) ? 1 : 0;
}

}  // namespace Storage
