#include "lib/storage/file_read_target.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "lib/util/log.h"
#include "scratch_dir.h"
#include "source_lines.h"

namespace {

namespace fs = std::filesystem;
using Storage::FileReadTarget;
using Storage::SlotHandle;
using Storage::TargetSlot;
using testing_support::Bytes;
using testing_support::runInChild;
using testing_support::ScratchDir;
using testing_support::writeBytes;

// Scripts match the open failure by this fixed line of libcommon/lib/util/fd.
const std::string kOpenFailurePrefix = testing_support::openFailurePrefix();

constexpr size_t kUnset = 0xA5A5A5A5;

Bytes pattern(size_t size, uint8_t seed) {
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<uint8_t>(seed + i * 7 + (i >> 8));
    return bytes;
}

// Open descriptors of this process, so that a test can tell a slot's file
// was closed.
size_t openDescriptorCount() {
    size_t count = 0;
    DIR* dir = ::opendir("/proc/self/fd");
    if (dir == nullptr) return 0;
    while (const dirent* entry = ::readdir(dir)) {
        if (entry->d_name[0] != '.') ++count;
    }
    ::closedir(dir);
    return count - 1;  // the directory stream's own
}

class FileReadTargetTest : public ::testing::Test {
protected:
    void SetUp() override {
        fs::create_directories(base());
        writeBytes(base() / "first.bin", first);
        writeBytes(base() / "second.bin", second);
        writeBytes(base() / "hundred.bin", hundred);
    }

    fs::path base() const { return dir / "base"; }

    // addSlot that must succeed; returns the index.
    size_t add(FileReadTarget& target, const char* name, size_t expectedSize) {
        size_t index = kUnset;
        size_t size = kUnset;
        EXPECT_EQ(target.addSlot(name, index, size), STATUS_OK) << name;
        EXPECT_EQ(size, expectedSize) << name;
        return index;
    }

    static Bytes readAll(TargetSlot& slot, size_t size) {
        Bytes buffer(size, 0xEE);
        size_t got = kUnset;
        EXPECT_EQ(slot.readSome(buffer.data(), buffer.size(), 0, got), STATUS_OK);
        buffer.resize(got == kUnset ? 0 : got);
        return buffer;
    }

    ScratchDir dir;
    const Bytes first = pattern(37, 1);
    const Bytes second = pattern(5000, 2);
    const Bytes hundred = pattern(100, 3);
};

TEST_F(FileReadTargetTest, FreshTargetHasNoSlots) {
    FileReadTarget target(base());
    EXPECT_EQ(target.getSlotCount(), 0u);
    EXPECT_FALSE(target.getSlot(0));
    EXPECT_FALSE(target.getSlot(1));
    EXPECT_EQ(target.getDescription(), "FileReadTarget " + base().string());
}

TEST_F(FileReadTargetTest, DescriptionCarriesThePathAsGiven) {
    FileReadTarget target(fs::path("/media/static"));
    EXPECT_EQ(target.getDescription(), "FileReadTarget /media/static");
}

TEST_F(FileReadTargetTest, AddedSlotReadsTheFile) {
    FileReadTarget target(base());
    EXPECT_EQ(add(target, "second.bin", second.size()), 0u);
    EXPECT_EQ(target.getSlotCount(), 1u);
    SlotHandle slot = target.getSlot(0);
    ASSERT_TRUE(slot);
    EXPECT_FALSE(slot.ownsSlot());
    EXPECT_TRUE(slot->exists());
    EXPECT_TRUE(slot->isValid());
    EXPECT_EQ(readAll(*slot.get(), 8192), second);
    EXPECT_EQ(target.getSlot(0).get(), slot.get());
}

TEST_F(FileReadTargetTest, ReadsAtAnyOffsetAnyNumberOfTimes) {
    FileReadTarget target(base());
    const size_t index = add(target, "second.bin", second.size());
    TargetSlot& slot = *target.getSlot(index).get();
    for (const int64_t offset : {int64_t{4000}, int64_t{0}, int64_t{4999}, int64_t{17}, int64_t{4000}}) {
        Bytes buffer(3, 0xEE);
        size_t got = kUnset;
        ASSERT_EQ(slot.readSome(buffer.data(), buffer.size(), offset, got), STATUS_OK) << offset;
        const size_t expected = std::min<size_t>(3, second.size() - static_cast<size_t>(offset));
        EXPECT_EQ(got, expected) << offset;
        EXPECT_EQ(Bytes(buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(expected)),
                  Bytes(second.begin() + offset, second.begin() + offset + static_cast<std::ptrdiff_t>(expected)))
            << offset;
    }
}

TEST_F(FileReadTargetTest, AddSlotOfMissingNameFailsAndAddsNothing) {
    const fs::path missing = base() / "missing.bin";
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        FileReadTarget target(base());
        size_t index = kUnset;
        size_t size = kUnset;
        const Status status = target.addSlot("missing.bin", index, size);
        std::printf("status %u index %zx size %zx count %zu\n", status, index, size, target.getSlotCount());
        // The failure did not use up an index.
        const Status next = target.addSlot("first.bin", index, size);
        std::printf("next %u %zu\n", next, index);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, kOpenFailurePrefix + missing.string() +
                              ": No such file or directory\n"
                              "status 52 index a5a5a5a5 size a5a5a5a5 count 0\n"
                              "next 0 0\n");
    EXPECT_EQ(result.err, "");
}

TEST_F(FileReadTargetTest, RemovingTheFirstOfTwoKeepsTheSecond) {
    FileReadTarget target(base());
    EXPECT_EQ(add(target, "first.bin", first.size()), 0u);
    EXPECT_EQ(add(target, "second.bin", second.size()), 1u);
    EXPECT_EQ(target.getSlotCount(), 2u);
    EXPECT_EQ(target.removeSlot(0), STATUS_OK);
    EXPECT_EQ(target.getSlotCount(), 1u);
    EXPECT_FALSE(target.getSlot(0));
    SlotHandle slot = target.getSlot(1);
    ASSERT_TRUE(slot);
    EXPECT_EQ(readAll(*slot.get(), 8192), second);
}

TEST_F(FileReadTargetTest, RemoveSlotOfAnIndexNeverAdded) {
    FileReadTarget target(base());
    EXPECT_EQ(target.removeSlot(0), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(add(target, "first.bin", first.size()), 0u);
    EXPECT_EQ(target.removeSlot(1), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(target.getSlotCount(), 1u);
    EXPECT_EQ(target.removeSlot(0), STATUS_OK);
    // Removed already.
    EXPECT_EQ(target.removeSlot(0), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(target.getSlotCount(), 0u);
}

TEST_F(FileReadTargetTest, ReadPastTheEndIsShortButOk) {
    FileReadTarget target(base());
    TargetSlot& slot = *target.getSlot(add(target, "hundred.bin", 100)).get();

    Bytes buffer(100, 0xEE);
    EXPECT_EQ(slot.read(buffer.data(), 100, 90), STATUS_OK);
    Bytes expected(100, 0xEE);
    std::copy(hundred.begin() + 90, hundred.end(), expected.begin());
    EXPECT_EQ(buffer, expected);

    Bytes some(100, 0xEE);
    size_t got = kUnset;
    EXPECT_EQ(slot.readSome(some.data(), 100, 90, got), STATUS_OK);
    EXPECT_EQ(got, 10u);
    EXPECT_EQ(some, expected);
}

TEST_F(FileReadTargetTest, ReadAtTheEndGivesNothing) {
    FileReadTarget target(base());
    TargetSlot& slot = *target.getSlot(add(target, "hundred.bin", 100)).get();
    Bytes buffer(8, 0xEE);
    EXPECT_EQ(slot.read(buffer.data(), 8, 100), STATUS_OK);
    size_t got = kUnset;
    EXPECT_EQ(slot.readSome(buffer.data(), 8, 1000, got), STATUS_OK);
    EXPECT_EQ(got, 0u);
    EXPECT_EQ(buffer, Bytes(8, 0xEE));
}

// pread refuses a negative offset: the raw errno comes back, silently.
TEST_F(FileReadTargetTest, ReadErrorIsTheRawErrno) {
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_DEBUG);
        FileReadTarget target(base());
        size_t index = 0;
        size_t size = 0;
        if (target.addSlot("hundred.bin", index, size) != STATUS_OK) return 1;
        TargetSlot& slot = *target.getSlot(index).get();
        uint8_t buffer[4] = {9, 9, 9, 9};
        size_t got = kUnset;
        std::printf("read %u\n", slot.read(buffer, sizeof buffer, -1));
        const Status someStatus = slot.readSome(buffer, sizeof buffer, -1, got);
        std::printf("readSome %u %zu\n", someStatus, got);
        std::printf("%u %u %u %u\n", buffer[0], buffer[1], buffer[2], buffer[3]);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "read 22\nreadSome 22 0\n9 9 9 9\n");
}

TEST_F(FileReadTargetTest, IndexIsTakenModulo2To32) {
    FileReadTarget target(base());
    EXPECT_EQ(add(target, "first.bin", first.size()), 0u);
    EXPECT_EQ(add(target, "second.bin", second.size()), 1u);
    constexpr size_t kTwoTo32 = size_t{1} << 32;
    EXPECT_EQ(target.getSlot(kTwoTo32).get(), target.getSlot(0).get());
    EXPECT_EQ(target.getSlot(kTwoTo32 + 1).get(), target.getSlot(1).get());
    EXPECT_TRUE(target.getSlot(kTwoTo32));
    EXPECT_FALSE(target.getSlot(kTwoTo32 + 2));
    // removeSlot truncates too.
    EXPECT_EQ(target.removeSlot(kTwoTo32 + 1), STATUS_OK);
    EXPECT_FALSE(target.getSlot(1));
    EXPECT_EQ(target.getSlotCount(), 1u);
}

// The same rule seen in the data: a read through an index 2^32 above a
// slot's reads that slot's file, and 2^33 above too.
TEST_F(FileReadTargetTest, ReadThroughAWrappedIndexReadsTheSlotsFile) {
    FileReadTarget target(base());
    ASSERT_EQ(add(target, "first.bin", first.size()), 0u);
    ASSERT_EQ(add(target, "second.bin", second.size()), 1u);
    for (const size_t above : {size_t{1} << 32, size_t{1} << 33}) {
        SlotHandle slot = target.getSlot(above + 1);
        ASSERT_TRUE(slot) << above;
        EXPECT_EQ(readAll(*slot.get(), 8192), second) << above;
    }
}

TEST_F(FileReadTargetTest, DirectoryOpensButItsSizeThrows) {
    fs::create_directory(base() / "subdir");
    FileReadTarget target(base());
    const size_t descriptorsBefore = openDescriptorCount();
    size_t index = kUnset;
    size_t size = kUnset;
    EXPECT_THROW((void)target.addSlot("subdir", index, size), fs::filesystem_error);
    EXPECT_EQ(index, kUnset);
    EXPECT_EQ(target.getSlotCount(), 0u);
    EXPECT_FALSE(target.getSlot(0));
    // The directory's descriptor did not stay open, and no index was used.
    EXPECT_EQ(openDescriptorCount(), descriptorsBefore);
    EXPECT_EQ(add(target, "first.bin", first.size()), 0u);
}

// A FIFO opens at once instead of waiting for a writer (the child would be
// ended by its alarm), and then has no file size, like a directory.
TEST_F(FileReadTargetTest, FifoNeverWaitsAndItsSizeThrows) {
    ASSERT_EQ(::mkfifo((base() / "fifo").c_str(), 0666), 0);
    const auto result = runInChild([&] {
        ::alarm(20);
        FileReadTarget target(base());
        size_t index = kUnset;
        size_t size = kUnset;
        try {
            (void)target.addSlot("fifo", index, size);
        } catch (const fs::filesystem_error&) {
            return target.getSlotCount() == 0 && index == kUnset ? 0 : 2;
        }
        return 1;
    });
    EXPECT_EQ(result.signal, 0) << "waited on the FIFO";
    EXPECT_EQ(result.exitStatus, 0);
}

TEST_F(FileReadTargetTest, RemoveAllSlotsKeepsTheCounter) {
    FileReadTarget target(base());
    EXPECT_EQ(add(target, "first.bin", first.size()), 0u);
    EXPECT_EQ(add(target, "second.bin", second.size()), 1u);
    EXPECT_EQ(target.removeAllSlots(), STATUS_OK);
    EXPECT_EQ(target.getSlotCount(), 0u);
    EXPECT_FALSE(target.getSlot(0));
    EXPECT_FALSE(target.getSlot(1));
    EXPECT_EQ(add(target, "first.bin", first.size()), 2u);
    EXPECT_EQ(target.removeAllSlots(), STATUS_OK);
    EXPECT_EQ(target.removeAllSlots(), STATUS_OK);
    EXPECT_EQ(add(target, "hundred.bin", 100), 3u);
}

TEST_F(FileReadTargetTest, IndicesAreNotReused) {
    FileReadTarget target(base());
    EXPECT_EQ(add(target, "first.bin", first.size()), 0u);
    EXPECT_EQ(add(target, "first.bin", first.size()), 1u);
    EXPECT_EQ(target.removeSlot(0), STATUS_OK);
    EXPECT_EQ(target.removeSlot(1), STATUS_OK);
    EXPECT_EQ(add(target, "second.bin", second.size()), 2u);
    EXPECT_EQ(target.getSlotCount(), 1u);
    EXPECT_EQ(readAll(*target.getSlot(2).get(), 8192), second);
}

// The same file opened twice gives two independent slots.
TEST_F(FileReadTargetTest, SameFileTwiceGivesTwoSlots) {
    FileReadTarget target(base());
    EXPECT_EQ(add(target, "first.bin", first.size()), 0u);
    EXPECT_EQ(add(target, "first.bin", first.size()), 1u);
    EXPECT_NE(target.getSlot(0).get(), target.getSlot(1).get());
    EXPECT_EQ(target.removeSlot(0), STATUS_OK);
    EXPECT_EQ(readAll(*target.getSlot(1).get(), 100), first);
}

TEST_F(FileReadTargetTest, AbsoluteNameReplacesTheBase) {
    const fs::path elsewhere = dir / "elsewhere.bin";
    const Bytes data = pattern(11, 9);
    writeBytes(elsewhere, data);
    FileReadTarget target(base());
    const size_t index = add(target, elsewhere.c_str(), data.size());
    EXPECT_EQ(readAll(*target.getSlot(index).get(), 100), data);
}

TEST_F(FileReadTargetTest, NameBelowASubdirectory) {
    fs::create_directories(base() / "a" / "b");
    const Bytes data = pattern(3, 4);
    writeBytes(base() / "a" / "b" / "c.bin", data);
    FileReadTarget target(base());
    const size_t index = add(target, "a/b/c.bin", data.size());
    EXPECT_EQ(readAll(*target.getSlot(index).get(), 100), data);
}

TEST_F(FileReadTargetTest, EmptyFile) {
    writeBytes(base() / "empty.bin", {});
    FileReadTarget target(base());
    TargetSlot& slot = *target.getSlot(add(target, "empty.bin", 0)).get();
    EXPECT_TRUE(slot.exists());
    EXPECT_TRUE(slot.isValid());
    EXPECT_EQ(readAll(slot, 10), Bytes{});
}

// The file stays open: a slot keeps reading what it opened even after the
// name is replaced.
TEST_F(FileReadTargetTest, SlotKeepsItsFileOpen) {
    FileReadTarget target(base());
    const size_t index = add(target, "first.bin", first.size());
    fs::remove(base() / "first.bin");
    writeBytes(base() / "first.bin", pattern(37, 99));
    EXPECT_EQ(readAll(*target.getSlot(index).get(), 100), first);
}

TEST_F(FileReadTargetTest, RemovingSlotsClosesTheirFiles) {
    const size_t before = openDescriptorCount();
    {
        FileReadTarget target(base());
        add(target, "first.bin", first.size());
        add(target, "second.bin", second.size());
        add(target, "hundred.bin", 100);
        EXPECT_EQ(openDescriptorCount(), before + 3);
        EXPECT_EQ(target.removeSlot(1), STATUS_OK);
        EXPECT_EQ(openDescriptorCount(), before + 2);
        EXPECT_EQ(target.removeAllSlots(), STATUS_OK);
        EXPECT_EQ(openDescriptorCount(), before);
        add(target, "first.bin", first.size());
        add(target, "first.bin", first.size());
        EXPECT_EQ(openDescriptorCount(), before + 2);
    }
    // Destroying the target closes the rest.
    EXPECT_EQ(openDescriptorCount(), before);
}

TEST_F(FileReadTargetTest, SlotsAreReadOnly) {
    FileReadTarget target(base());
    TargetSlot& slot = *target.getSlot(add(target, "hundred.bin", 100)).get();
    const Bytes data = pattern(4, 5);
    EXPECT_EQ(slot.beginWrite(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.writeAt(0, data.data(), data.size()), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.write(data.data(), data.size()), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.finalise(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.erase(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(testing_support::readBytes(base() / "hundred.bin"), hundred);
    EXPECT_TRUE(slot.exists());
}

}  // namespace
