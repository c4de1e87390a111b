// The 8-byte check value that the dual-file store keeps beside each copy of
// a blob: the data file's size ORed with its CRC-32 shifted left by 32, or
// all ones when the data file does not exist. Stored little-endian.
#pragma once

#include <sys/stat.h>
#include <cstdint>
#include <ctime>

#include "lib/util/status.h"

namespace Storage {

constexpr uint64_t kAbsentBlobCheckValue = ~uint64_t{0};
constexpr size_t kCheckValueSize = 8;

// The check value of the open regular data file `fd`, whose fstat is
// `status`: its size ORed with the CRC-32 of its bytes, read to the end in
// blocks of 4096 bytes, shifted left by 32. STATUS_FAILED on a read error.
[[nodiscard]] Status computeCheckValue(int fd, const struct stat& status, uint64_t& value);

// How the open regular data file `fd` compares with the check value
// `stored`, as computeCheckValue gives it. The data is read only when its
// size agrees with the size half of `stored`: a file that cannot match,
// however large, is never read. kUnreadable leaves the read's errno.
enum class CheckMatch { kMatches, kSizeDiffers, kCrcDiffers, kUnreadable };
CheckMatch compareCheckValue(int fd, const struct stat& status, uint64_t stored);

// A check file's modification time, as opening a slot compares them.
// Unknown when it could not be read or lies beyond what
// std::filesystem::file_time_type holds (from the year 2262 on); an unknown
// time is earlier than every known one.
struct CheckTime {
    bool known = false;
    struct timespec time {};
};

// The modification time in `status`.
CheckTime checkTimeOf(const struct stat& status);

// `later` is strictly later than `earlier`.
bool isLater(const CheckTime& later, const CheckTime& earlier);

// The value stored in the open regular check file `fd`, whose fstat is
// `status`. STATUS_FAILED unless it holds exactly 8 bytes and they read; a
// file of any other size is not read.
[[nodiscard]] Status readCheckValue(int fd, const struct stat& status, uint64_t& value);

// The 8 bytes of `value` as stored (little-endian).
void encodeCheckValue(uint64_t value, uint8_t (&bytes)[kCheckValueSize]);

}  // namespace Storage
