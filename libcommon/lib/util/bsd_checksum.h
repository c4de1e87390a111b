// The classic BSD 16-bit rotating checksum.
#pragma once

#include <cstdint>

// For each byte: rotate the 16-bit sum right by one bit, then add the byte.
// A length of 0 returns `seed`.
uint16_t bsdChecksum16(uint16_t seed, const uint8_t* data, uint32_t length);
