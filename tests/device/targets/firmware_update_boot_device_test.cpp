// The firmware-update boot-file target on the simulated device, with the
// real read-only ext4 boot partition at /media/boot and the real mount
// command behind a recorder.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "boot_update_log.h"
#include "device_test_support.h"
#include "fault_injection.h"
#include "files.h"
#include "lib/storage/firmware_update_boot_target.h"
#include "lib/util/log.h"
#include "lock_holder.h"
#include "scratch_dir.h"
#include "simulated_device.h"
#include "storage_log.h"

namespace device_test {
namespace {

using Storage::FirmwareUpdateBootTarget;

constexpr const char* kRemountRw = testing_support::kBootRemountRwCall;
constexpr const char* kRemountRo = testing_support::kBootRemountRoCall;

fs::path bootFile(const std::string& name) { return fs::path(sd::kBootMount) / name; }

std::string quoted(const std::string& name) { return "\"/media/boot/" + name + "\""; }

// The log of a begin and a transfer that both succeeded, up to the
// update-size message of finalise.
std::string receivedLines(const std::string& name, size_t bytes) {
    return testing_support::begunLines(name) + "begin 0\nwrites 0\n" + testing_support::finalisingLines(name, bytes);
}

const std::string kUpToDateLines =
    "Closing #1\n"
    "Did not update file as it was already up to date\n"
    "finalise 0 valid 0\n";

// A copy of `bytes` into the boot file that was read back intact, and the
// end of the update.
std::string copiedLines(const std::string& name, size_t bytes) {
    return "Opening " + quoted(name) + " for write\nWrote " + std::to_string(bytes) +
           " bytes\nReadback successful for " + quoted(name) +
           "\nRemounting \"/media/boot\" as ro\nClosing #1\nfinalise 0 valid 0\n";
}

std::string rewrittenLines(const std::string& name, size_t bytes) {
    return testing_support::needsUpdatingLines(name) + copiedLines(name, bytes);
}

// Begin, stream `data` in blocks of `block` bytes at increasing offsets,
// finalise.
int transfer(TargetSlot& slot, const Bytes& data, size_t block) {
    std::printf("begin %u\n", slot.beginWrite());
    Status writes = STATUS_OK;
    for (size_t offset = 0; offset < data.size() && writes == STATUS_OK; offset += block) {
        const size_t size = std::min(block, data.size() - offset);
        writes = slot.writeAt(static_cast<int64_t>(offset), data.data() + offset, size);
    }
    std::printf("writes %u\n", writes);
    const Status finalised = slot.finalise();
    std::printf("finalise %u valid %d\n", finalised, slot.isValid() ? 1 : 0);
    return 0;
}

Bytes bootPartitionImage() {
    sd::dropDeviceCaches();
    return sd::readImageBytes(sd::bootPartitionOffset(), sd::bootPartitionSize());
}

class FirmwareUpdateBootOnDevice : public ::testing::Test {
protected:
    void SetUp() override {
        SKIP_UNLESS_ON_SIMULATED_DEVICE();
        if (sd::variant() != "normal") GTEST_SKIP() << "for the normal image";
        ASSERT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
        for (const char* name : {"BOOT.BIN", "BOOT0010.BIN"}) {
            ASSERT_EQ(fileBytes(bootFile(name)), fileBytes(sd::originalBootFile(name))) << name;
        }
        restore = true;
    }

    void TearDown() override {
        if (restore) restoreBootFiles();
    }

    // Runs a whole update of `slotIndex` in a child, at the informational
    // threshold, with the recorder in front of mount.
    ProcessResult update(size_t slotIndex, const Bytes& data, size_t block = 4096,
                         const std::map<std::string, std::string>& env = {}) {
        return recorder.run(
            LOG_PRIORITY_INFO,
            [&] {
                FirmwareUpdateBootTarget target;
                return transfer(*target.getSlot(slotIndex).get(), data, block);
            },
            env);
    }

    MountRecorder recorder;
    bool restore = false;
};

// ---- data equal to the boot file ----

TEST_F(FirmwareUpdateBootOnDevice, IdenticalDataLeavesTheFileSystemUntouched) {
    const Bytes imageBefore = bootPartitionImage();
    const Bytes boot = fileBytes(sd::originalBootFile("BOOT.BIN"));
    const Bytes boot0010 = fileBytes(sd::originalBootFile("BOOT0010.BIN"));
    ASSERT_EQ(boot.size(), 10000u);
    ASSERT_EQ(boot0010.size(), 12000u);

    const ProcessResult first = update(0, boot, 1000);
    EXPECT_EQ(first.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(first.out), receivedLines("BOOT.BIN", 10000) + kUpToDateLines);
    const ProcessResult second = update(1, boot0010, 4096);
    EXPECT_EQ(normalisedStorageLog(second.out), receivedLines("BOOT0010.BIN", 12000) + kUpToDateLines);

    EXPECT_EQ(recorder.calls(), "");
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
    EXPECT_EQ(bootPartitionImage() == imageBefore, true) << "the boot partition changed";
}

// The received size is taken modulo 2^32: 4 GiB + 10 bytes compare as the
// first 10 bytes.
TEST_F(FirmwareUpdateBootOnDevice, SizeIsTakenModulo2To32) {
    constexpr int64_t kFourGiB = int64_t{1} << 32;
    {
        // Sparse files that large must be possible in /tmp.
        testing_support::ScratchDir probe;
        const int fd = ::open((probe / "sparse").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
        ASSERT_GE(fd, 0);
        const ssize_t put = ::pwrite(fd, "x", 1, kFourGiB + 9);
        ::close(fd);
        if (put != 1) GTEST_SKIP() << "/tmp cannot hold a sparse file of 4 GiB";
    }
    const Bytes ten = pattern(10, 40);
    changeBootPartition([&] { testing_support::writeBytes(bootFile("BOOT.BIN"), ten); });
    const Bytes imageBefore = bootPartitionImage();
    recorder.clear();

    const ProcessResult result = recorder.run(LOG_PRIORITY_INFO, [&] {
        FirmwareUpdateBootTarget target;
        TargetSlot& slot = *target.getSlot(0).get();
        std::printf("begin %u\n", slot.beginWrite());
        const Bytes tail = pattern(10, 99);
        const Status head = slot.writeAt(0, ten.data(), ten.size());
        const Status far = slot.writeAt(kFourGiB, tail.data(), tail.size());
        std::printf("writes %u\n", head != STATUS_OK ? head : far);
        const Status finalised = slot.finalise();
        std::printf("finalise %u valid %d\n", finalised, slot.isValid() ? 1 : 0);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), receivedLines("BOOT.BIN", 20) + kUpToDateLines);
    EXPECT_EQ(recorder.calls(), "");
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), ten);
    EXPECT_EQ(bootPartitionImage() == imageBefore, true) << "the boot partition changed";
}

// ---- data that differs ----

TEST_F(FirmwareUpdateBootOnDevice, DifferentDataIsWrittenAndReadBack) {
    const Bytes data = pattern(300001, 3);
    const ProcessResult result = update(0, data, 65536);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), receivedLines("BOOT.BIN", 300001) + rewrittenLines("BOOT.BIN", 300001));
    EXPECT_EQ(recorder.calls(), std::string(kRemountRw) + kRemountRo);
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")) == data, true);
    EXPECT_EQ(fileBytes(bootFile("BOOT0010.BIN")), fileBytes(sd::originalBootFile("BOOT0010.BIN")));

    // On the partition itself, not only in the cache.
    mustRun("umount /media/boot && mount /media/boot");
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")) == data, true);
}

// ---- beside other updates ----

// An application that holds the boot files' lock delays an update by the
// bound, after which the update fails and leaves the file and the mount
// alone.
TEST_F(FirmwareUpdateBootOnDevice, HeldBootPartitionFailsWithinTheBound) {
    const Bytes data = pattern(5000, 4);
    ProcessResult result;
    {
        const testing_support::LockHolder holder({{sd::kBootMount, true}});
        const auto start = std::chrono::steady_clock::now();
        result = update(0, data);
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    }
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_NE(result.out.find("Boot partition \"/media/boot\" is busy: not locked within 2000 ms\n"), std::string::npos)
        << result.out;
    EXPECT_NE(result.out.find("finalise 110 valid 0\n"), std::string::npos) << result.out;
    EXPECT_EQ(recorder.calls(), "");
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), fileBytes(sd::originalBootFile("BOOT.BIN")));
}

// Two processes updating one boot file at once: one's remount, writes and
// read-back never come between the other's, so both succeed and the file
// holds one of the two whole.
TEST_F(FirmwareUpdateBootOnDevice, TwoUpdatesAtOnceNeverInterleave) {
    const Bytes first = pattern(400000, 5);
    const Bytes second = pattern(300000, 6);
    for (int round = 0; round < 5; ++round) {
        ProcessResult resultFirst;
        std::thread other([&] { resultFirst = update(0, first, 4096); });
        ProcessResult resultSecond = update(0, second, 4096);
        other.join();
        for (const ProcessResult* result : {&resultFirst, &resultSecond}) {
            EXPECT_NE(result->out.find("finalise 0 valid 0\n"), std::string::npos) << result->out;
        }
        EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
        const Bytes now = fileBytes(bootFile("BOOT.BIN"));
        EXPECT_TRUE(now == first || now == second) << "round " << round << ": " << now.size() << " bytes";
    }
}

// The size alone does not decide: one byte differing in the last block of
// a file of the same size is found by the comparison and written.
TEST_F(FirmwareUpdateBootOnDevice, SameSizeWithOneByteChangedIsWritten) {
    Bytes data = fileBytes(sd::originalBootFile("BOOT.BIN"));
    ASSERT_GT(data.size(), 4096u);
    data.back() = static_cast<uint8_t>(data.back() ^ 0x01);
    const ProcessResult result = update(0, data);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out),
              receivedLines("BOOT.BIN", data.size()) + rewrittenLines("BOOT.BIN", data.size()));
    EXPECT_EQ(recorder.calls(), std::string(kRemountRw) + kRemountRo);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")) == data, true);
}

TEST_F(FirmwareUpdateBootOnDevice, ShorterDataReplacesTheWholeFile) {
    const Bytes data = pattern(3, 8);
    const ProcessResult result = update(1, data);
    EXPECT_EQ(normalisedStorageLog(result.out), receivedLines("BOOT0010.BIN", 3) + rewrittenLines("BOOT0010.BIN", 3));
    EXPECT_EQ(fileBytes(bootFile("BOOT0010.BIN")), data);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), fileBytes(sd::originalBootFile("BOOT.BIN")));
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
}

// From the first begin on, /tmp holds no firmware file: it is unlinked at
// once and lives only behind the descriptor.
TEST_F(FirmwareUpdateBootOnDevice, TemporaryFileIsNeverLeftInTmp) {
    const std::vector<std::string> before = temporaryFirmwareFiles();
    const Bytes data = pattern(5000, 6);
    const ProcessResult result = recorder.run(LOG_PRIORITY_INFO, [&] {
        auto show = [&](const char* when) {
            const bool same = temporaryFirmwareFiles() == before;
            std::printf("%s: tmp %s\n%s", when, same ? "unchanged" : "CHANGED", temporaryFirmwareDescriptors().c_str());
        };
        FirmwareUpdateBootTarget target;
        TargetSlot& slot = *target.getSlot(0).get();
        std::printf("begin %u\n", slot.beginWrite());
        show("after begin");
        std::printf("writeAt %u\n", slot.writeAt(0, data.data(), 4096));
        show("after writeAt");
        std::printf("writeAt %u\n", slot.writeAt(4096, data.data() + 4096, data.size() - 4096));
        show("after writeAt");
        std::printf("finalise %u\n", slot.finalise());
        show("after finalise");
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out),
              "Beginning update of /boot file \"/media/boot/BOOT.BIN\"\n"
              "Opened #1 for receiving firmware\n"
              "begin 0\n"
              "after begin: tmp unchanged\n"
              "#1 (deleted)\n"
              "writeAt 0\n"
              "after writeAt: tmp unchanged\n"
              "#1 (deleted)\n"
              "writeAt 0\n"
              "after writeAt: tmp unchanged\n"
              "#1 (deleted)\n"
              "lib/storage/storage_target:N TODO: Sanity-check the file\n"
              "\"/media/boot/BOOT.BIN\" update with 5000 bytes written\n" +
                  rewrittenLines("BOOT.BIN", 5000).substr(0, rewrittenLines("BOOT.BIN", 5000).rfind("finalise")) +
                  "finalise 0\n"
                  "after finalise: tmp unchanged\n");
    EXPECT_EQ(temporaryFirmwareFiles(), before);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), data);
}

// A missing boot file needs updating; it is created with 0666 less the
// umask.
TEST_F(FirmwareUpdateBootOnDevice, MissingDestinationIsCreatedUnderTheUmask) {
    for (const mode_t mask : {mode_t{022}, mode_t{027}, mode_t{0}}) {
        SCOPED_TRACE("umask " + std::to_string(mask));
        changeBootPartition([] { fs::remove(bootFile("BOOT0010.BIN")); });
        recorder.clear();
        const Bytes data = pattern(777, static_cast<uint8_t>(mask));
        const ProcessResult result = recorder.run(LOG_PRIORITY_INFO, [&] {
            ::umask(mask);
            FirmwareUpdateBootTarget target;
            return transfer(*target.getSlot(1).get(), data, 4096);
        });
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(normalisedStorageLog(result.out),
                  receivedLines("BOOT0010.BIN", 777) + rewrittenLines("BOOT0010.BIN", 777));
        EXPECT_EQ(recorder.calls(), std::string(kRemountRw) + kRemountRo);
        ASSERT_TRUE(fs::is_regular_file(bootFile("BOOT0010.BIN")));
        struct stat st {};
        ASSERT_EQ(::stat(bootFile("BOOT0010.BIN").c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 07777, 0666 & ~mask);
        EXPECT_EQ(fileBytes(bootFile("BOOT0010.BIN")), data);
        EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
    }
}

// ---- updates that do not complete ----

TEST_F(FirmwareUpdateBootOnDevice, FinaliseWithoutBegin) {
    const ProcessResult result = recorder.run(LOG_PRIORITY_DEBUG, [] {
        FirmwareUpdateBootTarget target;
        std::printf("finalise %u\n", target.getSlot(0)->finalise());
        std::printf("finalise %u\n", target.getSlot(1)->finalise());
        return 0;
    });
    EXPECT_EQ(result.out, "finalise 2\nfinalise 2\n");
    EXPECT_EQ(recorder.calls(), "");
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
}

TEST_F(FirmwareUpdateBootOnDevice, NothingReceivedFailsAndCloses) {
    const ProcessResult result = update(0, Bytes{});
    EXPECT_EQ(normalisedStorageLog(result.out),
              "Beginning update of /boot file \"/media/boot/BOOT.BIN\"\n"
              "Opened #1 for receiving firmware\n"
              "begin 0\n"
              "writes 0\n"
              "lib/storage/storage_target:N TODO: Sanity-check the file\n"
              "\"/media/boot/BOOT.BIN\" update with 0 bytes written\n"
              "Closing #1\n"
              "finalise 52 valid 0\n");
    EXPECT_EQ(recorder.calls(), "");
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), fileBytes(sd::originalBootFile("BOOT.BIN")));
}

// A second begin throws the first transfer away: only the second one's
// bytes count and are compared.
TEST_F(FirmwareUpdateBootOnDevice, BeginTwiceRestarts) {
    const Bytes boot = fileBytes(sd::originalBootFile("BOOT.BIN"));
    const ProcessResult result = recorder.run(LOG_PRIORITY_INFO, [&] {
        FirmwareUpdateBootTarget target;
        TargetSlot& slot = *target.getSlot(0).get();
        const Bytes junk = pattern(500, 1);
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", slot.writeAt(0, junk.data(), junk.size()));
        return transfer(slot, boot, 4096);
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "Beginning update of /boot file \"/media/boot/BOOT.BIN\"\n"
              "Opened #1 for receiving firmware\n"
              "begin 0\n"
              "writeAt 0\n"
              "Restarting firmware update!\n"
              "Closing #1\n"
              "Beginning update of /boot file \"/media/boot/BOOT.BIN\"\n"
              "Opened #2 for receiving firmware\n"
              "begin 0\n"
              "writes 0\n"
              "lib/storage/storage_target:N TODO: Sanity-check the file\n"
              "\"/media/boot/BOOT.BIN\" update with 10000 bytes written\n"
              "Closing #2\n"
              "Did not update file as it was already up to date\n"
              "finalise 0 valid 0\n");
    EXPECT_EQ(recorder.calls(), "");
}

// The read-write remount fails: the update ends there, nothing is written
// and no read-only remount follows.
TEST_F(FirmwareUpdateBootOnDevice, FailedRemountEndsTheUpdate) {
    const ProcessResult result = update(0, pattern(100, 2), 4096, {{"FAKE_MOUNT_EXIT", "32"}});
    EXPECT_EQ(normalisedStorageLog(result.out), receivedLines("BOOT.BIN", 100) +
                                                    testing_support::needsUpdatingLines("BOOT.BIN") +
                                                    "lib/storage/storage_target:N Failed to execute mount\n"
                                                    "Closing #1\n"
                                                    "finalise 52 valid 0\n");
    EXPECT_EQ(recorder.calls(), kRemountRw);
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), fileBytes(sd::originalBootFile("BOOT.BIN")));
}

// An immutable boot file cannot be opened for writing: every attempt's
// read-back fails, and after the fifth the file system is read-only again.
// The message names BOOT.BIN for either slot.
TEST_F(FirmwareUpdateBootOnDevice, FiveFailedReadBacks) {
    changeBootPartition([] { setImmutable(bootFile("BOOT0010.BIN"), true); });
    recorder.clear();
    const ProcessResult result = recorder.run(LOG_PRIORITY_INFO, [] {
        FirmwareUpdateBootTarget target;
        TargetSlot& slot = *target.getSlot(1).get();
        transfer(slot, pattern(1000, 5), 4096);
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              receivedLines("BOOT0010.BIN", 1000) + testing_support::needsUpdatingLines("BOOT0010.BIN") +
                  testing_support::failedOpenLines("BOOT0010.BIN", "Operation not permitted") +
                  "Remounting \"/media/boot\" as ro\n"
                  "Closing #1\n"
                  "finalise 52 valid 0\n"
                  "finalise 2\n");
    EXPECT_EQ(recorder.calls(), std::string(kRemountRw) + kRemountRo);
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
    EXPECT_EQ(fileBytes(bootFile("BOOT0010.BIN")), fileBytes(sd::originalBootFile("BOOT0010.BIN")));
}

// ---- faults in the copy, through the shim in a program of its own ----

class FirmwareUpdateBootFaults : public FirmwareUpdateBootOnDevice {
protected:
    ProcessResult runDriver(testing_support::Environment env, const Bytes& data) {
        testing_support::writeBytes(dir / "data", data);
        env["PATH"] = recorder.searchPath();
        return testing_support::runProgram({DEVICE_TARGET_DRIVER, "boot-update", "0", (dir / "data").string()}, env);
    }

    testing_support::ScratchDir dir;
};

// The first attempt's copy is cut short; its read-back fails and the second
// attempt succeeds.
TEST_F(FirmwareUpdateBootFaults, ShortCopyIsRetried) {
    const Bytes data = pattern(9000, 7);
    const ProcessResult result = runDriver(testing_support::faultEnv("write", 1, "short:100", "BOOT.BIN"), data);
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(normalisedStorageLog(result.out), receivedLines("BOOT.BIN", 9000) +
                                                    testing_support::needsUpdatingLines("BOOT.BIN") +
                                                    "Opening \"/media/boot/BOOT.BIN\" for write\n"
                                                    "Wrote 100 bytes\n" +
                                                    copiedLines("BOOT.BIN", 9000));
    EXPECT_EQ(recorder.calls(), std::string(kRemountRw) + kRemountRo);
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), data);
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
}

// A failing write in the second block is reported with its errno; the
// retry succeeds.
TEST_F(FirmwareUpdateBootFaults, FailedCopyIsReportedAndRetried) {
    const Bytes data = pattern(9000, 9);
    const ProcessResult result = runDriver(testing_support::faultEnv("write", 2, "errno:EIO", "BOOT.BIN"), data);
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(normalisedStorageLog(result.out),
              receivedLines("BOOT.BIN", 9000) + testing_support::needsUpdatingLines("BOOT.BIN") +
                  "Opening \"/media/boot/BOOT.BIN\" for write\n"
                  "lib/storage/storage_target:N cat: write failed: 5: Input/output error\n"
                  "Wrote 4096 bytes\n" +
                  copiedLines("BOOT.BIN", 9000));
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), data);
    EXPECT_EQ(sd::mountState(sd::kBootMount), sd::MountState::kReadOnly);
}

// Without a fault the driver does what the in-process tests do.
TEST_F(FirmwareUpdateBootFaults, DriverWithoutFaults) {
    const Bytes data = pattern(4097, 10);
    const ProcessResult result = runDriver(testing_support::preloadEnv(), data);
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(normalisedStorageLog(result.out), receivedLines("BOOT.BIN", 4097) + rewrittenLines("BOOT.BIN", 4097));
    EXPECT_EQ(fileBytes(bootFile("BOOT.BIN")), data);
}

}  // namespace
}  // namespace device_test
