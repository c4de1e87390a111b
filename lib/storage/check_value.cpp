#include "lib/storage/check_value.h"

#include <cerrno>
#include <chrono>
#include <sys/stat.h>
#include <unistd.h>

#include "lib/util/crc32.h"
#include "lib/util/fd.h"

namespace Storage {
namespace {

// Data and check files are both read in blocks of this size.
constexpr size_t kReadBlock = 4096;

// Reads `fd` to its end into `buffer`, handing each piece to `consume`.
// Returns the number of bytes read, or -1 on a read error. `size` is the
// size of a regular file, whose end is then known without the final read
// that returns nothing; -1 for anything else.
template <typename Consume>
int64_t readAll(int fd, int64_t size, uint8_t* buffer, size_t capacity, Consume consume) {
    int64_t total = 0;
    while (size < 0 || total < size) {
        const ssize_t count = ::read(fd, buffer, capacity);
        if (count < 0) {
            if (errno == EINTR) continue;
            return -1;
        }
        if (count == 0) break;
        consume(buffer, static_cast<size_t>(count));
        total += count;
    }
    return total;
}

int64_t regularFileSize(const struct stat& status) { return S_ISREG(status.st_mode) ? status.st_size : -1; }

// std::filesystem turns a time from here on into an error.
constexpr time_t kFileClockEnd =
    static_cast<time_t>(std::chrono::nanoseconds::max().count() / std::chrono::nanoseconds::period::den);

}  // namespace

Status computeCheckValue(const std::filesystem::path& dataPath, uint64_t& value) {
    UniqueFd fd(::open(dataPath.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) {
        if (errno != ENOENT) return STATUS_FAILED;
        value = kAbsentBlobCheckValue;
        return STATUS_OK;
    }
    struct stat status {};
    if (::fstat(fd.get(), &status) != 0) return STATUS_FAILED;

    uint8_t block[kReadBlock];
    uint32_t crc = kCrc32Initial;
    const auto consume = [&](const uint8_t* data, size_t size) { crc = crc32Update(crc, data, size); };
    if (readAll(fd.get(), regularFileSize(status), block, sizeof block, consume) < 0) return STATUS_FAILED;
    // Sizes of 4 GiB and more spill into the CRC half; no blob is that large.
    value = static_cast<uint64_t>(status.st_size) | (static_cast<uint64_t>(crc32Finish(crc)) << 32);
    return STATUS_OK;
}

bool isLater(const CheckTime& later, const CheckTime& earlier) {
    if (!later.known) return false;
    if (!earlier.known) return true;
    if (later.time.tv_sec != earlier.time.tv_sec) return later.time.tv_sec > earlier.time.tv_sec;
    return later.time.tv_nsec > earlier.time.tv_nsec;
}

Status readCheckValue(const std::filesystem::path& checkPath, uint64_t& value, CheckTime* modified) {
    if (modified != nullptr) *modified = CheckTime{};
    UniqueFd fd(::open(checkPath.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) return errno == ENOENT ? STATUS_NOT_FOUND : STATUS_FAILED;
    struct stat status {};
    int64_t size = -1;
    if (::fstat(fd.get(), &status) == 0) {
        size = regularFileSize(status);
        if (modified != nullptr) *modified = {status.st_mtim.tv_sec < kFileClockEnd, status.st_mtim};
    }

    uint8_t block[kReadBlock];
    uint8_t stored[kCheckValueSize] = {};
    size_t offset = 0;
    const auto consume = [&](const uint8_t* data, size_t count) {
        for (size_t i = 0; i < count && offset < kCheckValueSize; ++i) stored[offset++] = data[i];
    };
    if (readAll(fd.get(), size, block, sizeof block, consume) != static_cast<int64_t>(kCheckValueSize)) {
        return STATUS_FAILED;
    }
    value = 0;
    for (size_t i = kCheckValueSize; i-- > 0;) value = (value << 8) | stored[i];
    return STATUS_OK;
}

void encodeCheckValue(uint64_t value, uint8_t (&bytes)[kCheckValueSize]) {
    for (size_t i = 0; i < kCheckValueSize; ++i) bytes[i] = static_cast<uint8_t>(value >> (8 * i));
}

}  // namespace Storage
