// The simulated device itself. SimulatedDevice.* run inside a device (one
// ctest entry per image variant); SimulatedDeviceLifecycle.* start devices
// of their own from outside and check what is left afterwards.
#include "simulated_device.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <spawn.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fstream>
#include <set>
#include <thread>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "scratch_dir.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;
using simulated_device::Bytes;
using simulated_device::MountState;
using testing_support::ProcessResult;
using testing_support::runProgram;
using testing_support::runShell;

constexpr uint64_t kSector = 512;
constexpr uint64_t kDeviceSectors = 33554432;  // 16 GiB
constexpr uint64_t kLowestBootVectorSector = 6291456;
// Inside the third partition in every variant and used by nothing.
constexpr uint64_t kUnusedOffset = 300ull * 1024 * 1024;

uint64_t firstNumber(const std::string& text) { return std::strtoull(text.c_str(), nullptr, 10); }

dev_t deviceNumber(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return 0;
    return S_ISBLK(st.st_mode) ? st.st_rdev : 0;
}

uint64_t blockDeviceSize(const std::string& path) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return 0;
    uint64_t size = 0;
    if (::ioctl(fd, BLKGETSIZE64, &size) != 0) size = 0;
    ::close(fd);
    return size;
}

// ext4 superblock at byte 1024: magic 0xEF53 at 56 (little-endian), label at 120.
std::string ext4Label(const Bytes& superblock) {
    if (superblock.size() < 136 || superblock[56] != 0x53 || superblock[57] != 0xEF) return "<no ext4>";
    return std::string(reinterpret_cast<const char*>(&superblock[120]),
                       strnlen(reinterpret_cast<const char*>(&superblock[120]), 16));
}

class SimulatedDevice : public ::testing::Test {
protected:
    void SetUp() override { SKIP_UNLESS_ON_SIMULATED_DEVICE(); }

    bool variantIs(std::initializer_list<const char*> names) {
        const std::string current = simulated_device::variant();
        for (const char* name : names) {
            if (current == name) return true;
        }
        return false;
    }
};

TEST_F(SimulatedDevice, LastFreeAreaIsWhereTheRunnerPutIt) {
    const ProcessResult result = runShell("/usr/sbin/sfdisk -q -n -F /dev/mmcblk0 | tail -1");
    ASSERT_EQ(result.exitStatus, 0) << result.err;
    if (variantIs({"nofree"})) {
        EXPECT_EQ(result.out, "");
        EXPECT_EQ(simulated_device::bootVectorSector(), 0u);
        return;
    }
    EXPECT_EQ(firstNumber(result.out), simulated_device::bootVectorSector()) << result.out;
    if (variantIs({"low"})) {
        EXPECT_EQ(firstNumber(result.out), 2048000u) << result.out;
        EXPECT_LT(firstNumber(result.out), kLowestBootVectorSector);
    } else {
        EXPECT_EQ(firstNumber(result.out), 30703616u) << result.out;
    }
    // The free area runs to the end of the 16 GiB device.
    std::istringstream fields(result.out);
    uint64_t start = 0, end = 0;
    fields >> start >> end;
    EXPECT_EQ(end, kDeviceSectors - 1);
}

TEST_F(SimulatedDevice, RecordSectorHoldsWhatWasWritten) {
    if (variantIs({"nofree"})) GTEST_SKIP() << "no free area, no record";
    const Bytes onDisk =
        simulated_device::readDeviceBytes(simulated_device::kDisk, simulated_device::bootVectorOffset(), 20);
    EXPECT_EQ(onDisk, simulated_device::readImageBytes(simulated_device::bootVectorOffset(), 20));
    if (variantIs({"norecord"})) {
        EXPECT_EQ(simulated_device::writtenBootVectorRecord(), Bytes{});
        EXPECT_EQ(onDisk, Bytes(20, 0));
        return;
    }
    ASSERT_EQ(simulated_device::writtenBootVectorRecord().size(), 20u);
    EXPECT_EQ(testing_support::hex(onDisk), testing_support::hex(simulated_device::writtenBootVectorRecord()));
    // Value 0x01020304, big-endian.
    EXPECT_EQ(testing_support::hex(Bytes(onDisk.begin(), onDisk.begin() + 4)), "01020304");
    if (variantIs({"badrecord"})) {
        unsigned sum = 0;
        for (size_t i = 0; i < 8; ++i) sum += onDisk[i];
        EXPECT_EQ(sum & 0xFF, onDisk[8]) << "only the record checksum is to be wrong";
        EXPECT_FALSE(simulated_device::isValidBootVectorRecord(onDisk));
    } else {
        EXPECT_TRUE(simulated_device::isValidBootVectorRecord(onDisk));
    }
}

TEST_F(SimulatedDevice, DeviceNodesAreTheLoopDevices) {
    EXPECT_NE(deviceNumber(simulated_device::diskLoop()), 0u);
    EXPECT_EQ(deviceNumber(simulated_device::kDisk), deviceNumber(simulated_device::diskLoop()));
    EXPECT_EQ(deviceNumber(simulated_device::kBootPartition), deviceNumber(simulated_device::bootLoop()));
    EXPECT_EQ(deviceNumber(simulated_device::kResourcePartition), deviceNumber(simulated_device::resourcesLoop()));
    EXPECT_NE(deviceNumber(simulated_device::kBootPartition), deviceNumber(simulated_device::kResourcePartition));
}

TEST_F(SimulatedDevice, PartitionNodesCoverTheirRangesOfTheDisk) {
    const Bytes boot = simulated_device::readDeviceBytes(simulated_device::kBootPartition, 1024, 136);
    const Bytes resources = simulated_device::readDeviceBytes(simulated_device::kResourcePartition, 1024, 136);
    EXPECT_EQ(ext4Label(boot), "boot");
    EXPECT_EQ(ext4Label(resources), "resources");
    EXPECT_EQ(
        simulated_device::readDeviceBytes(simulated_device::kDisk, simulated_device::bootPartitionOffset() + 1024, 136),
        boot);
    EXPECT_EQ(simulated_device::readImageBytes(simulated_device::resourcesPartitionOffset() + 1024, 136), resources);
    EXPECT_EQ(simulated_device::bootPartitionSize(), 64u * 1024 * 1024);
    EXPECT_EQ(simulated_device::resourcesPartitionSize(), 128u * 1024 * 1024);
    // The partition devices end where their partitions end.
    EXPECT_EQ(blockDeviceSize(simulated_device::kBootPartition), simulated_device::bootPartitionSize());
    EXPECT_EQ(blockDeviceSize(simulated_device::kResourcePartition), simulated_device::resourcesPartitionSize());
    EXPECT_EQ(blockDeviceSize(simulated_device::kDisk), kDeviceSectors * kSector);
}

TEST_F(SimulatedDevice, ImageAndDiskSeeEachOthersWrites) {
    const Bytes first = simulated_device::makeBootVectorRecord(0xA1B2C3D4, 7);
    simulated_device::writeImageBytes(kUnusedOffset, first);
    EXPECT_EQ(simulated_device::readDeviceBytes(simulated_device::kDisk, kUnusedOffset, first.size()), first);

    const Bytes second = simulated_device::makeBootVectorRecord(0x0BADF00D, 9);
    simulated_device::writeDeviceBytes(simulated_device::kDisk, kUnusedOffset, second);
    EXPECT_EQ(simulated_device::readImageBytes(kUnusedOffset, second.size()), second);

    simulated_device::writeImageBytes(kUnusedOffset, Bytes(first.size(), 0));
    EXPECT_EQ(simulated_device::readDeviceBytes(simulated_device::kDisk, kUnusedOffset, first.size()),
              Bytes(first.size(), 0));
}

TEST_F(SimulatedDevice, BootPartitionIsMountedReadOnlyWithTheBootFiles) {
    const std::optional<simulated_device::MountEntry> boot = simulated_device::findMount(simulated_device::kBootMount);
    ASSERT_TRUE(boot.has_value());
    EXPECT_EQ(boot->source, simulated_device::kBootPartition);
    EXPECT_EQ(boot->type, "ext4");
    EXPECT_TRUE(boot->readOnly());
    for (const char* name : {"BOOT.BIN", "BOOT0010.BIN"}) {
        const Bytes original = testing_support::readBytes(simulated_device::originalBootFile(name));
        EXPECT_GT(original.size(), 4096u);
        EXPECT_EQ(testing_support::readBytes(fs::path(simulated_device::kBootMount) / name), original) << name;
    }
    EXPECT_NE(testing_support::readBytes(simulated_device::originalBootFile("BOOT.BIN")),
              testing_support::readBytes(simulated_device::originalBootFile("BOOT0010.BIN")));
    const int fd = ::open("/media/boot/probe", O_WRONLY | O_CREAT | O_CLOEXEC, 0666);
    const int error = errno;
    if (fd >= 0) ::close(fd);
    EXPECT_EQ(fd, -1);
    EXPECT_EQ(error, EROFS);
}

TEST_F(SimulatedDevice, BootPartitionRemountsReadWriteAndBack) {
    ASSERT_EQ(simulated_device::mountState(simulated_device::kBootMount), MountState::kReadOnly);
    const ProcessResult rw = runShell("mount -o remount,rw /media/boot");
    ASSERT_EQ(rw.exitStatus, 0) << rw.err;
    EXPECT_EQ(simulated_device::mountState(simulated_device::kBootMount), MountState::kReadWrite);
    testing_support::writeText("/media/boot/probe", "written while read-write\n");
    EXPECT_EQ(testing_support::readText("/media/boot/probe"), "written while read-write\n");
    ASSERT_TRUE(fs::remove("/media/boot/probe"));

    const ProcessResult ro = runShell("mount -o remount,ro /media/boot");
    ASSERT_EQ(ro.exitStatus, 0) << ro.err;
    EXPECT_EQ(simulated_device::mountState(simulated_device::kBootMount), MountState::kReadOnly);
    EXPECT_EQ(simulated_device::findMount(simulated_device::kBootMount)->source, simulated_device::kBootPartition);
}

TEST_F(SimulatedDevice, ResourcePartitionUnmountsAndMountsThroughFstab) {
    ASSERT_EQ(simulated_device::mountState(simulated_device::kResourcesMount), MountState::kReadWrite);
    EXPECT_EQ(testing_support::readText(simulated_device::kResourcesMarker), simulated_device::kResourcesMarkerText);

    const ProcessResult down = runShell("umount /media/resources");
    ASSERT_EQ(down.exitStatus, 0) << down.err;
    EXPECT_EQ(simulated_device::mountState(simulated_device::kResourcesMount), MountState::kNotMounted);
    EXPECT_FALSE(fs::exists(simulated_device::kResourcesMarker));
    EXPECT_NE(runShell("umount /media/resources").exitStatus, 0);

    const ProcessResult up = runShell("mount /media/resources");
    ASSERT_EQ(up.exitStatus, 0) << up.err;
    const std::optional<simulated_device::MountEntry> resources =
        simulated_device::findMount(simulated_device::kResourcesMount);
    ASSERT_TRUE(resources.has_value());
    EXPECT_EQ(resources->source, simulated_device::kResourcePartition);
    EXPECT_EQ(resources->type, "ext4");
    EXPECT_FALSE(resources->readOnly());
    EXPECT_EQ(testing_support::readText(simulated_device::kResourcesMarker), simulated_device::kResourcesMarkerText);
}

TEST_F(SimulatedDevice, MountPointsAndFstabAreTheDevicesOwn) {
    EXPECT_TRUE(fs::is_directory(simulated_device::kStaticDir));
    EXPECT_EQ(simulated_device::findMount("/media").value().type, "tmpfs");
    EXPECT_EQ(simulated_device::findMount("/dev").value().type, "tmpfs");
    EXPECT_EQ(testing_support::readText("/etc/fstab"),
              "# simulated device\n"
              "/dev/mmcblk0p1  /media/boot       ext4  ro        0  0\n"
              "/dev/mmcblk0p2  /media/resources  ext4  defaults  0  0\n");
}

TEST_F(SimulatedDevice, EverydayDeviceNodesWork) {
    testing_support::writeText("/dev/null", "discarded");
    std::ifstream zero("/dev/zero", std::ios::binary);
    char zeros[4] = {1, 1, 1, 1};
    EXPECT_TRUE(zero.read(zeros, sizeof zeros));
    EXPECT_EQ(std::string(zeros, sizeof zeros), std::string(4, '\0'));
    std::ifstream random("/dev/urandom", std::ios::binary);
    char byte = 0;
    EXPECT_TRUE(random.get(byte));
    EXPECT_EQ(fs::read_symlink("/dev/fd"), "/proc/self/fd");
    const ProcessResult echo = runShell("echo through-stdout > /dev/stdout");
    EXPECT_EQ(echo.out, "through-stdout\n");
}

// --- The record helpers, independent of any device. ---

TEST(BootVectorRecordHelper, BuiltRecordsAreValidAndCarryTheValueBigEndian) {
    const Bytes record = simulated_device::makeBootVectorRecord(258);
    ASSERT_EQ(record.size(), 20u);
    EXPECT_EQ(testing_support::hex(Bytes(record.begin(), record.begin() + 4)), "00000102");
    EXPECT_TRUE(simulated_device::isValidBootVectorRecord(record));
    EXPECT_TRUE(simulated_device::isValidBootVectorRecord(Bytes(20, 0)));
}

TEST(BootVectorRecordHelper, ChecksumIsRotateRightAndAddStoredLittleEndian) {
    // Byte 0 = 1 gives c = 1; eight rotations later byte 8 = 1 is added:
    // rotr^8(1) + 1 = 0x0101; nine more rotations leave 0x8080.
    Bytes record(20, 0);
    record[0] = 0x01;
    record[8] = 0x01;
    record[18] = 0x80;
    record[19] = 0x80;
    EXPECT_TRUE(simulated_device::isValidBootVectorRecord(record));
    record[19] = 0x81;
    EXPECT_FALSE(simulated_device::isValidBootVectorRecord(record));
}

TEST(BootVectorRecordHelper, EveryChangedByteIsCaught) {
    const Bytes record = simulated_device::makeBootVectorRecord(0x01020304, 3);
    for (size_t i = 0; i < record.size(); ++i) {
        for (unsigned delta : {0x01u, 0x80u, 0xFFu}) {
            Bytes changed = record;
            changed[i] = static_cast<uint8_t>(changed[i] + delta);
            EXPECT_FALSE(simulated_device::isValidBootVectorRecord(changed)) << "byte " << i << " +" << delta;
        }
    }
    for (size_t length = 0; length < 20; ++length) {
        EXPECT_FALSE(simulated_device::isValidBootVectorRecord(Bytes(record.begin(), record.begin() + length)));
    }
}

TEST(BootVectorRecordHelper, HexRoundTrips) {
    const Bytes bytes{0x00, 0x7f, 0x80, 0xff};
    EXPECT_EQ(testing_support::hex(bytes), "007f80ff");
    EXPECT_EQ(testing_support::fromHex("007F80ff"), bytes);
    EXPECT_THROW(testing_support::fromHex("0"), std::invalid_argument);
    EXPECT_THROW(testing_support::fromHex("zz"), std::invalid_argument);
}

TEST(SimulatedDeviceHelper, OutsideTheDeviceTheGuardSkips) {
    if (simulated_device::onSimulatedDevice()) GTEST_SKIP() << "runs outside the device";
    bool bodyRan = false;
    auto guarded = [&] {
        SKIP_UNLESS_ON_SIMULATED_DEVICE();
        bodyRan = true;
    };
    // GTEST_SKIP records a skip on the current test; run it in a child so
    // this test is not marked skipped itself.
    const ProcessResult result = testing_support::runInChild([&] {
        guarded();
        return bodyRan ? 1 : 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_THROW(simulated_device::imagePath(), std::runtime_error);
}

// --- Devices started from outside. ---

// Loop devices whose backing file lies under `dir`.
std::vector<std::string> loopsBackedUnder(const fs::path& dir) {
    std::vector<std::string> found;
    std::error_code ignored;
    for (const fs::directory_entry& entry : fs::directory_iterator("/sys/block", ignored)) {
        const fs::path backing = entry.path() / "loop" / "backing_file";
        if (!fs::exists(backing, ignored)) continue;
        const std::string file = testing_support::readText(backing);
        if (file.rfind(dir.string() + "/", 0) == 0) found.push_back(entry.path().filename().string() + ": " + file);
    }
    return found;
}

std::vector<std::string> runDirsUnder(const fs::path& dir) {
    std::vector<std::string> found;
    for (const fs::directory_entry& entry : fs::directory_iterator(dir)) {
        if (entry.path().filename().string().rfind("simulated-device.", 0) == 0) found.push_back(entry.path().string());
    }
    return found;
}

bool waitFor(const fs::path& file, std::chrono::seconds limit) {
    const auto end = std::chrono::steady_clock::now() + limit;
    while (!fs::exists(file)) {
        if (std::chrono::steady_clock::now() > end) return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return true;
}

std::string trimmed(std::string text) {
    while (!text.empty() && text.back() == '\n') text.pop_back();
    return text;
}

class SimulatedDeviceLifecycle : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        if (simulated_device::onSimulatedDevice()) return;
        testing_support::ScratchDir tmp;
        probe_ = runProgram({"/bin/bash", simulated_device::runnerPath().string(), "--", "/bin/true"},
                            {{"TMPDIR", tmp.path().string()}});
    }

    void SetUp() override {
        if (simulated_device::onSimulatedDevice()) GTEST_SKIP() << "starts devices of its own from outside";
        // A skip turns into a failure (status 1) under REQUIRE_SIMULATED_DEVICE=1.
        if (probe_.exitStatus == 77) GTEST_SKIP() << probe_.err;
        ASSERT_EQ(probe_.exitStatus, 0) << probe_.err;
        // Runs go under a scratch TMPDIR of this test, so that what they
        // leave can be told from other runs on the same host.
        env_ = {{"TMPDIR", tmp_.path().string()}, {"REQUIRE_SIMULATED_DEVICE", ""}};
    }

    void TearDown() override { EXPECT_EQ(loopsBackedUnder(tmp_.path()), std::vector<std::string>{}); }

    ProcessResult run(const std::vector<std::string>& args, const std::map<std::string, std::string>& extraEnv = {}) {
        std::vector<std::string> argv{"/bin/bash", simulated_device::runnerPath().string()};
        argv.insert(argv.end(), args.begin(), args.end());
        std::map<std::string, std::string> env = env_;
        for (const auto& [name, value] : extraEnv) env[name] = value;
        return runProgram(argv, env);
    }

    // Starts the runner without waiting; its output goes to the test's.
    pid_t spawn(const std::vector<std::string>& args) {
        std::vector<std::string> argv{"/bin/bash", simulated_device::runnerPath().string()};
        argv.insert(argv.end(), args.begin(), args.end());
        std::vector<char*> pointers;
        for (std::string& arg : argv) pointers.push_back(arg.data());
        pointers.push_back(nullptr);
        std::vector<std::string> envStrings;
        for (char** entry = environ; *entry != nullptr; ++entry) {
            const std::string text = *entry;
            if (text.rfind("TMPDIR=", 0) != 0 && text.rfind("REQUIRE_SIMULATED_DEVICE=", 0) != 0)
                envStrings.push_back(text);
        }
        envStrings.push_back("TMPDIR=" + tmp_.path().string());
        std::vector<char*> envPointers;
        for (std::string& text : envStrings) envPointers.push_back(text.data());
        envPointers.push_back(nullptr);
        pid_t pid = -1;
        if (posix_spawn(&pid, "/bin/bash", nullptr, nullptr, pointers.data(), envPointers.data()) != 0) return -1;
        return pid;
    }

    // Starts the runner with `args`, waits until it writes `ready`, then
    // sends it `signal`; `status` is its wait status.
    void startThenSignal(const std::vector<std::string>& args, const fs::path& ready, int signal, int& status) {
        const pid_t pid = spawn(args);
        ASSERT_GT(pid, 0);
        const bool started = waitFor(ready, std::chrono::seconds(60));
        ASSERT_EQ(::kill(pid, signal), 0);
        ASSERT_EQ(::waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(started);
    }

    // A command that names its run directory in `ready`, then waits for `go`.
    std::vector<std::string> waitingCommand(const fs::path& ready, const fs::path& go) {
        return {"--",
                "/bin/sh",
                "-c",
                "echo \"$SIMULATED_DEVICE_DIR\" > \"$0.tmp\" && mv \"$0.tmp\" \"$0\"; "
                "while [ ! -e \"$1\" ]; do sleep 0.05; done",
                ready.string(),
                go.string()};
    }

    // The variant whose disk is an image behind loop devices everywhere; on
    // the emulated ARM64 device the others are made on its real eMMC.
    static std::vector<std::string> onLoopDevices(std::vector<std::string> args) {
        args.insert(args.begin(), {"--image-variant", "low"});
        return args;
    }

    testing_support::ScratchDir tmp_;
    testing_support::ScratchDir work_;
    std::map<std::string, std::string> env_;
    static ProcessResult probe_;
};

ProcessResult SimulatedDeviceLifecycle::probe_;

TEST_F(SimulatedDeviceLifecycle, CommandStatusComesBackAndNothingIsLeft) {
    const ProcessResult result = run({"--", "/bin/sh", "-c", "echo \"$SIMULATED_DEVICE_DIR\"; exit 3"});
    EXPECT_EQ(result.exitStatus, 3) << result.err;
    const fs::path dir = trimmed(result.out);
    EXPECT_EQ(dir.parent_path(), tmp_.path());
    EXPECT_FALSE(fs::exists(dir));
    EXPECT_EQ(runDirsUnder(tmp_.path()), std::vector<std::string>{});
}

TEST_F(SimulatedDeviceLifecycle, CommandEndedBySignalReportsItLikeAShell) {
    const ProcessResult result = run({"--", "/bin/sh", "-c", "kill -KILL $$"});
    EXPECT_EQ(result.exitStatus, 128 + SIGKILL);
    EXPECT_EQ(runDirsUnder(tmp_.path()), std::vector<std::string>{});
}

TEST_F(SimulatedDeviceLifecycle, RunsOneAfterAnotherEachGetAFreshDevice) {
    const std::vector<std::pair<std::string, std::string>> expected{
        {"normal", "30703616"}, {"low", "2048000"}, {"normal", "30703616"}, {"nofree", ""}, {"badrecord", "30703616"}};
    for (const auto& [variant, start] : expected) {
        const ProcessResult result = run({"--image-variant", variant, "--", "/bin/sh", "-c",
                                          "/usr/sbin/sfdisk -q -n -F /dev/mmcblk0 | tail -1 | awk '{print $1}'; "
                                          "ls /media/resources; touch /media/resources/left-by-an-earlier-run"});
        EXPECT_EQ(result.exitStatus, 0) << variant << result.err;
        EXPECT_EQ(result.out, (start.empty() ? "" : start + "\n") + "lost+found\nresources.id\n") << variant;
        EXPECT_EQ(loopsBackedUnder(tmp_.path()), std::vector<std::string>{}) << variant;
    }
    EXPECT_EQ(runDirsUnder(tmp_.path()), std::vector<std::string>{});
}

TEST_F(SimulatedDeviceLifecycle, NothingIsVisibleOutsideWhileItRuns) {
    const std::string fstabBefore = testing_support::readText("/etc/fstab");
    const bool diskExistedOutside = fs::exists(simulated_device::kDisk);
    const std::optional<simulated_device::MountEntry> mediaBefore = simulated_device::findMount("/media");
    // A device's own eMMC is mounted outside as it always was.
    std::set<std::string> mountsBefore;
    for (const simulated_device::MountEntry& entry : simulated_device::readMounts()) {
        mountsBefore.insert(entry.source + " " + entry.mountPoint);
    }
    const fs::path ready = work_ / "ready";
    const fs::path go = work_ / "go";
    std::atomic<int> status{-2};
    std::thread runner([&] { status = run(onLoopDevices(waitingCommand(ready, go))).exitStatus; });
    const bool started = waitFor(ready, std::chrono::seconds(60));
    if (started) {
        const fs::path dir = trimmed(testing_support::readText(ready));
        EXPECT_EQ(loopsBackedUnder(tmp_.path()).size(), 3u);
        EXPECT_TRUE(fs::exists(dir / "emmc.img"));
        EXPECT_EQ(testing_support::readText("/etc/fstab"), fstabBefore);
        EXPECT_EQ(fs::exists(simulated_device::kDisk), diskExistedOutside);
        for (const simulated_device::MountEntry& entry : simulated_device::readMounts()) {
            if (mountsBefore.count(entry.source + " " + entry.mountPoint) != 0) continue;
            EXPECT_EQ(entry.source.rfind("/dev/mmcblk0", 0), std::string::npos)
                << entry.source << " " << entry.mountPoint;
            EXPECT_NE(entry.source, "simulated-dev");
            EXPECT_NE(entry.source, "simulated-media");
        }
        const std::optional<simulated_device::MountEntry> media = simulated_device::findMount("/media");
        EXPECT_EQ(media.has_value(), mediaBefore.has_value());
    }
    testing_support::writeText(go, "");
    runner.join();
    ASSERT_TRUE(started);
    EXPECT_EQ(status.load(), 0);
    EXPECT_EQ(runDirsUnder(tmp_.path()), std::vector<std::string>{});
}

TEST_F(SimulatedDeviceLifecycle, TerminatedRunnerTearsDown) {
    const fs::path ready = work_ / "ready";
    int status = 0;
    ASSERT_NO_FATAL_FAILURE(startThenSignal(waitingCommand(ready, work_ / "never"), ready, SIGTERM, status));
    EXPECT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(WTERMSIG(status), SIGTERM);
    EXPECT_EQ(runDirsUnder(tmp_.path()), std::vector<std::string>{});
}

TEST_F(SimulatedDeviceLifecycle, KilledRunIsClearedByTheNextRun) {
    if (runShell("command -v setpriv").exitStatus != 0) {
        GTEST_SKIP() << "without setpriv the command outlives a killed runner";
    }
    const fs::path ready = work_ / "ready";
    int status = 0;
    ASSERT_NO_FATAL_FAILURE(
        startThenSignal(onLoopDevices(waitingCommand(ready, work_ / "never")), ready, SIGKILL, status));
    const fs::path abandoned = trimmed(testing_support::readText(ready));
    EXPECT_TRUE(fs::exists(abandoned));
    EXPECT_EQ(loopsBackedUnder(tmp_.path()).size(), 3u);

    const ProcessResult next = run({"--", "/bin/true"});
    EXPECT_EQ(next.exitStatus, 0) << next.err;
    EXPECT_FALSE(fs::exists(abandoned));
    // A detach of a still-busy loop device completes with its last close.
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!loopsBackedUnder(tmp_.path()).empty() && std::chrono::steady_clock::now() < end) {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
}

TEST_F(SimulatedDeviceLifecycle, FailedSetUpLeavesNothing) {
    // Larger than the 64 MiB boot partition, so mkfs.ext4 fails after the
    // loop devices are attached.
    const fs::path big = work_ / "BOOT.BIN";
    {
        std::ofstream out(big, std::ios::binary);
        const std::string block(1 << 20, 'x');
        for (int i = 0; i < 70; ++i) out << block;
    }
    const ProcessResult result = run(onLoopDevices({"--boot-bin", big.string(), "--", "/bin/true"}));
    EXPECT_EQ(result.exitStatus, 1);
    const std::string last = "run_on_device.sh: mkfs.ext4 failed on the boot partition\n";
    ASSERT_GE(result.err.size(), last.size()) << result.err;
    EXPECT_EQ(result.err.substr(result.err.size() - last.size()), last);
    EXPECT_EQ(runDirsUnder(tmp_.path()), std::vector<std::string>{});
}

TEST_F(SimulatedDeviceLifecycle, BootFilesAndRecordCanBeChosen) {
    const fs::path boot = work_ / "boot.bin";
    const fs::path boot0010 = work_ / "boot0010.bin";
    testing_support::writeText(boot, "chosen BOOT.BIN\n");
    testing_support::writeText(boot0010, "chosen BOOT0010.BIN\n");
    const Bytes record = simulated_device::makeBootVectorRecord(0x00000102, 42);
    const ProcessResult result =
        run({"--boot-bin", boot.string(), "--boot0010-bin", boot0010.string(), "--record", testing_support::hex(record),
             "--", "/bin/sh", "-c",
             "cat /media/boot/BOOT.BIN /media/boot/BOOT0010.BIN; echo \"$SIMULATED_DEVICE_BOOT_VECTOR_RECORD\"; "
             "dd if=/dev/mmcblk0 bs=512 skip=30703616 count=1 status=none | head -c 20 | od -An -tx1 | tr -d ' \\n'"});
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(result.out, "chosen BOOT.BIN\nchosen BOOT0010.BIN\n" + testing_support::hex(record) + "\n" +
                              testing_support::hex(record));
}

TEST_F(SimulatedDeviceLifecycle, WrongUsageIsRefused) {
    const std::string usage =
        "usage: run_on_device.sh [--image-variant normal|low|badrecord|norecord|nofree] [--boot-bin FILE] "
        "[--boot0010-bin FILE] [--record HEX40] -- COMMAND [ARGS...]\n";
    const ProcessResult noCommand = run({"--"});
    EXPECT_EQ(noCommand.exitStatus, 2);
    EXPECT_EQ(noCommand.err, usage);
    const ProcessResult badVariant = run({"--image-variant", "huge", "--", "/bin/true"});
    EXPECT_EQ(badVariant.exitStatus, 2);
    EXPECT_EQ(badVariant.err, "run_on_device.sh: unknown image variant 'huge'\n" + usage);
    const ProcessResult badRecord = run({"--record", "0102", "--", "/bin/true"});
    EXPECT_EQ(badRecord.exitStatus, 2);
    EXPECT_EQ(badRecord.err, "run_on_device.sh: --record needs 40 hex digits\n" + usage);
}

TEST_F(SimulatedDeviceLifecycle, MissingToolsSkipUnlessTheDeviceIsRequired) {
    const ProcessResult skipped = run({"--", "/bin/true"}, {{"PATH", "/nonexistent"}});
    EXPECT_EQ(skipped.exitStatus, 77);
    EXPECT_EQ(skipped.err, "run_on_device.sh: skipped, simulated device unavailable: unshare not found\n");
    const ProcessResult required =
        run({"--", "/bin/true"}, {{"PATH", "/nonexistent"}, {"REQUIRE_SIMULATED_DEVICE", "1"}});
    EXPECT_EQ(required.exitStatus, 1);
    EXPECT_EQ(required.err, "run_on_device.sh: simulated device required but unavailable: unshare not found\n");
}

TEST_F(SimulatedDeviceLifecycle, NonRootSkipsUnlessTheDeviceIsRequired) {
    if (!fs::exists("/usr/bin/setpriv")) GTEST_SKIP() << "needs setpriv to drop root";
    const std::vector<std::string> dropRoot{"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"};
    // The checkout may lie below a directory that nobody cannot enter (/root
    // is mode 700): nobody runs a copy of the runner, with the layout it
    // reads, from a scratch directory open to all.
    testing_support::ScratchDir copy;
    const fs::path runner = copy / "run_on_device.sh";
    fs::copy_file(simulated_device::runnerPath(), runner);
    fs::copy_file(simulated_device::runnerPath().parent_path() / "device_layout.sh", copy / "device_layout.sh");
    fs::permissions(copy.path(), fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                     fs::perms::others_read | fs::perms::others_exec);
    for (const fs::path& file : {runner, copy / "device_layout.sh"}) {
        fs::permissions(
            file, fs::perms::owner_read | fs::perms::owner_write | fs::perms::group_read | fs::perms::others_read);
    }
    std::vector<std::string> canRead = dropRoot;
    canRead.insert(canRead.end(), {"/usr/bin/test", "-r", runner.string()});
    if (runProgram(canRead).exitStatus != 0) {
        GTEST_SKIP() << "nobody cannot read " << runner << ": a directory above it is closed to other users";
    }
    std::vector<std::string> asNobody = dropRoot;
    asNobody.insert(asNobody.end(), {"/bin/bash", runner.string(), "--", "/bin/true"});
    std::map<std::string, std::string> env = env_;
    const ProcessResult skipped = runProgram(asNobody, env);
    EXPECT_EQ(skipped.exitStatus, 77);
    EXPECT_EQ(skipped.err, "run_on_device.sh: skipped, simulated device unavailable: not running as root\n");
    env["REQUIRE_SIMULATED_DEVICE"] = "1";
    const ProcessResult required = runProgram(asNobody, env);
    EXPECT_EQ(required.exitStatus, 1);
    EXPECT_EQ(required.err, "run_on_device.sh: simulated device required but unavailable: not running as root\n");
}

}  // namespace
