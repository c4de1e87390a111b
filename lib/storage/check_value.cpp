#include "lib/storage/check_value.h"

#include <sys/stat.h>
#include <unistd.h>
#include <cerrno>
#include <chrono>

#include "lib/util/crc32.h"

namespace Storage {
namespace {

// Data and check files are both read in blocks of this size.
constexpr size_t kReadBlock = 4096;

// Reads the regular file `fd` of `size` bytes, handing each piece of it to
// `consume`. Returns the number of bytes read, or -1 on a read error. The
// end is known from the size, without the final read that returns nothing;
// a file that shrank meanwhile ends early.
template <typename Consume>
int64_t readAll(int fd, int64_t size, uint8_t* buffer, size_t capacity, Consume consume) {
    int64_t total = 0;
    while (total < size) {
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

// std::filesystem turns a time from here on into an error.
constexpr time_t kFileClockEnd =
    static_cast<time_t>(std::chrono::nanoseconds::max().count() / std::chrono::nanoseconds::period::den);

}  // namespace

Status computeCheckValue(int fd, const struct stat& status, uint64_t& value) {
    uint8_t block[kReadBlock];
    uint32_t crc = kCrc32Initial;
    const auto consume = [&](const uint8_t* data, size_t size) { crc = crc32Update(crc, data, size); };
    if (readAll(fd, status.st_size, block, sizeof block, consume) < 0) return STATUS_FAILED;
    // Sizes of 4 GiB and more spill into the CRC half; no blob is that large.
    value = static_cast<uint64_t>(status.st_size) | (static_cast<uint64_t>(crc32Finish(crc)) << 32);
    return STATUS_OK;
}

CheckMatch compareCheckValue(int fd, const struct stat& status, uint64_t stored) {
    if (static_cast<uint32_t>(status.st_size) != static_cast<uint32_t>(stored)) return CheckMatch::kSizeDiffers;
    uint64_t actual = 0;
    if (computeCheckValue(fd, status, actual) != STATUS_OK) return CheckMatch::kUnreadable;
    return actual == stored ? CheckMatch::kMatches : CheckMatch::kCrcDiffers;
}

CheckTime checkTimeOf(const struct stat& status) { return {status.st_mtim.tv_sec < kFileClockEnd, status.st_mtim}; }

bool isLater(const CheckTime& later, const CheckTime& earlier) {
    if (!later.known) return false;
    if (!earlier.known) return true;
    if (later.time.tv_sec != earlier.time.tv_sec) return later.time.tv_sec > earlier.time.tv_sec;
    return later.time.tv_nsec > earlier.time.tv_nsec;
}

Status readCheckValue(int fd, const struct stat& status, uint64_t& value) {
    // Any other size cannot be good, and a huge planted file is not read.
    if (status.st_size != static_cast<off_t>(kCheckValueSize)) return STATUS_FAILED;
    uint8_t stored[kCheckValueSize] = {};
    size_t offset = 0;
    const auto consume = [&](const uint8_t* data, size_t count) {
        for (size_t i = 0; i < count && offset < kCheckValueSize; ++i) stored[offset++] = data[i];
    };
    uint8_t block[kReadBlock];
    if (readAll(fd, status.st_size, block, sizeof block, consume) != static_cast<int64_t>(kCheckValueSize)) {
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
