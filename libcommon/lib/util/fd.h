// Owning file descriptors and the logged open.
#pragma once

#include <fcntl.h>
#include <sys/types.h>
#include <cerrno>

// Owns one descriptor; -1 means none. Destruction closes it and ignores the
// result of close. Movable, not copyable.
class UniqueFd {
public:
    UniqueFd() = default;
    explicit UniqueFd(int fd) : fd_(fd) {}
    ~UniqueFd() { reset(); }

    UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
    UniqueFd& operator=(UniqueFd&& other) noexcept {
        if (this != &other) reset(other.release());
        return *this;
    }
    UniqueFd(const UniqueFd&) = delete;
    UniqueFd& operator=(const UniqueFd&) = delete;

    int get() const { return fd_; }
    bool valid() const { return fd_ >= 0; }
    explicit operator bool() const { return valid(); }

    // Gives up ownership without closing.
    int release() {
        const int fd = fd_;
        fd_ = -1;
        return fd;
    }
    // Closes the held descriptor (if any) and takes `fd`.
    void reset(int fd = -1);

private:
    int fd_ = -1;
};

// Logs "Failed to open <path>: <strerror(error)>" at error priority.
void logOpenFailure(const char* path, int error);

// open(2) into a UniqueFd. On failure logs through logOpenFailure and
// returns an empty descriptor with errno as open left it.
inline UniqueFd openFd(const char* path, int flags, mode_t mode = 0) {
    const int fd = ::open(path, flags, mode);
    if (fd < 0) {
        const int error = errno;
        logOpenFailure(path, error);
        errno = error;
    }
    return UniqueFd(fd);
}
