#include "lib/storage/dual_file_target.h"

#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <initializer_list>
#include <iterator>
#include <memory>
#include <stdexcept>
#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "dual_file_test_names.h"
#include "files.h"
#include "lib/util/log.h"
#include "scratch_dir.h"
#include "source_lines.h"
#include "store_files.h"

namespace {

using namespace dual_file_test;
using Storage::SlotHandle;
using store_test::absentCheckFile;
using store_test::mtimeNs;
using store_test::nothingStored;
using store_test::setMtimeNs;
using testing_support::readBytes;
using testing_support::runInChild;
using testing_support::writeBytes;

constexpr int64_t kTwoSeconds = 2 * kSecond;

class DualFileStore : public ::testing::Test {
protected:
    fs::path base() const { return dir / "store"; }
    fs::path copyDir(int copy) const { return base() / (copy == 0 ? "1" : "2"); }
    fs::path data(int copy) const { return copyDir(copy) / "data"; }
    fs::path check(int copy) const { return copyDir(copy) / "data.chk"; }

    std::unique_ptr<DualFileTarget> open(size_t slots = 1) { return std::make_unique<DualFileTarget>(base(), slots); }
    // A fresh one-slot target over the same directory, read at once.
    SlotContent reopened() {
        DualFileTarget target(base(), 1);
        return contentOf(*target.getSlot(0).get());
    }
    static TargetSlot& slotOf(DualFileTarget& target, size_t index = 0) {
        TargetSlot* slot = target.getSlot(index).get();
        if (slot == nullptr) throw std::runtime_error("no slot");
        return *slot;
    }
    static Status write(TargetSlot& slot, const Bytes& blob) { return slot.write(blob.data(), blob.size()); }
    static Status writeAt(TargetSlot& slot, int64_t offset, const Bytes& block) {
        return slot.writeAt(offset, block.data(), block.size());
    }
    // Both reads at offset 0 fail with `status`, leave the buffer as it was
    // and leave readSome's count alone.
    static void expectReadsFail(TargetSlot& slot, Status status) {
        uint8_t buffer[4] = {1, 2, 3, 4};
        size_t count = 42;
        EXPECT_EQ(slot.read(buffer, sizeof buffer, 0), status);
        EXPECT_EQ(slot.readSome(buffer, sizeof buffer, 0, count), status);
        EXPECT_EQ(count, 42u);
        EXPECT_EQ(Bytes(buffer, buffer + 4), (Bytes{1, 2, 3, 4}));
    }
    // In a child with the log on standard output: `body` on the slot of a
    // fresh one-slot target with the blob "new", then the slot's content in
    // hex on a line of its own.
    testing_support::ProcessResult newBlobInChild(const std::function<void(TargetSlot&, const Bytes&)>& body) {
        return runInChild([&] {
            setLogOutput(LOG_OUTPUT_STDOUT);
            DualFileTarget target(base(), 1);
            TargetSlot& slot = *target.getSlot(0).get();
            body(slot, bytesOf("new"));
            std::printf("%s\n", hex(contentOf(slot).data).c_str());
            return 0;
        });
    }
    // Writes each blob in turn through a one-slot target that is closed
    // before this returns.
    void storeInTurn(std::initializer_list<Bytes> blobs) {
        DualFileTarget target(base(), 1);
        TargetSlot& slot = slotOf(target);
        for (const Bytes& blob : blobs) EXPECT_EQ(write(slot, blob), STATUS_OK);
    }
    // A data file in each copy directory and no check file beside either.
    void writeUncheckedCopies(const Bytes& zero, const Bytes& one) {
        fs::create_directories(copyDir(0));
        fs::create_directories(copyDir(1));
        writeBytes(data(0), zero);
        writeBytes(data(1), one);
    }
    // The slot of a fresh one-slot target, the target living as long as the
    // test.
    TargetSlot& freshSlot() { return slotAfterWrites({}); }

    // The slot of a fresh one-slot target after each blob was written to it in
    // turn; the target lives as long as the test.
    TargetSlot& slotAfterWrites(std::initializer_list<Bytes> blobs) {
        written = open();
        TargetSlot& slot = slotOf(*written);
        for (const Bytes& blob : blobs) EXPECT_EQ(write(slot, blob), STATUS_OK);
        return slot;
    }

    ScratchDir dir;
    std::unique_ptr<DualFileTarget> written;
};

// ---- the target ----

TEST_F(DualFileStore, FreshOneSlotStoreHoldsNothing) {
    auto target = open();
    EXPECT_EQ(target->getSlotCount(), 1u);
    SlotHandle slot = target->getSlot(0);
    ASSERT_TRUE(slot);
    EXPECT_FALSE(slot.ownsSlot());
    EXPECT_FALSE(slot->exists());
    EXPECT_FALSE(slot->isValid());
    expectReadsFail(*slot.get(), STATUS_NOT_FOUND);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n");
}

TEST_F(DualFileStore, IndexEqualToTheCountHasNoSlot) {
    for (const size_t count : {size_t{1}, size_t{2}, size_t{8}}) {
        DualFileTarget target(dir / ("count" + std::to_string(count)), count);
        EXPECT_EQ(target.getSlotCount(), count);
        EXPECT_TRUE(target.getSlot(count - 1));
        EXPECT_FALSE(target.getSlot(count));
        EXPECT_FALSE(target.getSlot(count + 1000));
    }
}

TEST_F(DualFileStore, HandsOutTheSameSlotEachTime) {
    auto target = open(3);
    EXPECT_EQ(target->getSlot(2).get(), target->getSlot(2).get());
    EXPECT_NE(target->getSlot(1).get(), target->getSlot(2).get());
}

TEST_F(DualFileStore, ZeroSlotsStillMakesTheBaseDirectory) {
    auto target = open(0);
    EXPECT_EQ(target->getSlotCount(), 0u);
    EXPECT_FALSE(target->getSlot(0));
    EXPECT_TRUE(fs::is_directory(base()));
    EXPECT_EQ(describeTree(base()), "");
}

TEST_F(DualFileStore, CreatesMissingParentsOfTheBase) {
    const fs::path deep = dir / "a" / "b" / "c";
    DualFileTarget target(deep, 1);
    EXPECT_EQ(describeTree(dir / "a"), "d b\nd b/c\nd b/c/1\nd b/c/2\n");
}

TEST_F(DualFileStore, Description) {
    auto target = open();
    EXPECT_EQ(target->getDescription(), "DualFileTarget " + base().string());
}

TEST_F(DualFileStore, SlotsCannotBeAddedOrRemoved) {
    auto target = open(2);
    size_t index = 5;
    size_t size = 6;
    EXPECT_EQ(target->addSlot("x", index, size), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(index, 5u);
    EXPECT_EQ(size, 6u);
    EXPECT_EQ(target->removeSlot(0), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(target->removeAllSlots(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(target->getSlotCount(), 2u);
    EXPECT_EQ(describeTree(base()), "d 0\nd 0/1\nd 0/2\nd 1\nd 1/1\nd 1/2\n");
}

TEST_F(DualFileStore, TwentySixSlotsLiveInNumberedDirectories) {
    auto target = open(26);
    EXPECT_EQ(target->getSlotCount(), 26u);
    std::vector<std::string> lines;
    for (int i = 0; i < 26; ++i) {
        for (const char* sub : {"", "/1", "/2"}) lines.push_back("d " + std::to_string(i) + sub);
    }
    std::sort(lines.begin(), lines.end());
    std::string expected;
    for (const auto& line : lines) expected += line + "\n";
    EXPECT_EQ(describeTree(base()), expected);

    const Bytes last = bytesOf("slot twenty-five");
    const Bytes first = bytesOf("slot zero");
    EXPECT_EQ(write(slotOf(*target, 25), last), STATUS_OK);
    EXPECT_EQ(write(slotOf(*target, 0), first), STATUS_OK);
    EXPECT_EQ(readBytes(base() / "25" / "2" / "data"), last);
    EXPECT_EQ(readBytes(base() / "25" / "2" / "data.chk"), expectedCheckFile(last));
    EXPECT_EQ(readBytes(base() / "0" / "2" / "data"), first);
    EXPECT_EQ(describeTree(base() / "13"), "d 1\nd 2\n");
    EXPECT_FALSE(fs::exists(base() / "2" / "data"));
    EXPECT_FALSE(fs::exists(base() / "25" / "1" / "data"));

    DualFileTarget again(base(), 26);
    EXPECT_EQ(contentOf(slotOf(again, 25)), holding(last));
    EXPECT_EQ(contentOf(slotOf(again, 0)), holding(first));
    EXPECT_EQ(contentOf(slotOf(again, 24)), nothingStored());
}

TEST_F(DualFileStore, OneSlotLivesInTheBaseItself) {
    const Bytes blob = bytesOf("single");
    {
        auto target = open(1);
        EXPECT_EQ(write(slotOf(*target), blob), STATUS_OK);
    }
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("2", blob));
}

TEST_F(DualFileStore, SlotsOfOneTargetAreIndependent) {
    auto target = open(3);
    const Bytes one = bytesOf("one");
    const Bytes two = bytesOf("two");
    EXPECT_EQ(write(slotOf(*target, 1), one), STATUS_OK);
    EXPECT_EQ(write(slotOf(*target, 2), two), STATUS_OK);
    EXPECT_EQ(slotOf(*target, 1).erase(), STATUS_OK);
    EXPECT_EQ(contentOf(slotOf(*target, 0)), nothingStored());
    EXPECT_EQ(contentOf(slotOf(*target, 1)), absentBlob());
    EXPECT_EQ(contentOf(slotOf(*target, 2)), holding(two));
    EXPECT_EQ(describeTree(base() / "2"), "d 1\nd 2\n" + copyLines("2", two));
}

TEST_F(DualFileStore, DestroyingTheTargetTouchesNoFile) {
    auto target = open(2);
    EXPECT_EQ(write(slotOf(*target, 1), bytesOf("abc")), STATUS_OK);
    ASSERT_EQ(slotOf(*target, 1).beginWrite(), STATUS_OK);
    EXPECT_EQ(writeAt(slotOf(*target, 1), 0, bytesOf("pending")), STATUS_OK);
    const std::string before = describeTree(base(), true);
    target.reset();
    EXPECT_EQ(describeTree(base(), true), before);
}

// ---- opening ----

TEST_F(DualFileStore, EqualCheckTimesChooseCopy0) {
    const Bytes zero = bytesOf("copy zero");
    const Bytes one = bytesOf("copy one");
    store_test::writeCopy(copyDir(0), zero, kPast);
    store_test::writeCopy(copyDir(1), one, kPast);
    EXPECT_EQ(reopened(), holding(zero));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", zero) + copyLines("2", one));
}

TEST_F(DualFileStore, StrictlyLaterCopy1Wins) {
    const Bytes zero = patternBytes(5000, 1);  // larger, and its data file newer
    const Bytes one = bytesOf("copy one");
    store_test::writeCopy(copyDir(1), one, kPast + 1);
    store_test::writeCopy(copyDir(0), zero, kPast);
    setMtimeNs(data(0), kPast + 1000 * kSecond);
    EXPECT_EQ(reopened(), holding(one));
}

TEST_F(DualFileStore, EarlierCopy1Loses) {
    const Bytes zero = bytesOf("copy zero");
    const Bytes one = patternBytes(5000, 2);
    store_test::writeCopy(copyDir(0), zero, kPast);
    store_test::writeCopy(copyDir(1), one, kPast - 1);
    setMtimeNs(data(1), kPast + 1000 * kSecond);
    EXPECT_EQ(reopened(), holding(zero));
}

TEST_F(DualFileStore, OnlyCopy1ValidWins) {
    const Bytes one = bytesOf("copy one");
    store_test::writeCopy(copyDir(1), one, kPast);
    EXPECT_EQ(reopened(), holding(one));
}

// A check file dated from the year 2262 on has no time std::filesystem can
// give; it counts as the earliest, whichever copy it belongs to.
constexpr int64_t kBeyondTheFileClock = 9223372036 * kSecond;

TEST_F(DualFileStore, Copy1DatedBeyondTheFileClockLoses) {
    store_test::writeCopy(copyDir(0), bytesOf("copy zero"), kPast);
    store_test::writeCopy(copyDir(1), bytesOf("copy one"), kBeyondTheFileClock);
    if (mtimeNs(check(1)) != kBeyondTheFileClock) GTEST_SKIP() << "the file system cannot hold this time";
    EXPECT_EQ(reopened(), holding(bytesOf("copy zero")));
}

TEST_F(DualFileStore, Copy0DatedBeyondTheFileClockLoses) {
    store_test::writeCopy(copyDir(0), bytesOf("copy zero"), kBeyondTheFileClock);
    store_test::writeCopy(copyDir(1), bytesOf("copy one"), kPast);
    if (mtimeNs(check(0)) != kBeyondTheFileClock) GTEST_SKIP() << "the file system cannot hold this time";
    EXPECT_EQ(reopened(), holding(bytesOf("copy one")));
}

TEST_F(DualFileStore, BothDatedBeyondTheFileClockChooseCopy0) {
    store_test::writeCopy(copyDir(0), bytesOf("copy zero"), kBeyondTheFileClock);
    store_test::writeCopy(copyDir(1), bytesOf("copy one"), kBeyondTheFileClock + 1);
    if (mtimeNs(check(1)) != kBeyondTheFileClock + 1) GTEST_SKIP() << "the file system cannot hold this time";
    EXPECT_EQ(reopened(), holding(bytesOf("copy zero")));
}

// An invalid copy 0 has no time: copy 1 wins even dated before the epoch.
TEST_F(DualFileStore, ValidCopy1DatedBeforeTheEpochBeatsAnInvalidCopy0) {
    store_test::writeCopy(copyDir(0), bytesOf("copy zero"), kPast);
    writeBytes(data(0), bytesOf("COPY ZERO"));
    store_test::writeCopy(copyDir(1), bytesOf("copy one"), -1000 * kSecond);
    EXPECT_EQ(reopened(), holding(bytesOf("copy one")));
    EXPECT_FALSE(fs::exists(check(0)));
}

TEST_F(DualFileStore, OpeningKeepsValidFilesAsTheyAre) {
    const Bytes zero = bytesOf("copy zero");
    const Bytes one = bytesOf("copy one");
    store_test::writeCopy(copyDir(0), zero, kPast);
    store_test::writeCopy(copyDir(1), one, kPast + kSecond);
    const std::string before = describeTree(base(), true);
    EXPECT_EQ(reopened(), holding(one));
    EXPECT_EQ(describeTree(base(), true), before);
}

TEST_F(DualFileStore, CommittedAbsentBlob) {
    store_test::writeAbsentCopy(copyDir(0), kPast);
    TargetSlot& slot = freshSlot();
    EXPECT_TRUE(slot.isValid());
    EXPECT_FALSE(slot.exists());
    expectReadsFail(slot, STATUS_NOT_FOUND);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data.chk ffffffffffffffff\n");
}

TEST_F(DualFileStore, LaterAbsentBlobWinsOverData) {
    store_test::writeCopy(copyDir(0), bytesOf("old data"), kPast);
    store_test::writeAbsentCopy(copyDir(1), kPast + kSecond);
    EXPECT_EQ(reopened(), absentBlob());
}

TEST_F(DualFileStore, AllOnesBesideADataFileIsInvalid) {
    store_test::writeCopy(copyDir(0), bytesOf("old"), kPast);
    fs::create_directories(copyDir(1));
    writeBytes(data(1), bytesOf("present"));
    writeBytes(check(1), absentCheckFile());
    setMtimeNs(check(1), kPast + kSecond);
    EXPECT_EQ(reopened(), holding(bytesOf("old")));
    EXPECT_FALSE(fs::exists(check(1)));
    EXPECT_EQ(readBytes(data(1)), bytesOf("present"));
}

TEST_F(DualFileStore, NeitherCopyValidReadsFailOnCopy0) {
    writeUncheckedCopies(bytesOf("unchecked zero"), bytesOf("unchecked one"));
    TargetSlot& slot = freshSlot();
    EXPECT_FALSE(slot.isValid());
    EXPECT_FALSE(slot.exists());
    expectReadsFail(slot, STATUS_FAILED);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(bytesOf("unchecked zero")) + "\nf 2/data " +
                                        hex(bytesOf("unchecked one")) + "\n");
}

TEST_F(DualFileStore, ReadsNeverFallBackToTheOtherCopy) {
    // Copy 1 is current; its data file goes missing after opening.
    store_test::writeCopy(copyDir(0), bytesOf("older"), kPast);
    store_test::writeCopy(copyDir(1), bytesOf("newer"), kPast + kSecond);
    TargetSlot& slot = freshSlot();
    fs::remove(data(1));
    EXPECT_FALSE(slot.exists());
    EXPECT_TRUE(slot.isValid());
    uint8_t buffer[8] = {};
    EXPECT_EQ(slot.read(buffer, sizeof buffer, 0), STATUS_NOT_FOUND);
}

TEST_F(DualFileStore, ReadWhenTheCopyDirectoryBecameAFile) {
    store_test::writeCopy(copyDir(0), bytesOf("only"), kPast);
    TargetSlot& slot = freshSlot();
    fs::remove_all(copyDir(0));
    writeBytes(copyDir(0), bytesOf("a file"));
    uint8_t buffer[8] = {};
    size_t count = 42;
    EXPECT_EQ(slot.readSome(buffer, sizeof buffer, 0, count), STATUS_NOT_FOUND);
    EXPECT_EQ(count, 42u);
}

// Each operation reaches the base afresh: once it is gone, so is the blob.
TEST_F(DualFileStore, ReadAfterTheBaseDirectoryWentAway) {
    store_test::writeCopy(copyDir(0), bytesOf("only"), kPast);
    TargetSlot& slot = freshSlot();
    fs::rename(base(), dir / "elsewhere");
    uint8_t buffer[8] = {};
    size_t count = 42;
    EXPECT_EQ(slot.readSome(buffer, sizeof buffer, 0, count), STATUS_NOT_FOUND);
    EXPECT_EQ(count, 42u);
    EXPECT_FALSE(slot.exists());
    EXPECT_TRUE(slot.isValid());
}

// Something that exists but cannot be opened for reading: the open's errno.
TEST_F(DualFileStore, ReadOfADataPathThatExistsButCannotBeOpened) {
    store_test::writeCopy(copyDir(0), bytesOf("only"), kPast);
    TargetSlot& slot = freshSlot();
    fs::remove(data(0));
    const int listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    ASSERT_GE(listener, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    ASSERT_LT(data(0).string().size(), sizeof address.sun_path);
    std::strcpy(address.sun_path, data(0).c_str());
    ASSERT_EQ(::bind(listener, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    uint8_t buffer[8] = {};
    size_t count = 42;
    EXPECT_EQ(slot.readSome(buffer, sizeof buffer, 0, count), static_cast<Status>(ENXIO));
    EXPECT_EQ(count, 42u);
    EXPECT_TRUE(slot.exists());
    ::close(listener);
}

// The data file turned into a directory: it opens, the read fails.
TEST_F(DualFileStore, ReadOfADataPathThatBecameADirectory) {
    store_test::writeCopy(copyDir(0), bytesOf("only"), kPast);
    TargetSlot& slot = freshSlot();
    fs::remove(data(0));
    fs::create_directory(data(0));
    uint8_t buffer[8] = {};
    EXPECT_EQ(slot.read(buffer, sizeof buffer, 0), static_cast<Status>(EISDIR));
}

TEST_F(DualFileStore, PartialReadAtTheEnd) {
    const Bytes blob = patternBytes(120, 7);
    store_test::writeCopy(copyDir(0), blob, kPast);
    TargetSlot& slot = freshSlot();

    Bytes buffer(100, 0xAA);
    EXPECT_EQ(slot.read(buffer.data(), 100, 90), STATUS_OK);
    Bytes expected(blob.begin() + 90, blob.end());
    expected.resize(100, 0xAA);
    EXPECT_EQ(buffer, expected);

    Bytes some(100, 0xBB);
    size_t count = 0;
    EXPECT_EQ(slot.readSome(some.data(), 100, 90, count), STATUS_OK);
    EXPECT_EQ(count, 30u);
    EXPECT_EQ(Bytes(some.begin(), some.begin() + 30), Bytes(blob.begin() + 90, blob.end()));
    EXPECT_EQ(Bytes(some.begin() + 30, some.end()), Bytes(70, 0xBB));
}

TEST_F(DualFileStore, ReadsAtAndPastTheEndGiveNothing) {
    const Bytes blob = patternBytes(120, 8);
    store_test::writeCopy(copyDir(0), blob, kPast);
    TargetSlot& slot = freshSlot();
    uint8_t buffer[16] = {};
    for (const int64_t offset : {int64_t{120}, int64_t{121}, int64_t{1} << 40}) {
        size_t count = 99;
        EXPECT_EQ(slot.readSome(buffer, sizeof buffer, offset, count), STATUS_OK);
        EXPECT_EQ(count, 0u);
        EXPECT_EQ(slot.read(buffer, sizeof buffer, offset), STATUS_OK);
    }
    size_t count = 99;
    EXPECT_EQ(slot.readSome(buffer, sizeof buffer, -1, count), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(count, 99u);
}

TEST_F(DualFileStore, ReadsSeeTheBytesAtTheOffset) {
    const Bytes blob = patternBytes(10000, 9);
    store_test::writeCopy(copyDir(1), blob, kPast);
    auto target = open();
    Bytes buffer(5000);
    size_t count = 0;
    EXPECT_EQ(slotOf(*target).readSome(buffer.data(), buffer.size(), 4096, count), STATUS_OK);
    EXPECT_EQ(count, 5000u);
    EXPECT_EQ(buffer, Bytes(blob.begin() + 4096, blob.begin() + 9096));
}

// Damage to copy 0 after its commit makes copy 1 current whatever the
// check-file times, and copy 0's check file is deleted.
struct Damage {
    const char* name;
    std::function<void(const fs::path& data)> apply;
};

const Damage kDamages[] = {
    {"FlippedBit",
     [](const fs::path& path) {
         Bytes bytes = readBytes(path);
         bytes[17] ^= 0x08;
         writeBytes(path, bytes);
     }},
    {"Truncated",
     [](const fs::path& path) {
         Bytes bytes = readBytes(path);
         bytes.pop_back();
         writeBytes(path, bytes);
     }},
    {"Extended",
     [](const fs::path& path) {
         Bytes bytes = readBytes(path);
         bytes.push_back(0);
         writeBytes(path, bytes);
     }},
    {"BytesSwapped",
     [](const fs::path& path) {
         Bytes bytes = readBytes(path);
         std::swap(bytes[3], bytes[4]);
         writeBytes(path, bytes);
     }},
    {"Removed", [](const fs::path& path) { fs::remove(path); }},
    {"Emptied", [](const fs::path& path) { writeBytes(path, {}); }},
};

class DamagedCopy0 : public DualFileStore, public ::testing::WithParamInterface<std::tuple<size_t, int64_t>> {};

TEST_P(DamagedCopy0, Copy1IsCurrent) {
    const Damage& damage = kDamages[std::get<0>(GetParam())];
    const int64_t copy0Offset = std::get<1>(GetParam());
    const Bytes zero = patternBytes(64, 10);
    const Bytes one = patternBytes(40, 11);
    ASSERT_NE(zero[3], zero[4]);
    store_test::writeCopy(copyDir(0), zero, kPast + copy0Offset);
    store_test::writeCopy(copyDir(1), one, kPast);
    damage.apply(data(0));
    const std::string damagedData = fs::exists(data(0)) ? "f 1/data " + hex(readBytes(data(0))) + "\n" : "";

    EXPECT_EQ(reopened(), holding(one));
    EXPECT_FALSE(fs::exists(check(0)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + damagedData + copyLines("2", one));
    // Gone for good: the next opening agrees.
    EXPECT_EQ(reopened(), holding(one));
}

INSTANTIATE_TEST_SUITE_P(DamageAndTimes, DamagedCopy0,
                         ::testing::Combine(::testing::Range(size_t{0}, std::size(kDamages)),
                                            ::testing::Values(1000 * kSecond, 1, 0, -1000 * kSecond)),
                         [](const auto& info) {
                             const int64_t offset = std::get<1>(info.param);
                             const char* when = offset > 0 ? (offset == 1 ? "OneNsLater" : "Later")
                                                           : (offset == 0 ? "SameTime" : "Earlier");
                             return std::string(kDamages[std::get<0>(info.param)].name) + when;
                         });

TEST_F(DualFileStore, DamagedCopy1LeavesCopy0Current) {
    const Bytes zero = bytesOf("zero");
    const Bytes one = bytesOf("one, damaged");
    store_test::writeCopy(copyDir(0), zero, kPast);
    store_test::writeCopy(copyDir(1), one, kPast + 1000 * kSecond);
    writeBytes(data(1), bytesOf("one, DAMAGED"));
    EXPECT_EQ(reopened(), holding(zero));
    EXPECT_FALSE(fs::exists(check(1)));
    EXPECT_EQ(readBytes(data(1)), bytesOf("one, DAMAGED"));
}

TEST_F(DualFileStore, CheckFilesOf7And9BytesAreInvalid) {
    const Bytes zero = bytesOf("zero");
    const Bytes one = bytesOf("one");
    store_test::writeCopy(copyDir(0), zero, kPast);
    store_test::writeCopy(copyDir(1), one, kPast + kSecond);
    Bytes seven = expectedCheckFile(zero);
    seven.pop_back();
    Bytes nine = expectedCheckFile(one);
    nine.push_back(0);
    writeBytes(check(0), seven);
    writeBytes(check(1), nine);
    EXPECT_EQ(reopened(), (SlotContent{false, false, STATUS_FAILED, {}}));
    EXPECT_FALSE(fs::exists(check(0)));
    EXPECT_FALSE(fs::exists(check(1)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(zero) + "\nf 2/data " + hex(one) + "\n");
}

TEST_F(DualFileStore, StrayTemporaryFilesDoNotCount) {
    const Bytes zero = bytesOf("committed");
    const Bytes one = bytesOf("never committed");
    store_test::writeCopy(copyDir(0), zero, kPast);
    fs::create_directories(copyDir(1));
    writeBytes(data(1), one);
    // What a commit cut short before its rename leaves: the right value,
    // under the temporary name only.
    writeBytes(copyDir(1) / "data.chk.tmp", expectedCheckFile(one));
    setMtimeNs(copyDir(1) / "data.chk.tmp", kPast + 1000 * kSecond);
    writeBytes(copyDir(0) / "data.chk.tmp", bytesOf("junk"));
    const std::string before = describeTree(base());

    auto target = open();
    EXPECT_EQ(contentOf(slotOf(*target)), holding(zero));
    EXPECT_EQ(describeTree(base()), before);

    // The next commit into copy 1 replaces the leftover.
    const Bytes next = bytesOf("next");
    EXPECT_EQ(write(slotOf(*target), next), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", zero) + "f 1/data.chk.tmp " + hex(bytesOf("junk")) +
                                        "\n" + copyLines("2", next));
    EXPECT_EQ(reopened(), holding(next));
}

// Every damaged form of the newer copy's check file is rejected: the older
// copy stays current and the damaged check file is deleted, its data kept.
struct CheckMutation {
    std::string name;
    Bytes bytes;  // the check file after the mutation
    bool accepted;
};

void PrintTo(const CheckMutation& mutation, std::ostream* out) { *out << mutation.name; }

std::vector<CheckMutation> checkMutations() {
    const Bytes good = expectedCheckFile(bytesOf("newer copy"));
    std::vector<CheckMutation> mutations;
    for (size_t length = 0; length <= good.size(); ++length) {
        mutations.push_back(
            {"Truncated" + std::to_string(length), Bytes(good.begin(), good.begin() + length), length == good.size()});
    }
    for (size_t i = 0; i < good.size(); ++i) {
        Bytes bytes = good;
        bytes[i] ^= 0xFF;
        mutations.push_back({"Byte" + std::to_string(i) + "Inverted", bytes, false});
    }
    for (size_t bit = 0; bit < 64; ++bit) {
        Bytes bytes = good;
        bytes[bit / 8] ^= static_cast<uint8_t>(1u << (bit % 8));
        mutations.push_back({"Bit" + std::to_string(bit) + "Flipped", bytes, false});
    }
    Bytes extended = good;
    extended.push_back(0);
    mutations.push_back({"Extended9", extended, false});
    Bytes doubled = good;
    doubled.insert(doubled.end(), good.begin(), good.end());
    mutations.push_back({"Doubled16", doubled, false});
    Bytes bigEndian(good.rbegin(), good.rend());
    mutations.push_back({"Reversed", bigEndian, false});
    Bytes swapped(good.begin() + 4, good.end());
    swapped.insert(swapped.end(), good.begin(), good.begin() + 4);
    mutations.push_back({"HalvesSwapped", swapped, false});
    mutations.push_back({"AllOnes", absentCheckFile(), false});
    mutations.push_back({"Zeros", Bytes(8, 0), false});
    return mutations;
}

class CheckFileSweep : public DualFileStore, public ::testing::WithParamInterface<CheckMutation> {};

TEST_P(CheckFileSweep, OnlyTheExactValueIsAccepted) {
    const Bytes older = bytesOf("older copy");
    const Bytes newer = bytesOf("newer copy");
    store_test::writeCopy(copyDir(0), older, kPast);
    store_test::writeCopy(copyDir(1), newer, kPast + kSecond);
    writeBytes(check(1), GetParam().bytes);
    setMtimeNs(check(1), kPast + kSecond);

    if (GetParam().accepted) {
        EXPECT_EQ(reopened(), holding(newer));
        EXPECT_EQ(readBytes(check(1)), expectedCheckFile(newer));
    } else {
        EXPECT_EQ(reopened(), holding(older));
        EXPECT_FALSE(fs::exists(check(1)));
        EXPECT_EQ(readBytes(data(1)), newer);
        EXPECT_EQ(readBytes(check(0)), expectedCheckFile(older));
    }
}

INSTANTIATE_TEST_SUITE_P(Mutations, CheckFileSweep, ::testing::ValuesIn(checkMutations()),
                         [](const auto& info) { return info.param.name; });

// The same sweep over copy 0 alone: a rejected check file leaves nothing
// valid.
class CheckFileSweepAlone : public DualFileStore, public ::testing::WithParamInterface<CheckMutation> {};

TEST_P(CheckFileSweepAlone, RejectedMeansNothingValid) {
    const Bytes newer = bytesOf("newer copy");
    store_test::writeCopy(copyDir(0), newer, kPast);
    writeBytes(check(0), GetParam().bytes);
    if (GetParam().accepted) {
        EXPECT_EQ(reopened(), holding(newer));
    } else {
        EXPECT_EQ(reopened(), (SlotContent{false, false, STATUS_FAILED, {}}));
        EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(newer) + "\n");
    }
}

INSTANTIATE_TEST_SUITE_P(Mutations, CheckFileSweepAlone, ::testing::ValuesIn(checkMutations()),
                         [](const auto& info) { return info.param.name; });

TEST_F(DualFileStore, UnreadableDataMakesTheCopyInvalid) {
    store_test::writeCopy(copyDir(1), bytesOf("fine"), kPast);
    fs::create_directories(copyDir(0));
    fs::create_directory(data(0));  // opens, but cannot be read
    writeBytes(check(0), absentCheckFile());
    setMtimeNs(check(0), kPast + kSecond);
    EXPECT_EQ(reopened(), holding(bytesOf("fine")));
    EXPECT_FALSE(fs::exists(check(0)));
}

TEST_F(DualFileStore, OpeningRemovesAnEmptyDirectoryInPlaceOfACheckFile) {
    store_test::writeCopy(copyDir(0), bytesOf("zero"), kPast);
    fs::create_directories(check(1));
    EXPECT_EQ(reopened(), holding(bytesOf("zero")));
    EXPECT_FALSE(fs::exists(check(1)));
}

// Opening says nothing about invalid copies it cleaned up, even at the
// debug threshold.
TEST_F(DualFileStore, OpeningCleansUpSilently) {
    store_test::writeCopy(copyDir(0), bytesOf("zero"), kPast);
    store_test::writeCopy(copyDir(1), bytesOf("one"), kPast + kSecond);
    writeBytes(data(1), bytesOf("ONE"));
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_DEBUG);
        DualFileTarget target(base(), 1);
        return target.getSlot(0)->isValid() ? 0 : 1;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
    EXPECT_FALSE(fs::exists(check(1)));
}

// A check path that cannot be removed stays; the copy is still invalid.
TEST_F(DualFileStore, CheckFileThatCannotBeRemovedIsLogged) {
    store_test::writeCopy(copyDir(0), bytesOf("zero"), kPast);
    fs::create_directories(check(1) / "inside");
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        DualFileTarget target(base(), 1);
        const SlotContent content = contentOf(*target.getSlot(0).get());
        std::printf("%d %d %s\n", content.valid, content.exists, hex(content.data).c_str());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "lib/storage/storage_target:334 Failure cleaning up checkfile \"" + check(1).string() +
                              "\"\n1 1 " + hex(bytesOf("zero")) + "\n");
    EXPECT_TRUE(fs::is_directory(check(1) / "inside"));
}

TEST_F(DualFileStore, QuotedPathInTheCleanupLine) {
    const fs::path odd = dir / "we\"ird\\base";
    store_test::writeCopy(odd / "1", bytesOf("zero"), kPast);
    fs::create_directories(odd / "2" / "data.chk" / "inside");
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        DualFileTarget target(odd, 1);
        return target.getSlot(0)->isValid() ? 0 : 1;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "lib/storage/storage_target:334 Failure cleaning up checkfile \"" + dir.path().string() +
                              "/we\\\"ird\\\\base/2/data.chk\"\n");
}

// ---- one-shot writes and the on-disk format ----

TEST_F(DualFileStore, WritesAlternateBetweenTheCopies) {
    const Bytes first = bytesOf("first blob");
    const Bytes second = patternBytes(5000, 12);
    const Bytes third = bytesOf("third");
    TargetSlot& slot = freshSlot();

    EXPECT_EQ(write(slot, first), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("2", first));
    EXPECT_EQ(contentOf(slot), holding(first));
    EXPECT_EQ(reopened(), holding(first));

    EXPECT_EQ(write(slot, second), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", second) + copyLines("2", first));
    EXPECT_EQ(contentOf(slot), holding(second));
    EXPECT_EQ(reopened(), holding(second));

    EXPECT_EQ(write(slot, third), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", second) + copyLines("2", third));
    EXPECT_EQ(contentOf(slot), holding(third));
    EXPECT_EQ(reopened(), holding(third));
}

TEST_F(DualFileStore, WriteAfterReopeningGoesToTheOtherCopy) {
    const Bytes first = bytesOf("first");
    const Bytes second = bytesOf("second");
    storeInTurn({first});
    auto target = open();
    EXPECT_EQ(write(slotOf(*target), second), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", second) + copyLines("2", first));
}

TEST_F(DualFileStore, EmptyWriteCommitsAnEmptyFile) {
    TargetSlot& slot = freshSlot();
    EXPECT_EQ(slot.write(nullptr, 0), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 2/data \nf 2/data.chk 0000000000000000\n");
    EXPECT_EQ(contentOf(slot), holding({}));
    EXPECT_EQ(reopened(), holding({}));
}

TEST_F(DualFileStore, CheckFileOfALargerBlob) {
    const Bytes blob = patternBytes(70000, 13);
    auto target = open();
    EXPECT_EQ(write(slotOf(*target), blob), STATUS_OK);
    const Bytes checkBytes = readBytes(check(1));
    const uint32_t crc = store_test::referenceCrc32(blob);
    EXPECT_EQ(checkBytes, (Bytes{0x70, 0x11, 0x01, 0x00, static_cast<uint8_t>(crc), static_cast<uint8_t>(crc >> 8),
                                 static_cast<uint8_t>(crc >> 16), static_cast<uint8_t>(crc >> 24)}));
    EXPECT_EQ(reopened(), holding(blob));
}

TEST_F(DualFileStore, WriteReplacesALongerLeftover) {
    slotAfterWrites({patternBytes(3000, 14), patternBytes(100, 15), bytesOf("short")});
    EXPECT_EQ(readBytes(data(1)), bytesOf("short"));
    EXPECT_EQ(reopened(), holding(bytesOf("short")));
}

TEST_F(DualFileStore, WriteOverAnInvalidCurrentCopy) {
    fs::create_directories(copyDir(0));
    writeBytes(data(0), bytesOf("unchecked"));
    auto target = open();
    const Bytes blob = bytesOf("good");
    EXPECT_EQ(write(slotOf(*target), blob), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(bytesOf("unchecked")) + "\n" + copyLines("2", blob));
    EXPECT_EQ(reopened(), holding(blob));
}

// ---- check-file times ----

TEST_F(DualFileStore, FirstCommitKeepsItsOwnTime) {
    auto target = open();
    const int64_t before = store_test::touchNow(dir / "before");
    EXPECT_EQ(write(slotOf(*target), bytesOf("x")), STATUS_OK);
    const int64_t after = store_test::touchNow(dir / "after");
    EXPECT_LE(before, mtimeNs(check(1)));
    EXPECT_LE(mtimeNs(check(1)), after);
}

TEST_F(DualFileStore, LaterCommitIsStrictlyNewer) {
    TargetSlot& slot = slotAfterWrites({bytesOf("a")});
    for (int i = 0; i < 5; ++i) {
        const fs::path previous = check((i + 1) % 2);
        const fs::path next = check(i % 2);
        const int64_t previousTime = mtimeNs(previous);
        EXPECT_EQ(write(slot, bytesOf("b" + std::to_string(i))), STATUS_OK);
        const int64_t time = mtimeNs(next);
        EXPECT_GT(time, previousTime);
        EXPECT_LE(time, previousTime + kTwoSeconds);
    }
}

// A commit after one whose check file is dated ahead of the clock is dated
// exactly 2 s after it, whichever operation commits.
class FutureDatedPrevious : public DualFileStore, public ::testing::WithParamInterface<const char*> {
protected:
    Status commit(TargetSlot& slot) {
        const std::string operation = GetParam();
        const Bytes blob = bytesOf("second");
        if (operation == "write") return write(slot, blob);
        if (operation == "erase") return slot.erase();
        if (operation == "writeAt") return writeAt(slot, 2, blob);
        if (slot.beginWrite() != STATUS_OK) return STATUS_FAILED;
        if (operation == "beginWrite-writeAt-finalise" && writeAt(slot, 0, blob) != STATUS_OK) return STATUS_FAILED;
        return slot.finalise();
    }
};

TEST_P(FutureDatedPrevious, NextCheckFileIsTwoSecondsLater) {
    TargetSlot& slot = slotAfterWrites({bytesOf("first")});
    const int64_t future = store_test::nowNs() + 3600 * kSecond + 123456789;
    setMtimeNs(check(1), future);

    EXPECT_EQ(commit(slot), STATUS_OK);
    EXPECT_EQ(mtimeNs(check(0)), future + kTwoSeconds);
    EXPECT_EQ(mtimeNs(check(1)), future);

    // And again from the one just made: the clock is still behind.
    EXPECT_EQ(write(slot, bytesOf("third")), STATUS_OK);
    EXPECT_EQ(mtimeNs(check(1)), future + 2 * kTwoSeconds);
    EXPECT_EQ(reopened(), holding(bytesOf("third")));
}

TEST_P(FutureDatedPrevious, ReopeningPicksTheNewCommit) {
    storeInTurn({bytesOf("first")});
    const int64_t future = store_test::nowNs() + 3600 * kSecond;
    setMtimeNs(check(1), future);
    TargetSlot& slot = freshSlot();
    EXPECT_EQ(commit(slot), STATUS_OK);
    const SlotContent committed = contentOf(slot);
    EXPECT_NE(committed, holding(bytesOf("first")));
    EXPECT_EQ(reopened(), committed);
}

INSTANTIATE_TEST_SUITE_P(Commits, FutureDatedPrevious,
                         ::testing::Values("write", "erase", "writeAt", "beginWrite-finalise",
                                           "beginWrite-writeAt-finalise"),
                         [](const auto& info) {
                             std::string name = info.param;
                             name.erase(std::remove(name.begin(), name.end(), '-'), name.end());
                             return name;
                         });

// Two commits in one tick of the file-system clock. Disk file systems now
// hand out finer stamps once a time has been read, so the test runs on a
// private ramfs, which stamps every file with the coarse clock. Probe files
// made before the first and after the second write show whether both fell
// into one tick; the attempt is repeated until they do, for up to two
// minutes: on a loaded emulated CPU two writes fit into one 4 ms tick only
// now and then.
TEST_F(DualFileStore, SecondCommitInTheSameTickIsTwoSecondsLater) {
    const fs::path mount = dir / "ramfs";
    fs::create_directory(mount);
    const Bytes first = bytesOf("first");
    const Bytes second = bytesOf("second");
    const auto result = runInChild([&] {
        if (unshare(CLONE_NEWNS) != 0) return 77;
        if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return 77;
        if (::mount("none", mount.c_str(), "ramfs", 0, nullptr) != 0) return 77;
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(2);
        for (int attempt = 0; std::chrono::steady_clock::now() < deadline; ++attempt) {
            const fs::path store = mount / std::to_string(attempt);
            DualFileTarget target(store, 1);
            TargetSlot& slot = *target.getSlot(0).get();
            const int64_t before = store_test::touchNow(mount / "before");
            const Status firstStatus = slot.write(first.data(), first.size());
            const Status secondStatus = slot.write(second.data(), second.size());
            const int64_t after = store_test::touchNow(mount / "after");
            if (before != after) continue;
            DualFileTarget again(store, 1);
            std::printf("%lld\n%u %u\n%lld\n%lld\n%s%s\n", static_cast<long long>(before), firstStatus, secondStatus,
                        static_cast<long long>(mtimeNs(store / "2" / "data.chk")),
                        static_cast<long long>(mtimeNs(store / "1" / "data.chk")), describeTree(store).c_str(),
                        hex(contentOf(*again.getSlot(0).get()).data).c_str());
            return 0;
        }
        return 1;
    });
    if (result.exitStatus == 77) GTEST_SKIP() << "no private ramfs mount here";
    ASSERT_EQ(result.exitStatus, 0) << "never two writes in one tick";
    const long long tick = std::atoll(result.out.c_str());
    // Statuses, the first check file at the tick, the second 2 s later, the
    // files, and what a reopened store reads.
    EXPECT_EQ(result.out, std::to_string(tick) + "\n0 0\n" + std::to_string(tick) + "\n" +
                              std::to_string(tick + kTwoSeconds) + "\nd 1\nd 2\n" + copyLines("1", second) +
                              copyLines("2", first) + hex(second) + "\n");
}

// ---- erase ----

TEST_F(DualFileStore, EraseOfAFreshStoreCommitsAnAbsentBlob) {
    TargetSlot& slot = freshSlot();
    EXPECT_EQ(slot.erase(), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 2/data.chk ffffffffffffffff\n");
    EXPECT_EQ(contentOf(slot), absentBlob());
    EXPECT_EQ(reopened(), absentBlob());
}

TEST_F(DualFileStore, EraseRemovesTheOtherCopysData) {
    const Bytes first = bytesOf("first");
    const Bytes second = bytesOf("second");
    TargetSlot& slot = slotAfterWrites({first, second});
    EXPECT_EQ(slot.erase(), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", second) + "f 2/data.chk ffffffffffffffff\n");
    EXPECT_EQ(contentOf(slot), absentBlob());
    EXPECT_EQ(reopened(), absentBlob());

    // And a write after it goes back to copy 0.
    EXPECT_EQ(write(slot, first), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", first) + "f 2/data.chk ffffffffffffffff\n");
    EXPECT_EQ(reopened(), holding(first));
}

TEST_F(DualFileStore, EraseRecreatesAMissingCopyDirectory) {
    TargetSlot& slot = freshSlot();
    fs::remove(copyDir(1));
    EXPECT_EQ(slot.erase(), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 2/data.chk ffffffffffffffff\n");
}

TEST_F(DualFileStore, WriteRecreatesAMissingCopyDirectory) {
    TargetSlot& slot = freshSlot();
    fs::remove_all(base());
    EXPECT_EQ(write(slot, bytesOf("back")), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 2\n" + copyLines("2", bytesOf("back")));
    EXPECT_EQ(contentOf(slot), holding(bytesOf("back")));
}

// ---- incremental writes ----

TEST_F(DualFileStore, FinaliseWithoutBeginChangesNothing) {
    TargetSlot& slot = slotAfterWrites({bytesOf("one"), bytesOf("two")});
    const std::string before = describeTree(base(), true);
    EXPECT_EQ(slot.finalise(), STATUS_INVALID_OPERATION);
    EXPECT_EQ(describeTree(base(), true), before);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("two")));
}

TEST_F(DualFileStore, FinaliseOfAFreshStoreChangesNothing) {
    TargetSlot& slot = freshSlot();
    EXPECT_EQ(slot.finalise(), STATUS_INVALID_OPERATION);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n");
    EXPECT_EQ(contentOf(slot), nothingStored());
}

TEST_F(DualFileStore, BeginThenFinaliseCommitsAnAbsentBlob) {
    TargetSlot& slot = slotAfterWrites({bytesOf("one"), bytesOf("two")});
    // Current is copy 0; copy 1 still holds "one".
    EXPECT_EQ(slot.beginWrite(), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", bytesOf("two")) + "f 2/data.chk " +
                                        hex(expectedCheckFile(bytesOf("one"))) + "\n");
    EXPECT_EQ(contentOf(slot), holding(bytesOf("two")));
    EXPECT_EQ(slot.finalise(), STATUS_OK);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", bytesOf("two")) + "f 2/data.chk ffffffffffffffff\n");
    EXPECT_EQ(contentOf(slot), absentBlob());
    EXPECT_EQ(reopened(), absentBlob());
    EXPECT_EQ(slot.finalise(), STATUS_INVALID_OPERATION);
}

TEST_F(DualFileStore, PendingBlocksAreInvisibleUntilFinalised) {
    const Bytes old = bytesOf("old content");
    TargetSlot& slot = slotAfterWrites({old});
    EXPECT_EQ(slot.beginWrite(), STATUS_OK);
    EXPECT_EQ(writeAt(slot, 0, bytesOf("head")), STATUS_OK);
    EXPECT_EQ(writeAt(slot, 10, bytesOf("tail")), STATUS_OK);
    EXPECT_EQ(writeAt(slot, 2, bytesOf("AD")), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(old));
    const Bytes pending = {'h', 'e', 'A', 'D', 0, 0, 0, 0, 0, 0, 't', 'a', 'i', 'l'};
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(pending) + "\n" + copyLines("2", old));
    EXPECT_EQ(reopened(), holding(old));

    EXPECT_EQ(slot.finalise(), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(pending));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", pending) + copyLines("2", old));
    EXPECT_EQ(reopened(), holding(pending));
}

TEST_F(DualFileStore, BeginDropsTheOtherCopysLeftovers) {
    TargetSlot& slot = slotAfterWrites({patternBytes(500, 16), bytesOf("current")});
    EXPECT_EQ(slot.beginWrite(), STATUS_OK);
    EXPECT_FALSE(fs::exists(data(1)));
    EXPECT_EQ(writeAt(slot, 0, bytesOf("new")), STATUS_OK);
    EXPECT_EQ(slot.finalise(), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("new")));
}

TEST_F(DualFileStore, SecondBeginDoesNotRestart) {
    TargetSlot& slot = slotAfterWrites({bytesOf("current")});
    EXPECT_EQ(slot.beginWrite(), STATUS_OK);
    EXPECT_EQ(writeAt(slot, 0, bytesOf("abc")), STATUS_OK);
    EXPECT_EQ(slot.beginWrite(), STATUS_OK);
    EXPECT_EQ(readBytes(data(0)), bytesOf("abc"));
    EXPECT_EQ(writeAt(slot, 3, bytesOf("def")), STATUS_OK);
    EXPECT_EQ(slot.finalise(), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("abcdef")));
    EXPECT_EQ(reopened(), holding(bytesOf("abcdef")));
}

TEST_F(DualFileStore, WriteAtInsideABegunWriteWithABadOffset) {
    TargetSlot& slot = slotAfterWrites({bytesOf("current")});
    EXPECT_EQ(slot.beginWrite(), STATUS_OK);
    EXPECT_EQ(writeAt(slot, -1, bytesOf("x")), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("current")));
    EXPECT_EQ(reopened(), holding(bytesOf("current")));
}

TEST_F(DualFileStore, ABegunWriteLeftUnfinishedIsNotCommitted) {
    {
        auto target = open();
        TargetSlot& slot = slotOf(*target);
        EXPECT_EQ(write(slot, bytesOf("committed")), STATUS_OK);
        EXPECT_EQ(slot.beginWrite(), STATUS_OK);
        EXPECT_EQ(writeAt(slot, 0, bytesOf("pending")), STATUS_OK);
    }
    EXPECT_EQ(reopened(), holding(bytesOf("committed")));
    EXPECT_EQ(describeTree(base()),
              "d 1\nd 2\nf 1/data " + hex(bytesOf("pending")) + "\n" + copyLines("2", bytesOf("committed")));
}

TEST_F(DualFileStore, OneShotWriteInsideABegunWriteLeavesItBegun) {
    TargetSlot& slot = freshSlot();
    EXPECT_EQ(slot.beginWrite(), STATUS_OK);
    EXPECT_EQ(write(slot, bytesOf("one-shot")), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("one-shot")));
    // Still begun: finalise commits the (now empty) other copy.
    EXPECT_EQ(slot.finalise(), STATUS_OK);
    EXPECT_EQ(contentOf(slot), absentBlob());
}

// ---- writeAt outside a begun write ----

TEST_F(DualFileStore, WriteAtKeepsTheBytesAroundTheBlock) {
    const Bytes old = patternBytes(300, 17);
    TargetSlot& slot = slotAfterWrites({old});
    const Bytes block = patternBytes(20, 18);
    EXPECT_EQ(writeAt(slot, 100, block), STATUS_OK);
    Bytes expected = old;
    std::copy(block.begin(), block.end(), expected.begin() + 100);
    EXPECT_EQ(contentOf(slot), holding(expected));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", expected) + copyLines("2", old));
    EXPECT_EQ(reopened(), holding(expected));
}

TEST_F(DualFileStore, WriteAtPastTheEndExtends) {
    TargetSlot& slot = slotAfterWrites({bytesOf("0123456789")});
    EXPECT_EQ(writeAt(slot, 8, bytesOf("ABCDE")), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("01234567ABCDE")));
    EXPECT_EQ(writeAt(slot, 15, bytesOf("Z")), STATUS_OK);
    EXPECT_EQ(contentOf(slot),
              holding(Bytes{'0', '1', '2', '3', '4', '5', '6', '7', 'A', 'B', 'C', 'D', 'E', 0, 0, 'Z'}));
    EXPECT_EQ(describeTree(base()),
              "d 1\nd 2\n" + copyLines("1", bytesOf("01234567ABCDE")) +
                  copyLines("2", Bytes{'0', '1', '2', '3', '4', '5', '6', '7', 'A', 'B', 'C', 'D', 'E', 0, 0, 'Z'}));
}

TEST_F(DualFileStore, WriteAtOnAFreshStoreStartsFromNothing) {
    TargetSlot& slot = freshSlot();
    EXPECT_EQ(writeAt(slot, 5, bytesOf("xy")), STATUS_OK);
    const Bytes expected = {0, 0, 0, 0, 0, 'x', 'y'};
    EXPECT_EQ(contentOf(slot), holding(expected));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("2", expected));
}

TEST_F(DualFileStore, WriteAtOverAnInvalidCurrentCopyWritesIntoTheLeftover) {
    writeUncheckedCopies(bytesOf("unchecked current"), bytesOf("ZZZZZZZZZZ"));
    TargetSlot& slot = freshSlot();
    EXPECT_EQ(writeAt(slot, 2, bytesOf("ab")), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("ZZabZZZZZZ")));
    EXPECT_EQ(readBytes(data(0)), bytesOf("unchecked current"));
}

TEST_F(DualFileStore, WriteAtAfterEraseCopiesNothing) {
    TargetSlot& slot = slotAfterWrites({bytesOf("first"), bytesOf("second")});
    EXPECT_EQ(slot.erase(), STATUS_OK);
    // The current copy (1) has no data; copy 0 still holds "second".
    EXPECT_EQ(writeAt(slot, 0, bytesOf("XY")), STATUS_OK);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("XYcond")));
}

TEST_F(DualFileStore, WriteAtWithABadOffsetLeavesTheCurrentCopy) {
    TargetSlot& slot = slotAfterWrites({bytesOf("first"), bytesOf("second")});
    EXPECT_EQ(writeAt(slot, -5, bytesOf("x")), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(contentOf(slot), holding(bytesOf("second")));
    EXPECT_FALSE(fs::exists(check(1)));
    EXPECT_EQ(reopened(), holding(bytesOf("second")));
}

// ---- failures that need no fault injection ----

// A directory in place of the other copy's check file cannot be removed.
TEST_F(DualFileStore, UnremovableCheckPathFailsTheWrite) {
    storeInTurn({bytesOf("old"), bytesOf("older")});
    fs::remove(check(1));
    fs::create_directories(check(1) / "inside");
    const auto result = newBlobInChild(
        [](TargetSlot& slot, const Bytes& blob) { std::printf("write %u\n", slot.write(blob.data(), blob.size())); });
    EXPECT_EQ(result.out, "lib/storage/storage_target:334 Failure cleaning up checkfile \"" + check(1).string() +
                              "\"\nlib/storage/storage_target:378 generic:39\nwrite 39\n" + hex(bytesOf("older")) +
                              "\n");
    EXPECT_EQ(reopened(), holding(bytesOf("older")));
}

// A link where a copy directory should be is never followed: the copy is
// invalid at opening (its check file cannot be reached to remove it), and
// every update of it fails with ENOTDIR without creating anything.
TEST_F(DualFileStore, LinkedCopyDirectoryFailsEveryUpdate) {
    {
        auto target = open();
        EXPECT_EQ(write(slotOf(*target), bytesOf("kept")), STATUS_OK);     // copy 1
        EXPECT_EQ(write(slotOf(*target), bytesOf("current")), STATUS_OK);  // copy 0
    }
    // Copy 1's directory becomes a dangling symbolic link.
    fs::remove_all(copyDir(1));
    fs::create_directory_symlink(dir / "nowhere", copyDir(1));
    const auto result = newBlobInChild([](TargetSlot& slot, const Bytes& blob) {
        std::printf("write %u\n", slot.write(blob.data(), blob.size()));
        std::printf("writeAt %u\n", slot.writeAt(1, blob.data(), blob.size()));
        std::printf("erase %u\n", slot.erase());
        std::printf("beginWrite %u\n", slot.beginWrite());
        std::printf("finalise %u\n", slot.finalise());
    });
    const std::string invalidated = "lib/storage/storage_target:378 generic:20\n";
    EXPECT_EQ(result.out, "lib/storage/storage_target:334 Failure cleaning up checkfile \"" +
                              (copyDir(1) / "data.chk").string() + "\"\n" + invalidated +
                              "lib/storage/storage_target:410 20\n"
                              "write 20\n" +
                              invalidated +
                              "[lib/storage/storage_target:192] err_code = 20 (<unknown>)\n"
                              "writeAt 20\n" +
                              invalidated +
                              "erase 20\n"
                              "beginWrite 20\n"
                              "finalise 95\n" +
                              hex(bytesOf("current")) + "\n");
    EXPECT_EQ(reopened(), holding(bytesOf("current")));
    EXPECT_FALSE(fs::exists(dir / "nowhere"));
    EXPECT_TRUE(fs::is_symlink(copyDir(1)));
}

// A directory in place of the transient file: it can be neither opened nor
// removed.
TEST_F(DualFileStore, TransientFileThatCannotBeCleanedUp) {
    storeInTurn({bytesOf("current")});
    fs::create_directories(copyDir(0) / "data.chk.tmp" / "inside");
    const auto result = newBlobInChild(
        [](TargetSlot& slot, const Bytes& blob) { std::printf("write %u\n", slot.write(blob.data(), blob.size())); });
    EXPECT_EQ(result.out, kOpenFailure + (copyDir(0) / "data.chk.tmp").string() +
                              ": Is a directory\n"
                              "lib/storage/storage_target:461 finalise: write failed: 9: Bad file descriptor\n"
                              "lib/storage/storage_target:470 Failed to cleanup check file\n"
                              "write 52\n" +
                              hex(bytesOf("current")) + "\n");
    EXPECT_EQ(describeTree(base()), "d 1\nd 1/data.chk.tmp\nd 1/data.chk.tmp/inside\nd 2\nf 1/data " +
                                        hex(bytesOf("new")) + "\n" + copyLines("2", bytesOf("current")));
    EXPECT_EQ(reopened(), holding(bytesOf("current")));
}

TEST_F(DualFileStore, DirectoryFailuresAreShownAtInfoLevel) {
    auto target = open();
    fs::remove(copyDir(1));
    fs::create_directory_symlink(dir / "nowhere", copyDir(1));
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_INFO);
        const Bytes block = bytesOf("block");
        std::printf("writeAt %u\n", slotOf(*target).writeAt(0, block.data(), block.size()));
        return 0;
    });
    EXPECT_EQ(result.out, "lib/storage/storage_target:378 generic:20\nFailed to create \"" + copyDir(1).string() +
                              "\" Not a directory\n[lib/storage/storage_target:192] err_code = 20 (<unknown>)\n"
                              "writeAt 20\n");
}

// ---- resources ----

// Files are made with mode 0666 less the umask, by every kind of update.
TEST_F(DualFileStore, FilesAreCreatedWithMode0666) {
    const auto result = runInChild([&] {
        ::umask(0);
        DualFileTarget target(base(), 1);
        TargetSlot& slot = *target.getSlot(0).get();
        const Bytes blob = bytesOf("blob");
        if (slot.write(blob.data(), blob.size()) != STATUS_OK) return 1;       // copy 1
        if (slot.writeAt(2, blob.data(), blob.size()) != STATUS_OK) return 2;  // copy 0, copied
        if (slot.erase() != STATUS_OK) return 3;                               // copy 1
        if (slot.beginWrite() != STATUS_OK) return 4;                          // copy 0
        if (slot.writeAt(0, blob.data(), blob.size()) != STATUS_OK) return 5;
        if (slot.finalise() != STATUS_OK) return 6;
        if (slot.write(blob.data(), blob.size()) != STATUS_OK) return 7;  // copy 1
        return 0;
    });
    ASSERT_EQ(result.exitStatus, 0);
    for (const fs::path& file : {data(0), check(0), data(1), check(1)}) {
        EXPECT_EQ(fs::status(file).permissions(),
                  fs::perms::all & ~(fs::perms::owner_exec | fs::perms::group_exec | fs::perms::others_exec))
            << file;
    }
}

size_t openDescriptors() {
    size_t count = 0;
    for (auto it = fs::directory_iterator("/proc/self/fd"); it != fs::directory_iterator(); ++it) ++count;
    return count;
}

// Every operation closes what it opened, also when it fails.
TEST_F(DualFileStore, OperationsLeaveNoDescriptorOpen) {
    const size_t before = openDescriptors();
    {
        auto target = open(2);
        TargetSlot& slot = slotOf(*target, 1);
        const Bytes blob = patternBytes(9000, 26);
        uint8_t buffer[64];
        size_t count = 0;
        EXPECT_EQ(write(slot, blob), STATUS_OK);
        EXPECT_EQ(writeAt(slot, 100, blob), STATUS_OK);
        EXPECT_EQ(writeAt(slot, -1, blob), STATUS_INVALID_PARAMETER);
        EXPECT_EQ(slot.read(buffer, sizeof buffer, 5), STATUS_OK);
        EXPECT_EQ(slot.readSome(buffer, sizeof buffer, 5, count), STATUS_OK);
        EXPECT_EQ(slot.readSome(buffer, sizeof buffer, -5, count), STATUS_INVALID_PARAMETER);
        EXPECT_EQ(slot.beginWrite(), STATUS_OK);
        EXPECT_EQ(writeAt(slot, 0, blob), STATUS_OK);
        EXPECT_EQ(writeAt(slot, -1, blob), STATUS_INVALID_PARAMETER);
        EXPECT_EQ(slot.finalise(), STATUS_OK);
        EXPECT_EQ(slot.erase(), STATUS_OK);
        EXPECT_EQ(slot.read(buffer, sizeof buffer, 0), STATUS_NOT_FOUND);
        EXPECT_EQ(openDescriptors(), before);
    }
    {
        auto target = open(2);
        EXPECT_EQ(contentOf(slotOf(*target, 1)), absentBlob());
    }
    EXPECT_EQ(openDescriptors(), before);
}

}  // namespace
