// The 8-byte check value that the dual-file store keeps beside each copy of
// a blob: the data file's size ORed with its CRC-32 shifted left by 32, or
// all ones when the data file does not exist. Stored little-endian.
#pragma once

#include <cstdint>
#include <filesystem>

#include "lib/util/status.h"

namespace Storage {

constexpr uint64_t kAbsentBlobCheckValue = ~uint64_t{0};
constexpr size_t kCheckValueSize = 8;

// The check value of `dataPath`. STATUS_OK with kAbsentBlobCheckValue when
// the file does not exist; STATUS_FAILED when it cannot be opened, sized or
// read to the end.
[[nodiscard]] Status computeCheckValue(const std::filesystem::path& dataPath, uint64_t& value);

// The value stored in `checkPath`. STATUS_FAILED unless the file reads
// completely and holds exactly 8 bytes.
[[nodiscard]] Status readCheckValue(const std::filesystem::path& checkPath, uint64_t& value);

// The 8 bytes of `value` as stored (little-endian).
void encodeCheckValue(uint64_t value, uint8_t (&bytes)[kCheckValueSize]);

}  // namespace Storage
