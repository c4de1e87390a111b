// A deliberately broken writer, for proving that the crash exploration and
// the power cuts of the ARM64 device can fail: it replaces the blob of a
// one-slot dual-file store the way the store does, except that it commits
// the new copy's check file before the data is written, then writes the
// data and commits again. A power cut in between can leave a valid, newest
// copy that holds an empty blob. With --in-place it instead rewrites the
// current copy itself, data (synced) then check file: a power cut in
// between leaves only the older copy valid, although the current one was
// acknowledged. --pause-ms=N waits N ms between the two, so that the power
// cuts of the ARM64 device, which come at random times, meet that window
// within a few tries.
//
//   broken_order_writer [--in-place [--pause-ms=N]] BASE FILE
//
// Exit status 0 when every call succeeded, 1 otherwise.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>

#include "files.h"
#include "lib/storage/check_value.h"

namespace {

namespace fs = std::filesystem;
using Storage::kCheckValueSize;

constexpr long kTimeStepSeconds = 2;

struct Copy {
    fs::path data;
    fs::path check;
    bool valid = false;
    timespec checkTime{};
};

// The check value of the data file as the store computes it: all ones when
// there is none.
bool checkValueOf(const fs::path& data, uint64_t& value) {
    const int fd = ::open(data.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        value = Storage::kAbsentBlobCheckValue;
        return errno == ENOENT;
    }
    struct stat status {};
    const bool computed = ::fstat(fd, &status) == 0 && Storage::computeCheckValue(fd, status, value) == STATUS_OK;
    ::close(fd);
    return computed;
}

bool storedValueOf(const fs::path& check, uint64_t& value) {
    const int fd = ::open(check.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return false;
    struct stat status {};
    const bool read = ::fstat(fd, &status) == 0 && Storage::readCheckValue(fd, status, value) == STATUS_OK;
    ::close(fd);
    return read;
}

Copy inspect(const fs::path& directory) {
    Copy copy;
    copy.data = directory / "data";
    copy.check = directory / "data.chk";
    uint64_t actual = 0;
    uint64_t stored = 0;
    struct stat status {};
    copy.valid = checkValueOf(copy.data, actual) && storedValueOf(copy.check, stored) && actual == stored &&
                 ::stat(copy.check.c_str(), &status) == 0;
    if (copy.valid) copy.checkTime = status.st_mtim;
    return copy;
}

bool newer(const timespec& a, const timespec& b) {
    return a.tv_sec != b.tv_sec ? a.tv_sec > b.tv_sec : a.tv_nsec > b.tv_nsec;
}

bool fail(const char* what, const fs::path& path) {
    std::fprintf(stderr, "broken_order_writer: %s %s: %s\n", what, path.c_str(), std::strerror(errno));
    return false;
}

// The store's commit: check value of the data file as it is now, written
// under a temporary name, dated after the current copy, renamed into place.
bool commit(const Copy& copy, const timespec& previous) {
    uint64_t value = 0;
    if (!checkValueOf(copy.data, value)) return fail("check value of", copy.data);
    uint8_t bytes[kCheckValueSize];
    Storage::encodeCheckValue(value, bytes);
    const fs::path tmp = copy.check.string() + ".tmp";
    const int fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) return fail("open", tmp);
    const bool written = ::write(fd, bytes, sizeof bytes) == static_cast<ssize_t>(sizeof bytes);
    struct stat status {};
    const bool dated = ::fstat(fd, &status) == 0;
    ::close(fd);
    if (!written || !dated) return fail("write", tmp);
    if (!newer(status.st_mtim, previous)) {
        const timespec later = {previous.tv_sec + kTimeStepSeconds, previous.tv_nsec};
        const timespec times[2] = {later, later};
        if (::utimensat(AT_FDCWD, tmp.c_str(), times, 0) != 0) return fail("utimensat", tmp);
    }
    if (::rename(tmp.c_str(), copy.check.c_str()) != 0) return fail("rename", tmp);
    return true;
}

bool syncStore(const fs::path& base) {
    const int directory = ::open(base.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    const bool synced = directory >= 0 && ::syncfs(directory) == 0;
    if (directory >= 0) ::close(directory);
    return synced || fail("syncfs", base);
}

bool replace(const fs::path& base, const testing_support::Bytes& blob, bool inPlace, long pauseMs) {
    const Copy first = inspect(base / "1");
    const Copy second = inspect(base / "2");
    const bool secondCurrent = second.valid && (!first.valid || newer(second.checkTime, first.checkTime));
    const Copy& current = secondCurrent ? second : first;
    const Copy& target = secondCurrent ? first : second;

    if (inPlace) {
        // The broken place: the only copy that opening would choose.
        fs::create_directories(current.data.parent_path());
        const int fd = ::open(current.data.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (fd < 0) return fail("open", current.data);
        // Made durable at once, as a careful writer would: the power can now
        // be cut between the new data and its check file.
        const bool written =
            ::write(fd, blob.data(), blob.size()) == static_cast<ssize_t>(blob.size()) && ::fsync(fd) == 0;
        ::close(fd);
        if (!written) return fail("write", current.data);
        // Busy elsewhere before the check file: the window a cut must meet.
        std::this_thread::sleep_for(std::chrono::milliseconds(pauseMs));
        return commit(current, target.valid ? target.checkTime : timespec{}) && syncStore(base);
    }
    if (::unlink(target.check.c_str()) != 0 && errno != ENOENT) return fail("unlink", target.check);
    const int fd = ::open(target.data.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) return fail("open", target.data);
    // The broken order: the check file goes into place before the data.
    bool ok = commit(target, current.checkTime);
    ok = ok && ::write(fd, blob.data(), blob.size()) == static_cast<ssize_t>(blob.size());
    ::close(fd);
    ok = ok && commit(target, current.checkTime);
    return ok && syncStore(base);
}

}  // namespace

int main(int argc, char** argv) {
    bool inPlace = false;
    long pauseMs = 0;
    int next = 1;
    for (; next < argc && std::strncmp(argv[next], "--", 2) == 0; ++next) {
        if (std::strcmp(argv[next], "--in-place") == 0) {
            inPlace = true;
        } else if (std::strncmp(argv[next], "--pause-ms=", 11) == 0) {
            pauseMs = std::strtol(argv[next] + 11, nullptr, 10);
        } else {
            break;
        }
    }
    if (argc - next != 2 || pauseMs < 0 || (pauseMs > 0 && !inPlace)) {
        std::fprintf(stderr, "usage: broken_order_writer [--in-place [--pause-ms=N]] BASE FILE\n");
        return 2;
    }
    return replace(argv[next], testing_support::readBytes(argv[next + 1]), inPlace, pauseMs) ? 0 : 1;
}
