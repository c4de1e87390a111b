// The implementations behind crc32Update, one per instruction set, so that
// each can be run and compared on its own. Not for use outside crc32.cpp and
// its tests: crc32Update picks the fastest available one.
//
// Every path takes and returns the running state exactly as crc32Update
// does and gives bit-identical results; a path may only be called when its
// `available` answers true on the running CPU.
#pragma once

#include <cstddef>
#include <cstdint>

namespace Crc32Paths {

using Update = uint32_t (*)(uint32_t state, const uint8_t* data, size_t length);

// Slicing-by-8 tables: runs on every CPU.
uint32_t updateTable(uint32_t state, const uint8_t* data, size_t length);

#if defined(__x86_64__)
// Carry-less multiplication (PCLMULQDQ) folding 64 bytes per step; short
// inputs and tails go through the tables.
bool clmulAvailable();
uint32_t updateClmul(uint32_t state, const uint8_t* data, size_t length);
#endif

#if defined(__aarch64__) && __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
#define CRC32_PATHS_ARM_CRC 1
// The ARMv8 CRC32 instructions (optional in ARMv8.0, so asked of the CPU
// once through the auxiliary vector).
bool armCrcAvailable();
uint32_t updateArmCrc(uint32_t state, const uint8_t* data, size_t length);
#endif

struct Path {
    const char* name;
    bool (*available)();
    Update update;
};

inline bool always() { return true; }

// Fastest first; the last one is always available.
inline constexpr Path kPaths[] = {
#if defined(__x86_64__)
    {"clmul", clmulAvailable, updateClmul},
#endif
#if defined(CRC32_PATHS_ARM_CRC)
    {"arm-crc32", armCrcAvailable, updateArmCrc},
#endif
    {"table", always, updateTable},
};

}  // namespace Crc32Paths
