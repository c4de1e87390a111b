// CRC-32 by folding with carry-less multiplication: four 16-byte lanes are
// carried forward over the input, each step multiplying a lane by x^512
// modulo the polynomial, then folded into one 16-byte remainder whose CRC
// the tables finish.
#include "lib/util/crc32_paths.h"

#if defined(__x86_64__)

#include <cpuid.h>
#include <immintrin.h>

namespace Crc32Paths {
namespace {

// Below this the set-up costs more than the tables.
constexpr size_t kMinimumLength = 128;

// The polynomial P in normal bit order (bit d: x^d), x^32 implied; the
// tables use the same one bit-reversed, 0xEDB88320.
constexpr uint32_t kPolynomial = 0x04C11DB7u;

// x^n mod P, in normal bit order.
constexpr uint32_t xPowerModP(unsigned n) {
    uint32_t remainder = 1;
    for (unsigned i = 0; i < n; ++i) remainder = (remainder << 1) ^ ((remainder & 0x80000000u) ? kPolynomial : 0u);
    return remainder;
}

static_assert(xPowerModP(32) == kPolynomial, "x^32 is congruent to the rest of P");

constexpr uint32_t reflect32(uint32_t value) {
    uint32_t reflected = 0;
    for (int bit = 0; bit < 32; ++bit) reflected |= ((value >> bit) & 1u) << (31 - bit);
    return reflected;
}

// The input is bit-reflected: the first byte's lowest bit is the highest
// power of x. A 16-byte lane A is H * x^64 + L, H its first eight bytes;
// moving it forward by `distance` bits means A * x^distance, which is
// congruent to H * (x^(distance+64) mod P) + L * (x^distance mod P). A
// reflected carry-less product carries an extra x, and a 32-bit constant
// in the low half of its quadword another x^32, hence the 33 taken off.
struct FoldConstants {
    uint64_t forFirstHalf;
    uint64_t forSecondHalf;
};

constexpr FoldConstants foldBy(unsigned distance) {
    return {reflect32(xPowerModP(distance + 64 - 33)), reflect32(xPowerModP(distance - 33))};
}

constexpr FoldConstants kFold512 = foldBy(512);
constexpr FoldConstants kFold128 = foldBy(128);

__attribute__((target("pclmul"))) inline __m128i fold(__m128i lane, __m128i constants, __m128i next) {
    const __m128i first = _mm_clmulepi64_si128(lane, constants, 0x00);
    const __m128i second = _mm_clmulepi64_si128(lane, constants, 0x11);
    return _mm_xor_si128(_mm_xor_si128(first, second), next);
}

inline __m128i load(const uint8_t* p) { return _mm_loadu_si128(reinterpret_cast<const __m128i*>(p)); }

inline __m128i constantsOf(FoldConstants constants) {
    return _mm_set_epi64x(static_cast<long long>(constants.forSecondHalf),
                          static_cast<long long>(constants.forFirstHalf));
}

}  // namespace

// Asked of the CPU on first use: __builtin_cpu_supports would bring a
// start-up constructor with it.
bool clmulAvailable() {
    static const bool available = [] {
        unsigned eax = 0, ebx = 0, ecx = 0, edx = 0;
        return __get_cpuid(1, &eax, &ebx, &ecx, &edx) != 0 && (ecx & bit_PCLMUL) != 0;
    }();
    return available;
}

__attribute__((target("pclmul"))) uint32_t updateClmul(uint32_t state, const uint8_t* data, size_t length) {
    if (length < kMinimumLength) return updateTable(state, data, length);

    // Starting from a state is the same as starting from zero with the
    // state XORed into the first four bytes.
    __m128i lane0 = _mm_xor_si128(load(data), _mm_cvtsi32_si128(static_cast<int>(state)));
    __m128i lane1 = load(data + 16);
    __m128i lane2 = load(data + 32);
    __m128i lane3 = load(data + 48);
    data += 64;
    length -= 64;

    const __m128i by512 = constantsOf(kFold512);
    while (length >= 64) {
        lane0 = fold(lane0, by512, load(data));
        lane1 = fold(lane1, by512, load(data + 16));
        lane2 = fold(lane2, by512, load(data + 32));
        lane3 = fold(lane3, by512, load(data + 48));
        data += 64;
        length -= 64;
    }

    const __m128i by128 = constantsOf(kFold128);
    __m128i remainder = fold(lane0, by128, lane1);
    remainder = fold(remainder, by128, lane2);
    remainder = fold(remainder, by128, lane3);
    while (length >= 16) {
        remainder = fold(remainder, by128, load(data));
        data += 16;
        length -= 16;
    }

    // The remainder stands for everything so far: its CRC from a zero state
    // is the running state after it.
    alignas(16) uint8_t bytes[16];
    _mm_store_si128(reinterpret_cast<__m128i*>(bytes), remainder);
    return updateTable(updateTable(0, bytes, sizeof bytes), data, length);
}

}  // namespace Crc32Paths

#endif
