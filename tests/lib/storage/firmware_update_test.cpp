// The firmware-update targets on a host without the device: everything
// that happens before "/media/boot" or "/dev/mmcblk0p2" is needed. The rest
// runs on the simulated device (tests/device/targets).
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "boot_update_log.h"
#include "child_process.h"
#include "fake_mount_commands.h"
#include "fault_injection.h"
#include "files.h"
#include "lib/storage/firmware_update_boot_target.h"
#include "lib/storage/firmware_update_partition_target.h"
#include "lib/util/log.h"
#include "slot_changes_refused.h"
#include "storage_log.h"

namespace {

namespace fs = std::filesystem;
using Storage::FirmwareUpdateBootTarget;
using Storage::FirmwareUpdatePartitionTarget;
using Storage::TargetSlot;
using testing_support::begunLines;
using testing_support::failedOpenLines;
using testing_support::FakeMountCommands;
using testing_support::finalisingLines;
using testing_support::kBootRemountRoCall;
using testing_support::kBootRemountRwCall;
using testing_support::needsUpdatingLines;
using testing_support::normalisedStorageLog;
using testing_support::ProcessResult;
using testing_support::runInChild;

using Bytes = std::vector<uint8_t>;

// "/tmp/firmware..." descriptors this process holds, as the kernel names
// them (a removed file carries " (deleted)"), and whether each is
// close-on-exec.
void printTemporaryDescriptors() {
    for (const auto& entry : fs::directory_iterator("/proc/self/fd")) {
        std::error_code error;
        const fs::path target = fs::read_symlink(entry.path(), error);
        if (error || target.string().rfind("/tmp/firmware", 0) != 0) continue;
        const int fd = std::stoi(entry.path().filename().string());
        std::printf("fd %s cloexec %d\n", target.c_str(), (fcntl(fd, F_GETFD) & FD_CLOEXEC) != 0 ? 1 : 0);
    }
}

Bytes pattern(size_t size, uint8_t seed) {
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<uint8_t>(seed + i * 11);
    return bytes;
}

Status writeAt(TargetSlot& slot, int64_t offset, const Bytes& data) {
    return slot.writeAt(offset, data.data(), data.size());
}

// "<what> <status> valid <0|1>", the slot's validity taken after the call
// that gave `status`.
void printWithValidity(const char* what, Status status, TargetSlot& slot) {
    std::printf("%s %u valid %d\n", what, status, slot.isValid() ? 1 : 0);
}

// Runs `body` on slot `index` of a new boot-file target in a child, with
// the log on standard output at `threshold`; optionally with the stand-in
// mount commands first on PATH.
ProcessResult onBootSlot(size_t index, int threshold, const std::function<int(TargetSlot&)>& body) {
    return runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(threshold);
        FirmwareUpdateBootTarget target;
        return body(*target.getSlot(index).get());
    });
}

ProcessResult onBootSlot(const FakeMountCommands& fake, size_t index, int threshold,
                         const std::function<int(TargetSlot&)>& body,
                         const std::map<std::string, std::string>& env = {}) {
    return fake.run(
        threshold,
        [&] {
            FirmwareUpdateBootTarget target;
            return body(*target.getSlot(index).get());
        },
        env);
}

size_t countOf(const std::string& text, const std::string& part) {
    size_t count = 0;
    for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + part.size())) ++count;
    return count;
}

// ---- both targets ----

// What a firmware-update target looks like before any update: a fixed set of
// slots, each handed out as the same borrowed slot, none added or removed.
struct TargetShape {
    const char* name;
    std::function<std::unique_ptr<Storage::Target>()> make;
    size_t slotCount;
    const char* description;
    // A name addSlot() is asked for.
    const char* slotName;
};

class FirmwareUpdateTargetShape : public ::testing::TestWithParam<TargetShape> {};

TEST_P(FirmwareUpdateTargetShape, FixedSlotsNoneAddedOrRemoved) {
    const TargetShape& shape = GetParam();
    const std::unique_ptr<Storage::Target> target = shape.make();
    EXPECT_EQ(target->getSlotCount(), shape.slotCount);
    EXPECT_EQ(target->getDescription(), shape.description);
    for (size_t index = 0; index < shape.slotCount; ++index) {
        ASSERT_TRUE(target->getSlot(index)) << index;
        EXPECT_FALSE(target->getSlot(index).ownsSlot()) << index;
        EXPECT_EQ(target->getSlot(index).get(), target->getSlot(index).get()) << index;
        if (index > 0) {
            EXPECT_NE(target->getSlot(index).get(), target->getSlot(index - 1).get()) << index;
        }
    }
    EXPECT_FALSE(target->getSlot(shape.slotCount));
    EXPECT_FALSE(target->getSlot(size_t{1} << 32));
    store_test::expectSlotChangesRefused(*target, shape.slotName);
    EXPECT_EQ(target->removeAllSlots(), STATUS_NOTHING_TO_DO);
    EXPECT_EQ(target->getSlotCount(), shape.slotCount);
}

INSTANTIATE_TEST_SUITE_P(
    FirmwareUpdate, FirmwareUpdateTargetShape,
    ::testing::Values(TargetShape{"BootTwoSlotsOnePerBootFile",
                                  [] { return std::make_unique<FirmwareUpdateBootTarget>(); }, 2,
                                  "FirmwareUpdateBootTarget /media/boot", "BOOT.BIN"},
                      TargetShape{"PartitionOneSlot", [] { return std::make_unique<FirmwareUpdatePartitionTarget>(); },
                                  1, "FirmwareUpdatePartitionTarget", "x"}),
    [](const ::testing::TestParamInfo<TargetShape>& info) { return std::string(info.param.name); });

// ---- the boot-file target ----

// No update in progress: nothing to finalise, write or close, and nothing
// said about it.
TEST(FirmwareUpdateBoot, IdleSlot) {
    FakeMountCommands fake;
    const auto result = onBootSlot(fake, 0, LOG_PRIORITY_DEBUG, [](TargetSlot& slot) {
        const Bytes data = pattern(10, 1);
        uint8_t buffer[10] = {};
        size_t got = 5;
        std::printf("exists %d valid %d\n", slot.exists() ? 1 : 0, slot.isValid() ? 1 : 0);
        std::printf("finalise %u\n", slot.finalise());
        std::printf("writeAt %u\n", writeAt(slot, 0, data));
        std::printf("erase %u\n", slot.erase());
        std::printf("write %u\n", slot.write(data.data(), data.size()));
        std::printf("read %u\n", slot.read(buffer, sizeof buffer, 0));
        std::printf("readSome %u\n", slot.readSome(buffer, sizeof buffer, 0, got));
        std::printf("got %zu\n", got);
        std::printf("valid %d\n", slot.isValid() ? 1 : 0);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out,
              "exists 1 valid 0\n"
              "finalise 2\n"
              "writeAt 95\n"
              "erase 95\n"
              "write 38\n"
              "read 38\n"
              "readSome 38\n"
              "got 5\n"
              "valid 0\n");
    EXPECT_EQ(fake.calls(), "");
}

TEST(FirmwareUpdateBoot, BeginOpensAnUnnamedTemporaryFile) {
    const auto result = onBootSlot(0, LOG_PRIORITY_DEBUG, [](TargetSlot& slot) {
        printWithValidity("begin", slot.beginWrite(), slot);
        printTemporaryDescriptors();
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT.BIN", 1) +
                                                    "begin 0 valid 1\n"
                                                    "fd #1 (deleted) cloexec 1\n");
}

TEST(FirmwareUpdateBoot, SecondSlotIsBoot0010) {
    const auto result = runInChild([] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        FirmwareUpdateBootTarget target;
        std::printf("begin %u\n", target.getSlot(1)->beginWrite());
        std::printf("slot 0 valid %d\n", target.getSlot(0)->isValid() ? 1 : 0);
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT0010.BIN", 1) +
                                                    "begin 0\n"
                                                    "slot 0 valid 0\n");
}

TEST(FirmwareUpdateBoot, NothingBelowWarningPriority) {
    const auto result = onBootSlot(0, LOG_PRIORITY_ERROR, [](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("erase %u\n", slot.erase());
        return 0;
    });
    EXPECT_EQ(result.out, "begin 0\nbegin 0\nerase 0\n");
}

TEST(FirmwareUpdateBoot, BeginTwiceRestarts) {
    const auto result = onBootSlot(0, LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(100, 1)));
        printWithValidity("begin", slot.beginWrite(), slot);
        printTemporaryDescriptors();
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT.BIN", 1) +
                                                    "begin 0\n"
                                                    "writeAt 0\n"
                                                    "Restarting firmware update!\n"
                                                    "Closing #1\n" +
                                                    begunLines("BOOT.BIN", 2) +
                                                    "begin 0 valid 1\n"
                                                    "fd #2 (deleted) cloexec 1\n");
}

// The restart's own count starts at 0: nothing received after it means a
// failed finalise, whatever came before.
TEST(FirmwareUpdateBoot, RestartForgetsWhatWasReceived) {
    const auto result = onBootSlot(0, LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        (void)slot.beginWrite();
        (void)writeAt(slot, 0, pattern(100, 1));
        (void)slot.beginWrite();
        std::printf("--\n");
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    const std::string out = normalisedStorageLog(result.out);
    EXPECT_EQ(out.substr(out.find("--\n")), "--\n" + finalisingLines("BOOT.BIN", 0) +
                                                "Closing #2\n"
                                                "finalise 52\n");
}

TEST(FirmwareUpdateBoot, FinaliseWithNothingReceivedFails) {
    FakeMountCommands fake;
    const auto result = onBootSlot(fake, 0, LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        printWithValidity("finalise", slot.finalise(), slot);
        printTemporaryDescriptors();
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT.BIN", 1) + "begin 0\n" +
                                                    finalisingLines("BOOT.BIN", 0) +
                                                    "Closing #1\n"
                                                    "finalise 52 valid 0\n"
                                                    "finalise 2\n");
    EXPECT_EQ(fake.calls(), "");
}

// Empty blocks count nothing either.
TEST(FirmwareUpdateBoot, EmptyWritesCountNothing) {
    FakeMountCommands fake;
    const auto result = onBootSlot(fake, 1, LOG_PRIORITY_ERROR, [](TargetSlot& slot) {
        const Bytes none;
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, none));
        std::printf("writeAt %u\n", writeAt(slot, 4096, none));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "begin 0\n"
              "writeAt 0\n"
              "writeAt 0\n"
              "lib/storage/storage_target:N TODO: Sanity-check the file\n"
              "finalise 52\n");
    EXPECT_EQ(fake.calls(), "");
}

TEST(FirmwareUpdateBoot, EraseAbandonsTheUpdate) {
    const auto result = onBootSlot(1, LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
        printWithValidity("erase", slot.erase(), slot);
        printTemporaryDescriptors();
        std::printf("erase %u\n", slot.erase());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT0010.BIN", 1) +
                                                    "begin 0\n"
                                                    "writeAt 0\n"
                                                    "Closing #1\n"
                                                    "erase 0 valid 0\n"
                                                    "erase 95\n"
                                                    "writeAt 95\n"
                                                    "finalise 2\n");
}

// pwrite refuses a negative offset; the errno comes back and the update is
// over, so the next block is refused.
TEST(FirmwareUpdateBoot, StreamedWriteAfterAFailedOneIsRefused) {
    const auto result = onBootSlot(0, LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
        printWithValidity("writeAt", writeAt(slot, -1, pattern(10, 2)), slot);
        std::printf("writeAt %u\n", writeAt(slot, 10, pattern(10, 3)));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT.BIN", 1) +
                                                    "begin 0\n"
                                                    "writeAt 0\n"
                                                    "Closing #1\n"
                                                    "writeAt 22 valid 0\n"
                                                    "writeAt 95\n"
                                                    "finalise 2\n");
}

// With the file-size limit at 1 MiB, a block across it is written short
// (STATUS_FAILED) and a block beyond it fails with EFBIG; either ends the
// update.
TEST(FirmwareUpdateBoot, ShortOrFailedStreamedWriteEndsTheUpdate) {
    constexpr rlim_t kLimit = 1 << 20;
    const auto result = runInChild([] {
        std::signal(SIGXFSZ, SIG_IGN);
        const rlimit limit{kLimit, kLimit};
        if (setrlimit(RLIMIT_FSIZE, &limit) != 0) return 1;
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_INFO);
        FirmwareUpdateBootTarget target;
        TargetSlot& slot = *target.getSlot(0).get();
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(4096, 1)));
        std::printf("writeAt %u\n", writeAt(slot, kLimit - 10, pattern(20, 2)));
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 3)));
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, kLimit, pattern(10, 4)));
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 5)));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT.BIN", 1) +
                                                    "begin 0\n"
                                                    "writeAt 0\n"
                                                    "Closing #1\n"
                                                    "writeAt 52\n"
                                                    "writeAt 95\n" +
                                                    begunLines("BOOT.BIN", 2) +
                                                    "begin 0\n"
                                                    "Closing #2\n"
                                                    "writeAt 27\n"
                                                    "writeAt 95\n"
                                                    "finalise 2\n");
}

// Offsets are the caller's business: the count adds up the block sizes. The
// boot file is missing here, so the update goes on to the read-write
// remount, whose failure ends it without a read-only remount.
TEST(FirmwareUpdateBoot, FailedRemountEndsTheUpdate) {
    if (fs::exists("/media/boot")) GTEST_SKIP() << "this host has a /media/boot";
    FakeMountCommands fake;
    const auto result = onBootSlot(fake, 0, LOG_PRIORITY_INFO,
                                   [](TargetSlot& slot) {
                                       std::printf("begin %u\n", slot.beginWrite());
                                       std::printf("writeAt %u\n", writeAt(slot, 100, pattern(10, 1)));
                                       std::printf("writeAt %u\n", writeAt(slot, 0, pattern(7, 2)));
                                       std::printf("writeAt %u\n", writeAt(slot, 100, pattern(13, 3)));
                                       printWithValidity("finalise", slot.finalise(), slot);
                                       printTemporaryDescriptors();
                                       return 0;
                                   },
                                   {{"FAKE_MOUNT_EXIT", "32"}});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT.BIN", 1) +
                                                    "begin 0\n"
                                                    "writeAt 0\n"
                                                    "writeAt 0\n"
                                                    "writeAt 0\n" +
                                                    finalisingLines("BOOT.BIN", 30) + needsUpdatingLines("BOOT.BIN") +
                                                    "lib/storage/storage_target:N Failed to execute mount\n"
                                                    "Closing #1\n"
                                                    "finalise 52 valid 0\n");
    EXPECT_EQ(fake.calls(), kBootRemountRwCall);
}

// Without a boot partition every attempt fails to open the boot file and
// its read-back finds nothing: five attempts, then the read-only remount.
TEST(FirmwareUpdateBoot, UnwritableBootFileIsTriedFiveTimes) {
    if (fs::exists("/media/boot")) GTEST_SKIP() << "this host has a /media/boot";
    FakeMountCommands fake;
    const auto result = onBootSlot(fake, 0, LOG_PRIORITY_INFO, [](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
        printWithValidity("finalise", slot.finalise(), slot);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(result.out), begunLines("BOOT.BIN", 1) +
                                                    "begin 0\n"
                                                    "writeAt 0\n" +
                                                    finalisingLines("BOOT.BIN", 10) + needsUpdatingLines("BOOT.BIN") +
                                                    failedOpenLines("BOOT.BIN", "No such file or directory") +
                                                    "Remounting \"/media/boot\" as ro\n"
                                                    "Closing #1\n"
                                                    "finalise 52 valid 0\n");
    EXPECT_EQ(fake.calls(), std::string(kBootRemountRwCall) + kBootRemountRoCall);
}

// At the critical threshold the same failing update says nothing, and ends
// as it does when it talks.
TEST(FirmwareUpdateBoot, FailingUpdateIsSilentAtTheCriticalThreshold) {
    if (fs::exists("/media/boot")) GTEST_SKIP() << "this host has a /media/boot";
    FakeMountCommands fake;
    const auto result = onBootSlot(fake, 0, LOG_PRIORITY_CRITICAL, [](TargetSlot& slot) {
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("begin %u\n", slot.beginWrite());
        std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "begin 0\nbegin 0\nwriteAt 0\nfinalise 52\n");
    EXPECT_EQ(fake.calls(), std::string(kBootRemountRwCall) + kBootRemountRoCall);
}

// The same seen from outside the process: the shim counts one open of the
// boot file per attempt, and failing the first one with EIO changes nothing
// but its message.
TEST(FirmwareUpdateBootHostFaults, EveryAttemptOpensTheBootFileOnce) {
    if (!testing_support::programEmulator().empty()) {
        GTEST_SKIP() << "native builds only: the shim cannot be preloaded under qemu-aarch64";
    }
    if (fs::exists("/media/boot")) GTEST_SKIP() << "this host has a /media/boot";
    FakeMountCommands fake;
    testing_support::ScratchDir dir;
    const Bytes data = pattern(5000, 4);
    testing_support::writeBytes(dir / "data", data);
    const std::string counts = (dir / "count").string();
    const auto drive = [&](testing_support::Environment env) {
        env["PATH"] = fake.searchPath();
        return testing_support::runProgram({DEVICE_TARGET_DRIVER, "boot-update", "0", (dir / "data").string()}, env);
    };

    const ProcessResult counted = drive(testing_support::faultCountEnv("open", counts, "/media/boot/BOOT.BIN"));
    EXPECT_EQ(counted.exitStatus, 0) << counted.err;
    EXPECT_EQ(testing_support::readFaultCount(counts), 5u);
    EXPECT_EQ(countOf(counted.out, "Failed to open /media/boot/BOOT.BIN: No such file or directory\n"), 5u);
    EXPECT_EQ(countOf(counted.out, "finalise 52 valid 0\n"), 1u);

    const ProcessResult failed =
        drive(testing_support::faultEnv("open", 1, "errno:EIO", "/media/boot/BOOT.BIN", counts));
    EXPECT_EQ(failed.exitStatus, 0) << failed.err;
    EXPECT_EQ(testing_support::readFaultCount(counts), 5u);
    EXPECT_EQ(countOf(failed.out, "Failed to open /media/boot/BOOT.BIN: Input/output error\n"), 1u);
    EXPECT_EQ(countOf(failed.out, "Failed to open /media/boot/BOOT.BIN: No such file or directory\n"), 4u);
    EXPECT_EQ(countOf(failed.out, "finalise 52 valid 0\n"), 1u);
}

// Destroying a slot in the middle of an update closes its temporary file.
TEST(FirmwareUpdateBoot, DestructionClosesTheTemporaryFile) {
    const auto result = runInChild([] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_ERROR);
        {
            FirmwareUpdateBootTarget target;
            std::printf("begin %u\n", target.getSlot(0)->beginWrite());
            std::printf("begin %u\n", target.getSlot(1)->beginWrite());
            printTemporaryDescriptors();
        }
        std::printf("after\n");
        printTemporaryDescriptors();
        return 0;
    });
    EXPECT_EQ(normalisedStorageLog(result.out),
              "begin 0\n"
              "begin 0\n"
              "fd #1 (deleted) cloexec 1\n"
              "fd #2 (deleted) cloexec 1\n"
              "after\n");
}

// ---- the partition target ----

// Without an update: nothing is written, nothing mounted, nothing said.
TEST(FirmwareUpdatePartition, IdleSlot) {
    FakeMountCommands fake;
    const auto result = fake.run(LOG_PRIORITY_DEBUG, [] {
        FirmwareUpdatePartitionTarget target;
        TargetSlot& slot = *target.getSlot(0).get();
        const Bytes data = pattern(4096, 1);
        uint8_t buffer[10] = {};
        size_t got = 5;
        std::printf("exists %d valid %d\n", slot.exists() ? 1 : 0, slot.isValid() ? 1 : 0);
        std::printf("finalise %u\n", slot.finalise());
        std::printf("writeAt %u\n", writeAt(slot, 0, data));
        std::printf("write %u\n", slot.write(data.data(), data.size()));
        std::printf("read %u\n", slot.read(buffer, sizeof buffer, 0));
        std::printf("readSome %u\n", slot.readSome(buffer, sizeof buffer, 0, got));
        std::printf("got %zu\n", got);
        std::printf("erase %u\n", slot.erase());
        std::printf("finalise %u\n", slot.finalise());
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out,
              "exists 1 valid 0\n"
              "finalise 2\n"
              "writeAt 95\n"
              "write 38\n"
              "read 38\n"
              "readSome 38\n"
              "got 5\n"
              "erase 38\n"
              "finalise 2\n");
    EXPECT_EQ(fake.calls(), "");
}

TEST(FirmwareUpdatePartition, BeginWithoutTheBlockDevice) {
    if (fs::exists("/dev/mmcblk0p2")) GTEST_SKIP() << "this host has a /dev/mmcblk0p2";
    // The error line shows down to the error threshold only.
    for (const int threshold : {LOG_PRIORITY_DEBUG, LOG_PRIORITY_ERROR, LOG_PRIORITY_CRITICAL}) {
        FakeMountCommands fake;
        const auto result = fake.run(threshold, [] {
            FirmwareUpdatePartitionTarget target;
            TargetSlot& slot = *target.getSlot(0).get();
            printWithValidity("begin", slot.beginWrite(), slot);
            std::printf("writeAt %u\n", writeAt(slot, 0, pattern(10, 1)));
            std::printf("finalise %u\n", slot.finalise());
            return 0;
        });
        EXPECT_EQ(result.exitStatus, 0) << threshold;
        EXPECT_EQ(normalisedStorageLog(result.out),
                  std::string(threshold >= LOG_PRIORITY_ERROR
                                  ? "lib/storage/storage_target:N Unable to locate block device \"/dev/mmcblk0p2\"\n"
                                  : "") +
                      "begin 2 valid 0\n"
                      "writeAt 95\n"
                      "finalise 2\n")
            << threshold;
        // Nothing was unmounted.
        EXPECT_EQ(fake.calls(), "") << threshold;
    }
}

}  // namespace
