// Whole runs of migrate_settings against scratch stores: the exit status,
// the exact log output at each level, and the exact bytes left on disk.

#include <algorithm>
#include <filesystem>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "fault_injection.h"
#include "scratch_store.h"
#include "tool_run.h"

namespace {

namespace fs = std::filesystem;
using e2e::Bytes;
using e2e::checkFileFor;
using e2e::concat;
using e2e::Files;
using e2e::lutFile;
using e2e::overlayFile;
using e2e::ProcessResult;
using e2e::registerLines;
using e2e::settingsBlock;
using e2e::storedFiles;
using testing_support::readBytes;
using testing_support::writeBytes;
using testing_support::writeText;

const std::string kOpenFailurePrefix = "lib/storage/tools/migrate_settings:494 Failed to open '";

class ToolRun : public e2e::ScratchStore {
protected:
    std::string inScratch(const std::string& name) const { return (scratch / name).string(); }

    // Every run names the scratch store; nothing here may reach the device's.
    // For command lines that get past option parsing and build the registry.
    ProcessResult run(const std::vector<std::string>& args) const {
        return e2e::runAccepted(concat({"--base", base.string()}, args));
    }

    // For command lines that end in option parsing: the output as it came.
    ProcessResult runUnparsed(const std::vector<std::string>& args) const {
        return e2e::runTool(concat({"--base", base.string()}, args));
    }

    // The copy below `slotDirectory` ("settings", "app/luts/3") holds `data`
    // with its check file, and nothing else is stored.
    void expectOnlyCopy(const std::string& slotDirectory, const char* copy, const Bytes& data) const {
        const std::string dataPath = slotDirectory + "/" + copy + "/data";
        ASSERT_EQ(storedFiles(base), (Files{dataPath, dataPath + ".chk"}));
        EXPECT_EQ(readBytes(base / dataPath), data);
        EXPECT_EQ(readBytes(base / (dataPath + ".chk")), checkFileFor(data));
    }

    void expectNothingStored() const { EXPECT_EQ(storedFiles(base), Files{}); }
};

void expectSilentSuccess(const ProcessResult& result) {
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
}

void expectOutcome(const ProcessResult& result, int exitStatus, const std::string& out) {
    EXPECT_EQ(result.exitStatus, exitStatus);
    EXPECT_EQ(result.out, out);
    EXPECT_EQ(result.err, "");
}

Bytes head(const Bytes& bytes, size_t length) { return Bytes(bytes.begin(), bytes.begin() + length); }

// ---------------------------------------------------------------------------
// The checksums and blocks the other tests are built from

TEST(MigrateSettingsTestData, ChecksumsMatchKnownValues) {
    const std::string digits = "123456789";
    EXPECT_EQ(e2e::crc32(Bytes(digits.begin(), digits.end())), 0xCBF43926u);
    EXPECT_EQ(e2e::crc32(Bytes{}), 0u);
    const uint8_t ones[] = {0x01, 0x01};
    EXPECT_EQ(e2e::bsdChecksum16(ones, 0), 0u);
    EXPECT_EQ(e2e::bsdChecksum16(ones, 1), 1u);
    EXPECT_EQ(e2e::bsdChecksum16(ones, 2), 0x8001u);
    EXPECT_EQ(checkFileFor(Bytes(digits.begin(), digits.end())), (Bytes{9, 0, 0, 0, 0x26, 0x39, 0xF4, 0xCB}));
}

TEST(MigrateSettingsTestData, SettingsBlockLayout) {
    const Bytes block = settingsBlock(6, 8);
    ASSERT_EQ(block.size(), 8u);
    EXPECT_EQ(block[0], 6);
    EXPECT_EQ(block[1], 0);
    const uint16_t sum = e2e::bsdChecksum16(block.data(), 4);
    EXPECT_EQ(block[4], sum & 0xFF);
    EXPECT_EQ(block[5], sum >> 8);
    EXPECT_EQ(block[6], 0xEE);
    EXPECT_EQ(block[7], 0xEE);
}

// ---------------------------------------------------------------------------
// Exit status of every outcome

using MigrateSettingsExitStatus = ToolRun;

TEST_F(MigrateSettingsExitStatus, HelpIsZeroAndBuildsNoStore) {
    const ProcessResult result = runUnparsed({"--target", "settings", "--type", "simple", "--data", "x", "--help"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out.rfind("Usage: " + e2e::kBinary + " [OPTIONS]\n", 0), 0u) << result.out;
    // Not even the boot-vector target was built: nothing asked for the flash.
    EXPECT_EQ(result.err, "");
    EXPECT_FALSE(fs::exists(base));
}

TEST_F(MigrateSettingsExitStatus, OptionErrorIsOneAndBuildsNoStore) {
    const std::string data = dataFile("block", settingsBlock(16, 16));
    const ProcessResult result =
        runUnparsed({"--target", "settings", "--type", "checked", "--check", "foo", "--data", data});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out.rfind("Invalid check type 'foo'\nUsage: ", 0), 0u) << result.out;
    EXPECT_EQ(result.err, "");
    EXPECT_FALSE(fs::exists(base));
}

TEST_F(MigrateSettingsExitStatus, IndexAboveTheSlotCountIsOne) {
    struct Case {
        const char* target;
        const char* index;
        const char* count;
    };
    for (const Case& c : {Case{"settings", "2", "1"}, Case{"overlay", "9", "8"}, Case{"lut", "27", "26"},
                          Case{"calib_save", "2", "1"}, Case{"calib_extra", "2", "1"}, Case{"util_save", "2", "1"},
                          Case{"application_internal", "2", "1"}, Case{"reboot_persistent", "4294967295", "1"}}) {
        SCOPED_TRACE(std::string(c.target) + " " + c.index);
        const std::string outOfRange = std::string("index is out of range of available slots ") + c.count + "\n";
        // The missing data file is never looked at: the range test comes first.
        const std::vector<std::string> migration = {"--target", c.target, "--index", c.index,
                                                    "--type",   "simple", "--data",  inScratch("absent")};
        const std::vector<std::string> query = {"--target", c.target, "--index", c.index, "--query-present"};
        expectOutcome(run(concat(migration, {"--verbose"})), 1, registerLines(base) + outOfRange);
        expectOutcome(run(concat(query, {"--verbose"})), 1, registerLines(base) + outOfRange);
        expectOutcome(run(migration), 1, "");
        expectOutcome(run(query), 1, "");
        expectNothingStored();
    }
}

TEST_F(MigrateSettingsExitStatus, QueryOfAnEmptySlotIsTen) {
    expectOutcome(run({"--target", "settings", "--query-present"}), 10, "");
    expectOutcome(run({"--target", "lut", "--index", "25", "--query-present"}), 10, "");
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, QueryAfterAMigrationIsZero) {
    const std::string data = dataFile("block", settingsBlock(32, 32));
    expectSilentSuccess(run({"--target", "settings", "--type", "checked", "--data", data}));
    expectSilentSuccess(run({"--target", "settings", "--query-present"}));
    expectOutcome(run({"--target", "settings", "--query-present", "--verbose"}), 0, registerLines(base));
    // Other stores stay absent.
    expectOutcome(run({"--target", "calib_save", "--query-present"}), 10, "");
}

TEST_F(MigrateSettingsExitStatus, QueryOfADamagedSlotIsTenAndIfNotPresentReplacesIt) {
    const Bytes block = settingsBlock(16, 16);
    expectSilentSuccess(run({"--target", "settings", "--type", "checked", "--data", dataFile("block", block)}));
    Bytes damaged = block;
    damaged[5] ^= 0x01;
    writeBytes(base / "settings/2/data", damaged);

    expectOutcome(run({"--target", "settings", "--query-present"}), 10, "");
    // Opening the store dropped the check file that no longer matches.
    EXPECT_EQ(storedFiles(base), Files{"settings/2/data"});

    const Bytes replacement = settingsBlock(20, 20, 7);
    expectSilentSuccess(run({"--target", "settings", "--if-not-present", "--type", "checked", "--data",
                             dataFile("replacement", replacement)}));
    expectOnlyCopy("settings", "2", replacement);
}

// A committed absent blob: valid, but nothing to read.
TEST_F(MigrateSettingsExitStatus, QueryOfAnAbsentBlobIsTenAndIfNotPresentMigrates) {
    fs::create_directories(base / "settings/1");
    writeBytes(base / "settings/1/data.chk", Bytes(8, 0xFF));
    expectOutcome(run({"--target", "settings", "--query-present"}), 10, "");

    const Bytes block = settingsBlock(8, 8);
    expectSilentSuccess(
        run({"--target", "settings", "--if-not-present", "--type", "checked", "--data", dataFile("block", block)}));
    EXPECT_EQ(storedFiles(base), (Files{"settings/1/data.chk", "settings/2/data", "settings/2/data.chk"}));
    EXPECT_EQ(readBytes(base / "settings/1/data.chk"), Bytes(8, 0xFF));
    EXPECT_EQ(readBytes(base / "settings/2/data"), block);
    EXPECT_EQ(readBytes(base / "settings/2/data.chk"), checkFileFor(block));
    expectSilentSuccess(run({"--target", "settings", "--query-present"}));
}

TEST_F(MigrateSettingsExitStatus, QueryAtAnIndexEqualToTheCountIsTen) {
    for (const auto& [target, count] : {std::pair{"settings", "1"}, std::pair{"overlay", "8"}, std::pair{"lut", "26"},
                                        std::pair{"reboot_persistent", "1"}}) {
        SCOPED_TRACE(target);
        expectOutcome(run({"--target", target, "--index", count, "--query-present"}), 10, "");
        expectOutcome(run({"--target", target, "--index", count, "--query-present", "--verbose"}), 10,
                      registerLines(base));
    }
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, QueryNeverReadsTheDataFiles) {
    expectOutcome(run({"--target", "settings", "--query-present", "--type", "redundant", "--data", inScratch("absent1"),
                       "--data2", inScratch("absent2")}),
                  10, "");
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, QueryDecidesWhenBothFlagsAreGiven) {
    const std::string data = dataFile("block", settingsBlock(16, 16));
    expectOutcome(
        run({"--target", "settings", "--if-not-present", "--query-present", "--type", "checked", "--data", data}), 10,
        "");
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, IfNotPresentOnAPresentSlotIsZeroWithoutReadingTheData) {
    const Bytes first = settingsBlock(40, 40);
    expectSilentSuccess(run({"--target", "settings", "--type", "checked", "--data", dataFile("first", first)}));

    // A warning: printed at the default level.
    expectOutcome(run({"--target", "settings", "--if-not-present", "--type", "simple", "--data", inScratch("absent")}),
                  0, "No update required\n");
    expectOutcome(run({"--target", "settings", "--if-not-present", "--type", "checked", "--data",
                       dataFile("second", settingsBlock(20, 20, 9)), "--verbose"}),
                  0, registerLines(base) + "No update required\n");
    expectOnlyCopy("settings", "2", first);
}

TEST_F(MigrateSettingsExitStatus, IfNotPresentOnAnEmptySlotMigrates) {
    const Bytes lut = lutFile(19784);
    expectSilentSuccess(run({"--target", "lut", "--index", "4", "--if-not-present", "--type", "checked", "--check",
                             "lut", "--data", dataFile("lut", lut)}));
    expectOnlyCopy("app/luts/4", "2", lut);
}

TEST_F(MigrateSettingsExitStatus, MissingDataFileIsOneAndNamesTheFile) {
    const std::string absent = inScratch("old settings.bin");
    const std::string good = dataFile("good", settingsBlock(16, 16));
    for (const std::vector<std::string>& typeArgs : std::vector<std::vector<std::string>>{
             {"--type", "simple"}, {"--type", "checked"}, {"--type", "redundant", "--data2", good}}) {
        SCOPED_TRACE(e2e::describe(typeArgs));
        const std::vector<std::string> args = concat({"--target", "settings", "--data", absent}, typeArgs);
        expectOutcome(run(args), 1, kOpenFailurePrefix + absent + "'\n");
        expectOutcome(run(concat(args, {"--verbose"})), 1, registerLines(base) + kOpenFailurePrefix + absent + "'\n");
    }
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, DataPathThatIsADirectoryIsOne) {
    const std::string directory = scratch.path().string();
    expectOutcome(run({"--target", "settings", "--type", "simple", "--data", directory}), 1,
                  kOpenFailurePrefix + directory + "'\n");
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, MissingSecondDataFileIsOneForEveryType) {
    const std::string good = dataFile("good", settingsBlock(16, 16));
    const std::string absent = inScratch("absent2");
    for (const char* type : {"simple", "checked", "redundant"}) {
        SCOPED_TRACE(type);
        expectOutcome(run({"--target", "settings", "--type", type, "--data", good, "--data2", absent}), 1,
                      kOpenFailurePrefix + absent + "'\n");
    }
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, RejectedDataIsOneAndNothingIsWritten) {
    Bytes badChecksum = settingsBlock(64, 64);
    badChecksum[10] ^= 0x01;
    Bytes badMagic = overlayFile(0, 284);
    badMagic[0] ^= 0x01;
    struct Case {
        const char* target;
        const char* check;
        Bytes data;
    };
    const Case cases[] = {
        {"settings", "settings", badChecksum},
        {"lut", "lut", lutFile(19783)},
        {"overlay", "overlay", badMagic},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.check);
        const std::string data = dataFile("data", c.data);
        expectOutcome(run({"--target", c.target, "--type", "checked", "--check", c.check, "--data", data}), 1, "");
        expectOutcome(
            run({"--target", c.target, "--type", "redundant", "--check", c.check, "--data", data, "--data2", data}), 1,
            "");
    }
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, NoSlotAtAnIndexEqualToTheCountIsOneAndWritesNothing) {
    const std::string settings = dataFile("settings", settingsBlock(16, 16));
    const std::string lut = dataFile("lut", lutFile(19784));
    const std::string overlay = dataFile("overlay", overlayFile(4, 288));
    struct Case {
        const char* target;
        const char* count;
        const char* check;
        std::string data;
    };
    const Case cases[] = {
        {"settings", "1", "settings", settings},
        {"overlay", "8", "overlay", overlay},
        {"lut", "26", "lut", lut},
        {"util_save", "1", "settings", settings},
    };
    for (const Case& c : cases) {
        for (const std::vector<std::string>& typeArgs : std::vector<std::vector<std::string>>{
                 {"--type", "simple"}, {"--type", "checked"}, {"--type", "redundant", "--data2", c.data}}) {
            SCOPED_TRACE(std::string(c.target) + e2e::describe(typeArgs));
            const std::vector<std::string> args =
                concat({"--target", c.target, "--index", c.count, "--check", c.check, "--data", c.data}, typeArgs);
            expectOutcome(run(args), 1, "");
            expectOutcome(run(concat(args, {"--verbose"})), 1, registerLines(base));
        }
    }
    // Even with two bad blocks the missing slot is what fails.
    const std::string bad = dataFile("bad", Bytes{1, 2, 3});
    expectOutcome(run({"--target", "lut", "--index", "26", "--type", "redundant", "--check", "lut", "--data", bad,
                       "--data2", bad}),
                  1, "");
    expectNothingStored();
}

// A regular file where the store wants the directory of copy "2".
TEST_F(MigrateSettingsExitStatus, FailedWriteIsOne) {
    fs::create_directories(base / "settings");
    writeText(base / "settings/2", "in the way");
    const std::string data = dataFile("block", settingsBlock(16, 16));
    const std::string check = (base / "settings/2/data.chk").string();
    expectOutcome(run({"--target", "settings", "--type", "checked", "--data", data}), 1,
                  "lib/storage/storage_target:334 Failure cleaning up checkfile \"" + check +
                      "\"\n"
                      "lib/storage/storage_target:378 generic:20\n"
                      "lib/storage/storage_target:410 20\n");
    EXPECT_EQ(storedFiles(base), Files{"settings/2"});
    EXPECT_EQ(testing_support::readText(base / "settings/2"), "in the way");
}

// A directory where the store wants the data file of copy "2".
TEST_F(MigrateSettingsExitStatus, FailedWriteOfTheDataFileIsOne) {
    fs::create_directories(base / "app/calibSave/2/data");
    const std::string data = dataFile("block", Bytes{1, 2, 3, 4, 5});
    const ProcessResult result = run({"--target", "calib_save", "--type", "simple", "--data", data});
    EXPECT_EQ(result.exitStatus, 1);
    const std::string message = " Failed to open " + (base / "app/calibSave/2/data").string() + ": Is a directory\n";
    EXPECT_EQ(result.out.rfind("libcommon/lib/util/fd:", 0), 0u) << result.out;
    ASSERT_GE(result.out.size(), message.size());
    EXPECT_EQ(result.out.substr(result.out.size() - message.size()), message);
    EXPECT_EQ(result.out.find('\n'), result.out.size() - 1) << "one line only: " << result.out;
    expectNothingStored();
}

// The data file can be sized but not opened (the shim fails the open): the
// run fails without a line, as only sizing failures are logged.
TEST_F(MigrateSettingsExitStatus, UnopenableDataFileIsOneAndSilent) {
    if (!testing_support::programEmulator().empty()) {
        GTEST_SKIP() << "native builds only: the shim cannot be preloaded under qemu-aarch64";
    }
    const std::string data = dataFile("block", Bytes{1, 2, 3, 4, 5});
    const ProcessResult result = e2e::withoutBootVectorFailure(testing_support::runProgram(
        {e2e::kBinary, "--base", base.string(), "--target", "calib_save", "--type", "simple", "--data", data},
        testing_support::faultEnv("open", 1, "errno:EACCES", "/block")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
    expectNothingStored();
}

TEST_F(MigrateSettingsExitStatus, SuccessfulWriteIsZeroAndSilent) {
    const Bytes block = settingsBlock(100, 128);
    expectSilentSuccess(run({"--target", "settings", "--type", "checked", "--data", dataFile("block", block)}));
    expectOnlyCopy("settings", "2", head(block, 100));
}

// ---------------------------------------------------------------------------
// Log output at each threshold

using MigrateSettingsLogLevel = ToolRun;

TEST_F(MigrateSettingsLogLevel, VerboseListsEveryTargetInRegistrationOrder) {
    const std::string data = dataFile("block", settingsBlock(16, 16));
    for (const char* option : {"--verbose", "-v"}) {
        SCOPED_TRACE(option);
        expectOutcome(run({"--target", "settings", "--type", "checked", "--data", data, option}), 0,
                      registerLines(base));
    }
    EXPECT_EQ(registerLines(base).rfind("Register kIpiStorageTargetSettings = DualFileTarget " + base.string() +
                                            "/settings [1]\nRegister kIpiStorageTargetOverlay = DualFileTarget " +
                                            base.string() + "/app/overlays [8]\n",
                                        0),
              0u);
    // The shared transcript itself, against the text written out here.
    const std::string lines = registerLines(base);
    EXPECT_EQ(std::count(lines.begin(), lines.end(), '\n'), 14);
    const std::string deviceTargets =
        "Register kIpiStorageTargetRebootPersistent = DualFileTarget " + base.string() +
        "/app/rebootPersistent [1]\n"
        "Register kIpiStorageTargetBootPartition = FileReadTarget /media/boot [0]\n"
        "Register kIpiStorageTargetResourcePartition = FileReadTarget /media/resources [0]\n"
        "Register kIpiStorageTargetResourceManufacturingPartition = FileReadTarget /media/static [0]\n"
        "Register kIpiStorageTargetBootVector = BootVectorTarget [1]\n"
        "Register kIpiStorageTargetFirmwareUpdateBootFile = FirmwareUpdateBootTarget /media/boot [2]\n"
        "Register kIpiStorageTargetFirmwareUpdateResourcePartition = FirmwareUpdatePartitionTarget [1]\n";
    ASSERT_GE(lines.size(), deviceTargets.size());
    EXPECT_EQ(lines.substr(lines.size() - deviceTargets.size()), deviceTargets);
}

TEST_F(MigrateSettingsLogLevel, DebugPrintsWhatVerbosePrints) {
    const std::string data = dataFile("block", settingsBlock(16, 16));
    for (const std::vector<std::string>& levels :
         std::vector<std::vector<std::string>>{{"--debug"}, {"--debug", "--verbose"}, {"-v", "--debug"}}) {
        SCOPED_TRACE(e2e::describe(levels));
        expectOutcome(run(concat({"--target", "settings", "--type", "checked", "--data", data}, levels)), 0,
                      registerLines(base));
        expectOutcome(run(concat({"--target", "lut", "--query-present", "--index", "30"}, levels)), 1,
                      registerLines(base) + "index is out of range of available slots 26\n");
    }
}

TEST_F(MigrateSettingsLogLevel, DefaultLevelShowsWarningsAndErrorsOnly) {
    Bytes newer = lutFile(19784);
    newer[2] = 3;
    const std::string data = dataFile("lut", newer);
    expectOutcome(run({"--target", "lut", "--index", "17", "--type", "checked", "--check", "lut", "--data", data}), 1,
                  "Unable to parse LUT header at index 17\n");
    expectOutcome(
        run({"--target", "lut", "--index", "17", "--type", "checked", "--check", "lut", "--data", data, "--verbose"}),
        1, registerLines(base) + "Unable to parse LUT header at index 17\n");
    expectNothingStored();
}

// ---------------------------------------------------------------------------
// Where each store keeps its copies

using MigrateSettingsPlacement = ToolRun;

TEST_F(MigrateSettingsPlacement, EveryTargetStoresBelowItsOwnLocation) {
    struct Case {
        const char* target;
        const char* slotDirectory;
    };
    const Case cases[] = {
        {"settings", "settings"},
        {"lut", "app/luts/0"},
        {"overlay", "app/overlays/0"},
        {"calib_save", "app/calibSave"},
        {"calib_extra", "app/calibExtra"},
        {"util_save", "app/utilSave"},
        {"application_internal", "app/internal"},
        {"reboot_persistent", "app/rebootPersistent"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.target);
        const Bytes blob = e2e::pattern(33, 5);
        expectSilentSuccess(run({"--target", c.target, "--type", "simple", "--data", dataFile("blob", blob)}));
        expectOnlyCopy(c.slotDirectory, "2", blob);
        fs::remove_all(base);
    }
}

TEST_F(MigrateSettingsPlacement, BaseOptionPlacesTheStores) {
    const fs::path x = scratch / "x";
    const Bytes settings = settingsBlock(24, 24);
    const Bytes lut = lutFile(19784);
    // Not the fixture's run(): this one names its own base.
    expectSilentSuccess(e2e::runAccepted(
        {"--base", x.string(), "--target", "settings", "--type", "checked", "--data", dataFile("s", settings)}));
    expectSilentSuccess(e2e::runAccepted({"--target", "lut", "--type", "checked", "--check", "lut", "--index", "3",
                                          "--data", dataFile("l", lut), "-b", x.string()}));
    EXPECT_EQ(storedFiles(x),
              (Files{"app/luts/3/2/data", "app/luts/3/2/data.chk", "settings/2/data", "settings/2/data.chk"}));
    EXPECT_EQ(readBytes(x / "settings/2/data"), settings);
    EXPECT_EQ(readBytes(x / "app/luts/3/2/data"), lut);
    EXPECT_TRUE(fs::is_directory(x / "app/luts/25/1"));
    EXPECT_FALSE(fs::exists(x / "app/luts/26"));
    EXPECT_TRUE(fs::is_directory(x / "app/overlays/7/2"));
    EXPECT_FALSE(fs::exists(x / "app/overlays/8"));
    expectOutcome(e2e::runAccepted({"--base", x.string(), "--target", "settings", "--query-present", "-v"}), 0,
                  registerLines(x));
}

TEST_F(MigrateSettingsPlacement, LutIndicesZeroToTwentyFiveAreRealSlots) {
    Files expected;
    for (int index = 0; index < 26; ++index) {
        SCOPED_TRACE(index);
        const std::string slot = std::to_string(index);
        expectOutcome(run({"--target", "lut", "--index", slot, "--query-present"}), 10, "");
        const std::string data = dataFile("lut", lutFile(19784, static_cast<uint8_t>(index)));
        expectSilentSuccess(
            run({"--target", "lut", "--index", slot, "--type", "checked", "--check", "lut", "--data", data}));
        expectSilentSuccess(run({"--target", "lut", "--index", slot, "--query-present"}));
        expected.push_back("app/luts/" + slot + "/2/data");
        expected.push_back("app/luts/" + slot + "/2/data.chk");
        EXPECT_EQ(readBytes(base / ("app/luts/" + slot + "/2/data")), lutFile(19784, static_cast<uint8_t>(index)));
    }
    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(storedFiles(base), expected);

    // 26 passes the range test and then finds no slot.
    const std::string data = dataFile("lut", lutFile(19784));
    expectOutcome(run({"--target", "lut", "--index", "26", "--query-present"}), 10, "");
    expectOutcome(run({"--target", "lut", "--index", "26", "--type", "checked", "--check", "lut", "--data", data}), 1,
                  "");
    expectOutcome(run({"--target", "lut", "--index", "27", "--query-present", "--verbose"}), 1,
                  registerLines(base) + "index is out of range of available slots 26\n");
    EXPECT_EQ(storedFiles(base), expected);
}

TEST_F(MigrateSettingsPlacement, OverlayIndicesZeroToSevenAreRealSlots) {
    Files expected;
    for (int index = 0; index < 8; ++index) {
        SCOPED_TRACE(index);
        const std::string slot = std::to_string(index);
        const Bytes overlay = overlayFile(static_cast<uint32_t>(index), 284 + index, static_cast<uint8_t>(index));
        expectOutcome(run({"--target", "overlay", "--index", slot, "--query-present"}), 10, "");
        expectSilentSuccess(run({"--target", "overlay", "--index", slot, "--type", "checked", "--check", "overlay",
                                 "--data", dataFile("overlay", overlay)}));
        expectSilentSuccess(run({"--target", "overlay", "--index", slot, "--query-present"}));
        expected.push_back("app/overlays/" + slot + "/2/data");
        expected.push_back("app/overlays/" + slot + "/2/data.chk");
        EXPECT_EQ(readBytes(base / ("app/overlays/" + slot + "/2/data")), overlay);
    }
    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(storedFiles(base), expected);

    const std::string data = dataFile("overlay", overlayFile(0, 284));
    expectOutcome(run({"--target", "overlay", "--index", "8", "--query-present"}), 10, "");
    expectOutcome(
        run({"--target", "overlay", "--index", "8", "--type", "checked", "--check", "overlay", "--data", data}), 1, "");
    expectOutcome(run({"--target", "overlay", "--index", "9", "--query-present", "--verbose"}), 1,
                  registerLines(base) + "index is out of range of available slots 8\n");
    EXPECT_EQ(storedFiles(base), expected);
}

TEST_F(MigrateSettingsPlacement, HexadecimalIndexOnTheLutTarget) {
    const Bytes lut = lutFile(19784);
    const std::string data = dataFile("lut", lut);
    // 0x1f is 31, beyond the 26 slots.
    expectOutcome(
        run({"--target", "lut", "--index", "0x1f", "--type", "checked", "--check", "lut", "--data", data, "--verbose"}),
        1, registerLines(base) + "index is out of range of available slots 26\n");
    expectNothingStored();
    expectSilentSuccess(
        run({"--target", "lut", "--index", "0x19", "--type", "checked", "--check", "lut", "--data", data}));
    expectOnlyCopy("app/luts/25", "2", lut);
}

// ---------------------------------------------------------------------------
// The bytes a migration leaves in the store

using MigrateSettingsStoredBytes = ToolRun;

TEST_F(MigrateSettingsStoredBytes, CheckedSettingsStoresOnlyTheDeclaredLength) {
    const Bytes block = settingsBlock(4090, 4096);
    expectSilentSuccess(
        run({"--target", "settings", "--type", "checked", "--check", "settings", "--data", dataFile("block", block)}));
    expectOnlyCopy("settings", "2", head(block, 4090));
    // 4090 = 0x0FFA, the declared length, not the file's 4096.
    EXPECT_EQ(head(readBytes(base / "settings/2/data.chk"), 4), (Bytes{0xFA, 0x0F, 0x00, 0x00}));
}

TEST_F(MigrateSettingsStoredBytes, CheckOmittedMeansTheSettingsCheck) {
    const Bytes block = settingsBlock(6, 8);
    expectSilentSuccess(run({"--target", "util_save", "--type", "checked", "--data", dataFile("block", block)}));
    expectOnlyCopy("app/utilSave", "2", head(block, 6));

    // A good LUT file is not a settings block.
    const std::string lut = dataFile("lut", lutFile(19784));
    expectOutcome(run({"--target", "lut", "--type", "checked", "--data", lut}), 1, "");
    expectOutcome(run({"--target", "lut", "--type", "redundant", "--data", lut, "--data2", lut}), 1, "");
    expectOnlyCopy("app/utilSave", "2", head(block, 6));
}

TEST_F(MigrateSettingsStoredBytes, LutAndOverlayStoreTheWholeFile) {
    const Bytes lut = lutFile(20001);
    // Bytes after the payload are kept too.
    const Bytes overlay = overlayFile(100, 284 + 100 + 13);
    expectSilentSuccess(run(
        {"--target", "lut", "--index", "9", "--type", "checked", "--check", "lut", "--data", dataFile("lut", lut)}));
    expectSilentSuccess(run({"--target", "overlay", "--index", "2", "--type", "checked", "--check", "overlay", "--data",
                             dataFile("overlay", overlay)}));
    EXPECT_EQ(storedFiles(base), (Files{"app/luts/9/2/data", "app/luts/9/2/data.chk", "app/overlays/2/2/data",
                                        "app/overlays/2/2/data.chk"}));
    EXPECT_EQ(readBytes(base / "app/luts/9/2/data"), lut);
    EXPECT_EQ(readBytes(base / "app/luts/9/2/data.chk"), checkFileFor(lut));
    EXPECT_EQ(readBytes(base / "app/overlays/2/2/data"), overlay);
    EXPECT_EQ(readBytes(base / "app/overlays/2/2/data.chk"), checkFileFor(overlay));
}

TEST_F(MigrateSettingsStoredBytes, SimpleStoresTheFileUncheckedEvenWithACheckGiven) {
    const Bytes odd = {0x80, 0x11, 0x03, 0x00, 0x42, 0x43, 0x44};
    expectSilentSuccess(
        run({"--target", "calib_extra", "--type", "simple", "--check", "lut", "--data", dataFile("odd", odd)}));
    expectOnlyCopy("app/calibExtra", "2", odd);
}

TEST_F(MigrateSettingsStoredBytes, SimpleStoresAnEmptyFile) {
    expectSilentSuccess(run({"--target", "settings", "--type", "simple", "--data", dataFile("empty", Bytes{})}));
    expectOnlyCopy("settings", "2", Bytes{});
    EXPECT_EQ(readBytes(base / "settings/2/data.chk"), Bytes(8, 0));
    expectSilentSuccess(run({"--target", "settings", "--query-present"}));
}

TEST_F(MigrateSettingsStoredBytes, SuccessiveMigrationsAlternateBetweenTheCopies) {
    const Bytes first = settingsBlock(20, 24, 1);
    const Bytes second = settingsBlock(28, 32, 2);
    const Bytes third = settingsBlock(12, 12, 3);
    const auto migrate = [&](const Bytes& block) {
        return run({"--target", "settings", "--type", "checked", "--data", dataFile("block", block)});
    };

    // An empty store reads copy "1", so the first write goes to "2".
    expectSilentSuccess(migrate(first));
    expectOnlyCopy("settings", "2", head(first, 20));

    expectSilentSuccess(migrate(second));
    EXPECT_EQ(storedFiles(base),
              (Files{"settings/1/data", "settings/1/data.chk", "settings/2/data", "settings/2/data.chk"}));
    EXPECT_EQ(readBytes(base / "settings/1/data"), head(second, 28));
    EXPECT_EQ(readBytes(base / "settings/1/data.chk"), checkFileFor(head(second, 28)));
    EXPECT_EQ(readBytes(base / "settings/2/data"), head(first, 20));
    EXPECT_EQ(readBytes(base / "settings/2/data.chk"), checkFileFor(head(first, 20)));
    EXPECT_GT(fs::last_write_time(base / "settings/1/data.chk"), fs::last_write_time(base / "settings/2/data.chk"));

    // The next run finds "1" newer, so "2" is written again.
    expectSilentSuccess(migrate(third));
    EXPECT_EQ(readBytes(base / "settings/2/data"), third);
    EXPECT_EQ(readBytes(base / "settings/2/data.chk"), checkFileFor(third));
    EXPECT_EQ(readBytes(base / "settings/1/data"), head(second, 28));
    EXPECT_EQ(readBytes(base / "settings/1/data.chk"), checkFileFor(head(second, 28)));
    expectSilentSuccess(run({"--target", "settings", "--query-present"}));
}

// ---------------------------------------------------------------------------
// Two candidate blocks

using MigrateSettingsRedundant = ToolRun;

TEST_F(MigrateSettingsRedundant, BadFirstBlockStoresTheSecond) {
    Bytes bad = settingsBlock(48, 48, 1);
    bad[47] ^= 0xFF;
    const Bytes good = settingsBlock(30, 32, 2);
    expectSilentSuccess(run({"--target", "settings", "--type", "redundant", "--data", dataFile("bad", bad), "--data2",
                             dataFile("good", good)}));
    expectOnlyCopy("settings", "2", head(good, 30));
}

TEST_F(MigrateSettingsRedundant, GoodFirstBlockWinsWithoutComparison) {
    const Bytes first = overlayFile(3, 290, 1);
    const Bytes second = overlayFile(9, 300, 2);
    expectSilentSuccess(run({"--target", "overlay", "--index", "7", "--type", "redundant", "--check", "overlay", "-m",
                             dataFile("first", first), "-n", dataFile("second", second)}));
    expectOnlyCopy("app/overlays/7", "2", first);
}

TEST_F(MigrateSettingsRedundant, SecondBlockOfTheOtherFormatIsStoredWhole) {
    const Bytes lut = lutFile(19784);
    Bytes badLut = lut;
    badLut[0] = 0x81;
    expectSilentSuccess(run({"--target", "lut", "--index", "12", "--type", "redundant", "--check", "lut", "--data",
                             dataFile("bad", badLut), "--data2", dataFile("good", lut)}));
    expectOnlyCopy("app/luts/12", "2", lut);
}

TEST_F(MigrateSettingsRedundant, BothBlocksBadIsOneAndWritesNothing) {
    Bytes bad1 = settingsBlock(16, 16, 1);
    bad1[3] ^= 0x10;
    const Bytes bad2 = settingsBlock(12, 12, 2);
    const Bytes shortBad2(bad2.begin(), bad2.begin() + 8);  // declares 12 in 8 bytes
    expectOutcome(run({"--target", "settings", "--type", "redundant", "--data", dataFile("bad1", bad1), "--data2",
                       dataFile("bad2", shortBad2)}),
                  1, "");
    expectOutcome(run({"--target", "settings", "--type", "redundant", "--data", dataFile("bad1", bad1), "--data2",
                       dataFile("bad2", shortBad2), "--verbose"}),
                  1, registerLines(base));
    expectNothingStored();
}

TEST_F(MigrateSettingsRedundant, BothBlocksBadLeavesAnEarlierMigrationInPlace) {
    const Bytes earlier = settingsBlock(16, 16, 4);
    expectSilentSuccess(run({"--target", "settings", "--type", "checked", "--data", dataFile("earlier", earlier)}));
    const std::string bad = dataFile("bad", Bytes{0, 0, 0, 0});
    expectOutcome(run({"--target", "settings", "--type", "redundant", "--data", bad, "--data2", bad}), 1, "");
    expectOnlyCopy("settings", "2", earlier);
    expectSilentSuccess(run({"--target", "settings", "--query-present"}));
}

// ---------------------------------------------------------------------------
// Each block format at its boundaries, one checked migration per row

struct CheckRow {
    const char* name;
    const char* target;
    const char* index;
    const char* check;
    Bytes data;
    int exitStatus;
    const char* out;
    const char* slotDirectory;  // where an accepted block lands
    size_t storedLength;        // of the block's first bytes, when accepted
};

Bytes withByte(Bytes bytes, size_t offset, uint8_t value) {
    bytes.at(offset) = value;
    return bytes;
}

Bytes truncated(Bytes bytes, size_t size) {
    bytes.resize(size);
    return bytes;
}

std::vector<CheckRow> checkRows() {
    const Bytes settings64 = settingsBlock(64, 64);
    const Bytes lut = lutFile(19784);
    const Bytes overlay = overlayFile(0, 284);
    return {
        {"SettingsSixOfEight", "settings", "0", "settings", settingsBlock(6, 8), 0, "", "settings", 6},
        {"SettingsWholeFile", "settings", "0", "settings", settings64, 0, "", "settings", 64},
        {"SettingsOddLength", "settings", "0", "settings", settingsBlock(4093, 4096), 0, "", "settings", 4093},
        {"SettingsFillerIsNotChecked", "settings", "0", "settings", withByte(settingsBlock(60, 64), 63, 0), 0, "",
         "settings", 60},
        {"SettingsFileSizeSix", "settings", "0", "settings", settingsBlock(6, 6), 1, "", "", 0},
        {"SettingsEmptyFile", "settings", "0", "settings", Bytes{}, 1, "", "", 0},
        {"SettingsTwelveDeclaredInEight", "settings", "0", "settings", truncated(settingsBlock(12, 12), 8), 1, "", "",
         0},
        {"SettingsDeclaredTwo", "settings", "0", "settings", Bytes{2, 0, 0, 0}, 1, "", "", 0},
        {"SettingsDeclaredZero", "settings", "0", "settings", Bytes{0, 0, 0, 0}, 1, "", "", 0},
        {"SettingsBadChecksum", "settings", "0", "settings", withByte(settings64, 62, settings64[62] ^ 1), 1, "", "",
         0},
        {"SettingsChangedContents", "settings", "0", "settings", withByte(settings64, 20, settings64[20] ^ 0x80), 1, "",
         "", 0},
        {"LutOneByteShort", "lut", "5", "lut", lutFile(19783), 1, "", "", 0},
        {"LutExactMinimum", "lut", "5", "lut", lut, 0, "", "app/luts/5", 19784},
        {"LutFirstWordZero", "lut", "5", "lut", withByte(withByte(withByte(lut, 0, 0), 1, 0), 2, 0), 1, "", "", 0},
        {"LutVersionThree", "lut", "5", "lut", withByte(lut, 2, 3), 1, "Unable to parse LUT header at index 5\n", "",
         0},
        {"LutVersionHighByte", "lut", "0", "lut", withByte(lut, 3, 1), 1, "Unable to parse LUT header at index 0\n", "",
         0},
        {"LutWrongTypeByte", "lut", "5", "lut", withByte(lut, 0, 0x00), 1, "", "", 0},
        {"LutWrongSecondByte", "lut", "5", "lut", withByte(lut, 1, 0x12), 1, "", "", 0},
        {"LutThreeBytes", "lut", "5", "lut", Bytes{0x80, 0x11, 0x02}, 1, "", "", 0},
        {"OverlayEmptyPayload", "overlay", "0", "overlay", overlay, 0, "", "app/overlays/0", 284},
        {"OverlayPayloadOneBeyond", "overlay", "0", "overlay", overlayFile(1, 284), 1, "", "", 0},
        {"OverlayPayloadExactlyFits", "overlay", "7", "overlay", overlayFile(50, 334), 0, "", "app/overlays/7", 334},
        {"OverlayHeaderShort", "overlay", "0", "overlay", truncated(overlay, 283), 1, "", "", 0},
        {"OverlayBadMagic", "overlay", "0", "overlay", withByte(overlay, 3, 0x09), 1, "", "", 0},
        {"OverlayFormatSix", "overlay", "0", "overlay", withByte(overlay, 6, 6), 1, "", "", 0},
        {"OverlayFormatHighByte", "overlay", "0", "overlay", withByte(overlay, 7, 1), 1, "", "", 0},
        {"OverlayWordAtEightZero", "overlay", "0", "overlay",
         withByte(withByte(withByte(withByte(overlay, 8, 0), 9, 0), 10, 0), 11, 0), 1, "", "", 0},
        {"OverlayHugePayload", "overlay", "0", "overlay",
         withByte(withByte(withByte(withByte(overlay, 280, 0xFF), 281, 0xFF), 282, 0xFF), 283, 0xFF), 1, "", "", 0},
    };
}

class MigrateSettingsCheckRows : public ToolRun, public ::testing::WithParamInterface<CheckRow> {};

TEST_P(MigrateSettingsCheckRows, CheckedMigration) {
    const CheckRow& row = GetParam();
    const ProcessResult result = run({"--target", row.target, "--index", row.index, "--type", "checked", "--check",
                                      row.check, "--data", dataFile("data", row.data)});
    expectOutcome(result, row.exitStatus, row.out);
    if (row.exitStatus == 0) {
        expectOnlyCopy(row.slotDirectory, "2", head(row.data, row.storedLength));
    } else {
        expectNothingStored();
    }
}

INSTANTIATE_TEST_SUITE_P(Formats, MigrateSettingsCheckRows, ::testing::ValuesIn(checkRows()),
                         [](const ::testing::TestParamInfo<CheckRow>& info) { return std::string(info.param.name); });

// ---------------------------------------------------------------------------
// Files from the example generator

using MigrateSettingsExampleData = ToolRun;

TEST_F(MigrateSettingsExampleData, GeneratedFilesMigrate) {
    const std::string generator = MAKE_EXAMPLE_DATA_BIN;
    const auto generate = [&](const std::vector<std::string>& args) {
        const ProcessResult result = testing_support::runProgram(concat({generator}, args));
        EXPECT_EQ(result.exitStatus, 0) << result.err;
        return readBytes(args.at(1));
    };
    const Bytes settings = generate({"settings", inScratch("settings.bin"), "4093"});
    const Bytes lut = generate({"lut", inScratch("lut.bin")});
    const Bytes overlay = generate({"overlay", inScratch("overlay.bin"), "100"});
    ASSERT_EQ(settings.size(), 4096u);

    expectSilentSuccess(run({"--target", "settings", "--type", "checked", "--data", inScratch("settings.bin")}));
    expectSilentSuccess(run(
        {"--target", "lut", "--index", "25", "--type", "checked", "--check", "lut", "--data", inScratch("lut.bin")}));
    expectSilentSuccess(run({"--target", "overlay", "--index", "1", "--type", "checked", "--check", "overlay", "--data",
                             inScratch("overlay.bin")}));
    EXPECT_EQ(readBytes(base / "settings/2/data"), head(settings, 4093));
    EXPECT_EQ(readBytes(base / "app/luts/25/2/data"), lut);
    EXPECT_EQ(readBytes(base / "app/overlays/1/2/data"), overlay);
    EXPECT_EQ(overlay.size(), 384u);
}

}  // namespace
