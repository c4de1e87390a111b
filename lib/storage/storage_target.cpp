// The targets. Some error lines carry fixed line numbers (the *_LINE
// constants) because device scripts match on them.
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <iomanip>

#include "lib/storage/boot_vector_target.h"
#include "lib/storage/check_value.h"
#include "lib/storage/copy_check.h"
#include "lib/storage/dual_file_target.h"
#include "lib/storage/file_read_target.h"
#include "lib/storage/firmware_update_boot_target.h"
#include "lib/storage/firmware_update_partition_target.h"
#include "lib/storage/mount_commands.h"
#include "lib/storage/slot_directories.h"
#include "lib/util/log.h"
#include "lib/util/run_command.h"

namespace Storage {
namespace fs = std::filesystem;

namespace {

constexpr int kWriteFailedLine = 144;
constexpr int kEnsureDirectoryLine = 192;
constexpr int kCopyOldDataLine = 199;
constexpr int kCleanupCheckfileLine = 334;
constexpr int kInvalidateLine = 378;
constexpr int kOpenCopyDataLine = 410;
constexpr int kEraseDirectoryLine = 427;
constexpr int kCheckWriteFailedLine = 461;
constexpr int kCheckWriteShortLine = 465;
constexpr int kCheckCleanupLine = 470;
constexpr int kCheckTimeLine = 490;
constexpr int kSyncFailedLine = 510;
constexpr int kSyncOpenLine = 516;

constexpr mode_t kFileMode = 0666;

// How long a read waits on the copy it judged current before judging again:
// a copy held exclusive is being rewritten, so another one is current now.
constexpr std::chrono::milliseconds kLockSlice{50};

// A superseding check file is made at least this much newer than the one it
// replaces, so that opening picks it even when the clock stood still or went
// back.
constexpr time_t kCheckTimeStepSeconds = 2;

std::error_code errorCode(int error) { return std::error_code(error, std::generic_category()); }

// Logs that `what` at `path` stayed locked by another past the bound.
Status lockTimedOut(const char* what, const std::string& path) {
    LOGE << what << " " << std::quoted(path) << " is busy: not locked within " << kSlotLockWait.count() << " ms";
    return STATUS_TIMEOUT;
}

// "Failed to VERB "PATH": REASON (ERRNO)": a copy's file that the card or
// the file system failed.
void logFileFailure(const char* verb, const fs::path& path, int error) {
    LOGE << "Failed to " << verb << " " << std::quoted(path.string()) << ": " << std::strerror(error) << " (" << error
         << ")";
}

// A short write carries no errno (a file system that filled up, mostly):
// the line says how far it got.
Status shortWrite(const fs::path& path, ssize_t written, size_t size) {
    LOGE << "Short write to " << std::quoted(path.string()) << ": " << written << " of " << size << " bytes";
    return STATUS_FAILED;
}

Status copyFile(const CopyDirectory& from, const CopyDirectory& to) {
    const UniqueFd source = from.openToRead(kDataName);
    if (!source) return STATUS_FAILED;
    const UniqueFd target = to.openToWrite(kDataName, O_WRONLY | O_CREAT | O_TRUNC, kFileMode);
    if (!target) return STATUS_FAILED;
    uint8_t block[65536];
    for (;;) {
        const ssize_t count = ::read(source.get(), block, sizeof block);
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) return STATUS_FAILED;
        if (count == 0) return STATUS_OK;
        if (::write(target.get(), block, count) != count) return STATUS_FAILED;
    }
}

Status readCopy(SlotDirectories& directories, unsigned copy, bool valid, uint8_t* buffer, size_t size, int64_t offset,
                size_t* bytesRead) {
    if (!valid) return directories.open(copy).holds(kDataName) ? STATUS_FAILED : STATUS_NOT_FOUND;
    struct stat status {};
    const UniqueFd fd = directories.openForReading(copy, kDataName, status);
    const int error = errno;  // a file that opens exists; only a failed open asks
    if (!fd) return directories.open(copy).holds(kDataName) ? static_cast<Status>(error) : STATUS_NOT_FOUND;
    const ssize_t count = ::pread(fd.get(), buffer, size, offset);
    if (count < 0) return errno;
    if (bytesRead != nullptr) *bytesRead = static_cast<size_t>(count);
    return STATUS_OK;
}

}  // namespace

DualFileTarget::DualFileTarget(fs::path basePath, size_t slotCount) {
    basePath_ = std::move(basePath);
    std::error_code ignored;  // a missing directory shows in the slots' operations
    fs::create_directories(basePath_, ignored);
    // Opened once for all slots; followed if it is a link (the integrator's choice).
    const UniqueFd base(::open(basePath_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    // One wait for all slots: a run opens every store, and a held lock of
    // each slot must not add up to more than a moment.
    const LockDeadline deadline = std::chrono::steady_clock::now() + kOpeningLockWait;
    slots_.reserve(slotCount);
    for (size_t i = 0; i < slotCount; ++i) {
        slots_.emplace_back(basePath_, slotDirectoryName(slotCount, i), base.get(), deadline);
    }
}

SlotHandle DualFileTarget::getSlot(size_t index) {
    if (index >= slots_.size()) return SlotHandle();
    return SlotHandle::borrow(&slots_[index]);
}

DualFileTarget::Slot::Slot(fs::path baseDirectory, std::string name, int base, LockDeadline deadline)
    : baseDirectory_(std::move(baseDirectory)), name_(std::move(name)) {
    const fs::path directory = directoryPath();
    for (unsigned i = 0; i < copies_.size(); ++i) {
        Copy& copy = copies_[i];
        copy.dataPath = directory / kCopyDirectoryNames[i] / kDataName;
        copy.checkPath = directory / kCopyDirectoryNames[i] / kCheckName;
    }
    SlotDirectories opening(baseDirectory_, name_, base);
    judge(opening, &deadline);
}

SlotDirectories DualFileTarget::Slot::directories() const { return SlotDirectories(baseDirectory_, name_); }

fs::path DualFileTarget::Slot::directoryPath() const { return name_.empty() ? baseDirectory_ : baseDirectory_ / name_; }

void DualFileTarget::Slot::judge(SlotDirectories& directories, const LockDeadline* cleanUp) const {
    CopyCheck checks[2];
    for (unsigned i = 0; i < copies_.size(); ++i) {
        checks[i] = validate(i, directories, cleanUp);
        if (failedToRead(checks[i])) {
            const Copy& copy = copies_[i];
            logFileFailure("read", checks[i].fault == CopyFault::kDataUnreadable ? copy.dataPath : copy.checkPath,
                           checks[i].error);
        }
    }
    current_ = currentCopy(checks[0], checks[1]);
}

CopyCheck DualFileTarget::Slot::validate(unsigned index, SlotDirectories& directories,
                                         const LockDeadline* cleanUp) const {
    Copy& copy = copies_[index];
    CopyCheck check = checkCopy(directories, index);
    copy.valid = check.valid();
    copy.identity = check.identity;
    if (check.fault == CopyFault::kNoCheckFile || check.fault == CopyFault::kCheckUnopenable) {
        // Without a check file the directory may be missing; failing to make it fails the updates.
        (void)directories.ensure(index);
    }
    // A mismatching check file must never become valid again by accident; a missing one needs no removal.
    if (copy.valid || cleanUp == nullptr || check.fault == CopyFault::kNoCheckFile) return check;
    // What looks damaged may be a change's half-made copy, and its check
    // file may be in place by now: judged again while no change can hold it.
    SlotLock::Outcome outcome = SlotLock::Outcome::kUnreachable;
    const SlotLock lock = SlotLock::take(directories.open(index).fd, ".", LockMode::kShared, *cleanUp, outcome);
    if (outcome == SlotLock::Outcome::kBusy) return check;
    if (outcome == SlotLock::Outcome::kHeld) {
        check = checkCopy(directories, index);
        copy.valid = check.valid();
        copy.identity = check.identity;
        if (copy.valid || check.fault == CopyFault::kNoCheckFile) return check;
    }
    if (directories.open(index).remove(kCheckName) != 0) {
        LOGE_AT(kCleanupCheckfileLine) << "Failure cleaning up checkfile " << std::quoted(copy.checkPath.string());
    } else {
        copy.identity = CheckIdentity{};
    }
    return check;
}

void DualFileTarget::Slot::refresh(SlotDirectories& directories) const {
    for (unsigned i = 0; i < copies_.size(); ++i) {
        const CopyDirectory directory = directories.open(i);
        // A change never removes or replaces a copy's directory: one that
        // cannot be reached says nothing about commits.
        if (directory.fd >= 0 && directory.checkIdentity() != copies_[i].identity) {
            judge(directories);
            return;
        }
    }
}

Status DualFileTarget::Slot::busy() const { return lockTimedOut("Store", directoryPath().string()); }

Status DualFileTarget::Slot::lockCurrent(SlotDirectories& directories, SlotLock& lock) const {
    // A begun write of this slot holds the slot's lock: nobody else commits.
    if (writing_) return STATUS_OK;
    const LockDeadline deadline = std::chrono::steady_clock::now() + kSlotLockWait;
    for (;;) {
        refresh(directories);
        const LockDeadline slice = std::min(deadline, std::chrono::steady_clock::now() + kLockSlice);
        SlotLock::Outcome outcome = SlotLock::Outcome::kUnreachable;
        lock = SlotLock::take(directories.open(current_).fd, ".", LockMode::kShared, slice, outcome);
        if (outcome == SlotLock::Outcome::kUnreachable) return STATUS_OK;  // the read fails on its own
        if (outcome == SlotLock::Outcome::kHeld &&
            directories.open(current_).checkIdentity() == copies_[current_].identity) {
            return STATUS_OK;
        }
        lock.release();
        if (std::chrono::steady_clock::now() >= deadline) return busy();
    }
}

Status DualFileTarget::Slot::lockForChange(SlotDirectories& directories, ChangeLocks& locks) {
    if (writing_) return STATUS_OK;
    const LockDeadline deadline = std::chrono::steady_clock::now() + kSlotLockWait;
    SlotLock::Outcome outcome = SlotLock::Outcome::kUnreachable;
    locks.slot = SlotLock::take(directories.slot(true).fd, ".", LockMode::kExclusive, deadline, outcome);
    if (outcome == SlotLock::Outcome::kBusy) return busy();
    refresh(directories);
    // Readers that judged before the last commit may still be reading the
    // copy that is about to be rewritten.
    locks.copy = SlotLock::take(directories.open(otherIndex()).fd, ".", LockMode::kExclusive, deadline, outcome);
    if (outcome == SlotLock::Outcome::kBusy) return busy();
    return STATUS_OK;
}

bool DualFileTarget::Slot::exists() const {
    SlotDirectories reached = directories();
    SlotLock lock;
    // Busy: the copies as they look now.
    if (lockCurrent(reached, lock) != STATUS_OK) refresh(reached);
    if (!copies_[current_].valid) return false;
    return reached.open(current_).holds(kDataName);
}

bool DualFileTarget::Slot::isValid() const {
    SlotDirectories reached = directories();
    // Needs no lock: a check file that did not change since it was judged
    // still vouches for the same data.
    refresh(reached);
    return copies_[current_].valid;
}

Status DualFileTarget::Slot::read(uint8_t* buffer, size_t size, int64_t offset) {
    SlotDirectories reached = directories();
    SlotLock lock;
    if (const Status status = lockCurrent(reached, lock)) return status;
    return readCopy(reached, current_, copies_[current_].valid, buffer, size, offset, nullptr);
}

Status DualFileTarget::Slot::readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) {
    SlotDirectories reached = directories();
    SlotLock lock;
    if (const Status status = lockCurrent(reached, lock)) return status;
    return readCopy(reached, current_, copies_[current_].valid, buffer, size, offset, &bytesRead);
}

CheckTime DualFileTarget::Slot::currentCheckTime(SlotDirectories& directories) {
    return directories.open(current_).checkTime();
}

void DualFileTarget::Slot::invalidate(unsigned index, SlotDirectories& directories) {
    if (const int error = directories.open(index).remove(kCheckName)) {
        LOGE_AT(kInvalidateLine) << "" << errorCode(error);
    } else {
        copies_[index].identity = CheckIdentity{};
    }
    copies_[index].valid = false;
}

Status DualFileTarget::Slot::openCopyData(unsigned index, SlotDirectories& directories, int flags, UniqueFd& fd) {
    CopyDirectory directory = directories.ensure(index);
    if (directory.fd < 0) {
        // Tried again only to print what it says now; outside the statement,
        // since it logs on its own.
        directory = directories.ensure(index);
        LOGE_AT(kOpenCopyDataLine) << "" << (directory.fd < 0 ? static_cast<Status>(directory.error) : STATUS_OK);
    }
    if (const int error = directory.remove(kCheckName)) return static_cast<Status>(error);
    copies_[index].identity = CheckIdentity{};
    fd = directory.openToWrite(kDataName, flags, kFileMode);
    if (!fd) logOpenFailure(copies_[index].dataPath.c_str(), errno);
    return fd ? STATUS_OK : STATUS_FAILED;
}

Status DualFileTarget::Slot::commit(unsigned index, SlotDirectories& directories, const CheckTime& previousTime) {
    Copy& copy = copies_[index];
    const CopyDirectory directory = directories.open(index);
    uint64_t value = 0;
    int syncError = 0;
    if (directory.computeCheckAndSync(value, syncError) != STATUS_OK) {
        // A card that fails its writes says so here first, before the
        // check file is touched.
        if (syncError != 0) logFileFailure("sync", copy.dataPath, syncError);
        return STATUS_FAILED;
    }

    CheckIdentity installed;  // what the check file will be once renamed into place
    {
        const UniqueFd tmp = directory.openToWrite(kTransientName, O_WRONLY | O_CREAT | O_TRUNC, kFileMode);
        // A failed open is logged here; the write below then fails.
        if (!tmp) logOpenFailure((copy.dataPath.parent_path() / kTransientName).c_str(), errno);
        uint8_t bytes[kCheckValueSize];
        encodeCheckValue(value, bytes);
        const ssize_t written = ::write(tmp.get(), bytes, sizeof bytes);
        if (written != static_cast<ssize_t>(sizeof bytes)) {
            if (written < 0) {
                const int error = errno;
                LOGE_AT(kCheckWriteFailedLine) << "finalise: write failed: " << error << ": " << std::strerror(error);
            } else {
                LOGE_AT(kCheckWriteShortLine) << "Failed to write expected data: " << written;
            }
            [[maybe_unused]] const int cut = ::ftruncate(tmp.get(), 0);  // an orphan is harmless; removal matters
            if (directory.remove(kTransientName) != 0) LOGE_AT(kCheckCleanupLine) << "Failed to cleanup check file";
            return STATUS_FAILED;
        }
        // The time the write gave it.
        struct stat status {};
        const bool stated = ::fstat(tmp.get(), &status) == 0;
        if (stated) installed = checkIdentityOf(status);
        if (previousTime.known && !(stated && isLater(checkTimeOf(status), previousTime))) {
            struct timespec times[2] = {{0, UTIME_OMIT}, previousTime.time};
            times[1].tv_sec += kCheckTimeStepSeconds;
            if (::futimens(tmp.get(), times) != 0) {
                LOGE_AT(kCheckTimeLine) << "" << errorCode(errno);
            } else {
                installed.modified = times[1];
            }
        }
    }

    if (::renameat(directory.fd, kTransientName, directory.fd, kCheckName) != 0) return errno;
    // Whatever follows, this file is the copy's check file now.
    copy.identity = installed;

    const UniqueFd check = directory.openToRead(kCheckName);
    if (!check) {
        logOpenFailure(copy.checkPath.c_str(), errno);
        LOGE_AT(kSyncOpenLine) << "Failed to open path " << std::quoted(copy.checkPath.string()) << " for  fs sync";
        copy.valid = true;
        return STATUS_OK;
    }
    if (::syncfs(check.get()) != 0) {
        // The check file is in place: the next opening finds this copy valid.
        const int error = errno;
        LOGE_AT(kSyncFailedLine) << "Failed to sync fs: " << std::strerror(error) << " (" << error << ")";
        return static_cast<Status>(error);
    }
    copy.valid = true;
    return STATUS_OK;
}

Status DualFileTarget::Slot::commitOther(SlotDirectories& directories, const CheckTime& previousTime) {
    const Status status = commit(otherIndex(), directories, previousTime);
    if (status == STATUS_OK) current_ = otherIndex();
    return status;
}

Status DualFileTarget::Slot::write(const uint8_t* data, size_t size) {
    SlotDirectories reached = directories();
    ChangeLocks locks;
    if (const Status status = lockForChange(reached, locks)) return status;
    const CheckTime previousTime = currentCheckTime(reached);
    invalidate(otherIndex(), reached);
    UniqueFd fd;
    if (const Status status = openCopyData(otherIndex(), reached, O_RDWR | O_CREAT | O_TRUNC, fd)) return status;
    const ssize_t written = ::write(fd.get(), data, size);
    if (written < 0) {
        const int error = errno;
        LOGE_AT(kWriteFailedLine) << "write failed: " << error << ": " << std::strerror(error);
        return static_cast<Status>(error);
    }
    if (static_cast<size_t>(written) != size) return shortWrite(copies_[otherIndex()].dataPath, written, size);
    fd.reset();
    return commitOther(reached, previousTime);
}

Status DualFileTarget::Slot::beginWrite() {
    if (writing_) return STATUS_OK;
    SlotDirectories reached = directories();
    ChangeLocks locks;
    if (const Status status = lockForChange(reached, locks)) return status;
    const CopyDirectory directory = reached.open(otherIndex());
    // The second removal finds nothing; it is kept deliberately.
    for (int attempt = 0; attempt < 2; ++attempt) {
        if (const int error = directory.remove(kDataName)) return static_cast<Status>(error);
    }
    writing_ = true;
    writeLocks_ = std::move(locks);
    return STATUS_OK;
}

Status DualFileTarget::Slot::writeAt(int64_t offset, const uint8_t* data, size_t size) {
    SlotDirectories reached = directories();
    ChangeLocks locks;
    if (const Status status = lockForChange(reached, locks)) return status;
    CheckTime previousTime;
    const unsigned target = otherIndex();
    if (!writing_) {
        previousTime = currentCheckTime(reached);
        invalidate(target, reached);
        const CopyDirectory directory = reached.ensure(target);
        if (directory.fd < 0) {
            LOG_STATUS_AT(kEnsureDirectoryLine, static_cast<Status>(directory.error));
            return static_cast<Status>(directory.error);
        }
        const CopyDirectory source = reached.open(current_);
        if (source.holds(kDataName) && copies_[current_].valid && copyFile(source, directory) != STATUS_OK) {
            LOGE_AT(kCopyOldDataLine) << "Failed to copy old data\n";
            return STATUS_FAILED;
        }
    }
    UniqueFd fd;
    if (const Status status = openCopyData(target, reached, O_RDWR | O_CREAT, fd)) return status;
    const ssize_t written = ::pwrite(fd.get(), data, size, offset);
    if (written < 0 && errno != 0) return static_cast<Status>(errno);
    if (written < 0) return STATUS_FAILED;
    if (static_cast<size_t>(written) != size) return shortWrite(copies_[target].dataPath, written, size);
    fd.reset();
    return writing_ ? STATUS_OK : commitOther(reached, previousTime);
}

Status DualFileTarget::Slot::finalise() {
    if (!writing_) return STATUS_INVALID_OPERATION;
    writing_ = false;
    SlotDirectories reached = directories();
    const Status status = commitOther(reached, currentCheckTime(reached));
    writeLocks_ = ChangeLocks();
    return status;
}

Status DualFileTarget::Slot::erase() {
    SlotDirectories reached = directories();
    ChangeLocks locks;
    if (const Status status = lockForChange(reached, locks)) return status;
    const CheckTime previousTime = currentCheckTime(reached);
    const unsigned target = otherIndex();
    invalidate(target, reached);
    if (const int error = reached.open(target).remove(kDataName)) return static_cast<Status>(error);
    const CopyDirectory directory = reached.ensure(target);
    if (directory.fd < 0) {
        LOG_STATUS_AT(kEraseDirectoryLine, static_cast<Status>(directory.error));
        return static_cast<Status>(directory.error);
    }
    return commitOther(reached, previousTime);
}

// ---------------------------------------------------------------------------
// File-read target

SlotHandle FileReadTarget::getSlot(size_t index) {
    const auto found = slots_.find(static_cast<uint32_t>(index));
    return found == slots_.end() ? SlotHandle() : SlotHandle::borrow(found->second.get());
}

Status FileReadTarget::addSlot(const char* name, size_t& index, size_t& size) {
    const fs::path path = basePath_ / name;
    // O_NONBLOCK: a FIFO opens at once instead of waiting for a writer.
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd) {
        logOpenFailure(path.c_str(), errno);
        return STATUS_FAILED;
    }
    size = fs::file_size(path);
    index = nextIndex_;
    // After the counter wraps, a new slot replaces the old one at its index.
    slots_[nextIndex_++] = std::make_unique<Slot>(std::move(fd));
    return STATUS_OK;
}

Status FileReadTarget::removeSlot(size_t index) {
    return slots_.erase(static_cast<uint32_t>(index)) == 0 ? STATUS_INVALID_PARAMETER : STATUS_OK;
}

Status FileReadTarget::removeAllSlots() {
    slots_.clear();
    return STATUS_OK;
}

Status FileReadTarget::Slot::read(uint8_t* buffer, size_t size, int64_t offset) {
    size_t ignored = 0;
    return readSome(buffer, size, offset, ignored);
}

Status FileReadTarget::Slot::readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) {
    const ssize_t count = ::pread(fd_.get(), buffer, size, offset);
    if (count < 0) {
        bytesRead = 0;
        return static_cast<Status>(errno);
    }
    bytesRead = static_cast<size_t>(count);
    return STATUS_OK;
}

// ---------------------------------------------------------------------------
// Boot-vector target

namespace {

constexpr const char* kFlashDevice = "/dev/mmcblk0";
// The first number of the last line is the start of the last free area.
constexpr const char* kFreeAreaCommand = "/usr/sbin/sfdisk -q -n -F /dev/mmcblk0 | tail -1";

void logFlashWriteFailure(bool opened, int64_t written) {
    LOGE << "Failed to write to flash: valid=" << (opened ? 1 : 0) << " written=" << written;
}

}  // namespace

Status locateBootVector(uint64_t& sector) {
    std::string output;
    if (runCommand(kFreeAreaCommand, output) != STATUS_OK) {
        LOGE << "Failed to query flash size";
        return STATUS_FAILED;
    }
    switch (parseBootVectorSector(output, sector)) {
        case SectorParse::kNotANumber:
            LOGE << "Failed to parse flash size '" << output << "'";
            return STATUS_FAILED;
        case SectorParse::kOutOfRange:
            LOGE << "Boot vector " << sector << " not in range " << kBootVectorFirstSector << " to "
                 << kBootVectorLastSector;
            return STATUS_FAILED;
        case SectorParse::kOk:
            break;
    }
    return STATUS_OK;
}

Status readBootVectorRecord(uint64_t sector, uint8_t (&record)[kBootVectorRecordSize]) {
    const UniqueFd fd(::open(kFlashDevice, O_RDONLY | O_CLOEXEC | O_SYNC));
    if (!fd) logOpenFailure(kFlashDevice, errno);
    if (!fd || ::lseek(fd.get(), static_cast<off_t>(sector * kSectorSize), SEEK_SET) < 0 ||
        ::read(fd.get(), record, sizeof record) != static_cast<ssize_t>(sizeof record)) {
        return STATUS_FAILED;
    }
    return STATUS_OK;
}

BootVectorTarget::Slot::Slot() {
    uint64_t sector = 0;
    if (locateBootVector(sector) != STATUS_OK || sector == 0) return;
    if (readBootVectorRecord(sector, record_) != STATUS_OK || !isValidBootVectorRecord(record_)) {
        LOGE << "Boot vector query failed!";
        return;
    }
    sector_ = sector;
}

Status BootVectorTarget::Slot::read(uint8_t* buffer, size_t size, int64_t offset) {
    if (sector_ == 0) {
        LOGE << "Cannot read boot vector";
        return STATUS_NOT_FOUND;
    }
    if (size != sizeof record_ || offset != 0) {
        LOGE << "Unexpected length " << size << " or offset " << offset;
        return STATUS_INVALID_PARAMETER;
    }
    std::memcpy(buffer, record_, sizeof record_);
    return STATUS_OK;
}

Status BootVectorTarget::Slot::readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) {
    const Status status = read(buffer, size, offset);
    if (status == STATUS_OK) bytesRead = sizeof record_;
    return status;
}

Status BootVectorTarget::Slot::write(const uint8_t* data, size_t size) {
    if (sector_ == 0) {
        LOGE << "Cannot change boot vector";
        return STATUS_NOT_FOUND;
    }
    if (size != sizeof record_) {
        LOGE << "Unexpected length " << size;
        return STATUS_INVALID_PARAMETER;
    }
    uint8_t candidate[kBootVectorRecordSize];
    std::memcpy(candidate, data, sizeof candidate);
    if (!isValidBootVectorRecord(candidate)) {
        LOGE << "Failed validation of boot vectors";
        return STATUS_FAILED;
    }
    // Cached before the device is written: a read after a failed write
    // returns the record that was meant to be stored.
    std::memcpy(record_, candidate, sizeof record_);

    // O_SYNC is what makes the record durable; there is no separate sync.
    const UniqueFd fd(::open(kFlashDevice, O_WRONLY | O_SYNC | O_CLOEXEC));
    if (!fd) {
        logOpenFailure(kFlashDevice, errno);
        logFlashWriteFailure(false, 0);
        return STATUS_FAILED;
    }
    if (::lseek(fd.get(), static_cast<off_t>(sector_ * kSectorSize), SEEK_SET) < 0) {
        logFlashWriteFailure(true, 0);
        return STATUS_FAILED;
    }
    const ssize_t written = ::write(fd.get(), record_, sizeof record_);
    if (written < 0) {
        const int error = errno;
        LOGE << "BootVector write failed: " << error << ": " << std::strerror(error);
        logFlashWriteFailure(true, -1);
        return STATUS_FAILED;
    }
    if (written != static_cast<ssize_t>(sizeof record_)) {
        logFlashWriteFailure(true, written);
        return STATUS_FAILED;
    }
    LOGI << "Changed boot vector to " << bootVectorValue(record_);
    return STATUS_OK;
}

// ---------------------------------------------------------------------------
// Mount and remount commands

const char kBootMountPoint[] = "/media/boot";

namespace {

Status runMountCommand(const char* notice, const char* command, const std::string& mountPoint) {
    LOGW << notice << std::quoted(mountPoint);
    std::string ignoredOutput;
    const Status status = runCommand(command + mountPoint, ignoredOutput);
    if (status != STATUS_OK) LOG_STATUS(status);
    return status;
}

}  // namespace

Status remountBootPartition(bool writable) {
    const char* const mode = writable ? "rw" : "ro";
    LOGW << "Remounting " << std::quoted(kBootMountPoint) << " as " << mode;
    const std::string command = std::string("mount -o remount,") + mode + " " + kBootMountPoint;
    if (std::system(command.c_str()) != 0) {
        LOGE << "Failed to execute mount";
        return STATUS_FAILED;
    }
    return STATUS_OK;
}

Status mountPartition(const std::string& mountPoint) { return runMountCommand("Mounting ", "mount ", mountPoint); }

Status unmountPartition(const std::string& mountPoint) { return runMountCommand("Unmounting ", "umount ", mountPoint); }

// ---------------------------------------------------------------------------
// Firmware-update boot-file target

namespace {

constexpr int kBootFileAttempts = 5;
constexpr size_t kCompareBlock = 4096;

void logAlreadyUpToDate() { LOGW << "Did not update file as it was already up to date"; }

// Takes the lock on `path` that one device update holds at a time; logs and
// returns STATUS_TIMEOUT when another holds it past the bound.
Status lockDeviceUpdate(const char* what, const char* path, SlotLock& lock) {
    SlotLock::Outcome outcome = SlotLock::Outcome::kUnreachable;
    lock =
        SlotLock::take(AT_FDCWD, path, LockMode::kExclusive, std::chrono::steady_clock::now() + kSlotLockWait, outcome);
    return outcome == SlotLock::Outcome::kBusy ? lockTimedOut(what, path) : STATUS_OK;
}

}  // namespace

FirmwareUpdateBootTarget::FirmwareUpdateBootTarget() : slots_{Slot("BOOT.BIN"), Slot("BOOT0010.BIN")} {}

SlotHandle FirmwareUpdateBootTarget::getSlot(size_t index) {
    return index < 2 ? SlotHandle::borrow(&slots_[index]) : SlotHandle();
}

std::string FirmwareUpdateBootTarget::getDescription() const {
    return std::string("FirmwareUpdateBootTarget ") + kBootMountPoint;
}

FirmwareUpdateBootTarget::Slot::Slot(const char* fileName) : destination_(fs::path(kBootMountPoint) / fileName) {}

Status FirmwareUpdateBootTarget::Slot::close() {
    if (!receive_) return STATUS_INVALID_OPERATION;
    LOGI << "Closing " << temporaryPath_;
    receive_.reset();
    return STATUS_OK;
}

Status FirmwareUpdateBootTarget::Slot::beginWrite() {
    if (receive_) {
        // An interrupted update is thrown away, never resumed.
        LOGW << "Restarting firmware update!";
        (void)close();
    }
    LOGW << "Beginning update of /boot file " << std::quoted(destination_.string());
    bytesReceived_ = 0;
    temporaryPath_ = "/tmp/firmwareXXXXXX";
    receive_.reset(::mkostemp(temporaryPath_.data(), O_CLOEXEC));
    if (!receive_) return STATUS_FAILED;
    LOGW << "Opened " << temporaryPath_ << " for receiving firmware";
    // The data lives only behind the descriptor from here on, so nothing is
    // left in /tmp whatever happens later. mkostemp made the name with
    // O_EXCL, and in the sticky /tmp nobody else can replace it before this
    // removal.
    (void)::unlink(temporaryPath_.c_str());
    return STATUS_OK;
}

Status FirmwareUpdateBootTarget::Slot::writeAt(int64_t offset, const uint8_t* data, size_t size) {
    if (!receive_) {
        (void)close();
        return STATUS_INVALID_OPERATION;
    }
    const ssize_t written = ::pwrite(receive_.get(), data, size, offset);
    if (written < 0 && errno != 0) {
        const int error = errno;
        (void)close();
        return static_cast<Status>(error);
    }
    if (written < 0 || static_cast<size_t>(written) != size) {
        (void)close();
        return STATUS_FAILED;
    }
    bytesReceived_ += static_cast<uint32_t>(size);
    return STATUS_OK;
}

Status FirmwareUpdateBootTarget::Slot::compareWithDestination() {
    // Sizes are 32-bit here: the received size is taken modulo 2^32.
    const uint32_t receivedSize = static_cast<uint32_t>(::lseek(receive_.get(), 0, SEEK_END));
    std::error_code error;
    const std::uintmax_t fileSize = fs::file_size(destination_, error);
    if (error) return STATUS_NOT_FOUND;
    if (fileSize != receivedSize) return STATUS_FAILED;
    const UniqueFd file(::open(destination_.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file) {
        logOpenFailure(destination_.c_str(), errno);
        return STATUS_INVALID_OPERATION;
    }
    // Pages whose write-back the card refused stay cached as if stored;
    // dropped, they are read again from the card.
    (void)::posix_fadvise(file.get(), 0, 0, POSIX_FADV_DONTNEED);

    (void)::lseek(receive_.get(), 0, SEEK_SET);
    uint8_t received[kCompareBlock];
    uint8_t stored[kCompareBlock];
    Status result = STATUS_OK;
    for (uint32_t remaining = receivedSize; remaining > 0;) {
        const size_t wanted = std::min<size_t>(kCompareBlock, remaining);
        const ssize_t got = ::read(receive_.get(), received, wanted);
        if (got <= 0) {
            [[maybe_unused]] const ssize_t ignored = ::read(file.get(), stored, wanted);
            result = STATUS_OUT_OF_RANGE;
            break;
        }
        if (::read(file.get(), stored, got) < got) {
            result = STATUS_OUT_OF_RANGE;
            break;
        }
        if (std::memcmp(received, stored, got) != 0) {
            result = STATUS_FAILED;
            break;
        }
        if (remaining == got) break;
        remaining -= static_cast<uint32_t>(got);
    }
    return result == STATUS_OK ? STATUS_OK : STATUS_FAILED;
}

Status FirmwareUpdateBootTarget::Slot::copyToDestination(int destination, uint32_t& written) {
    uint8_t block[kCompareBlock];
    for (;;) {
        const ssize_t count = ::read(receive_.get(), block, sizeof block);
        if (count == 0) return STATUS_OK;
        if (count < 0) return STATUS_INVALID_OPERATION;
        const ssize_t stored = ::write(destination, block, count);
        if (stored < 0) {
            const int error = errno;
            LOGE << "cat: write failed: " << error << ": " << std::strerror(error);
            return STATUS_INVALID_OPERATION;
        }
        written += static_cast<uint32_t>(stored);
        if (stored != count) return STATUS_FAILED;
    }
}

Status FirmwareUpdateBootTarget::Slot::writeDestination() {
    for (int attempt = 1;; ++attempt) {
        LOGI << "Opening " << std::quoted(destination_.string()) << " for write";
        Status status = STATUS_FAILED;
        // By its fixed path: the boot partition is mounted read-only and
        // only root remounts it, so nothing less trusted can have put a
        // link or a FIFO there.
        UniqueFd file = openFd(destination_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kFileMode);
        if (!file) {
            LOGE << "Failed to open BOOT.BIN for writing\n";
        } else {
            (void)::lseek(receive_.get(), 0, SEEK_SET);
            uint32_t written = 0;
            status = copyToDestination(file.get(), written);
            LOGI << "Wrote " << written << " bytes";
            // The read-back must judge what the card holds: the write-back
            // is settled here, and a failed one is caught by the compare,
            // which reads past the page cache.
            (void)::fsync(file.get());
            file.reset();
        }
        // Read back whatever the attempt did, even a failed open.
        if (compareWithDestination() == STATUS_OK) {
            LOGW << "Readback successful for " << std::quoted(destination_.string());
            return status;
        }
        if (attempt == kBootFileAttempts) return STATUS_FAILED;
    }
}

Status FirmwareUpdateBootTarget::Slot::finalise() {
    if (!receive_) return STATUS_NOT_FOUND;
    LOGE << "TODO: Sanity-check the file";
    LOGI << std::quoted(destination_.string()) << " update with " << bytesReceived_ << " bytes written";
    if (bytesReceived_ == 0) {
        (void)close();
        return STATUS_FAILED;
    }
    if (compareWithDestination() == STATUS_OK) {
        (void)close();
        logAlreadyUpToDate();
        return STATUS_OK;
    }
    LOGW << std::quoted(destination_.string()) << " needs updating";

    // Another update of the boot files must not remount or write between
    // this one's remount, writes and read-back.
    SlotLock lock;
    if (const Status status = lockDeviceUpdate("Boot partition", kBootMountPoint, lock)) {
        (void)close();
        return status;
    }
    if (const Status status = remountBootPartition(true)) {
        (void)close();
        if (status != STATUS_NOTHING_TO_DO) return status;
        logAlreadyUpToDate();
        return STATUS_OK;
    }
    const Status status = writeDestination();
    (void)remountBootPartition(false);  // the update's own status is what matters
    (void)close();
    if (status == STATUS_NOTHING_TO_DO) {
        logAlreadyUpToDate();
        return STATUS_OK;
    }
    return status;
}

// ---------------------------------------------------------------------------
// Firmware-update partition target

FirmwareUpdatePartitionTarget::Slot::Slot() : mountPath_("/media/resources"), devicePath_("/dev/mmcblk0p2") {}

Status FirmwareUpdatePartitionTarget::Slot::beginWrite() {
    const bool restart = device_.valid();
    if (restart) {
        LOGW << "Restarting partition update!";
        device_.reset();
    }
    std::error_code error;
    if (!fs::is_block_file(devicePath_, error)) {
        LOGE << "Unable to locate block device " << std::quoted(devicePath_.string());
        return STATUS_NOT_FOUND;
    }
    bytesWritten_ = 0;
    // A restart holds it already. On the directory of the mount point: a
    // descriptor of the device would keep the writer's close from being its
    // last, which is what writes the device's cache back, and one of the
    // mounted file system would keep it from being unmounted.
    if (!updateLock_.held()) {
        const std::string mountPoints = mountPath_.parent_path().string();
        if (const Status status = lockDeviceUpdate("Mount points", mountPoints.c_str(), updateLock_)) return status;
    }
    // On a restart the first begin has unmounted it already.
    const Status unmounted = unmountPartition(mountPath_.string());
    if (unmounted != STATUS_OK && !restart) {
        LOGE << "Failed to unmount " << std::quoted(mountPath_.string());
        updateLock_.release();
        return unmounted;
    }
    device_ = openFd(devicePath_.c_str(), O_WRONLY | O_CLOEXEC);
    if (!device_) {
        LOGE << "Failed to open " << std::quoted(devicePath_.string()) << " for writing";
        updateLock_.release();
        return STATUS_FAILED;
    }
    LOGW << "Beginning partition update " << std::quoted(devicePath_.string()) << " at "
         << std::quoted(mountPath_.string());
    return STATUS_OK;
}

Status FirmwareUpdatePartitionTarget::Slot::writeAt(int64_t offset, const uint8_t* data, size_t size) {
    if (!device_) return STATUS_INVALID_OPERATION;
    const ssize_t written = ::pwrite(device_.get(), data, size, offset);
    if (written < 0 && errno != 0) return static_cast<Status>(errno);
    if (written < 0 || static_cast<size_t>(written) != size) return STATUS_FAILED;
    bytesWritten_ += static_cast<uint32_t>(size);
    return STATUS_OK;
}

Status FirmwareUpdatePartitionTarget::Slot::finalise() {
    if (!device_) return STATUS_NOT_FOUND;
    LOGI << "Wrote " << bytesWritten_ << " bytes to " << std::quoted(devicePath_.string());
    // No separate sync: the last close of a block device writes back its cache.
    device_.reset();
    const Status mounted = mountPartition(mountPath_.string());
    updateLock_.release();
    return mounted;
}

}  // namespace Storage
