// The 8-byte check value that the dual-file store keeps beside each copy of
// a blob: the data file's size ORed with its CRC-32 shifted left by 32, or
// all ones when the data file does not exist. Stored little-endian.
#pragma once

#include <cstdint>
#include <ctime>
#include <sys/stat.h>

#include "lib/util/status.h"

namespace Storage {

constexpr uint64_t kAbsentBlobCheckValue = ~uint64_t{0};
constexpr size_t kCheckValueSize = 8;

// The check value of the data file `name` in `directory`, from one open of
// the file: its size as fstat gives it, the CRC-32 of its bytes read to the
// end. STATUS_OK with kAbsentBlobCheckValue when the file does not exist;
// STATUS_FAILED when it cannot be opened, sized or read, or is not a regular
// file (a link is not followed; a FIFO or device is never read).
[[nodiscard]] Status computeCheckValue(int directory, const char* name, uint64_t& value);

// Whether the data file `name` in `directory` has the check value `stored`,
// as computeCheckValue gives it. The data is read only when its size agrees
// with the size half of `stored`: a file that cannot match, however large,
// is never read.
bool matchesCheckValue(int directory, const char* name, uint64_t stored);

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

// The value stored in the check file `name` in `directory`, from one open
// of the file; `modified` (when not null) receives its modification time,
// also when the value is bad. STATUS_NOT_FOUND when the file does not
// exist; STATUS_FAILED unless it is a regular file (a link is not followed)
// that reads completely and holds exactly 8 bytes.
[[nodiscard]] Status readCheckValue(int directory, const char* name, uint64_t& value, CheckTime* modified = nullptr);

// The 8 bytes of `value` as stored (little-endian).
void encodeCheckValue(uint64_t value, uint8_t (&bytes)[kCheckValueSize]);

}  // namespace Storage
