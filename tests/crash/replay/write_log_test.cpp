// The log-writes reader on logs made by hand: every field read back, and
// every way a log can be cut short or damaged rejected with its reason.
#include "write_log.h"

#include <stdexcept>
#include <string>

#include <gtest/gtest.h>

#include "log_entries.h"

#include "files.h"
#include "scratch_dir.h"

namespace replay {
namespace {

WriteLog sample() {
    WriteLog log;
    log.entries = {writeEntry(8, 2, 0xa1, kMetadata), markEntry("op 1 begin"), writeEntry(100, 1, 0xb2, kFua),
                   writeEntry(0, 0, 0, kFlush),       discardEntry(64, 16),    markEntry("op 1 ack")};
    return log;
}

std::string rejection(const std::vector<uint8_t>& bytes) {
    try {
        parseWriteLog(bytes);
    } catch (const std::runtime_error& error) {
        return error.what();
    }
    return "accepted";
}

void putLittle(std::vector<uint8_t>& bytes, size_t at, uint64_t value) {
    for (int i = 0; i < 8; ++i) bytes[at + i] = static_cast<uint8_t>(value >> (8 * i));
}

TEST(WriteLog, ReadsBackEveryFieldOfEveryKindOfEntry) {
    const WriteLog log = parseWriteLog(encodeWriteLog(sample()));
    ASSERT_EQ(log.sectorSize, 512u);
    ASSERT_EQ(log.entries.size(), 6u);
    EXPECT_EQ(log.entries[0].sector, 8u);
    EXPECT_EQ(log.entries[0].sectorCount, 2u);
    EXPECT_EQ(log.entries[0].flags, kMetadata);
    EXPECT_EQ(log.entries[0].data, std::vector<uint8_t>(1024, 0xa1));
    EXPECT_TRUE(log.entries[0].writes());
    EXPECT_FALSE(log.entries[0].isBarrier());
    EXPECT_EQ(log.entries[1].mark, "op 1 begin");
    EXPECT_FALSE(log.entries[1].writes());
    EXPECT_TRUE(log.entries[2].isBarrier());
    EXPECT_EQ(log.entries[2].data, std::vector<uint8_t>(512, 0xb2));
    EXPECT_TRUE(log.entries[3].isBarrier());
    EXPECT_FALSE(log.entries[3].writes());
    EXPECT_TRUE(log.entries[4].isDiscard());
    EXPECT_EQ(log.entries[4].sectorCount, 16u);
    EXPECT_TRUE(log.entries[4].data.empty());
    EXPECT_EQ(log.entries[5].mark, "op 1 ack");
}

TEST(WriteLog, LayoutIsHeaderSectorsWithTheirDataBehind) {
    const std::vector<uint8_t> bytes = encodeWriteLog(sample());
    // Super block, then: header + 2 data, mark, header + 1 data, flush,
    // discard, mark.
    EXPECT_EQ(bytes.size(), 512u * (1 + 3 + 1 + 2 + 1 + 1 + 1));
    EXPECT_EQ(bytes[0], 0x72);
    EXPECT_EQ(bytes[16], 6);
    EXPECT_EQ(bytes[24], 0x00);
    EXPECT_EQ(bytes[25], 0x02);
    EXPECT_EQ(bytes[512], 8);            // first entry's sector
    EXPECT_EQ(bytes[1024], 0xa1);        // its data
    EXPECT_EQ(bytes[2048 + 16], kMark);  // the mark's flags
    EXPECT_EQ(std::string(reinterpret_cast<const char*>(&bytes[2048 + 32])), "op 1 begin");
}

TEST(WriteLog, ALargerSectorSizeScalesEverything) {
    WriteLog log;
    log.sectorSize = 4096;
    log.entries = {writeEntry(3, 1, 0x5a, kFua, 4096)};
    const std::vector<uint8_t> bytes = encodeWriteLog(log);
    EXPECT_EQ(bytes.size(), 3u * 4096);
    const WriteLog back = parseWriteLog(bytes);
    EXPECT_EQ(back.sectorSize, 4096u);
    EXPECT_EQ(back.entries.at(0).data.size(), 4096u);
}

TEST(WriteLog, AnEmptyLogHasNoEntries) { EXPECT_TRUE(parseWriteLog(encodeWriteLog(WriteLog{})).entries.empty()); }

TEST(WriteLog, EveryTruncationIsRejected) {
    const std::vector<uint8_t> bytes = encodeWriteLog(sample());
    for (size_t length = 0; length < bytes.size(); length += 16) {
        const std::vector<uint8_t> cut(bytes.begin(), bytes.begin() + static_cast<long>(length));
        EXPECT_NE(rejection(cut), "accepted") << "cut at " << length;
    }
    EXPECT_EQ(rejection(bytes), "accepted");
}

struct Damage {
    const char* name;
    size_t at;
    uint64_t value;
    const char* reason;
};

class WriteLogDamage : public ::testing::TestWithParam<Damage> {};

TEST_P(WriteLogDamage, IsRejectedWithItsReason) {
    std::vector<uint8_t> bytes = encodeWriteLog(sample());
    putLittle(bytes, GetParam().at, GetParam().value);
    EXPECT_EQ(rejection(bytes), std::string("write log: ") + GetParam().reason);
}

INSTANTIATE_TEST_SUITE_P(
    Rows, WriteLogDamage,
    ::testing::Values(Damage{"magic", 0, 0x6a736677736873, "bad magic"}, Damage{"version", 8, 2, "version 2, not 1"},
                      Damage{"sector_size_small", 24, 256, "sector size 256"},
                      Damage{"sector_size_odd", 24, 1536, "sector size 1536"},
                      Damage{"more_entries", 16, 7, "entry 6 lies beyond the end"},
                      Damage{"unknown_flag", 512 + 16, 32 | kFua, "entry 0 has unknown flags 34"},
                      Damage{"long_text", 2048 + 24, 481, "entry 1 has text longer than its sector"},
                      Damage{"data_beyond", 2560 + 8, 40, "entry 2's data lies beyond the end"},
                      Damage{"huge", 512 + 8, uint64_t{1} << 40, "entry 0 is implausibly long"}),
    [](const ::testing::TestParamInfo<Damage>& info) { return std::string(info.param.name); });

TEST(WriteLog, ReadsAFileAsFarAsTheLogGoes) {
    testing_support::ScratchDir scratch;
    std::vector<uint8_t> bytes = encodeWriteLog(sample());
    // A log device is larger than its log: what follows is not read.
    bytes.resize(bytes.size() + 4096, 0xee);
    testing_support::writeBytes(scratch.path() / "log", bytes);
    const WriteLog log = readWriteLog(scratch.path() / "log");
    EXPECT_EQ(log.entries.size(), 6u);
    EXPECT_EQ(log.entries.back().mark, "op 1 ack");
}

TEST(WriteLog, AMissingFileIsAnError) {
    testing_support::ScratchDir scratch;
    EXPECT_THROW(readWriteLog(scratch.path() / "missing"), std::system_error);
}

}  // namespace
}  // namespace replay
