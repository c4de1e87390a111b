// The targets. Some error lines carry fixed line numbers (the *_LINE
// constants) because device scripts match on them.
#include <cerrno>
#include <cstring>
#include <iomanip>
#include <sys/types.h>
#include <unistd.h>

#include "lib/storage/check_value.h"
#include "lib/storage/directories.h"
#include "lib/storage/dual_file_target.h"
#include "lib/util/log.h"

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

// A superseding check file is made at least this much newer than the one it
// replaces, so that opening picks it even when the clock stood still or went
// back.
constexpr std::chrono::nanoseconds kCheckTimeStep = std::chrono::seconds(2);

fs::path withSuffix(const fs::path& path, const char* suffix) {
    fs::path result = path;
    result += suffix;
    return result;
}

// std::filesystem::remove: a missing file is no error.
std::error_code removeFile(const fs::path& path) {
    std::error_code error;
    fs::remove(path, error);
    return error;
}

bool fileExists(const fs::path& path) {
    std::error_code ignored;
    return fs::exists(path, ignored);
}

// The earliest representable time when the file's time cannot be read.
fs::file_time_type modificationTime(const fs::path& path) {
    std::error_code ignored;
    return fs::last_write_time(path, ignored);
}

Status copyFile(const fs::path& from, const fs::path& to) {
    UniqueFd source(::open(from.c_str(), O_RDONLY | O_CLOEXEC));
    if (!source) return STATUS_FAILED;
    UniqueFd target(::open(to.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kFileMode));
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

Status readCopy(const fs::path& dataPath, bool valid, uint8_t* buffer, size_t size, int64_t offset,
                size_t* bytesRead) {
    if (!fileExists(dataPath)) return STATUS_NOT_FOUND;
    if (!valid) return STATUS_FAILED;
    UniqueFd fd(::open(dataPath.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) return errno;
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
    slots_.reserve(slotCount);
    for (size_t i = 0; i < slotCount; ++i) {
        slots_.emplace_back(slotCount == 1 ? basePath_ : basePath_ / std::to_string(i));
    }
}

SlotHandle DualFileTarget::getSlot(size_t index) {
    if (index >= slots_.size()) return SlotHandle();
    return SlotHandle::borrow(&slots_[index]);
}

DualFileTarget::Slot::Slot(const fs::path& directory) {
    const char* const names[] = {"1/data", "2/data"};
    for (size_t i = 0; i < copies_.size(); ++i) {
        Copy& copy = copies_[i];
        copy.dataPath = directory / names[i];
        copy.checkPath = withSuffix(copy.dataPath, ".chk");
        validate(copy);
    }
    const fs::file_time_type earliest = fs::file_time_type::min();
    const fs::file_time_type time0 = copies_[0].valid ? modificationTime(copies_[0].checkPath) : earliest;
    if (copies_[1].valid && modificationTime(copies_[1].checkPath) > time0) current_ = 1;
}

void DualFileTarget::Slot::validate(Copy& copy) {
    (void)ensureDataDirectory(copy.dataPath);  // a missing directory fails the check below
    uint64_t actual = 0;
    uint64_t stored = 0;
    if (computeCheckValue(copy.dataPath, actual) == STATUS_OK &&
        readCheckValue(copy.checkPath, stored) == STATUS_OK && actual == stored) {
        copy.valid = true;
        return;
    }
    // A mismatching check file must never become valid again by accident.
    if (removeFile(copy.checkPath)) {
        LOGE_AT(kCleanupCheckfileLine) << "Failure cleaning up checkfile " << std::quoted(copy.checkPath.string());
    }
}

bool DualFileTarget::Slot::exists() const {
    const Copy& copy = copies_[current_];
    return copy.valid && fileExists(copy.dataPath);
}

Status DualFileTarget::Slot::read(uint8_t* buffer, size_t size, int64_t offset) {
    const Copy copy = copies_[current_];
    return readCopy(copy.dataPath, copy.valid, buffer, size, offset, nullptr);
}

Status DualFileTarget::Slot::readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) {
    const Copy copy = copies_[current_];
    return readCopy(copy.dataPath, copy.valid, buffer, size, offset, &bytesRead);
}

fs::file_time_type DualFileTarget::Slot::currentCheckTime() const {
    return modificationTime(copies_[current_].checkPath);
}

void DualFileTarget::Slot::invalidate(Copy& copy) {
    if (const std::error_code error = removeFile(copy.checkPath)) LOGE_AT(kInvalidateLine) << "" << error;
    copy.valid = false;
}

Status DualFileTarget::Slot::openCopyData(Copy& copy, int flags, UniqueFd& fd) {
    if (ensureDataDirectory(copy.dataPath) != STATUS_OK) {
        // Tried again only to print what it says now; outside the statement,
        // since it logs on its own.
        const Status retried = ensureDataDirectory(copy.dataPath);
        LOGE_AT(kOpenCopyDataLine) << "" << retried;
    }
    if (const std::error_code error = removeFile(copy.checkPath)) return statusFromError(error);
    fd = openFd(copy.dataPath.c_str(), flags | O_CLOEXEC, kFileMode);
    return fd ? STATUS_OK : STATUS_FAILED;
}

Status DualFileTarget::Slot::commit(Copy& copy, fs::file_time_type previousTime) {
    uint64_t value = 0;
    if (computeCheckValue(copy.dataPath, value) != STATUS_OK) return STATUS_FAILED;

    const fs::path tmpPath = withSuffix(copy.checkPath, ".tmp");
    {
        // A failed open is logged by openFd; the write below then fails.
        UniqueFd tmp = openFd(tmpPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kFileMode);
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
            (void)::ftruncate(tmp.get(), 0);  // an orphaned partial file is harmless; the removal matters
            if (removeFile(tmpPath)) LOGE_AT(kCheckCleanupLine) << "Failed to cleanup check file";
            return STATUS_FAILED;
        }
    }

    if (!(previousTime < modificationTime(tmpPath))) {
        std::error_code error;
        fs::last_write_time(tmpPath, previousTime + kCheckTimeStep, error);
        if (error) LOGE_AT(kCheckTimeLine) << "" << error;
    }

    std::error_code renameError;
    fs::rename(tmpPath, copy.checkPath, renameError);
    if (renameError) return statusFromError(renameError);

    const UniqueFd check = openFd(copy.checkPath.c_str(), O_RDONLY | O_CLOEXEC);
    if (!check) {
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

Status DualFileTarget::Slot::commitOther(fs::file_time_type previousTime) {
    const Status status = commit(other(), previousTime);
    if (status == STATUS_OK) current_ = (current_ + 1) % 2;
    return status;
}

Status DualFileTarget::Slot::write(const uint8_t* data, size_t size) {
    const fs::file_time_type previousTime = currentCheckTime();
    Copy& target = other();
    invalidate(target);
    UniqueFd fd;
    if (const Status status = openCopyData(target, O_RDWR | O_CREAT | O_TRUNC, fd)) return status;
    const ssize_t written = ::write(fd.get(), data, size);
    if (written < 0) {
        const int error = errno;
        LOGE_AT(kWriteFailedLine) << "write failed: " << error << ": " << std::strerror(error);
        return static_cast<Status>(error);
    }
    if (static_cast<size_t>(written) != size) return STATUS_FAILED;
    fd.reset();
    return commitOther(previousTime);
}

Status DualFileTarget::Slot::beginWrite() {
    if (writing_) return STATUS_OK;
    // The second removal finds nothing; it is kept deliberately.
    for (int attempt = 0; attempt < 2; ++attempt) {
        if (const std::error_code error = removeFile(other().dataPath)) return statusFromError(error);
    }
    writing_ = true;
    return STATUS_OK;
}

Status DualFileTarget::Slot::writeAt(int64_t offset, const uint8_t* data, size_t size) {
    fs::file_time_type previousTime{};
    Copy& target = other();
    if (!writing_) {
        previousTime = currentCheckTime();
        invalidate(target);
        if (const Status status = ensureDataDirectory(target.dataPath)) {
            LOG_STATUS_AT(kEnsureDirectoryLine, status);
            return status;
        }
        const Copy& source = copies_[current_];
        if (fileExists(source.dataPath) && source.valid && copyFile(source.dataPath, target.dataPath) != STATUS_OK) {
            LOGE_AT(kCopyOldDataLine) << "Failed to copy old data\n";
            return STATUS_FAILED;
        }
    }
    UniqueFd fd;
    if (const Status status = openCopyData(target, O_RDWR | O_CREAT, fd)) return status;
    const ssize_t written = ::pwrite(fd.get(), data, size, offset);
    if (written < 0 && errno != 0) return static_cast<Status>(errno);
    if (written < 0 || static_cast<size_t>(written) != size) return STATUS_FAILED;
    fd.reset();
    return writing_ ? STATUS_OK : commitOther(previousTime);
}

Status DualFileTarget::Slot::finalise() {
    if (!writing_) return STATUS_INVALID_OPERATION;
    writing_ = false;
    return commitOther(currentCheckTime());
}

Status DualFileTarget::Slot::erase() {
    const fs::file_time_type previousTime = currentCheckTime();
    Copy& target = other();
    invalidate(target);
    if (const std::error_code error = removeFile(target.dataPath)) return statusFromError(error);
    if (const Status status = ensureDataDirectory(target.dataPath)) {
        LOG_STATUS_AT(kEraseDirectoryLine, status);
        return status;
    }
    return commitOther(previousTime);
}

}  // namespace Storage
