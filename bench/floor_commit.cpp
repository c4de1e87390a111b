#include "floor_commit.h"

#include <fcntl.h>
#include <stdio.h>
#include <unistd.h>
#include <cerrno>
#include <cstring>

namespace bench {
namespace {

constexpr mode_t kFileMode = 0666;

// Closes on every path; the result of close is not part of the floor.
class Fd {
public:
    explicit Fd(int fd) : fd_(fd) {}
    ~Fd() {
        if (fd_ >= 0) ::close(fd_);
    }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;

    int get() const { return fd_; }

private:
    int fd_;
};

int writeAll(int fd, const void* data, size_t size) {
    const ssize_t written = ::write(fd, data, size);
    if (written < 0) return errno;
    return static_cast<size_t>(written) == size ? 0 : EIO;
}

}  // namespace

FloorCopy::FloorCopy(const std::filesystem::path& directory)
    : data((directory / "data").string()), check(data + ".chk"), tmp(check + ".tmp") {}

int floorCommit(const FloorCopy& copy, const uint8_t* data, size_t size) {
    // The copy stops being valid before its data is touched, as in the
    // store; a first write finds no check file to remove.
    if (::unlink(copy.check.c_str()) != 0 && errno != ENOENT) return errno;
    {
        // Closed before the commit, as the store does: on ext4 that close
        // already starts writing back a file that was truncated.
        const Fd file(::open(copy.data.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kFileMode));
        if (file.get() < 0) return errno;
        if (const int error = writeAll(file.get(), data, size)) return error;
        // On disk before its check file can be: a check file that lands
        // as zeros would otherwise validate an empty data file.
        if (::fsync(file.get()) != 0) return errno;
    }
    const Fd tmp(::open(copy.tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kFileMode));
    if (tmp.get() < 0) return errno;
    uint8_t check[8] = {};
    const uint64_t size64 = size;
    std::memcpy(check, &size64, sizeof size64);  // the size only: the floor computes no CRC
    if (const int error = writeAll(tmp.get(), check, sizeof check)) return error;
    if (::rename(copy.tmp.c_str(), copy.check.c_str()) != 0) return errno;
    // The descriptor still names the file, now under the check file's name.
    return ::syncfs(tmp.get()) == 0 ? 0 : errno;
}

}  // namespace bench
