#include "lib/storage/check_value.h"

#include <filesystem>

#include <gtest/gtest.h>

#include "files.h"
#include "scratch_dir.h"
#include "store_files.h"

namespace {

using store_test::absentCheckFile;
using store_test::bytesOf;
using store_test::Bytes;
using store_test::expectedCheckFile;
using store_test::patternBytes;
using testing_support::ScratchDir;
using testing_support::writeBytes;

uint64_t littleEndian(const Bytes& bytes) {
    uint64_t value = 0;
    for (size_t i = bytes.size(); i-- > 0;) value = (value << 8) | bytes[i];
    return value;
}

TEST(ReferenceCrc32, MatchesTheStandardCheckValue) {
    EXPECT_EQ(store_test::referenceCrc32(bytesOf("123456789")), 0xCBF43926u);
    EXPECT_EQ(store_test::referenceCrc32({}), 0u);
}

TEST(ComputeCheckValue, AbsentFileIsAllOnes) {
    ScratchDir dir;
    uint64_t value = 0;
    ASSERT_EQ(Storage::computeCheckValue(dir / "data", value), STATUS_OK);
    EXPECT_EQ(value, 0xFFFFFFFFFFFFFFFFull);
    EXPECT_EQ(Storage::kAbsentBlobCheckValue, 0xFFFFFFFFFFFFFFFFull);
}

TEST(ComputeCheckValue, EmptyFileIsZero) {
    ScratchDir dir;
    writeBytes(dir / "data", {});
    uint64_t value = 1;
    ASSERT_EQ(Storage::computeCheckValue(dir / "data", value), STATUS_OK);
    EXPECT_EQ(value, 0u);
}

TEST(ComputeCheckValue, KnownTextGivesSizeAndCrc) {
    ScratchDir dir;
    writeBytes(dir / "data", bytesOf("123456789"));
    uint64_t value = 0;
    ASSERT_EQ(Storage::computeCheckValue(dir / "data", value), STATUS_OK);
    EXPECT_EQ(value, 0xCBF4392600000009ull);
}

class ComputeCheckValueSizes : public ::testing::TestWithParam<size_t> {};

// Sizes around the 4096-byte read blocks.
TEST_P(ComputeCheckValueSizes, MatchesTheReferenceLayout) {
    ScratchDir dir;
    const Bytes data = patternBytes(GetParam(), static_cast<uint32_t>(GetParam()));
    writeBytes(dir / "data", data);
    uint64_t value = 0;
    ASSERT_EQ(Storage::computeCheckValue(dir / "data", value), STATUS_OK);
    EXPECT_EQ(value, littleEndian(expectedCheckFile(data)));
}

INSTANTIATE_TEST_SUITE_P(Blocks, ComputeCheckValueSizes,
                         ::testing::Values(1, 7, 4095, 4096, 4097, 8192, 12289, 100000));

TEST(ComputeCheckValue, UnreadableDataFails) {
    ScratchDir dir;
    std::filesystem::create_directory(dir / "data");  // opens, but cannot be read
    uint64_t value = 7;
    EXPECT_EQ(Storage::computeCheckValue(dir / "data", value), STATUS_FAILED);
    EXPECT_EQ(value, 7u);
}

TEST(ComputeCheckValue, DataBelowAFileFails) {
    ScratchDir dir;
    writeBytes(dir / "file", bytesOf("x"));
    uint64_t value = 7;
    EXPECT_EQ(Storage::computeCheckValue(dir / "file" / "data", value), STATUS_FAILED);
    EXPECT_EQ(value, 7u);
}

TEST(ReadCheckValue, EightBytesAreLittleEndian) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", {0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x07, 0x88});
    uint64_t value = 0;
    ASSERT_EQ(Storage::readCheckValue(dir / "data.chk", value), STATUS_OK);
    EXPECT_EQ(value, 0x8807060504030201ull);
}

TEST(ReadCheckValue, AllOnes) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", absentCheckFile());
    uint64_t value = 0;
    ASSERT_EQ(Storage::readCheckValue(dir / "data.chk", value), STATUS_OK);
    EXPECT_EQ(value, Storage::kAbsentBlobCheckValue);
}

TEST(ReadCheckValue, MissingFileFails) {
    ScratchDir dir;
    uint64_t value = 7;
    EXPECT_EQ(Storage::readCheckValue(dir / "data.chk", value), STATUS_FAILED);
    EXPECT_EQ(value, 7u);
}

TEST(ReadCheckValue, DirectoryFails) {
    ScratchDir dir;
    std::filesystem::create_directory(dir / "data.chk");
    uint64_t value = 7;
    EXPECT_EQ(Storage::readCheckValue(dir / "data.chk", value), STATUS_FAILED);
    EXPECT_EQ(value, 7u);
}

class ReadCheckValueLength : public ::testing::TestWithParam<size_t> {};

TEST_P(ReadCheckValueLength, OnlyEightBytesAreGood) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", Bytes(GetParam(), 0x00));
    uint64_t value = 7;
    const Status status = Storage::readCheckValue(dir / "data.chk", value);
    if (GetParam() == 8) {
        EXPECT_EQ(status, STATUS_OK);
        EXPECT_EQ(value, 0u);
    } else {
        EXPECT_EQ(status, STATUS_FAILED);
        EXPECT_EQ(value, 7u);
    }
}

INSTANTIATE_TEST_SUITE_P(Lengths, ReadCheckValueLength,
                         ::testing::Values(0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 15, 16, 4096, 4104, 8192));

TEST(EncodeCheckValue, LittleEndian) {
    uint8_t bytes[Storage::kCheckValueSize] = {};
    Storage::encodeCheckValue(0x8807060504030201ull, bytes);
    EXPECT_EQ(Bytes(bytes, bytes + 8), (Bytes{0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x07, 0x88}));
}

TEST(EncodeCheckValue, RoundTripsThroughAFile) {
    ScratchDir dir;
    const Bytes data = patternBytes(300, 3);
    writeBytes(dir / "data", data);
    uint64_t value = 0;
    ASSERT_EQ(Storage::computeCheckValue(dir / "data", value), STATUS_OK);
    uint8_t bytes[Storage::kCheckValueSize] = {};
    Storage::encodeCheckValue(value, bytes);
    EXPECT_EQ(Bytes(bytes, bytes + 8), expectedCheckFile(data));
}

}  // namespace
