// The CRC-32 of IEEE 802.3: reflected polynomial 0xEDB88320, initial value
// 0xFFFFFFFF, final inversion (the value zlib's crc32 reports).
//
// Incremental use works on the running state, which is neither seeded nor
// inverted by crc32Update itself:
//
//     uint32_t state = kCrc32Initial;
//     state = crc32Update(state, block, blockLength);  // once per block
//     uint32_t crc = crc32Finish(state);
//
// Any split of the input into blocks gives the same result as crc32 over
// the whole of it. Pure functions: no errors, no allocation, thread-safe.
#pragma once

#include <cstddef>
#include <cstdint>

constexpr uint32_t kCrc32Initial = 0xFFFFFFFFu;

// Feeds `length` bytes at `data` into the running state and returns the new
// state. `data` may be null when `length` is 0.
uint32_t crc32Update(uint32_t state, const uint8_t* data, size_t length);

// Turns a running state into the CRC-32 value.
constexpr uint32_t crc32Finish(uint32_t state) { return ~state; }

// The CRC-32 of `length` bytes at `data`; 0 for no bytes.
uint32_t crc32(const uint8_t* data, size_t length);
