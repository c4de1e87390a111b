#include "lib/storage/check_value.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "files.h"
#include "lib/util/fd.h"
#include "scratch_dir.h"
#include "store_files.h"

namespace {

using store_test::absentCheckFile;
using store_test::Bytes;
using store_test::bytesOf;
using store_test::expectedCheckFile;
using store_test::kPast;
using store_test::kSecond;
using store_test::mtimeNs;
using store_test::patternBytes;
using store_test::setMtimeNs;
using testing_support::ScratchDir;
using testing_support::writeBytes;

// A file opened as the store hands it to the check-value functions.
struct Opened {
    UniqueFd fd;
    struct stat status {};
};

Opened opened(const std::filesystem::path& path) {
    Opened file;
    file.fd.reset(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file.fd || ::fstat(file.fd.get(), &file.status) != 0) throw std::runtime_error("cannot open " + path.string());
    return file;
}

Status computeFor(const std::filesystem::path& path, uint64_t& value) {
    const Opened file = opened(path);
    return Storage::computeCheckValue(file.fd.get(), file.status, value);
}

Status readFrom(const std::filesystem::path& path, uint64_t& value) {
    const Opened file = opened(path);
    return Storage::readCheckValue(file.fd.get(), file.status, value);
}

// `use` on a directory named `name` fails and leaves the value alone.
void expectADirectoryFails(Status (*use)(const std::filesystem::path&, uint64_t&), const char* name) {
    ScratchDir dir;
    std::filesystem::create_directory(dir / name);
    uint64_t value = 7;
    EXPECT_EQ(use(dir / name, value), STATUS_FAILED);
    EXPECT_EQ(value, 7u);
}

uint64_t littleEndian(const Bytes& bytes) {
    uint64_t value = 0;
    for (size_t i = bytes.size(); i-- > 0;) value = (value << 8) | bytes[i];
    return value;
}

TEST(ReferenceCrc32, MatchesTheStandardCheckValue) {
    EXPECT_EQ(store_test::referenceCrc32(bytesOf("123456789")), 0xCBF43926u);
    EXPECT_EQ(store_test::referenceCrc32({}), 0u);
}

TEST(CheckValue, AbsentBlobIsAllOnes) { EXPECT_EQ(Storage::kAbsentBlobCheckValue, 0xFFFFFFFFFFFFFFFFull); }

// A data file's bytes and the check value computed from them.
struct ComputedRow {
    std::string name;
    Bytes data;
    uint64_t value;
};

std::vector<ComputedRow> computedRows() {
    std::vector<ComputedRow> rows = {{"EmptyFileIsZero", {}, 0},
                                     {"KnownTextGivesSizeAndCrc", bytesOf("123456789"), 0xCBF4392600000009ull}};
    // Sizes around the 4096-byte blocks a data file is read in, and larger,
    // against the reference layout.
    for (const size_t size :
         {size_t{1}, size_t{7}, size_t{4095}, size_t{4096}, size_t{4097}, size_t{8192}, size_t{12289}, size_t{65535},
          size_t{65536}, size_t{65537}, size_t{3 * 65536 + 5}, size_t{1000000}}) {
        const Bytes data = patternBytes(size, static_cast<uint32_t>(size));
        rows.push_back(
            {"MatchesTheReferenceLayoutAt" + std::to_string(size), data, littleEndian(expectedCheckFile(data))});
    }
    return rows;
}

class ComputeCheckValueOf : public ::testing::TestWithParam<ComputedRow> {};

TEST_P(ComputeCheckValueOf, SizeAndCrc) {
    ScratchDir dir;
    writeBytes(dir / "data", GetParam().data);
    uint64_t value = 1;
    ASSERT_EQ(computeFor(dir / "data", value), STATUS_OK);
    EXPECT_EQ(value, GetParam().value);
}

INSTANTIATE_TEST_SUITE_P(Rows, ComputeCheckValueOf, ::testing::ValuesIn(computedRows()),
                         [](const auto& info) { return info.param.name; });

// A read error (a directory passed off as a data file) fails the value.
TEST(ComputeCheckValue, UnreadableDataFails) { expectADirectoryFails(computeFor, "data"); }

// A data file of 5000 bytes, opened, and the check value that matches it.
class CompareCheckValue : public ::testing::Test {
protected:
    void SetUp() override {
        const Bytes data = patternBytes(5000, 4);
        writeBytes(dir / "data", data);
        file = opened(dir / "data");
        good = littleEndian(expectedCheckFile(data));
    }
    Storage::CheckMatch compare(uint64_t value) const {
        return Storage::compareCheckValue(file.fd.get(), file.status, value);
    }

    ScratchDir dir;
    Opened file;
    uint64_t good = 0;
};

// Only a size that agrees with the stored one lets the data be read.
TEST_F(CompareCheckValue, AgreesWithTheComputedValue) {
    using Storage::CheckMatch;
    EXPECT_EQ(compare(good), CheckMatch::kMatches);
    EXPECT_EQ(compare(good ^ (uint64_t{1} << 40)), CheckMatch::kCrcDiffers);
    EXPECT_EQ(compare(good + 1), CheckMatch::kSizeDiffers);
    // Only the size half counts as size: bits 32 and up are the CRC's.
    EXPECT_EQ(compare(good + (uint64_t{1} << 32)), CheckMatch::kCrcDiffers);
}

// A read would move the file position; a size that cannot match leaves it.
TEST_F(CompareCheckValue, ADifferentSizeIsNotRead) {
    EXPECT_EQ(compare(good - 1), Storage::CheckMatch::kSizeDiffers);
    EXPECT_EQ(::lseek(file.fd.get(), 0, SEEK_CUR), 0);
    EXPECT_EQ(compare(good), Storage::CheckMatch::kMatches);
    EXPECT_EQ(::lseek(file.fd.get(), 0, SEEK_CUR), 5000);
}

TEST(ReadCheckValue, EightBytesAreLittleEndian) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", {0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x07, 0x88});
    uint64_t value = 0;
    ASSERT_EQ(readFrom(dir / "data.chk", value), STATUS_OK);
    EXPECT_EQ(value, 0x8807060504030201ull);
}

TEST(ReadCheckValue, AllOnes) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", absentCheckFile());
    uint64_t value = 0;
    ASSERT_EQ(readFrom(dir / "data.chk", value), STATUS_OK);
    EXPECT_EQ(value, Storage::kAbsentBlobCheckValue);
}

TEST(CheckTimeOf, TheModificationTimeToTheNanosecond) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", absentCheckFile());
    setMtimeNs(dir / "data.chk", kPast + 123456789);
    const Storage::CheckTime time = Storage::checkTimeOf(opened(dir / "data.chk").status);
    EXPECT_TRUE(time.known);
    EXPECT_EQ(time.time.tv_sec, kPast / kSecond);
    EXPECT_EQ(time.time.tv_nsec, kPast % kSecond + 123456789);
}

struct ClockEdge {
    const char* name;
    int64_t mtimeNs;
    bool known;
};

class CheckTimeClockEdge : public ::testing::TestWithParam<ClockEdge> {};

// std::filesystem::last_write_time reports an error (and the earliest time)
// from second 9223372036 on; such a time is unknown here too.
TEST_P(CheckTimeClockEdge, TimesBeyondTheFileClockAreUnknown) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", absentCheckFile());
    setMtimeNs(dir / "data.chk", GetParam().mtimeNs);
    if (mtimeNs(dir / "data.chk") != GetParam().mtimeNs) GTEST_SKIP() << "the file system cannot hold this time";
    EXPECT_EQ(Storage::checkTimeOf(opened(dir / "data.chk").status).known, GetParam().known);

    std::error_code error;
    (void)std::filesystem::last_write_time(dir / "data.chk", error);  // only whether it fails matters
    EXPECT_EQ(!error, GetParam().known) << error.message();
}

INSTANTIATE_TEST_SUITE_P(Edges, CheckTimeClockEdge,
                         ::testing::Values(ClockEdge{"epoch", 0, true}, ClockEdge{"before_epoch", -kSecond, true},
                                           ClockEdge{"last_second", 9223372035 * kSecond + 999999999, true},
                                           ClockEdge{"first_second_beyond", 9223372036 * kSecond, false}),
                         [](const auto& info) { return std::string(info.param.name); });

struct LaterRow {
    const char* name;
    Storage::CheckTime later;
    Storage::CheckTime earlier;
    bool expected;
};

class IsLater : public ::testing::TestWithParam<LaterRow> {};

TEST_P(IsLater, ComparesSecondsThenNanoseconds) {
    EXPECT_EQ(Storage::isLater(GetParam().later, GetParam().earlier), GetParam().expected);
}

INSTANTIATE_TEST_SUITE_P(
    Rows, IsLater,
    ::testing::Values(LaterRow{"equal", {true, {10, 5}}, {true, {10, 5}}, false},
                      LaterRow{"one_nanosecond_later", {true, {10, 6}}, {true, {10, 5}}, true},
                      LaterRow{"one_nanosecond_earlier", {true, {10, 4}}, {true, {10, 5}}, false},
                      LaterRow{"later_second_fewer_nanoseconds", {true, {11, 0}}, {true, {10, 999999999}}, true},
                      LaterRow{"earlier_second_more_nanoseconds", {true, {9, 999999999}}, {true, {10, 0}}, false},
                      LaterRow{"negative_seconds", {true, {-1, 0}}, {true, {-2, 999999999}}, true},
                      LaterRow{"known_over_unknown", {true, {-100, 0}}, {false, {}}, true},
                      LaterRow{"unknown_over_known", {false, {500, 0}}, {true, {-100, 0}}, false},
                      LaterRow{"both_unknown", {false, {2, 0}}, {false, {1, 0}}, false}),
    [](const auto& info) { return std::string(info.param.name); });

// A read error (a directory passed off as an 8-byte check file) fails it.
TEST(ReadCheckValue, AReadErrorFails) {
    expectADirectoryFails(
        [](const std::filesystem::path& path, uint64_t& value) {
            Opened file = opened(path);
            file.status.st_size = 8;
            return Storage::readCheckValue(file.fd.get(), file.status, value);
        },
        "data.chk");
}

// A directory passed off as a check file is not 8 bytes long: not read.
TEST(ReadCheckValue, DirectoryFails) { expectADirectoryFails(readFrom, "data.chk"); }

class ReadCheckValueLength : public ::testing::TestWithParam<size_t> {};

TEST_P(ReadCheckValueLength, OnlyEightBytesAreGood) {
    ScratchDir dir;
    writeBytes(dir / "data.chk", Bytes(GetParam(), 0x00));
    uint64_t value = 7;
    const Status status = readFrom(dir / "data.chk", value);
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
    ASSERT_EQ(computeFor(dir / "data", value), STATUS_OK);
    uint8_t bytes[Storage::kCheckValueSize] = {};
    Storage::encodeCheckValue(value, bytes);
    EXPECT_EQ(Bytes(bytes, bytes + 8), expectedCheckFile(data));
}

}  // namespace
