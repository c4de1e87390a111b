#include "lib/util/bsd_checksum.h"

#include <cstdint>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "files.h"

namespace {

using Bytes = std::vector<uint8_t>;
using testing_support::bytesOf;
using testing_support::counting;

Bytes pattern(size_t count) {
    Bytes bytes(count);
    for (size_t i = 0; i < count; ++i) bytes[i] = static_cast<uint8_t>(i * 7 + 3);
    return bytes;
}

TEST(BsdChecksum16, EmptyInputWithZeroSeedIsZero) {
    const uint8_t none[1] = {0xAA};
    EXPECT_EQ(bsdChecksum16(0, none, 0), 0);
}

TEST(BsdChecksum16, SingleByteOne) {
    const uint8_t data[] = {0x01};
    EXPECT_EQ(bsdChecksum16(0, data, 1), 0x0001);
}

TEST(BsdChecksum16, TwoBytesOneRotateIntoTopBit) {
    const uint8_t data[] = {0x01, 0x01};
    EXPECT_EQ(bsdChecksum16(0, data, 2), 0x8001);
}

TEST(BsdChecksum16, LengthZeroReturnsSeedUnread) {
    const uint8_t data[] = {0xFF, 0x01};
    for (const uint16_t seed : {0x0000, 0x0001, 0x1234, 0x8000, 0xFFFF}) {
        EXPECT_EQ(bsdChecksum16(seed, data, 0), seed) << "seed " << seed;
        EXPECT_EQ(bsdChecksum16(seed, nullptr, 0), seed) << "seed " << seed;
    }
}

TEST(BsdChecksum16, ReadsOnlyLengthBytes) {
    const uint8_t data[] = {0x01, 0x01, 0xFF, 0xFF};
    EXPECT_EQ(bsdChecksum16(0, data, 2), 0x8001);
    EXPECT_EQ(bsdChecksum16(0, data, 1), 0x0001);
}

TEST(BsdChecksum16, SeedIsRotatedLikeAnEarlierSum) {
    // 0x8001 rotated right 17 times is 0xC000; adding zeros changes nothing.
    const Bytes zeros(17, 0);
    EXPECT_EQ(bsdChecksum16(0x8001, zeros.data(), 17), 0xC000);
    const uint8_t one[] = {0x01};
    EXPECT_EQ(bsdChecksum16(0x0001, one, 1), 0x8001);
    EXPECT_EQ(bsdChecksum16(0x0002, one, 1), 0x0002);
}

TEST(BsdChecksum16, SumWrapsAtSixteenBits) {
    const uint8_t data[] = {0xFF};
    // 0xFFFE rotates to 0x7FFF; + 0xFF = 0x80FE.
    EXPECT_EQ(bsdChecksum16(0xFFFE, data, 1), 0x80FE);
    // 0xFFFF rotates to 0xFFFF; + 0xFF wraps to 0x00FE.
    EXPECT_EQ(bsdChecksum16(0xFFFF, data, 1), 0x00FE);
}

TEST(BsdChecksum16, SplitComputationCarriesSeedThrough) {
    const Bytes data = pattern(300);
    const uint16_t whole = bsdChecksum16(0x1234, data.data(), static_cast<uint32_t>(data.size()));
    for (size_t split = 0; split <= data.size(); ++split) {
        const uint16_t first = bsdChecksum16(0x1234, data.data(), static_cast<uint32_t>(split));
        const uint16_t rest = bsdChecksum16(first, data.data() + split, static_cast<uint32_t>(data.size() - split));
        ASSERT_EQ(rest, whole) << "split at " << split;
    }
}

struct Vector {
    const char* name;
    uint16_t seed;
    Bytes data;
    uint16_t expected;
};

// Values computed with an independent implementation of the same rotation.
TEST(BsdChecksum16, KnownVectors) {
    const std::vector<Vector> vectors = {
        {"digits", 0x0000, bytesOf("123456789"), 0xD16F},
        {"digits seeded", 0xFFFF, bytesOf("123456789"), 0xD06F},
        {"counting 0..255", 0x0000, counting(256), 0x0200},
        {"0xFF x100", 0x0000, Bytes(100, 0xFF), 0xE15D},
        {"pattern 1000 seeded", 0x1234, pattern(1000), 0x9C98},
        {"text", 0x0000, bytesOf("The quick brown fox jumps over the lazy dog"), 0xC56E},
    };
    for (const Vector& v : vectors) {
        EXPECT_EQ(bsdChecksum16(v.seed, v.data.data(), static_cast<uint32_t>(v.data.size())), v.expected) << v.name;
    }
}

}  // namespace
