#include "migration_checks.h"

#include <gtest/gtest.h>

#include <functional>
#include <string>

#include "child_process.h"
#include "lib/util/bsd_checksum.h"
#include "lib/util/log.h"

namespace {

using testing_support::runInChild;

// A settings file of `fileSize` bytes declaring length `declared`, with a
// correct checksum when it fits (and `goodChecksum`).
Block settingsBlock(size_t fileSize, uint16_t declared, bool goodChecksum = true) {
    Block block(fileSize);
    for (size_t i = 0; i < fileSize; ++i) block[i] = static_cast<uint8_t>(0x30 + i * 7);
    if (fileSize >= 2) {
        block[0] = static_cast<uint8_t>(declared);
        block[1] = static_cast<uint8_t>(declared >> 8);
    }
    if (declared >= 4 && declared <= fileSize) {
        uint16_t sum = bsdChecksum16(0, block.data(), declared - 2u);
        if (!goodChecksum) sum ^= 1;
        block[declared - 2] = static_cast<uint8_t>(sum);
        block[declared - 1] = static_cast<uint8_t>(sum >> 8);
    }
    return block;
}

Block lutBlock(size_t size, uint8_t type = 0x80, uint8_t second = 0x11, uint16_t version = 2) {
    Block block(size, 0x5A);
    const uint8_t header[] = {type, second, static_cast<uint8_t>(version), static_cast<uint8_t>(version >> 8)};
    for (size_t i = 0; i < 4 && i < size; ++i) block[i] = header[i];
    return block;
}

void putLe32(Block& block, size_t offset, uint32_t value) {
    for (int i = 0; i < 4; ++i) block[offset + i] = static_cast<uint8_t>(value >> (8 * i));
}

Block overlayBlock(size_t size, uint32_t payloadLength) {
    Block block(size, 0xEE);
    putLe32(block, 0, 0x089CC2CB);
    block[6] = 5;
    block[7] = 0;
    putLe32(block, 8, 1);
    putLe32(block, 280, payloadLength);
    return block;
}

struct CheckRow {
    const char* name;
    Block block;
    Status expected;
    size_t expectedLength;
};

void PrintTo(const CheckRow& row, std::ostream* os) { *os << row.name; }

// The row's status and length from `check`, called with `length` as it
// comes in.
void expectRow(const CheckRow& row, size_t length, const std::function<Status(const Block&, size_t&)>& check) {
    EXPECT_EQ(check(row.block, length), row.expected);
    EXPECT_EQ(length, row.expectedLength);
}

class SettingsCheck : public ::testing::TestWithParam<CheckRow> {};

TEST_P(SettingsCheck, StatusAndLength) { expectRow(GetParam(), 12345, checkSettingsBlock); }

Block withLength(Block block, uint16_t declared) {
    block[0] = static_cast<uint8_t>(declared);
    block[1] = static_cast<uint8_t>(declared >> 8);
    return block;
}

INSTANTIATE_TEST_SUITE_P(Boundaries, SettingsCheck,
                         ::testing::Values(CheckRow{"empty", Block{}, STATUS_INVALID_PARAMETER, 0},
                                           CheckRow{"size3", settingsBlock(3, 3), STATUS_INVALID_PARAMETER, 3},
                                           CheckRow{"size6", settingsBlock(6, 6), STATUS_INVALID_PARAMETER, 6},
                                           CheckRow{"size4_L4", settingsBlock(4, 4), STATUS_OK, 4},
                                           CheckRow{"size8_L6", settingsBlock(8, 6), STATUS_OK, 6},
                                           CheckRow{"size8_L8", settingsBlock(8, 8), STATUS_OK, 8},
                                           CheckRow{"size8_L9", settingsBlock(8, 9), STATUS_OVERFLOW, 8},
                                           CheckRow{"size8_L12", settingsBlock(8, 12), STATUS_OVERFLOW, 8},
                                           CheckRow{"L0", settingsBlock(8, 0), STATUS_OVERFLOW, 8},
                                           CheckRow{"L1", settingsBlock(8, 1), STATUS_OVERFLOW, 8},
                                           CheckRow{"L2_never_passes", settingsBlock(8, 2), STATUS_FAILED, 8},
                                           CheckRow{"L3", withLength(settingsBlock(8, 3), 3), STATUS_FAILED, 8},
                                           CheckRow{"bad_checksum", settingsBlock(8, 6, false), STATUS_FAILED, 8},
                                           CheckRow{"large", settingsBlock(19784, 19000), STATUS_OK, 19000}),
                         [](const auto& info) { return std::string(info.param.name); });

TEST(SettingsCheck, TwoLengthBytesOnlyAreTheLength) {
    // Bytes 2 and 3 belong to the contents, not to the length.
    Block block = settingsBlock(8, 6);
    block[2] ^= 0xFF;
    size_t length = block.size();
    EXPECT_EQ(checkSettingsBlock(block, length), STATUS_FAILED);
    block = settingsBlock(8, 6);
    block[6] ^= 0xFF;  // filler after L is never looked at
    EXPECT_EQ(checkSettingsBlock(block, length), STATUS_OK);
    EXPECT_EQ(length, 6u);
}

class LutCheck : public ::testing::TestWithParam<CheckRow> {};

TEST_P(LutCheck, StatusAndLength) {
    expectRow(GetParam(), 1, [](const Block& block, size_t& length) { return checkLutHeader(block, length, 0); });
}

INSTANTIATE_TEST_SUITE_P(Boundaries, LutCheck,
                         ::testing::Values(CheckRow{"empty", Block{}, STATUS_INVALID_PARAMETER, 0},
                                           CheckRow{"size3", lutBlock(3), STATUS_INVALID_PARAMETER, 3},
                                           CheckRow{"size4", lutBlock(4), STATUS_FAILED, 4},
                                           CheckRow{"size19783", lutBlock(19783), STATUS_FAILED, 19783},
                                           CheckRow{"size19784", lutBlock(19784), STATUS_OK, 19784},
                                           CheckRow{"size30000", lutBlock(30000), STATUS_OK, 30000},
                                           CheckRow{"zero_word", lutBlock(19784, 0, 0, 0), STATUS_NOT_FOUND, 19784},
                                           CheckRow{"version3", lutBlock(19784, 0x80, 0x11, 3), STATUS_FAILED, 19784},
                                           CheckRow{"version0x102", lutBlock(19784, 0x80, 0x11, 0x102), STATUS_FAILED,
                                                    19784},
                                           CheckRow{"wrong_type", lutBlock(19784, 0x81), STATUS_FAILED, 19784},
                                           CheckRow{"wrong_second", lutBlock(19784, 0x80, 0x12), STATUS_FAILED, 19784}),
                         [](const auto& info) { return std::string(info.param.name); });

std::string lutLog(const Block& block, uint32_t slotIndex) {
    return runInChild([&] {
               setLogOutput(LOG_OUTPUT_STDOUT);
               size_t length = 0;
               return static_cast<int>(checkLutHeader(block, length, slotIndex));
           })
        .out;
}

TEST(LutCheck, OnlyAVersionMismatchIsLogged) {
    EXPECT_EQ(lutLog(lutBlock(19784, 0x80, 0x11, 3), 17), "Unable to parse LUT header at index 17\n");
    EXPECT_EQ(lutLog(lutBlock(19784, 0, 0, 0), 17), "");
    EXPECT_EQ(lutLog(lutBlock(19784, 0x81), 17), "");
    EXPECT_EQ(lutLog(lutBlock(19783), 17), "");
}

TEST(LutCheck, VersionLineIsAWarning) {
    const auto result = runInChild([] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_ERROR);
        size_t length = 0;
        return static_cast<int>(checkLutHeader(lutBlock(19784, 0x80, 0x11, 3), length, 1));
    });
    EXPECT_EQ(result.exitStatus, static_cast<int>(STATUS_FAILED));
    EXPECT_EQ(result.out, "");
}

class OverlayCheck : public ::testing::TestWithParam<CheckRow> {};

TEST_P(OverlayCheck, StatusAndLength) {
    expectRow(GetParam(), 1, [](const Block& block, size_t& length) { return checkOverlayHeader(block, length, 3); });
}

Block overlayWith(size_t offset, uint8_t value, Block block = overlayBlock(284, 0)) {
    block[offset] = value;
    return block;
}

Block shortened(Block block) {
    block.pop_back();
    return block;
}

INSTANTIATE_TEST_SUITE_P(
    Boundaries, OverlayCheck,
    ::testing::Values(CheckRow{"empty", Block{}, STATUS_INVALID_PARAMETER, 0},
                      CheckRow{"size283", shortened(overlayBlock(284, 0)), STATUS_INVALID_PARAMETER, 283},
                      CheckRow{"size284_P0", overlayBlock(284, 0), STATUS_OK, 284},
                      CheckRow{"size284_P1", overlayBlock(284, 1), STATUS_OVERFLOW, 284},
                      CheckRow{"payload_fits", overlayBlock(300, 16), STATUS_OK, 300},
                      CheckRow{"trailing_bytes_kept", overlayBlock(300, 10), STATUS_OK, 300},
                      CheckRow{"payload_one_over", overlayBlock(300, 17), STATUS_OVERFLOW, 300},
                      CheckRow{"P_wraps_32_bits", overlayBlock(300, 0xFFFFFFFF), STATUS_OVERFLOW, 300},
                      CheckRow{"P_near_wrap", overlayBlock(300, 0xFFFFFEF0), STATUS_OVERFLOW, 300},
                      CheckRow{"bad_magic", overlayWith(0, 0xCA), STATUS_NOT_FOUND, 284},
                      CheckRow{"magic_high_byte", overlayWith(3, 0x09), STATUS_NOT_FOUND, 284},
                      CheckRow{"format4", overlayWith(6, 4), STATUS_NOT_IMPLEMENTED, 284},
                      CheckRow{"format_high_byte", overlayWith(7, 1), STATUS_NOT_IMPLEMENTED, 284},
                      CheckRow{"bytes4_5_ignored", overlayWith(5, 0x77, overlayWith(4, 0x66)), STATUS_OK, 284},
                      CheckRow{"word8_zero", overlayWith(8, 0), STATUS_NOT_FOUND, 284},
                      CheckRow{"word8_high_byte_only", overlayWith(11, 1, overlayWith(8, 0)), STATUS_OK, 284}),
    [](const auto& info) { return std::string(info.param.name); });

TEST(AcceptAll, KeepsTheCallersLength) {
    size_t length = 7;
    EXPECT_EQ(acceptAll(Block(3), length), STATUS_OK);
    EXPECT_EQ(length, 7u);
}

}  // namespace
