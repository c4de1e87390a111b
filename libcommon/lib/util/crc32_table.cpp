#include <array>

#include "lib/util/crc32_paths.h"

namespace Crc32Paths {
namespace {

constexpr uint32_t kPolynomial = 0xEDB88320u;
constexpr size_t kSlices = 8;

using Table = std::array<uint32_t, 256>;

// tables[0] is the classic byte-wise table; tables[k][b] is the state
// change of byte b followed by k zero bytes, so eight bytes can be folded
// in with eight independent look-ups (slicing-by-8).
constexpr std::array<Table, kSlices> makeTables() {
    std::array<Table, kSlices> tables{};
    for (uint32_t byte = 0; byte < 256; ++byte) {
        uint32_t value = byte;
        for (int bit = 0; bit < 8; ++bit) value = (value & 1u) ? (value >> 1) ^ kPolynomial : value >> 1;
        tables[0][byte] = value;
    }
    for (size_t slice = 1; slice < kSlices; ++slice) {
        for (size_t byte = 0; byte < 256; ++byte) {
            const uint32_t previous = tables[slice - 1][byte];
            tables[slice][byte] = (previous >> 8) ^ tables[0][previous & 0xFFu];
        }
    }
    return tables;
}

// Constant-initialised: no work at start-up.
constexpr std::array<Table, kSlices> kTables = makeTables();

static_assert(kTables[0][1] == 0x77073096u && kTables[0][255] == 0x2D02EF8Du, "byte-wise table");

// Assembled byte by byte so the result does not depend on host byte order
// or alignment; compilers turn this into one load on little-endian targets.
inline uint32_t loadLittleEndian32(const uint8_t* p) {
    return static_cast<uint32_t>(p[0]) | static_cast<uint32_t>(p[1]) << 8 | static_cast<uint32_t>(p[2]) << 16 |
           static_cast<uint32_t>(p[3]) << 24;
}

}  // namespace

uint32_t updateTable(uint32_t state, const uint8_t* data, size_t length) {
    while (length >= 8) {
        const uint32_t low = loadLittleEndian32(data) ^ state;
        const uint32_t high = loadLittleEndian32(data + 4);
        state = kTables[7][low & 0xFFu] ^ kTables[6][(low >> 8) & 0xFFu] ^ kTables[5][(low >> 16) & 0xFFu] ^
                kTables[4][low >> 24] ^ kTables[3][high & 0xFFu] ^ kTables[2][(high >> 8) & 0xFFu] ^
                kTables[1][(high >> 16) & 0xFFu] ^ kTables[0][high >> 24];
        data += 8;
        length -= 8;
    }
    while (length-- > 0) state = (state >> 8) ^ kTables[0][(state ^ *data++) & 0xFFu];
    return state;
}

}  // namespace Crc32Paths
