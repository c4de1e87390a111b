#include "lib/storage/untrusted_tree.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <atomic>
#include <cerrno>

namespace Storage {

UniqueFd openDirectoryAt(int parent, const char* name) {
    // With O_DIRECTORY a link in the last component fails as ENOTDIR.
    return UniqueFd(::openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
}

UniqueFd makeDirectoryAt(int parent, const char* name) {
    UniqueFd directory = openDirectoryAt(parent, name);
    if (directory || errno != ENOENT) return directory;
    // EEXIST: made meanwhile by someone else; the open below says what it is.
    if (::mkdirat(parent, name, 0777) != 0 && errno != EEXIST) return directory;
    return openDirectoryAt(parent, name);
}

bool isRegularFile(int fd, struct stat& status) {
    if (::fstat(fd, &status) != 0) return false;
    if (S_ISREG(status.st_mode)) return true;
    errno = S_ISDIR(status.st_mode) ? EISDIR : ENXIO;
    return false;
}

namespace {

// O_NONBLOCK: a FIFO opens at once (or fails with ENXIO) and a leased file
// fails with EWOULDBLOCK instead of waiting; it changes nothing for a
// regular file. O_NOCTTY: a terminal never becomes ours.
constexpr int kSafeFlags = O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;

// `fd`, or none when it is open on anything but a regular file.
UniqueFd regularOnly(UniqueFd fd, struct stat* status) {
    struct stat ignored {};
    if (fd && !isRegularFile(fd.get(), status != nullptr ? *status : ignored)) {
        const int error = errno;
        fd.reset();
        errno = error;
    }
    return fd;
}

// How often a writer unlinks a name of several links and creates the file
// afresh before it gives up.
constexpr int kFreshFileAttempts = 3;

// Cleared by the first openat2 that the kernel does not know.
std::atomic<bool> kernelOpensBeneath{true};

}  // namespace

UniqueFd openRegularAt(int directory, const char* name, int flags, mode_t mode, struct stat* status) {
    return regularOnly(UniqueFd(::openat(directory, name, flags | kSafeFlags, mode)), status);
}

UniqueFd openRegularToWriteAt(int directory, const char* name, int flags, mode_t mode) {
    const bool truncate = (flags & O_TRUNC) != 0;
    int openFlags = flags & ~O_TRUNC;
    // Bounded: someone who plants a link again as fast as it goes is refused.
    for (int attempt = 0; attempt < kFreshFileAttempts; ++attempt) {
        struct stat status {};
        UniqueFd fd = openRegularAt(directory, name, openFlags, mode, &status);
        if (!fd && attempt > 0 && errno == EEXIST) continue;  // planted again meanwhile
        if (!fd) return fd;
        if (status.st_nlink <= 1) {
            if (truncate && ::ftruncate(fd.get(), 0) != 0) {
                const int error = errno;
                fd.reset();
                errno = error;
            }
            return fd;
        }
        fd.reset();
        if (::unlinkat(directory, name, 0) != 0 && errno != ENOENT) return UniqueFd();
        if (!truncate) break;
        openFlags |= O_CREAT | O_EXCL;
    }
    errno = EMLINK;
    return UniqueFd();
}

UniqueFd openRegularBeneath(int directory, const char* path, int flags, struct stat* status) {
    if (!kernelOpensBeneath.load(std::memory_order_relaxed)) {
        errno = ENOSYS;
        return UniqueFd();
    }
    struct open_how how {};
    how.flags = static_cast<uint64_t>(flags | kSafeFlags);
    how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_BENEATH;
    UniqueFd fd(static_cast<int>(::syscall(SYS_openat2, directory, path, &how, sizeof how)));
    if (!fd && errno == ENOSYS) kernelOpensBeneath.store(false, std::memory_order_relaxed);
    return regularOnly(std::move(fd), status);
}

bool entryExists(int directory, const char* name) {
    struct stat status {};
    return ::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW) == 0;
}

}  // namespace Storage
