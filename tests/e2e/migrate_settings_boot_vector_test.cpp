// What building the boot-vector target adds to every run of the tool: on a
// host without "/dev/mmcblk0" one error line (and the partitioning tool's
// complaint on standard error), on the simulated device nothing. Also the
// filter that the other end-to-end tests pass their results through.

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest-spi.h>
#include <gtest/gtest.h>

#include "scratch_store.h"
#include "source_lines.h"
#include "tool_run.h"

namespace {

namespace fs = std::filesystem;
using e2e::Bytes;
using e2e::checkFileFor;
using e2e::Files;
using e2e::Host;
using e2e::kLastFileReadRegisterLine;
using e2e::kSfdiskComplaints;
using e2e::ProcessResult;
using e2e::registerLines;
using e2e::runTool;
using e2e::settingsBlock;
using e2e::storedFiles;
using e2e::withoutBootVectorFailure;
using testing_support::readBytes;

// The line number is where the statement stands in the source.
const std::string kFailureLine =
    testing_support::errorPrefixOf("lib/storage/storage_target.cpp", "<< \"Failed to parse flash size '\"") +
    "Failed to parse flash size ''\n";
const std::string kComplaint = kSfdiskComplaints.front() + "\n";

// registerLines() with `line` where the boot-vector target is built.
std::string withLineBeforeBootVector(const std::string& lines, const std::string& line) {
    const size_t at = lines.find(kLastFileReadRegisterLine);
    if (at == std::string::npos) return lines;
    std::string text = lines;
    text.insert(at + kLastFileReadRegisterLine.size(), line);
    return text;
}

ProcessResult result(const std::string& out, const std::string& err) {
    ProcessResult made;
    made.exitStatus = 0;
    made.out = out;
    made.err = err;
    return made;
}

// ---------------------------------------------------------------------------
// The filter itself, on made-up results

class BootVectorFailureFilter : public ::testing::Test {
protected:
    const fs::path base = "/base";
    const std::string lines = registerLines(base);
};

TEST_F(BootVectorFailureFilter, WithoutDeviceRemovesTheLineAfterTheFileReadTargets) {
    const ProcessResult filtered = withoutBootVectorFailure(
        result(withLineBeforeBootVector(lines, kFailureLine) + "No update required\n", kComplaint),
        Host::kWithoutDevice);
    EXPECT_EQ(filtered.out, lines + "No update required\n");
    EXPECT_EQ(filtered.err, "");
    EXPECT_EQ(filtered.exitStatus, 0);
}

TEST_F(BootVectorFailureFilter, WithoutDeviceRemovesTheLineAtTheDefaultThreshold) {
    for (const std::string& rest : {std::string(), std::string("No update required\n"),
                                    std::string("lib/storage/tools/migrate_settings:494 Failed to open '/x'\n")}) {
        SCOPED_TRACE(rest);
        const ProcessResult filtered =
            withoutBootVectorFailure(result(kFailureLine + rest, kComplaint), Host::kWithoutDevice);
        EXPECT_EQ(filtered.out, rest);
        EXPECT_EQ(filtered.err, "");
    }
    // A store built before the boot-vector target may log first.
    const std::string store = "lib/storage/storage_target:334 Failure cleaning up checkfile \"/x\"\n";
    EXPECT_EQ(withoutBootVectorFailure(result(store + kFailureLine + "20\n", kComplaint), Host::kWithoutDevice).out,
              store + "20\n");
}

TEST_F(BootVectorFailureFilter, AnySourceLineNumberIsAccepted) {
    for (const char* number : {"1", "382", "99999"}) {
        SCOPED_TRACE(number);
        const std::string line =
            std::string("lib/storage/storage_target:") + number + " Failed to parse flash size ''\n";
        EXPECT_EQ(withoutBootVectorFailure(result(line, kComplaint), Host::kWithoutDevice).out, "");
    }
}

TEST_F(BootVectorFailureFilter, EveryKnownComplaintIsRemovedAndOnlyIt) {
    for (const std::string& complaint : kSfdiskComplaints) {
        SCOPED_TRACE(complaint);
        const ProcessResult filtered =
            withoutBootVectorFailure(result(kFailureLine, "before\n" + complaint + "\nafter\n"), Host::kWithoutDevice);
        EXPECT_EQ(filtered.err, "before\nafter\n");
    }
}

TEST_F(BootVectorFailureFilter, WithoutDeviceAMissingLineFails) {
    EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result(lines, kComplaint), Host::kWithoutDevice),
                            "found it 0 times");
    EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result("", kComplaint), Host::kWithoutDevice), "found it 0 times");
}

TEST_F(BootVectorFailureFilter, WithoutDeviceALineTwiceFails) {
    EXPECT_NONFATAL_FAILURE(
        withoutBootVectorFailure(result(withLineBeforeBootVector(kFailureLine + lines, kFailureLine), kComplaint),
                                 Host::kWithoutDevice),
        "found it 2 times");
}

TEST_F(BootVectorFailureFilter, WithoutDeviceOtherTextsAreNotTheLine) {
    for (const std::string& other : {
             std::string("lib/storage/storage_target: Failed to parse flash size ''\n"),
             std::string("lib/storage/storage_target:38x Failed to parse flash size ''\n"),
             std::string("lib/storage/storage_target:382 Failed to parse flash size '0'\n"),
             std::string("lib/storage/storage_target:382 Failed to parse flash size ''"),
             std::string("xlib/storage/storage_target:382 Failed to parse flash size ''\n"),
             std::string("lib/storage/storage_target:382 Failed to query flash size\n"),
         }) {
        SCOPED_TRACE(other);
        EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result(other, kComplaint), Host::kWithoutDevice),
                                "found it 0 times");
    }
}

TEST_F(BootVectorFailureFilter, WithoutDeviceAMisplacedLineFails) {
    // Before every store, after the boot-vector target's own line, and
    // between two stores.
    EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result(kFailureLine + lines, kComplaint), Host::kWithoutDevice),
                            "must come right after the file-read targets");
    const std::string bootVector = "Register kIpiStorageTargetBootVector = BootVectorTarget [1]\n";
    std::string late = lines;
    late.insert(late.find(bootVector) + bootVector.size(), kFailureLine);
    EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result(late, kComplaint), Host::kWithoutDevice),
                            "must come right after the file-read targets");
    std::string early = lines;
    early.insert(early.find("Register kIpiStorageTargetOverlay"), kFailureLine);
    EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result(early, kComplaint), Host::kWithoutDevice),
                            "must come right after the file-read targets");
}

TEST_F(BootVectorFailureFilter, WithoutDeviceTheComplaintMustBeThereOnce) {
    EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result(kFailureLine, ""), Host::kWithoutDevice),
                            "one complaint about /dev/mmcblk0 on standard error, found 0");
    EXPECT_NONFATAL_FAILURE(
        withoutBootVectorFailure(result(kFailureLine, kComplaint + kComplaint), Host::kWithoutDevice),
        "one complaint about /dev/mmcblk0 on standard error, found 2");
    EXPECT_NONFATAL_FAILURE(
        withoutBootVectorFailure(result(kFailureLine, "sfdisk: cannot open /dev/mmcblk1: No such file or directory\n"),
                                 Host::kWithoutDevice),
        "found 0");
}

TEST_F(BootVectorFailureFilter, OnDeviceTheResultIsLeftAsItIs) {
    const ProcessResult filtered =
        withoutBootVectorFailure(result(lines + "No update required\n", "from the tool\n"), Host::kSimulatedDevice);
    EXPECT_EQ(filtered.out, lines + "No update required\n");
    EXPECT_EQ(filtered.err, "from the tool\n");
}

TEST_F(BootVectorFailureFilter, OnDeviceTheLineFails) {
    EXPECT_NONFATAL_FAILURE(withoutBootVectorFailure(result(kFailureLine, kComplaint), Host::kSimulatedDevice),
                            "boot vector must be found");
    EXPECT_NONFATAL_FAILURE(
        withoutBootVectorFailure(result(withLineBeforeBootVector(lines, kFailureLine), ""), Host::kSimulatedDevice),
        "boot vector must be found");
}

// ---------------------------------------------------------------------------
// Whole runs, exactly as they come out

class BootVectorRun : public e2e::ScratchStore {
protected:
    ProcessResult run(const std::vector<std::string>& args) const {
        return runTool(e2e::concat({"--base", base.string()}, args));
    }

    void expectOnlySettings(const Bytes& data) const {
        ASSERT_EQ(storedFiles(base), (Files{"settings/2/data", "settings/2/data.chk"}));
        EXPECT_EQ(readBytes(base / "settings/2/data"), data);
        EXPECT_EQ(readBytes(base / "settings/2/data.chk"), checkFileFor(data));
    }
};

using MigrateSettingsWithoutDevice = BootVectorRun;

TEST_F(MigrateSettingsWithoutDevice, StoresWorkAndTheBootVectorFailureIsLoggedOnce) {
    if (e2e::currentHost() == Host::kSimulatedDevice) GTEST_SKIP() << "needs a host without /dev/mmcblk0";
    ASSERT_FALSE(fs::exists("/dev/mmcblk0")) << "this host has a flash device; run on the simulated device";

    const Bytes block = settingsBlock(24, 32);
    const ProcessResult migrated = run({"--target", "settings", "--type", "checked", "--data", dataFile("b", block)});
    EXPECT_EQ(migrated.exitStatus, 0);
    ASSERT_EQ(migrated.out, kFailureLine);
    // sfdisk's own words, or the shell's when sfdisk is not installed.
    EXPECT_TRUE(std::any_of(kSfdiskComplaints.begin(), kSfdiskComplaints.end(), [&](const std::string& complaint) {
        return migrated.err == complaint + "\n";
    })) << migrated.err;
    expectOnlySettings(Bytes(block.begin(), block.begin() + 24));
    const std::string failure = kFailureLine;

    // The same line, once, in every run that builds the registry.
    const ProcessResult present = run({"--target", "settings", "--query-present"});
    EXPECT_EQ(present.exitStatus, 0);
    EXPECT_EQ(present.out, failure);
    EXPECT_EQ(present.err, migrated.err);

    const ProcessResult absent = run({"--target", "lut", "--index", "25", "--query-present", "--verbose"});
    EXPECT_EQ(absent.exitStatus, 10);
    EXPECT_EQ(absent.out, withLineBeforeBootVector(registerLines(base), failure));
    EXPECT_EQ(absent.err, migrated.err);

    const ProcessResult noUpdate =
        run({"--target", "settings", "--if-not-present", "--type", "simple", "--data", dataFile("c", Bytes{1})});
    EXPECT_EQ(noUpdate.exitStatus, 0);
    EXPECT_EQ(noUpdate.out, failure + "No update required\n");
    EXPECT_EQ(noUpdate.err, migrated.err);
    expectOnlySettings(Bytes(block.begin(), block.begin() + 24));

    // Ended in option parsing: no registry, so neither line.
    const ProcessResult rejected = run({"--target", "settings", "--type", "checked"});
    EXPECT_EQ(rejected.exitStatus, 1);
    EXPECT_EQ(rejected.out.rfind("Please specify a path to migration data\nUsage: ", 0), 0u) << rejected.out;
    EXPECT_EQ(rejected.err, "");
}

using MigrateSettingsOnDevice = BootVectorRun;

TEST_F(MigrateSettingsOnDevice, RunsLogNothingAtTheDefaultThreshold) {
    if (e2e::currentHost() != Host::kSimulatedDevice) GTEST_SKIP() << "needs the simulated device (SIMULATED_DEVICE=1)";
    ASSERT_TRUE(fs::is_block_file("/dev/mmcblk0"));

    const Bytes block = settingsBlock(24, 32);
    const ProcessResult migrated = run({"--target", "settings", "--type", "checked", "--data", dataFile("b", block)});
    EXPECT_EQ(migrated.exitStatus, 0);
    EXPECT_EQ(migrated.out, "");
    EXPECT_EQ(migrated.err, "");
    expectOnlySettings(Bytes(block.begin(), block.begin() + 24));

    const ProcessResult present = run({"--target", "settings", "--query-present"});
    EXPECT_EQ(present.exitStatus, 0);
    EXPECT_EQ(present.out, "");
    EXPECT_EQ(present.err, "");

    const ProcessResult absent = run({"--target", "lut", "--index", "25", "--query-present", "--verbose"});
    EXPECT_EQ(absent.exitStatus, 10);
    EXPECT_EQ(absent.out, registerLines(base));
    EXPECT_EQ(absent.err, "");
}

}  // namespace
