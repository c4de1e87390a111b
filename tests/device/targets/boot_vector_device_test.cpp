// The boot-vector target on the simulated device: located through the real
// partitioning tool, read from and written to the raw eMMC image. One suite
// per image variant; each runs only in its own variant.
#include <sys/stat.h>
#include <unistd.h>
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "device_test_support.h"
#include "fault_injection.h"
#include "lib/storage/boot_vector_target.h"
#include "lib/util/log.h"
#include "simulated_device.h"
#include "storage_log.h"

namespace device_test {
namespace {

using Storage::BootVectorTarget;
using testing_support::runInChild;

constexpr uint64_t kUsualSector = 30703616;
// What the image holds around the record, compared before and after.
constexpr uint64_t kAround = 1 << 20;

// Builds the target in a child with the log on standard output at
// `threshold`, then runs `body` on its slot.
ProcessResult withTarget(int threshold, const std::function<int(BootVectorTarget&, TargetSlot&)>& body) {
    return runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(threshold);
        BootVectorTarget target;
        std::printf("built\n");
        return body(target, *target.getSlot(0).get());
    });
}

// Prints "read <status> <count> <hex>" of a whole-record readSome.
void printRead(TargetSlot& slot) {
    Bytes buffer(20, 0xEE);
    size_t count = 99;
    const Status status = slot.readSome(buffer.data(), buffer.size(), 0, count);
    std::printf("read %u %zu %s\n", status, count, hex(buffer).c_str());
}

void printWrite(TargetSlot& slot, const Bytes& record) {
    std::printf("write %u\n", slot.write(record.data(), record.size()));
}

Bytes imageAroundRecord() { return sd::readImageBytes(sd::bootVectorOffset() - kAround, 2 * kAround); }

Bytes withRecord(Bytes image, const Bytes& record) {
    std::copy(record.begin(), record.end(), image.begin() + kAround);
    return image;
}

class BootVectorVariant : public ::testing::Test {
protected:
    explicit BootVectorVariant(const char* variant) : variant_(variant) {}

    void SetUp() override {
        SKIP_UNLESS_ON_SIMULATED_DEVICE();
        if (sd::variant() != variant_) GTEST_SKIP() << "for the " << variant_ << " image";
    }

private:
    std::string variant_;
};

// ---- the normal image: a valid record at sector 30703616 ----

class BootVectorOnDevice : public BootVectorVariant {
protected:
    BootVectorOnDevice() : BootVectorVariant("normal") {}

    void SetUp() override {
        BootVectorVariant::SetUp();
        if (IsSkipped()) return;
        original = sd::writtenBootVectorRecord();
        ASSERT_EQ(sd::bootVectorSector(), kUsualSector);
        ASSERT_EQ(original.size(), 20u);
        diskNumber = blockDeviceNumber(sd::kDisk);
        ASSERT_NE(diskNumber, 0u);
    }

    void TearDown() override {
        if (original.empty()) return;
        if (blockDeviceNumber(sd::kDisk) != diskNumber) makeBlockNode(sd::kDisk, diskNumber);
        sd::writeImageBytes(sd::bootVectorOffset(), original);
    }

    Bytes original;
    dev_t diskNumber = 0;
};

TEST_F(BootVectorOnDevice, ReadsTheRecordAtTheStartOfTheLastFreeArea) {
    EXPECT_EQ(sd::bootVectorOffset(), 15720251392u);
    // A record of its own there, so that nothing else could have produced it.
    const Bytes placed = sd::makeBootVectorRecord(0xA1B2C3D4u, 7);
    sd::writeImageBytes(sd::bootVectorOffset(), placed);
    const ProcessResult result = withTarget(LOG_PRIORITY_DEBUG, [](BootVectorTarget& target, TargetSlot& slot) {
        std::printf("count %zu exists %d valid %d\n", target.getSlotCount(), slot.exists() ? 1 : 0,
                    slot.isValid() ? 1 : 0);
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "built\ncount 1 exists 1 valid 1\nread 0 20 " + hex(placed) + "\n");
    EXPECT_EQ(result.err, "");
}

TEST_F(BootVectorOnDevice, ReadsTheRunnersRecord) {
    const ProcessResult result = withTarget(LOG_PRIORITY_WARNING, [](BootVectorTarget&, TargetSlot& slot) {
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(result.out, "built\nread 0 20 " + hex(original) + "\n");
}

// Reads come from the copy read at construction, not from the device.
TEST_F(BootVectorOnDevice, ReadsTheCopyTakenAtConstruction) {
    const Bytes later = sd::makeBootVectorRecord(0x00000005u, 3);
    const ProcessResult result = withTarget(LOG_PRIORITY_WARNING, [&](BootVectorTarget&, TargetSlot& slot) {
        sd::writeImageBytes(sd::bootVectorOffset(), later);
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(result.out, "built\nread 0 20 " + hex(original) + "\n");
}

TEST_F(BootVectorOnDevice, WriteChangesExactlyTheRecordBytes) {
    const Bytes before = imageAroundRecord();
    const Bytes tableBefore = sd::readImageBytes(0, 512);
    ASSERT_EQ(Bytes(before.begin() + kAround, before.begin() + kAround + 20), original);
    Bytes record(20, 0);
    record[2] = 0x01;
    record[3] = 0x02;
    record[4] = 0x5A;
    record[12] = 0xC3;
    record[8] = static_cast<uint8_t>(0x01 + 0x02 + 0x5A);
    const uint16_t sum = [&] {
        unsigned c = 0;
        for (size_t i = 0; i < 18; ++i) c = (((c >> 1) | ((c & 1u) << 15)) + record[i]) & 0xFFFFu;
        return static_cast<uint16_t>(c);
    }();
    record[18] = static_cast<uint8_t>(sum);
    record[19] = static_cast<uint8_t>(sum >> 8);
    ASSERT_TRUE(sd::isValidBootVectorRecord(record));

    const ProcessResult result = withTarget(LOG_PRIORITY_INFO, [&](BootVectorTarget&, TargetSlot& slot) {
        printWrite(slot, record);
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "built\nChanged boot vector to 258\nwrite 0\nread 0 20 " + hex(record) + "\n");

    sd::dropDeviceCaches();
    const Bytes after = imageAroundRecord();
    EXPECT_EQ(after == withRecord(before, record), true) << "the image changed beyond the 20 record bytes";
    EXPECT_EQ(hex(Bytes(after.begin() + kAround - 4, after.begin() + kAround + 24)),
              hex(Bytes(before.begin() + kAround - 4, before.begin() + kAround)) + hex(record) +
                  hex(Bytes(before.begin() + kAround + 20, before.begin() + kAround + 24)));
    EXPECT_EQ(sd::readImageBytes(0, 512), tableBefore);
    EXPECT_EQ(hex(sd::readDeviceBytes(sd::kDisk, sd::bootVectorOffset(), 20)), hex(record));

    // A new target reads it from the device.
    const ProcessResult reread = withTarget(LOG_PRIORITY_WARNING, [](BootVectorTarget&, TargetSlot& slot) {
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(reread.out, "built\nread 0 20 " + hex(record) + "\n");
}

// The success message is informational: not written at the default
// threshold, and the result is the same.
TEST_F(BootVectorOnDevice, ChangedMessageOnlyAtInfoPriority) {
    const Bytes record = sd::makeBootVectorRecord(0xFFFFFFFFu, 9);
    const ProcessResult quiet = withTarget(LOG_PRIORITY_WARNING, [&](BootVectorTarget&, TargetSlot& slot) {
        printWrite(slot, record);
        return 0;
    });
    EXPECT_EQ(quiet.out, "built\nwrite 0\n");
    const Bytes next = sd::makeBootVectorRecord(0x80000001u, 10);
    const ProcessResult told = withTarget(LOG_PRIORITY_INFO, [&](BootVectorTarget&, TargetSlot& slot) {
        printWrite(slot, next);
        return 0;
    });
    EXPECT_EQ(told.out, "built\nChanged boot vector to 2147483649\nwrite 0\n");
    EXPECT_EQ(hex(sd::readDeviceBytes(sd::kDisk, sd::bootVectorOffset(), 20)), hex(next));
}

TEST_F(BootVectorOnDevice, InvalidRecordsAreRefused) {
    const Bytes before = imageAroundRecord();
    Bytes badHeader = sd::makeBootVectorRecord(0x00000102u, 4);
    badHeader[8] = static_cast<uint8_t>(badHeader[8] + 1);
    Bytes badChecksum = sd::makeBootVectorRecord(0x00000102u, 4);
    badChecksum[18] = static_cast<uint8_t>(badChecksum[18] ^ 0x80);
    Bytes badBody = sd::makeBootVectorRecord(0x00000102u, 4);
    badBody[13] = static_cast<uint8_t>(badBody[13] + 1);
    const ProcessResult result = withTarget(LOG_PRIORITY_INFO, [&](BootVectorTarget&, TargetSlot& slot) {
        for (const Bytes& record : {badHeader, badChecksum, badBody}) printWrite(slot, record);
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "built\n"
              "lib/storage/storage_target:N Failed validation of boot vectors\nwrite 52\n"
              "lib/storage/storage_target:N Failed validation of boot vectors\nwrite 52\n"
              "lib/storage/storage_target:N Failed validation of boot vectors\nwrite 52\n"
              "read 0 20 " +
                  hex(original) + "\n");
    EXPECT_EQ(imageAroundRecord() == before, true) << "an invalid record reached the device";
}

TEST_F(BootVectorOnDevice, WrongLengthOrOffset) {
    const Bytes before = imageAroundRecord();
    const Bytes record = sd::makeBootVectorRecord(0x0000BEEFu, 2);
    const ProcessResult result = withTarget(LOG_PRIORITY_INFO, [&](BootVectorTarget&, TargetSlot& slot) {
        Bytes longer = record;
        longer.push_back(0);
        std::printf("write %u\n", slot.write(record.data(), 19));
        std::printf("write %u\n", slot.write(longer.data(), longer.size()));
        std::printf("write %u\n", slot.write(record.data(), 0));
        Bytes buffer(21, 0xEE);
        size_t count = 99;
        std::printf("read %u\n", slot.read(buffer.data(), 20, 1));
        std::printf("read %u\n", slot.read(buffer.data(), 19, 0));
        std::printf("read %u\n", slot.read(buffer.data(), 21, 0));
        std::printf("read %u\n", slot.read(buffer.data(), 20, -1));
        const Status status = slot.readSome(buffer.data(), 20, 20, count);
        std::printf("readSome %u %zu\n", status, count);
        std::printf("untouched %s\n", hex(buffer).c_str());
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "built\n"
              "lib/storage/storage_target:N Unexpected length 19\nwrite 22\n"
              "lib/storage/storage_target:N Unexpected length 21\nwrite 22\n"
              "lib/storage/storage_target:N Unexpected length 0\nwrite 22\n"
              "lib/storage/storage_target:N Unexpected length 20 or offset 1\nread 22\n"
              "lib/storage/storage_target:N Unexpected length 19 or offset 0\nread 22\n"
              "lib/storage/storage_target:N Unexpected length 21 or offset 0\nread 22\n"
              "lib/storage/storage_target:N Unexpected length 20 or offset -1\nread 22\n"
              "lib/storage/storage_target:N Unexpected length 20 or offset 20\nreadSome 22 99\n"
              "untouched " +
                  hex(Bytes(21, 0xEE)) + "\nread 0 20 " + hex(original) + "\n");
    EXPECT_EQ(imageAroundRecord() == before, true);
}

// Every length but 20 is refused, for writing and for reading, without
// touching the device or the cached record.
TEST_F(BootVectorOnDevice, EveryOtherLengthIsRefused) {
    const Bytes before = imageAroundRecord();
    const Bytes record = sd::makeBootVectorRecord(0x0000BEEFu, 2);
    const ProcessResult result = withTarget(LOG_PRIORITY_ERROR, [&](BootVectorTarget&, TargetSlot& slot) {
        Bytes source(64, 0);
        std::copy(record.begin(), record.end(), source.begin());
        Bytes buffer(64, 0xEE);
        for (size_t size = 0; size <= 64; ++size) {
            if (size == 20) continue;
            std::printf("%zu write %u\n", size, slot.write(source.data(), size));
            std::printf("%zu read %u\n", size, slot.read(buffer.data(), size, 0));
        }
        std::printf("untouched %d\n", buffer == Bytes(64, 0xEE) ? 1 : 0);
        printRead(slot);
        return 0;
    });
    std::string expected = "built\n";
    for (size_t size = 0; size <= 64; ++size) {
        if (size == 20) continue;
        const std::string n = std::to_string(size);
        expected += "lib/storage/storage_target:N Unexpected length " + n + "\n" + n + " write 22\n" +
                    "lib/storage/storage_target:N Unexpected length " + n + " or offset 0\n" + n + " read 22\n";
    }
    expected += "untouched 1\nread 0 20 " + hex(original) + "\n";
    EXPECT_EQ(normalisedStorageLog(result.out), expected);
    EXPECT_EQ(imageAroundRecord() == before, true);
}

// The cache takes the record before the device is opened: a read after the
// failed write returns the new record, while the device keeps the old one.
TEST_F(BootVectorOnDevice, WriteWhenTheDeviceCannotBeOpened) {
    const Bytes record = sd::makeBootVectorRecord(0x00C0FFEEu, 6);
    const ProcessResult result = withTarget(LOG_PRIORITY_INFO, [&](BootVectorTarget&, TargetSlot& slot) {
        if (::unlink(sd::kDisk) != 0) return 1;
        printWrite(slot, record);
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out),
              "built\n"
              "libcommon/lib/util/fd:N Failed to open /dev/mmcblk0: No such file or directory\n"
              "lib/storage/storage_target:N Failed to write to flash: valid=0 written=0\n"
              "write 52\n"
              "read 0 20 " +
                  hex(record) + "\n");
    makeBlockNode(sd::kDisk, diskNumber);
    EXPECT_EQ(hex(sd::readDeviceBytes(sd::kDisk, sd::bootVectorOffset(), 20)), hex(original));
}

// Write failures from the fault-injection shim, in a program of its own.
class BootVectorWriteFaults : public BootVectorOnDevice {
protected:
    ProcessResult runDriver(const testing_support::Environment& env, const Bytes& record) {
        return testing_support::runProgram({DEVICE_TARGET_DRIVER, "boot-vector-write", hex(record)}, env);
    }
};

TEST_F(BootVectorWriteFaults, FailedWrite) {
    const Bytes record = sd::makeBootVectorRecord(0x11223344u, 8);
    const ProcessResult result = runDriver(testing_support::faultEnv("write", 1, "errno:EIO", "mmcblk0"), record);
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(normalisedStorageLog(result.out),
              "lib/storage/storage_target:N BootVector write failed: 5: Input/output error\n"
              "lib/storage/storage_target:N Failed to write to flash: valid=1 written=-1\n"
              "write 52\n"
              "read 0 20 " +
                  hex(record) + "\n");
    EXPECT_EQ(hex(sd::readDeviceBytes(sd::kDisk, sd::bootVectorOffset(), 20)), hex(original));
}

// A short write leaves exactly its bytes on the device.
TEST_F(BootVectorWriteFaults, ShortWrite) {
    const Bytes record = sd::makeBootVectorRecord(0x11223344u, 8);
    const ProcessResult result = runDriver(testing_support::faultEnv("write", 1, "short:7", "mmcblk0"), record);
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(normalisedStorageLog(result.out),
              "lib/storage/storage_target:N Failed to write to flash: valid=1 written=7\n"
              "write 52\n"
              "read 0 20 " +
                  hex(record) + "\n");
    Bytes expected = original;
    std::copy(record.begin(), record.begin() + 7, expected.begin());
    EXPECT_EQ(hex(sd::readDeviceBytes(sd::kDisk, sd::bootVectorOffset(), 20)), hex(expected));
}

TEST_F(BootVectorWriteFaults, DriverWithoutFaultsWrites) {
    const Bytes record = sd::makeBootVectorRecord(0x01020305u, 8);
    const ProcessResult result = runDriver(testing_support::preloadEnv(), record);
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(result.out, "Changed boot vector to 16909061\nwrite 0\nread 0 20 " + hex(record) + "\n");
    EXPECT_EQ(hex(sd::readDeviceBytes(sd::kDisk, sd::bootVectorOffset(), 20)), hex(record));
}

// ---- the other images ----

// Every operation of an unusable slot, after construction has said why.
int probeUnusable(BootVectorTarget& target, TargetSlot& slot) {
    std::printf("exists %d valid %d count %zu\n", slot.exists() ? 1 : 0, slot.isValid() ? 1 : 0, target.getSlotCount());
    Bytes buffer(20, 0xEE);
    std::printf("read %u\n", slot.read(buffer.data(), 20, 0));
    const Bytes record = sd::makeBootVectorRecord(0x01020304u, 1);
    printWrite(slot, record);
    std::printf("untouched %s\n", hex(buffer).c_str());
    return 0;
}

const std::string kUnusableProbe =
    "built\n"
    "exists 0 valid 0 count 1\n"
    "lib/storage/storage_target:N Cannot read boot vector\n"
    "read 2\n"
    "lib/storage/storage_target:N Cannot change boot vector\n"
    "write 2\n"
    "untouched eeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeeee\n";

// The probe of an unusable slot where the image has a free area:
// construction logs `failure`, every operation is refused, and the
// record's sector on the image is unchanged.
void expectUnusable(const std::string& failure) {
    const Bytes before = sd::readImageBytes(sd::bootVectorOffset(), 512);
    const ProcessResult result = withTarget(LOG_PRIORITY_DEBUG, probeUnusable);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), failure + kUnusableProbe);
    EXPECT_EQ(sd::readImageBytes(sd::bootVectorOffset(), 512), before);
}

class BootVectorLowImage : public BootVectorVariant {
protected:
    BootVectorLowImage() : BootVectorVariant("low") {}
};

TEST_F(BootVectorLowImage, FreeAreaBelowTheRangeIsRefused) {
    expectUnusable("lib/storage/storage_target:N Boot vector 2048000 not in range 6291456 to 33554432\n");
}

class BootVectorBadRecord : public BootVectorVariant {
protected:
    BootVectorBadRecord() : BootVectorVariant("badrecord") {}
};

TEST_F(BootVectorBadRecord, InvalidRecordMakesTheSlotUnusable) {
    ASSERT_FALSE(sd::isValidBootVectorRecord(sd::writtenBootVectorRecord()));
    expectUnusable("lib/storage/storage_target:N Boot vector query failed!\n");
}

class BootVectorNoRecord : public BootVectorVariant {
protected:
    BootVectorNoRecord() : BootVectorVariant("norecord") {}
};

// Nothing was written at the free area: it reads as 20 zero bytes, whose
// checksums are both zero, so that is a valid record.
TEST_F(BootVectorNoRecord, ZeroSectorIsAValidRecord) {
    const ProcessResult result = withTarget(LOG_PRIORITY_DEBUG, [](BootVectorTarget&, TargetSlot& slot) {
        std::printf("exists %d valid %d\n", slot.exists() ? 1 : 0, slot.isValid() ? 1 : 0);
        printRead(slot);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "built\nexists 1 valid 1\nread 0 20 " + hex(Bytes(20, 0)) + "\n");
}

class BootVectorNoFreeArea : public BootVectorVariant {
protected:
    BootVectorNoFreeArea() : BootVectorVariant("nofree") {}
};

TEST_F(BootVectorNoFreeArea, NothingToParse) {
    const ProcessResult result = withTarget(LOG_PRIORITY_DEBUG, probeUnusable);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out),
              "lib/storage/storage_target:N Failed to parse flash size ''\n" + kUnusableProbe);
}

}  // namespace
}  // namespace device_test
