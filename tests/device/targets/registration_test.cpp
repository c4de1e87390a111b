// The tool builds every target on every run: the dual-file stores, then the
// partitions, the boot vector and the firmware-update targets. On the
// simulated device (RegistrationOnDevice) and on a host without the device
// (RegistrationWithoutDevice).
#include <unistd.h>
#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "device_test_support.h"
#include "files.h"
#include "registration_log.h"
#include "scratch_dir.h"
#include "simulated_device.h"
#include "storage_log.h"

namespace device_test {
namespace {

ProcessResult runTool(std::vector<std::string> args) {
    args.insert(args.begin(), MIGRATE_SETTINGS_BIN);
    return testing_support::runProgram(args);
}

const std::string kFileReadLines = testing_support::kFileReadRegisterLines;
const std::string kDeviceTargetLines = testing_support::kDeviceTargetRegisterLines;

std::string dualFileLines(const fs::path& base) { return testing_support::dualFileRegisterLines(base); }

const std::string kParseFailure = "lib/storage/storage_target:N Failed to parse flash size ''\n";

// ---- on the simulated device ----

class RegistrationOnDevice : public ::testing::Test {
protected:
    void SetUp() override {
        SKIP_UNLESS_ON_SIMULATED_DEVICE();
        if (sd::variant() != "normal") GTEST_SKIP() << "for the normal image";
        testing_support::writeText(dir / "data", "settings migrated on the device");
    }

    fs::path base() const { return dir / "base"; }

    testing_support::ScratchDir dir;
};

TEST_F(RegistrationOnDevice, VerboseListsTheDeviceTargetsAfterTheStores) {
    const ProcessResult result =
        runTool({"--base", base().string(), "--target", "settings", "--query-present", "--verbose"});
    EXPECT_EQ(result.exitStatus, 10);
    EXPECT_EQ(result.out, dualFileLines(base()) + kFileReadLines + kDeviceTargetLines);
    EXPECT_EQ(result.err, "");
}

TEST_F(RegistrationOnDevice, HealthyDeviceLogsNothingByDefault) {
    const ProcessResult absent = runTool({"--base", base().string(), "--target", "settings", "--query-present"});
    EXPECT_EQ(absent.exitStatus, 10);
    EXPECT_EQ(absent.out, "");
    EXPECT_EQ(absent.err, "");

    const ProcessResult migrated = runTool(
        {"--base", base().string(), "--target", "settings", "--type", "simple", "--data", (dir / "data").string()});
    EXPECT_EQ(migrated.exitStatus, 0);
    EXPECT_EQ(migrated.out, "");
    EXPECT_EQ(migrated.err, "");

    const ProcessResult present = runTool({"--base", base().string(), "--target", "settings", "--query-present"});
    EXPECT_EQ(present.exitStatus, 0);
    EXPECT_EQ(present.out, "");
    EXPECT_EQ(present.err, "");
}

// A query of a dual-file store still reads the boot vector: a record spoilt
// between two runs is reported by the second, which otherwise works as
// before.
TEST_F(RegistrationOnDevice, EveryRunReadsTheBootVector) {
    const Bytes original = sd::writtenBootVectorRecord();
    ASSERT_EQ(original.size(), 20u);
    Bytes spoilt = original;
    spoilt[8] = static_cast<uint8_t>(spoilt[8] + 1);
    sd::writeImageBytes(sd::bootVectorOffset(), spoilt);
    const ProcessResult result =
        runTool({"--base", base().string(), "--target", "settings", "--query-present", "--verbose"});
    sd::writeImageBytes(sd::bootVectorOffset(), original);
    EXPECT_EQ(result.exitStatus, 10);
    EXPECT_EQ(normalisedStorageLog(result.out), dualFileLines(base()) + kFileReadLines +
                                                    "lib/storage/storage_target:N Boot vector query failed!\n" +
                                                    kDeviceTargetLines);

    const ProcessResult healthy = runTool({"--base", base().string(), "--target", "settings", "--query-present"});
    EXPECT_EQ(healthy.out, "");
}

// ---- on a host without the device ----

class RegistrationWithoutDevice : public ::testing::Test {
protected:
    void SetUp() override {
        if (sd::onSimulatedDevice() || fs::exists("/dev/mmcblk0")) GTEST_SKIP() << "this host has a /dev/mmcblk0";
        testing_support::writeText(dir / "data", "settings migrated on a host");
    }

    fs::path base() const { return dir / "base"; }

    // What the partitioning tool says about the missing device, once.
    static void expectOneComplaint(const std::string& err) {
        if (::access("/usr/sbin/sfdisk", X_OK) == 0) {
            EXPECT_EQ(err, "sfdisk: cannot open /dev/mmcblk0: No such file or directory\n");
        } else {
            EXPECT_EQ(std::count(err.begin(), err.end(), '\n'), 1) << err;
        }
    }

    testing_support::ScratchDir dir;
};

TEST_F(RegistrationWithoutDevice, BootVectorFailureIsLoggedOnce) {
    const ProcessResult result = runTool({"--base", base().string(), "--target", "settings", "--query-present"});
    EXPECT_EQ(result.exitStatus, 10);
    EXPECT_EQ(normalisedStorageLog(result.out), kParseFailure);
    expectOneComplaint(result.err);
}

TEST_F(RegistrationWithoutDevice, VerboseRegistrationIsComplete) {
    const ProcessResult result =
        runTool({"--base", base().string(), "--target", "settings", "--query-present", "--verbose"});
    EXPECT_EQ(result.exitStatus, 10);
    EXPECT_EQ(normalisedStorageLog(result.out),
              dualFileLines(base()) + kFileReadLines + kParseFailure + kDeviceTargetLines);
    expectOneComplaint(result.err);
}

TEST_F(RegistrationWithoutDevice, DualFileStoresStillWork) {
    const ProcessResult migrated = runTool(
        {"--base", base().string(), "--target", "settings", "--type", "simple", "--data", (dir / "data").string()});
    EXPECT_EQ(migrated.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(migrated.out), kParseFailure);
    expectOneComplaint(migrated.err);

    const ProcessResult present = runTool({"--base", base().string(), "--target", "settings", "--query-present"});
    EXPECT_EQ(present.exitStatus, 0);
    EXPECT_EQ(normalisedStorageLog(present.out), kParseFailure);
}

// ---- anywhere ----

// None of the device targets has a command-line name: the run ends at the
// options, before any target is built (the partitioning tool is not run).
TEST(DeviceTargetNames, CannotBeChosenOnTheCommandLine) {
    for (const char* name : {"boot_partition", "resource_partition", "resource_manufacturing_partition", "boot_vector",
                             "firmware_update_boot_file", "firmware_update_resource_partition",
                             "kIpiStorageTargetBootVector", "BootVectorTarget", "boot", "8", "14", "16"}) {
        SCOPED_TRACE(name);
        testing_support::ScratchDir dir;
        const ProcessResult result =
            runTool({"--base", (dir / "base").string(), "--target", name, "--query-present", "--verbose"});
        EXPECT_EQ(result.exitStatus, 1);
        const std::string expectedStart =
            std::string("Invalid target type '") + name + "'\nUsage: " + MIGRATE_SETTINGS_BIN + " [OPTIONS]\n";
        EXPECT_EQ(result.out.substr(0, expectedStart.size()), expectedStart);
        EXPECT_EQ(result.out.find("Register "), std::string::npos);
        EXPECT_EQ(result.err, "");
        EXPECT_FALSE(fs::exists(dir / "base"));
    }
}

}  // namespace
}  // namespace device_test
