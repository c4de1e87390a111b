// CRC-32 with the ARMv8 CRC32 instructions. The file is built for plain
// ARMv8-A; only these functions may use the instructions, and only once the
// CPU has been seen to have them.
#include "lib/util/crc32_paths.h"

#if defined(CRC32_PATHS_ARM_CRC)

#include <arm_acle.h>
#include <asm/hwcap.h>
#include <sys/auxv.h>
#include <cstring>

namespace Crc32Paths {

bool armCrcAvailable() {
    static const bool available = (getauxval(AT_HWCAP) & HWCAP_CRC32) != 0;
    return available;
}

__attribute__((target("+crc"))) uint32_t updateArmCrc(uint32_t state, const uint8_t* data, size_t length) {
    for (; length >= 8; data += 8, length -= 8) {
        uint64_t word;
        std::memcpy(&word, data, sizeof word);  // unaligned, little-endian
        state = __crc32d(state, word);
    }
    for (; length > 0; ++data, --length) state = __crc32b(state, *data);
    return state;
}

}  // namespace Crc32Paths

#endif
