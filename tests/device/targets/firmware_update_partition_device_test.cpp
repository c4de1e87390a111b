// The firmware-update partition target on the simulated device: the real
// resource partition "/dev/mmcblk0p2" at /media/resources, mounted and
// unmounted through the real commands behind a recorder. Every test leaves
// a freshly made resource partition behind.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "device_test_support.h"
#include "files.h"
#include "lib/storage/firmware_update_partition_target.h"
#include "lib/storage/mount_commands.h"
#include "lib/util/log.h"
#include "lock_holder.h"
#include "scratch_dir.h"
#include "simulated_device.h"
#include "source_lines.h"
#include "storage_log.h"

namespace device_test {
namespace {

using Storage::FirmwareUpdatePartitionTarget;

constexpr const char* kUnmount = "umount [/media/resources]\n";
constexpr const char* kMount = "mount [/media/resources]\n";
const std::string kBegun =
    "Unmounting \"/media/resources\"\n"
    "Beginning partition update \"/dev/mmcblk0p2\" at \"/media/resources\"\n";

// pread of the block device, for the bytes a test writes back unchanged.
Bytes deviceBytes(uint64_t offset, size_t size) {
    Bytes bytes(size);
    const int fd = ::open(sd::kResourcePartition, O_RDONLY | O_CLOEXEC);
    if (fd < 0 || ::pread(fd, bytes.data(), size, static_cast<off_t>(offset)) != static_cast<ssize_t>(size)) {
        bytes.clear();
    }
    if (fd >= 0) ::close(fd);
    return bytes;
}

Status writeAt(TargetSlot& slot, int64_t offset, const Bytes& data) {
    return slot.writeAt(offset, data.data(), data.size());
}

class FirmwareUpdatePartitionOnDevice : public ::testing::Test {
protected:
    void SetUp() override {
        SKIP_UNLESS_ON_SIMULATED_DEVICE();
        if (sd::variant() != "normal") GTEST_SKIP() << "for the normal image";
        deviceNumber = blockDeviceNumber(sd::kResourcePartition);
        ASSERT_NE(deviceNumber, 0u);
        ASSERT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kReadWrite);
        ASSERT_EQ(testing_support::readText(sd::kResourcesMarker), sd::kResourcesMarkerText);
    }

    // A fresh resource partition, as the runner makes it, mounted.
    void TearDown() override {
        if (deviceNumber == 0) return;
        if (blockDeviceNumber(sd::kResourcePartition) != deviceNumber) {
            makeBlockNode(sd::kResourcePartition, deviceNumber);
        }
        if (sd::mountState(sd::kResourcesMount) != sd::MountState::kNotMounted) {
            mustRun("umount /media/resources");
        }
        testing_support::ScratchDir stage;
        testing_support::writeText(stage / "resources.id", sd::kResourcesMarkerText);
        // No discard: on the emulated device's card it costs seconds.
        mustRun("mkfs.ext4 -q -F -E nodiscard -L resources -d '" + stage.path().string() + "' /dev/mmcblk0p2");
        mustRun("mount /media/resources");
    }

    ProcessResult run(int threshold, const std::function<int(TargetSlot&)>& body) {
        return recorder.run(threshold, [&] {
            FirmwareUpdatePartitionTarget target;
            return body(*target.getSlot(0).get());
        });
    }

    MountRecorder recorder;
    dev_t deviceNumber = 0;
};

// A whole ext4 image, made here with a marker file of its own, streamed in
// blocks at increasing offsets; after finalise the new file system is
// mounted.
TEST_F(FirmwareUpdatePartitionOnDevice, ImageIsStreamedAndMounted) {
    testing_support::ScratchDir dir;
    fs::create_directory(dir / "content");
    testing_support::writeText(dir / "content" / "new-image.id", "image made by the test\n");
    {
        const int fd = ::open((dir / "image").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(::ftruncate(fd, 8 << 20), 0);
        ::close(fd);
    }
    mustRun("mkfs.ext4 -q -F -L newimage -d '" + (dir / "content").string() + "' '" + (dir / "image").string() + "'");
    const Bytes image = testing_support::readBytes(dir / "image");
    ASSERT_EQ(image.size(), 8u << 20);

    const ProcessResult result = run(LOG_PRIORITY_INFO, [&](TargetSlot& slot) {
        const Status begun = slot.beginWrite();
        std::printf("begin %u valid %d\n", begun, slot.isValid() ? 1 : 0);
        Status writes = STATUS_OK;
        for (size_t offset = 0; offset < image.size() && writes == STATUS_OK; offset += 65536) {
            writes = slot.writeAt(static_cast<int64_t>(offset), image.data() + offset, 65536);
        }
        std::printf("writes %u\n", writes);
        const Status finalised = slot.finalise();
        std::printf("finalise %u valid %d\n", finalised, slot.isValid() ? 1 : 0);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, kBegun +
                              "begin 0 valid 1\n"
                              "writes 0\n"
                              "Wrote 8388608 bytes to \"/dev/mmcblk0p2\"\n"
                              "Mounting \"/media/resources\"\n"
                              "finalise 0 valid 0\n");
    EXPECT_EQ(recorder.calls(), std::string(kUnmount) + kMount);
    EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kReadWrite);
    EXPECT_EQ(testing_support::readText(fs::path(sd::kResourcesMount) / "new-image.id"), "image made by the test\n");
    EXPECT_FALSE(fs::exists(sd::kResourcesMarker));
}

// Two blocks of garbage where the file system's first block and a later
// one were: exactly those bytes change, and the mount then fails.
TEST_F(FirmwareUpdatePartitionOnDevice, TwoBlocksThenTheMountResult) {
    const Bytes first = pattern(4096, 1);
    const Bytes second = pattern(4096, 2);
    const ProcessResult result = run(LOG_PRIORITY_INFO, [&](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, first));
        std::printf("writeAt %u\n", writeAt(slot, 1048576, second));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), kBegun +
                                                    "begin 0\n"
                                                    "writeAt 0\n"
                                                    "writeAt 0\n"
                                                    "Wrote 8192 bytes to \"/dev/mmcblk0p2\"\n"
                                                    "Mounting \"/media/resources\"\n"
                                                    "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
                                                    "finalise 52\n");
    EXPECT_EQ(recorder.calls(), std::string(kUnmount) + kMount);
    EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kNotMounted);
    EXPECT_EQ(sd::readDeviceBytes(sd::kResourcePartition, 0, 4096), first);
    EXPECT_EQ(sd::readDeviceBytes(sd::kResourcePartition, 1048576, 4096), second);
    // The image file behind the loop device has them at the partition's offset.
    EXPECT_EQ(sd::readImageBytes(sd::resourcesPartitionOffset() + 1048576, 4096), second);
}

// Writes of the device's own bytes keep the file system intact; a restart
// reopens the device and counts from 0 again, and its unmount failure is
// ignored.
TEST_F(FirmwareUpdatePartitionOnDevice, BeginTwiceRestarts) {
    const ProcessResult result = run(LOG_PRIORITY_INFO, [&](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, deviceBytes(0, 4096)));
        std::printf("writeAt %u\n", writeAt(slot, 8192, deviceBytes(8192, 4096)));
        const Status again = slot.beginWrite();
        std::printf("begin %u valid %d\n", again, slot.isValid() ? 1 : 0);
        std::printf("writeAt %u\n", writeAt(slot, 1048576, deviceBytes(1048576, 4096)));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out),
              kBegun +
                  "begin 0\n"
                  "writeAt 0\n"
                  "writeAt 0\n"
                  "Restarting partition update!\n"
                  "Unmounting \"/media/resources\"\n"
                  "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
                  "Beginning partition update \"/dev/mmcblk0p2\" at \"/media/resources\"\n"
                  "begin 0 valid 1\n"
                  "writeAt 0\n"
                  "Wrote 4096 bytes to \"/dev/mmcblk0p2\"\n"
                  "Mounting \"/media/resources\"\n"
                  "finalise 0\n");
    EXPECT_EQ(recorder.calls(), std::string(kUnmount) + kUnmount + kMount);
    EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kReadWrite);
    EXPECT_EQ(testing_support::readText(sd::kResourcesMarker), sd::kResourcesMarkerText);
}

TEST_F(FirmwareUpdatePartitionOnDevice, FinaliseOrWriteWithoutBegin) {
    const ProcessResult result = run(LOG_PRIORITY_DEBUG, [](TargetSlot& slot) {
        std::printf("finalise %u\n", slot.finalise());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
        return 0;
    });
    EXPECT_EQ(result.out, "finalise 2\nwriteAt 95\n");
    EXPECT_EQ(recorder.calls(), "");
    EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kReadWrite);
}

// Another update holds the mount points' lock: the begin fails within the
// bound, before anything is unmounted or opened.
TEST_F(FirmwareUpdatePartitionOnDevice, HeldMountPointsFailTheBeginWithinTheBound) {
    ProcessResult result;
    {
        const testing_support::LockHolder holder({{"/media", true}});
        const auto start = std::chrono::steady_clock::now();
        result = run(LOG_PRIORITY_INFO, [](TargetSlot& slot) {
            std::printf("begin %u\n", slot.beginWrite());
            std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
            return 0;
        });
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    }
    EXPECT_EQ(result.out, testing_support::errorPrefixOf("lib/storage/storage_target.cpp", "LOGE << what <<") +
                              "Mount points \"/media\" is busy: not locked within 2000 ms\nbegin 110\nwriteAt 95\n");
    EXPECT_EQ(recorder.calls(), "");
    EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kReadWrite);
    EXPECT_TRUE(fs::exists(sd::kResourcesMarker));
}

// A regular file or a directory at the device path: nothing is unmounted.
TEST_F(FirmwareUpdatePartitionOnDevice, DevicePathThatIsNoBlockDevice) {
    for (const bool directory : {false, true}) {
        SCOPED_TRACE(directory ? "directory" : "regular file");
        fs::remove_all(sd::kResourcePartition);
        if (directory) {
            fs::create_directory(sd::kResourcePartition);
        } else {
            testing_support::writeText(sd::kResourcePartition, "not a device\n");
        }
        const ProcessResult result = run(LOG_PRIORITY_DEBUG, [](TargetSlot& slot) {
            const Status begun = slot.beginWrite();
            std::printf("begin %u valid %d\n", begun, slot.isValid() ? 1 : 0);
            return 0;
        });
        EXPECT_EQ(normalisedStorageLog(result.out),
                  "lib/storage/storage_target:N Unable to locate block device \"/dev/mmcblk0p2\"\n"
                  "begin 2 valid 0\n");
        EXPECT_EQ(recorder.calls(), "");
        EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kReadWrite);
    }
    makeBlockNode(sd::kResourcePartition, deviceNumber);
}

// On a first begin a failed unmount ends it.
TEST_F(FirmwareUpdatePartitionOnDevice, FirstBeginStopsWhenTheUnmountFails) {
    mustRun("umount /media/resources");
    const ProcessResult result = run(LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        const Status begun = slot.beginWrite();
        std::printf("begin %u valid %d\n", begun, slot.isValid() ? 1 : 0);
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "Unmounting \"/media/resources\"\n"
              "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
              "lib/storage/storage_target:N Failed to unmount \"/media/resources\"\n"
              "begin 52 valid 0\n"
              "writeAt 95\n");
    EXPECT_EQ(recorder.calls(), kUnmount);
}

// A block device node without a device behind it: the partition has been
// unmounted and stays so.
TEST_F(FirmwareUpdatePartitionOnDevice, DeviceThatCannotBeOpened) {
    // Major 240 is reserved for local use; nothing here registers it.
    makeBlockNode(sd::kResourcePartition, makedev(240, 0));
    const ProcessResult result = run(LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        const Status begun = slot.beginWrite();
        std::printf("begin %u valid %d\n", begun, slot.isValid() ? 1 : 0);
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "Unmounting \"/media/resources\"\n"
              "libcommon/lib/util/fd:N Failed to open /dev/mmcblk0p2: No such device or address\n"
              "lib/storage/storage_target:N Failed to open \"/dev/mmcblk0p2\" for writing\n"
              "begin 52 valid 0\n");
    EXPECT_EQ(recorder.calls(), kUnmount);
    EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kNotMounted);
}

// A block across the end of the device is written short, one beyond it
// fails with ENOSPC; neither ends the update nor counts.
TEST_F(FirmwareUpdatePartitionOnDevice, FailedBlockWritesKeepTheUpdate) {
    const int64_t end = static_cast<int64_t>(sd::resourcesPartitionSize());
    const ProcessResult result = run(LOG_PRIORITY_INFO, [&](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, end - 10, pattern(4096, 1)));
        std::printf("valid %d\n", slot.isValid() ? 1 : 0);
        std::printf("writeAt %u\n", writeAt(slot, end, pattern(10, 2)));
        std::printf("valid %d\n", slot.isValid() ? 1 : 0);
        std::printf("writeAt %u\n", writeAt(slot, 0, deviceBytes(0, 1024)));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out), kBegun +
                                                    "begin 0\n"
                                                    "writeAt 52\n"
                                                    "valid 1\n"
                                                    "writeAt 28\n"
                                                    "valid 1\n"
                                                    "writeAt 0\n"
                                                    "Wrote 1024 bytes to \"/dev/mmcblk0p2\"\n"
                                                    "Mounting \"/media/resources\"\n"
                                                    "finalise 0\n");
    EXPECT_EQ(sd::mountState(sd::kResourcesMount), sd::MountState::kReadWrite);
    EXPECT_EQ(sd::readDeviceBytes(sd::kResourcePartition, static_cast<uint64_t>(end - 10), 10), pattern(10, 1));
}

// The real mount with a mount point that the device's fstab does not know.
TEST_F(FirmwareUpdatePartitionOnDevice, MountOfAMountPointUnknownToTheMountTable) {
    const ProcessResult result = recorder.run(LOG_PRIORITY_WARNING, [] {
        std::printf("status %u\n", Storage::mountPartition(sd::kStaticDir));
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "Mounting \"/media/static\"\n"
              "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
              "status 52\n");
    EXPECT_EQ(recorder.calls(), "mount [/media/static]\n");
    EXPECT_EQ(sd::mountState(sd::kStaticDir), sd::MountState::kNotMounted);
}

}  // namespace
}  // namespace device_test
