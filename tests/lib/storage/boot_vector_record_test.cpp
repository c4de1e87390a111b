#include "lib/storage/boot_vector_record.h"

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <ostream>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "lib/storage/boot_vector_target.h"
#include "lib/util/log.h"
#include "scratch_dir.h"
#include "storage_log.h"
#include "store_files.h"

namespace {

using Storage::BootVectorTarget;
using Storage::SectorParse;
using Record = std::vector<uint8_t>;
using store_test::hex;
using testing_support::runInChild;
using testing_support::withoutStorageLineNumbers;

// ---- the record format, computed here without the library ----

uint8_t headerSum(const Record& record) {
    unsigned sum = 0;
    for (size_t i = 0; i < 8; ++i) sum += record[i];
    return static_cast<uint8_t>(sum);
}

uint16_t rotateAddSum(const Record& record) {
    unsigned c = 0;
    for (size_t i = 0; i < 18; ++i) c = (((c >> 1) | ((c & 1u) << 15)) + record[i]) & 0xFFFFu;
    return static_cast<uint16_t>(c);
}

bool referenceValid(const Record& record) {
    return headerSum(record) == record[8] && rotateAddSum(record) == (record[18] | record[19] << 8);
}

// Fills in both checksums.
Record sealed(Record record) {
    record.resize(20);
    record[8] = headerSum(record);
    const uint16_t sum = rotateAddSum(record);
    record[18] = static_cast<uint8_t>(sum);
    record[19] = static_cast<uint8_t>(sum >> 8);
    return record;
}

Record recordWithValue(uint32_t value, uint8_t seed) {
    Record record(20);
    record[0] = static_cast<uint8_t>(value >> 24);
    record[1] = static_cast<uint8_t>(value >> 16);
    record[2] = static_cast<uint8_t>(value >> 8);
    record[3] = static_cast<uint8_t>(value);
    for (size_t i = 4; i < 18; ++i) record[i] = static_cast<uint8_t>(seed * 31 + i * 13);
    return sealed(record);
}

// ---- locating: the partitioning tool's last line ----

struct SectorRow {
    const char* text;
    SectorParse expected;
    uint64_t sector;  // checked unless the row says otherwise
    bool sectorChecked = true;
};

std::ostream& operator<<(std::ostream& out, const SectorRow& row) { return out << '"' << row.text << '"'; }

class SectorParsing : public ::testing::TestWithParam<SectorRow> {};

TEST_P(SectorParsing, Row) {
    const SectorRow& row = GetParam();
    uint64_t sector = 0xDEADBEEF;
    EXPECT_EQ(Storage::parseBootVectorSector(row.text, sector), row.expected);
    if (row.sectorChecked) {
        EXPECT_EQ(sector, row.sector);
    }
}

constexpr uint64_t kUntouched = 0xDEADBEEF;

INSTANTIATE_TEST_SUITE_P(
    Rows, SectorParsing,
    ::testing::Values(
        // The last line of "sfdisk -q -n -F": start, end, sectors, size.
        SectorRow{" 30703616 30777343 73728 36M\n", SectorParse::kOk, 30703616},
        SectorRow{"30703616 33554431 2850816  1.4G\n", SectorParse::kOk, 30703616},
        // The bounds: 3 GiB and 16 GiB in sectors, both inclusive.
        SectorRow{"6291456\n", SectorParse::kOk, 6291456}, SectorRow{"33554432\n", SectorParse::kOk, 33554432},
        SectorRow{"6291455\n", SectorParse::kOutOfRange, 6291455},
        SectorRow{"33554433\n", SectorParse::kOutOfRange, 33554433}, SectorRow{"0\n", SectorParse::kOutOfRange, 0},
        SectorRow{"2048000 33554431 31506432 15G\n", SectorParse::kOutOfRange, 2048000},
        // Nothing that starts a number.
        SectorRow{"", SectorParse::kNotANumber, kUntouched}, SectorRow{"\n", SectorParse::kNotANumber, kUntouched},
        SectorRow{"Start End Sectors Size\n", SectorParse::kNotANumber, kUntouched},
        SectorRow{"   Start\n", SectorParse::kNotANumber, kUntouched},
        SectorRow{"M30703616\n", SectorParse::kNotANumber, kUntouched},
        // Parsed as a floating-point number, truncated toward zero.
        SectorRow{"-5\n", SectorParse::kOutOfRange, 0}, SectorRow{"-30703616\n", SectorParse::kOutOfRange, 0},
        SectorRow{"12345678.9\n", SectorParse::kOk, 12345678}, SectorRow{"33554432.99\n", SectorParse::kOk, 33554432},
        SectorRow{"6291455.99\n", SectorParse::kOutOfRange, 6291455},
        SectorRow{"3.0703616e7 x\n", SectorParse::kOk, 30703616}, SectorRow{"+6291456", SectorParse::kOk, 6291456},
        SectorRow{"\t 6291457 ", SectorParse::kOk, 6291457}, SectorRow{"0x1d48000\n", SectorParse::kOk, 30703616},
        SectorRow{"30703616M", SectorParse::kOk, 30703616},
        // Numbers a sector cannot be.
        SectorRow{"nan\n", SectorParse::kOutOfRange, 0, false}, SectorRow{"inf\n", SectorParse::kOutOfRange, 0, false},
        SectorRow{"-inf\n", SectorParse::kOutOfRange, 0}, SectorRow{"1e30\n", SectorParse::kOutOfRange, 0, false},
        SectorRow{"18446744073709551616\n", SectorParse::kOutOfRange, 0, false}));

TEST(BootVectorLocation, RecordOffsetOfTheUsualSector) {
    uint64_t sector = 0;
    ASSERT_EQ(Storage::parseBootVectorSector(" 30703616 30777343 73728 36M\n", sector), SectorParse::kOk);
    EXPECT_EQ(sector * Storage::kSectorSize, 15720251392u);
}

// A value above 2^32 that lands in range after truncation to 32 bits must
// still be out of range.
TEST(BootVectorLocation, NoTruncationTo32Bits) {
    uint64_t sector = 0;
    EXPECT_EQ(Storage::parseBootVectorSector("4301670400\n", sector), SectorParse::kOutOfRange);  // 2^32 + 6291456
    EXPECT_EQ(sector, 4301670400u);
}

// ---- validating a record ----

TEST(BootVectorRecord, ZeroBytesAreValid) {
    const Record zeros(20, 0);
    EXPECT_TRUE(Storage::isValidBootVectorRecord(zeros.data()));
    EXPECT_EQ(Storage::bootVectorValue(zeros.data()), 0u);
}

TEST(BootVectorRecord, SealedRecordsAreValid) {
    for (const uint32_t value : {0u, 1u, 258u, 0x01020304u, 0xFFFFFFFFu}) {
        const Record record = recordWithValue(value, static_cast<uint8_t>(value));
        EXPECT_TRUE(Storage::isValidBootVectorRecord(record.data())) << hex(record);
    }
}

TEST(BootVectorRecord, ValueIsBigEndian) {
    Record record(20, 0);
    record[2] = 0x01;
    record[3] = 0x02;
    EXPECT_EQ(Storage::bootVectorValue(sealed(record).data()), 258u);
    EXPECT_EQ(Storage::bootVectorValue(recordWithValue(0x01020304u, 1).data()), 16909060u);
    EXPECT_EQ(Storage::bootVectorValue(recordWithValue(0xFFFFFFFEu, 1).data()), 4294967294u);
    record = Record{0x80, 0, 0, 0};
    EXPECT_EQ(Storage::bootVectorValue(sealed(record).data()), 2147483648u);
}

// Byte 8 wrong while bytes 18-19 match the 16-bit sum over the record as it
// stands: only the header check can reject it.
TEST(BootVectorRecord, WrongHeaderSumIsRejectedOnItsOwn) {
    for (unsigned delta = 1; delta < 256; ++delta) {
        Record record = recordWithValue(0x01020304u, 5);
        record[8] = static_cast<uint8_t>(record[8] + delta);
        const uint16_t sum = rotateAddSum(record);
        record[18] = static_cast<uint8_t>(sum);
        record[19] = static_cast<uint8_t>(sum >> 8);
        ASSERT_EQ(rotateAddSum(record), record[18] | record[19] << 8);
        EXPECT_FALSE(Storage::isValidBootVectorRecord(record.data())) << hex(record);
    }
}

// Header sum right, record checksum off by one.
TEST(BootVectorRecord, WrongRecordChecksumIsRejected) {
    Record record = recordWithValue(0x01020304u, 5);
    record[19] = static_cast<uint8_t>(record[19] + 1);
    EXPECT_EQ(headerSum(record), record[8]);
    EXPECT_FALSE(Storage::isValidBootVectorRecord(record.data()));
}

// A record whose 16-bit checksum is 0x1234 is valid with 34 12 in bytes
// 18-19 and invalid with 12 34.
TEST(BootVectorRecord, ChecksumIsStoredLittleEndian) {
    Record record = recordWithValue(0x00000102u, 0);
    // The body bytes 9 to 17 are free: try them until the sum is 0x1234.
    std::mt19937 random(42);
    bool found = false;
    for (int attempt = 0; attempt < 10000000 && !found; ++attempt) {
        for (size_t i = 9; i < 18; ++i) record[i] = static_cast<uint8_t>(random());
        found = rotateAddSum(record) == 0x1234;
    }
    ASSERT_TRUE(found);
    ASSERT_EQ(rotateAddSum(record), 0x1234);
    record[18] = 0x34;
    record[19] = 0x12;
    EXPECT_TRUE(Storage::isValidBootVectorRecord(record.data())) << hex(record);
    record[18] = 0x12;
    record[19] = 0x34;
    EXPECT_FALSE(Storage::isValidBootVectorRecord(record.data())) << hex(record);
}

// Every change of any one byte of a valid record is caught.
TEST(BootVectorRecord, EveryChangedByteIsRejected) {
    for (const Record& valid : {Record(20, 0), recordWithValue(0x01020304u, 3), recordWithValue(0xFFFFFFFFu, 200)}) {
        ASSERT_TRUE(Storage::isValidBootVectorRecord(valid.data()));
        for (size_t position = 0; position < 20; ++position) {
            for (unsigned flip = 1; flip < 256; ++flip) {
                Record changed = valid;
                changed[position] = static_cast<uint8_t>(changed[position] ^ flip);
                ASSERT_FALSE(Storage::isValidBootVectorRecord(changed.data()))
                    << "byte " << position << " ^ " << flip << ": " << hex(changed);
            }
        }
    }
}

// The library agrees with the computation here on records of every kind:
// random, with only the header sum right, and fully sealed.
TEST(BootVectorRecord, AgreesWithTheReferenceOnRandomRecords) {
    std::mt19937 random(12345);
    size_t validSeen = 0;
    for (int round = 0; round < 30000; ++round) {
        Record record(20);
        for (uint8_t& byte : record) byte = static_cast<uint8_t>(random());
        if (round % 3 >= 1) record[8] = headerSum(record);
        if (round % 3 == 2) record = sealed(record);
        const bool expected = referenceValid(record);
        validSeen += expected ? 1 : 0;
        ASSERT_EQ(Storage::isValidBootVectorRecord(record.data()), expected) << hex(record);
        if (round % 3 == 2) {
            ASSERT_TRUE(expected);
        }
    }
    EXPECT_GE(validSeen, 10000u);
}

// ---- the target on a host that has no "/dev/mmcblk0" ----

class BootVectorWithoutDevice : public ::testing::Test {
protected:
    void SetUp() override {
        if (std::filesystem::exists("/dev/mmcblk0")) GTEST_SKIP() << "this host has a /dev/mmcblk0";
    }
    // Runs `body` on a new target in a child, with the log on standard
    // output at `threshold`.
    static testing_support::ProcessResult onTarget(int threshold, int (*body)(BootVectorTarget&)) {
        return runInChild([&] {
            setLogOutput(LOG_OUTPUT_STDOUT);
            setLogLevel(threshold);
            BootVectorTarget target;
            return body(target);
        });
    }
};

TEST_F(BootVectorWithoutDevice, ConstructionLogsOneParseFailure) {
    const auto result = onTarget(LOG_PRIORITY_DEBUG, [](BootVectorTarget&) {
        std::printf("built\n");
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    // Nothing on the partitioning tool's standard output.
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "lib/storage/storage_target:N Failed to parse flash size ''\nbuilt\n")
        << result.out;
}

TEST_F(BootVectorWithoutDevice, SlotIsUnusable) {
    const auto result = onTarget(LOG_PRIORITY_ERROR, [](BootVectorTarget& target) {
        std::printf("---\n");
        std::printf("count %zu description %s\n", target.getSlotCount(), target.getDescription().c_str());
        std::printf("slot1 %d\n", target.getSlot(1) ? 1 : 0);
        std::printf("slot2^32 %d\n", target.getSlot(size_t{1} << 32) ? 1 : 0);
        Storage::SlotHandle slot = target.getSlot(0);
        if (!slot || slot.ownsSlot() || slot.get() != target.getSlot(0).get()) return 1;
        std::printf("exists %d valid %d\n", slot->exists() ? 1 : 0, slot->isValid() ? 1 : 0);

        uint8_t buffer[20];
        std::fill(buffer, buffer + 20, 0xEE);
        size_t got = 77;
        std::printf("read %u\n", slot->read(buffer, 20, 0));
        const Status someStatus = slot->readSome(buffer, 20, 0, got);
        std::printf("readSome %u %zu\n", someStatus, got);
        std::printf("untouched %d\n", std::all_of(buffer, buffer + 20, [](uint8_t b) { return b == 0xEE; }) ? 1 : 0);
        const Record record = recordWithValue(258, 1);
        std::printf("write %u\n", slot->write(record.data(), record.size()));
        std::printf("write 19 %u\n", slot->write(record.data(), 19));
        std::printf("removeAllSlots %u\n", target.removeAllSlots());
        size_t index = 0;
        size_t size = 0;
        std::printf("addSlot %u removeSlot %u\n", target.addSlot("x", index, size), target.removeSlot(0));
        std::printf("begin %u writeAt %u finalise %u erase %u\n", slot->beginWrite(),
                    slot->writeAt(0, record.data(), record.size()), slot->finalise(), slot->erase());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    const std::string out = withoutStorageLineNumbers(result.out);
    const size_t separator = out.find("---\n");
    ASSERT_NE(separator, std::string::npos) << out;
    EXPECT_EQ(out.substr(separator + 4),
              "count 1 description BootVectorTarget\n"
              "slot1 0\n"
              "slot2^32 0\n"
              "exists 0 valid 0\n"
              "lib/storage/storage_target:N Cannot read boot vector\n"
              "read 2\n"
              "lib/storage/storage_target:N Cannot read boot vector\n"
              "readSome 2 77\n"
              "untouched 1\n"
              "lib/storage/storage_target:N Cannot change boot vector\n"
              "write 2\n"
              "lib/storage/storage_target:N Cannot change boot vector\n"
              "write 19 2\n"
              "removeAllSlots 114\n"
              "addSlot 38 removeSlot 38\n"
              "begin 38 writeAt 38 finalise 38 erase 38\n");
}

// Results do not depend on the threshold; the messages do.
TEST_F(BootVectorWithoutDevice, SilentBelowErrorPriority) {
    const auto result = onTarget(LOG_PRIORITY_CRITICAL, [](BootVectorTarget& target) {
        uint8_t buffer[20] = {};
        const Record record = recordWithValue(258, 1);
        std::printf("read %u\n", target.getSlot(0)->read(buffer, 20, 0));
        std::printf("write %u\n", target.getSlot(0)->write(record.data(), record.size()));
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "read 2\nwrite 2\n");
}

// The locating steps through the whole target: a stand-in for `tail`, first
// on PATH, gives the last line of the partitioning tool's output (or fails).
struct LocateRow {
    const char* name;
    const char* tailScript;  // body of the stand-in
    const char* log;         // with line numbers as N
};

std::ostream& operator<<(std::ostream& out, const LocateRow& row) { return out << row.name; }

class BootVectorLocateWithoutDevice : public ::testing::TestWithParam<LocateRow> {
protected:
    void SetUp() override {
        if (std::filesystem::exists("/dev/mmcblk0")) GTEST_SKIP() << "this host has a /dev/mmcblk0";
    }

    // Builds the target with the row's stand-in first on PATH and the log
    // at `threshold`; prints whether the slot is valid.
    testing_support::ProcessResult build(int threshold) const {
        testing_support::ScratchDir dir;
        const std::filesystem::path tail = dir / "tail";
        testing_support::writeText(tail, std::string("#!/bin/sh\n") + GetParam().tailScript + "\n");
        std::filesystem::permissions(tail, std::filesystem::perms::owner_all);
        return runInChild([&] {
            const char* path = std::getenv("PATH");
            setenv("PATH", (dir.path().string() + ":" + (path != nullptr ? path : "/usr/bin:/bin")).c_str(), 1);
            setLogOutput(LOG_OUTPUT_STDOUT);
            setLogLevel(threshold);
            BootVectorTarget target;
            std::printf("valid %d\n", target.getSlot(0)->isValid() ? 1 : 0);
            return 0;
        });
    }
};

TEST_P(BootVectorLocateWithoutDevice, Row) {
    const auto result = build(LOG_PRIORITY_WARNING);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(withoutStorageLineNumbers(result.out), std::string(GetParam().log) + "valid 0\n");
}

// Every failure is an error line: none shows at the critical threshold.
TEST_P(BootVectorLocateWithoutDevice, SilentAtTheCriticalThreshold) {
    const auto result = build(LOG_PRIORITY_CRITICAL);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "valid 0\n");
}

INSTANTIATE_TEST_SUITE_P(
    Rows, BootVectorLocateWithoutDevice,
    ::testing::Values(LocateRow{"CommandFails", "exit 1", "lib/storage/storage_target:N Failed to query flash size\n"},
                      LocateRow{"CommandKilled", "kill -KILL $PPID; kill -KILL $$",
                                "lib/storage/storage_target:N Failed to query flash size\n"},
                      LocateRow{"NothingPrinted", "exit 0",
                                "lib/storage/storage_target:N Failed to parse flash size ''\n"},
                      // The captured text keeps its newline, which splits the line.
                      LocateRow{"Heading", "echo 'Start End Sectors Size'",
                                "lib/storage/storage_target:N Failed to parse flash size 'Start End Sectors Size\n'\n"},
                      LocateRow{"BelowTheRange", "echo ' 6291455 33554431 27262977 13G'",
                                "lib/storage/storage_target:N Boot vector 6291455 not in range 6291456 to 33554432\n"},
                      LocateRow{"AboveTheRange", "echo 33554433",
                                "lib/storage/storage_target:N Boot vector 33554433 not in range 6291456 to 33554432\n"},
                      LocateRow{"Negative", "echo -5",
                                "lib/storage/storage_target:N Boot vector 0 not in range 6291456 to 33554432\n"},
                      // In range, so the device is opened next, and it is missing.
                      LocateRow{"InRange", "echo ' 30703616 30777343 73728 36M'",
                                "libcommon/lib/util/fd:N Failed to open /dev/mmcblk0: No such file or directory\n"
                                "lib/storage/storage_target:N Boot vector query failed!\n"},
                      LocateRow{"Fraction", "echo 12345678.9",
                                "libcommon/lib/util/fd:N Failed to open /dev/mmcblk0: No such file or directory\n"
                                "lib/storage/storage_target:N Boot vector query failed!\n"}),
    [](const ::testing::TestParamInfo<LocateRow>& info) { return std::string(info.param.name); });

}  // namespace
