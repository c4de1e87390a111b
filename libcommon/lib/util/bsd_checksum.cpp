#include "lib/util/bsd_checksum.h"

uint16_t bsdChecksum16(uint16_t seed, const uint8_t* data, uint32_t length) {
    uint16_t sum = seed;
    for (uint32_t i = 0; i < length; ++i) {
        sum = static_cast<uint16_t>((sum >> 1) | (sum << 15));
        sum = static_cast<uint16_t>(sum + data[i]);
    }
    return sum;
}
