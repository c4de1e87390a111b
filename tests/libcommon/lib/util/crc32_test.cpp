#include "lib/util/crc32.h"

#include <algorithm>
#include <cstdint>
#include <fstream>
#include <functional>
#include <iterator>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "lib/util/crc32_paths.h"

namespace {

using Bytes = std::vector<uint8_t>;
using testing_support::bytesOf;
using testing_support::counting;

Bytes repeated(const std::string& text, size_t times) {
    Bytes bytes;
    for (size_t i = 0; i < times; ++i) bytes.insert(bytes.end(), text.begin(), text.end());
    return bytes;
}

// One bit at a time, straight from the polynomial: shares nothing with the
// tables under test.
uint32_t bitwiseCrc32(const uint8_t* data, size_t length) {
    uint32_t state = 0xFFFFFFFFu;
    for (size_t i = 0; i < length; ++i) {
        state ^= data[i];
        for (int bit = 0; bit < 8; ++bit) state = (state >> 1) ^ (0xEDB88320u & (0u - (state & 1u)));
    }
    return ~state;
}

Bytes randomBytes(std::mt19937& random, size_t count) {
    std::uniform_int_distribution<int> byte(0, 255);
    Bytes bytes(count);
    for (auto& b : bytes) b = static_cast<uint8_t>(byte(random));
    return bytes;
}

struct Vector {
    const char* name;
    Bytes data;
    uint32_t expected;
};

// Expected values taken from Python's zlib.crc32.
TEST(Crc32, KnownVectors) {
    const std::vector<Vector> vectors = {
        {"empty", Bytes{}, 0x00000000u},
        {"a", bytesOf("a"), 0xE8B7BE43u},
        {"check string", bytesOf("123456789"), 0xCBF43926u},
        {"eight digits", bytesOf("12345678"), 0x9AE0DAAFu},
        {"fox", bytesOf("The quick brown fox jumps over the lazy dog"), 0x414FA339u},
        {"counting 0..255", counting(256), 0x29058C73u},
        {"4096 zeros", Bytes(4096, 0x00), 0xC71C0011u},
        {"4097 x 0xFF", Bytes(4097, 0xFF), 0x1F24BD79u},
        {"check string x1000", repeated("123456789", 1000), 0x407589CFu},
    };
    for (const Vector& v : vectors) {
        EXPECT_EQ(crc32(v.data.data(), v.data.size()), v.expected) << v.name;
        EXPECT_EQ(crc32Finish(crc32Update(kCrc32Initial, v.data.data(), v.data.size())), v.expected) << v.name;
    }
}

TEST(Crc32, NoBytesLeaveTheStateAndMayBeNull) {
    EXPECT_EQ(crc32(nullptr, 0), 0u);
    for (const uint32_t state : {0u, 1u, 0x12345678u, kCrc32Initial}) {
        EXPECT_EQ(crc32Update(state, nullptr, 0), state);
    }
}

TEST(Crc32, FinishInvertsTheState) {
    EXPECT_EQ(kCrc32Initial, 0xFFFFFFFFu);
    EXPECT_EQ(crc32Finish(0xFFFFFFFFu), 0u);
    EXPECT_EQ(crc32Finish(0x340BC6D9u), 0xCBF43926u);
    const Bytes digits = bytesOf("123456789");
    EXPECT_EQ(crc32Update(kCrc32Initial, digits.data(), digits.size()), 0x340BC6D9u);
}

// Every length through a few eight-byte strides at every start alignment,
// so each tail length meets each alignment.
TEST(Crc32, ShortInputsAtEveryAlignmentMatchBitwise) {
    std::mt19937 random(20240501u);
    const Bytes buffer = randomBytes(random, 64 + 16);
    for (size_t offset = 0; offset < 16; ++offset) {
        for (size_t length = 0; length <= 64; ++length) {
            ASSERT_EQ(crc32(buffer.data() + offset, length), bitwiseCrc32(buffer.data() + offset, length))
                << "offset " << offset << " length " << length;
        }
    }
}

// `crc` of random inputs up to 70,000 bytes at random alignments against
// the bit-wise reference.
template <typename Crc>
void expectRandomInputsMatchBitwise(Crc crc, int rounds) {
    std::mt19937 random(0xC0FFEEu);
    std::uniform_int_distribution<size_t> lengthOf(0, 70000);
    std::uniform_int_distribution<size_t> offsetOf(0, 15);
    for (int round = 0; round < rounds; ++round) {
        const size_t length = lengthOf(random);
        const size_t offset = offsetOf(random);
        const Bytes buffer = randomBytes(random, offset + length);
        ASSERT_EQ(crc(buffer.data() + offset, length), bitwiseCrc32(buffer.data() + offset, length))
            << "round " << round << " offset " << offset << " length " << length;
    }
}

TEST(Crc32, RandomInputsMatchBitwise) { expectRandomInputsMatchBitwise(crc32, 150); }

// 0, `size` and up to eleven random places between, sorted: the bounds of
// one to twelve pieces.
std::vector<size_t> randomCuts(std::mt19937& random, size_t size) {
    std::uniform_int_distribution<int> piecesOf(1, 12);
    std::vector<size_t> cuts{0, size};
    const int pieces = piecesOf(random);
    std::uniform_int_distribution<size_t> cutAt(0, size);
    for (int i = 1; i < pieces; ++i) cuts.push_back(cutAt(random));
    std::sort(cuts.begin(), cuts.end());
    return cuts;
}

// `rounds` random inputs of up to `maxLength` bytes, each cut at random
// places and fed piece by piece, piece `i` of round `round` through
// `updateFor(i, round)`: the finished state is the bitwise CRC of the whole,
// and crc32()'s.
void expectRandomSplitsMatch(size_t maxLength, int rounds,
                             const std::function<Crc32Paths::Update(size_t i, int round)>& updateFor) {
    std::mt19937 random(77u);
    std::uniform_int_distribution<size_t> lengthOf(0, maxLength);
    for (int round = 0; round < rounds; ++round) {
        const Bytes data = randomBytes(random, lengthOf(random));
        const std::vector<size_t> cuts = randomCuts(random, data.size());

        uint32_t state = kCrc32Initial;
        for (size_t i = 0; i + 1 < cuts.size(); ++i) {
            state = updateFor(i, round)(state, data.data() + cuts[i], cuts[i + 1] - cuts[i]);
        }
        ASSERT_EQ(crc32Finish(state), bitwiseCrc32(data.data(), data.size())) << "round " << round;
        ASSERT_EQ(crc32Finish(state), crc32(data.data(), data.size())) << "round " << round;
    }
}

TEST(Crc32, IncrementalAtRandomSplitsMatchesOneShot) {
    expectRandomSplitsMatch(70000, 100, [](size_t, int) -> Crc32Paths::Update { return crc32Update; });
}

// The way a file is checksummed: whole 4096-byte blocks and a short tail.
TEST(Crc32, BlocksOf4096MatchOneShot) {
    std::mt19937 random(4096u);
    for (const size_t length :
         {size_t{0}, size_t{1}, size_t{4095}, size_t{4096}, size_t{4097}, size_t{8192}, size_t{3 * 4096 + 123}}) {
        const Bytes data = randomBytes(random, length);
        uint32_t state = kCrc32Initial;
        for (size_t at = 0; at < length; at += 4096) {
            state = crc32Update(state, data.data() + at, std::min<size_t>(4096, length - at));
        }
        EXPECT_EQ(crc32Finish(state), bitwiseCrc32(data.data(), data.size())) << "length " << length;
    }
}

TEST(Crc32, EverySingleBitFlipChangesTheValue) {
    std::mt19937 random(5u);
    Bytes data = randomBytes(random, 40);
    const uint32_t original = crc32(data.data(), data.size());
    for (size_t bit = 0; bit < data.size() * 8; ++bit) {
        data[bit / 8] ^= static_cast<uint8_t>(1u << (bit % 8));
        const uint32_t flipped = crc32(data.data(), data.size());
        ASSERT_NE(flipped, original) << "bit " << bit;
        ASSERT_EQ(flipped, bitwiseCrc32(data.data(), data.size())) << "bit " << bit;
        data[bit / 8] ^= static_cast<uint8_t>(1u << (bit % 8));
    }
}

// ---- every implementation path on its own ----

}  // namespace

namespace Crc32Paths {
// Test names and failure messages show the path by its name.
void PrintTo(const Path& path, std::ostream* out) { *out << path.name; }
}  // namespace Crc32Paths

namespace {

class Crc32Path : public ::testing::TestWithParam<Crc32Paths::Path> {
protected:
    void SetUp() override {
        if (!GetParam().available()) GTEST_SKIP() << GetParam().name << " is not available on this CPU";
    }
    uint32_t crcOf(const uint8_t* data, size_t length) const {
        return crc32Finish(GetParam().update(kCrc32Initial, data, length));
    }
};

TEST_P(Crc32Path, KnownVectors) {
    const Bytes fox = bytesOf("The quick brown fox jumps over the lazy dog");
    const Bytes digits = repeated("123456789", 1000);
    const Bytes ones(4097, 0xFF);
    const Bytes zeros(4096, 0x00);
    EXPECT_EQ(crcOf(nullptr, 0), 0u);
    EXPECT_EQ(crcOf(fox.data(), fox.size()), 0x414FA339u);
    EXPECT_EQ(crcOf(digits.data(), digits.size()), 0x407589CFu);
    EXPECT_EQ(crcOf(ones.data(), ones.size()), 0x1F24BD79u);
    EXPECT_EQ(crcOf(zeros.data(), zeros.size()), 0xC71C0011u);
}

TEST_P(Crc32Path, NoBytesLeaveTheState) {
    for (const uint32_t state : {0u, 1u, 0x12345678u, kCrc32Initial}) {
        EXPECT_EQ(GetParam().update(state, nullptr, 0), state);
    }
}

// Every length up to well past the sizes where a path changes strategy
// (whole 64-byte steps, 16-byte steps, byte tails), at every alignment,
// from several starting states.
TEST_P(Crc32Path, EveryLengthAndAlignmentMatchesBitwise) {
    std::mt19937 random(20240502u);
    const Bytes buffer = randomBytes(random, 600 + 16);
    for (size_t offset = 0; offset < 16; ++offset) {
        for (size_t length = 0; length <= 600; ++length) {
            const uint8_t* data = buffer.data() + offset;
            ASSERT_EQ(crcOf(data, length), bitwiseCrc32(data, length)) << "offset " << offset << " length " << length;
        }
    }
}

TEST_P(Crc32Path, AnyStartingStateMatchesTheTables) {
    std::mt19937 random(99u);
    const Bytes buffer = randomBytes(random, 5000);
    for (const uint32_t state : {0u, 1u, 0x80000000u, 0xDEADBEEFu, kCrc32Initial}) {
        for (const size_t length :
             {size_t{0}, size_t{3}, size_t{64}, size_t{127}, size_t{128}, size_t{129}, size_t{4999}}) {
            ASSERT_EQ(GetParam().update(state, buffer.data() + 1, length),
                      Crc32Paths::updateTable(state, buffer.data() + 1, length))
                << "state " << state << " length " << length;
        }
    }
}

TEST_P(Crc32Path, RandomLengthsAndOffsetsMatchBitwise) {
    expectRandomInputsMatchBitwise([this](const uint8_t* data, size_t length) { return crcOf(data, length); }, 60);
}

TEST_P(Crc32Path, LargeBuffersMatchBitwise) {
    std::mt19937 random(1u << 20);
    const Bytes data = randomBytes(random, (1u << 20) + 77);
    for (const size_t length : {size_t{65536}, size_t{65536 + 13}, data.size()}) {
        EXPECT_EQ(crcOf(data.data(), length), bitwiseCrc32(data.data(), length)) << "length " << length;
    }
}

// Pieces cut at random places, each fed by this path or by the tables in
// turn: the running state means the same to all of them.
TEST_P(Crc32Path, RandomSplitsMixedWithTheTablesMatchBitwise) {
    const Crc32Paths::Update path = GetParam().update;
    expectRandomSplitsMatch(20000, 60, [path](size_t i, int round) {
        return (i + static_cast<size_t>(round)) % 2 == 0 ? path : Crc32Paths::updateTable;
    });
}

TEST_P(Crc32Path, EverySingleBitFlipOfALongInputMatchesBitwise) {
    std::mt19937 random(6u);
    Bytes data = randomBytes(random, 200);
    for (size_t bit = 0; bit < data.size() * 8; bit += 7) {
        data[bit / 8] ^= static_cast<uint8_t>(1u << (bit % 8));
        ASSERT_EQ(crcOf(data.data(), data.size()), bitwiseCrc32(data.data(), data.size())) << "bit " << bit;
        data[bit / 8] ^= static_cast<uint8_t>(1u << (bit % 8));
    }
}

INSTANTIATE_TEST_SUITE_P(Paths, Crc32Path, ::testing::ValuesIn(Crc32Paths::kPaths),
                         [](const ::testing::TestParamInfo<Crc32Paths::Path>& info) {
                             std::string name = info.param.name;
                             std::replace(name.begin(), name.end(), '-', '_');
                             return name;
                         });

TEST(Crc32Paths, TheLastPathIsTheTablesAndAlwaysAvailable) {
    const Crc32Paths::Path& last = *std::prev(std::end(Crc32Paths::kPaths));
    EXPECT_STREQ(last.name, "table");
    EXPECT_TRUE(last.available());
    EXPECT_EQ(last.update, &Crc32Paths::updateTable);
}

// The CPU's own description of itself, as Linux reports it.
std::string cpuInfo() {
    std::ifstream in("/proc/cpuinfo");
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

#if defined(__x86_64__)
TEST(Crc32Paths, CarryLessMultiplyIsUsedWhenTheCpuHasIt) {
    const bool listed = cpuInfo().find(" pclmulqdq") != std::string::npos;
    EXPECT_EQ(Crc32Paths::clmulAvailable(), listed);
}
#endif

#if defined(CRC32_PATHS_ARM_CRC)
// qemu-aarch64's default CPU has the CRC32 instructions; under emulation
// /proc/cpuinfo describes the host, so it is asked only on real hardware.
TEST(Crc32Paths, CrcInstructionsAreUsedWhenTheCpuHasThem) {
    if (!testing_support::programEmulator().empty()) {
        EXPECT_TRUE(Crc32Paths::armCrcAvailable());
    } else {
        EXPECT_EQ(Crc32Paths::armCrcAvailable(), cpuInfo().find(" crc32") != std::string::npos);
    }
}
#endif

}  // namespace
