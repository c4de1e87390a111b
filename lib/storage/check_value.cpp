#include "lib/storage/check_value.h"

#include <cerrno>
#include <sys/stat.h>
#include <unistd.h>

#include "lib/util/crc32.h"
#include "lib/util/fd.h"

namespace Storage {
namespace {

constexpr size_t kReadBlock = 4096;

// Reads `fd` to the end in kReadBlock pieces, handing each to `consume`.
// Returns the number of bytes read, or -1 on a read error.
template <typename Consume>
int64_t readAll(int fd, Consume consume) {
    uint8_t block[kReadBlock];
    int64_t total = 0;
    for (;;) {
        const ssize_t count = ::read(fd, block, sizeof block);
        if (count < 0) {
            if (errno == EINTR) continue;
            return -1;
        }
        if (count == 0) return total;
        consume(block, static_cast<size_t>(count));
        total += count;
    }
}

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

    uint32_t crc = kCrc32Initial;
    if (readAll(fd.get(), [&](const uint8_t* data, size_t size) { crc = crc32Update(crc, data, size); }) < 0) {
        return STATUS_FAILED;
    }
    // Sizes of 4 GiB and more spill into the CRC half; no blob is that large.
    value = static_cast<uint64_t>(status.st_size) | (static_cast<uint64_t>(crc32Finish(crc)) << 32);
    return STATUS_OK;
}

Status readCheckValue(const std::filesystem::path& checkPath, uint64_t& value) {
    UniqueFd fd(::open(checkPath.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd) return STATUS_FAILED;
    uint8_t stored[kCheckValueSize] = {};
    const int64_t total = readAll(fd.get(), [&, offset = size_t{0}](const uint8_t* data, size_t size) mutable {
        for (size_t i = 0; i < size && offset < kCheckValueSize; ++i) stored[offset++] = data[i];
    });
    if (total != static_cast<int64_t>(kCheckValueSize)) return STATUS_FAILED;
    value = 0;
    for (size_t i = kCheckValueSize; i-- > 0;) value = (value << 8) | stored[i];
    return STATUS_OK;
}

void encodeCheckValue(uint64_t value, uint8_t (&bytes)[kCheckValueSize]) {
    for (size_t i = 0; i < kCheckValueSize; ++i) bytes[i] = static_cast<uint8_t>(value >> (8 * i));
}

}  // namespace Storage
