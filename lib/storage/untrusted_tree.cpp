#include "lib/storage/untrusted_tree.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>

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

UniqueFd openRegularAt(int directory, const char* name, int flags, mode_t mode, struct stat* status) {
    // O_NONBLOCK: a FIFO opens at once (or fails with ENXIO) and a leased
    // file fails with EWOULDBLOCK instead of waiting; it changes nothing
    // for a regular file. O_NOCTTY: a terminal never becomes ours.
    UniqueFd fd(::openat(directory, name, flags | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, mode));
    struct stat ignored {};
    if (fd && !isRegularFile(fd.get(), status != nullptr ? *status : ignored)) {
        const int error = errno;
        fd.reset();
        errno = error;
    }
    return fd;
}

bool entryExists(int directory, const char* name) {
    struct stat status {};
    return ::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW) == 0;
}

}  // namespace Storage
