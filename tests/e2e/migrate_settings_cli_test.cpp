// The command line of migrate_settings, seen from outside: the built binary
// runs as a child process and its output is compared byte for byte.

#include <filesystem>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "scratch_store.h"
#include "tool_run.h"

namespace {

namespace fs = std::filesystem;
using e2e::Bytes;
using e2e::concat;
using e2e::describe;
using e2e::Files;
using e2e::ProcessResult;
using e2e::registerLines;
using e2e::runAccepted;
using e2e::runTool;
using e2e::storedFiles;
using testing_support::readBytes;

const std::string kOptionList =
    "  -b, --base=arg          Base path for storage.\n"
    "                          default: /var/nonvolatile/app\n"
    "  --type=arg              Migration type to perform\n"
    "  --target=arg            Target to assign result to\n"
    "  --check=arg             Check to apply in checked/redundant mode\n"
    "                          default: settings\n"
    "  --query-present         Don't migrate, return success if target exists,\n"
    "                          failure otherwise.  For scripting.\n"
    "  --if-not-present        Only migrate if not already present\n"
    "  -i, --index=arg         Slot index within target.\n"
    "                          default: 0\n"
    "  -m, --data=arg          Path to file to read for migration data.\n"
    "  -n, --data2=arg         Path to file to read for 2nd block of migration data.\n"
    "                          Required for 'redundant' migration type.\n"
    "  -v, --verbose           Runs with extra logging.\n"
    "  --debug                 Runs with extra debug logging.\n"
    "  -h, --help              Print usage instructions.\n";

const std::string kUsage = "Usage: " + e2e::kBinary + " [OPTIONS]\n" + kOptionList + "\n";

// Passes the settings check as well as the LUT check: its first bytes
// 80 11 declare a settings block of 0x1180 bytes, whose checksum follows.
constexpr size_t kDualLength = 0x1180;
Bytes settingsAndLut() {
    Bytes bytes = e2e::lutFile(19784);
    e2e::putLe16(bytes, kDualLength - 2, e2e::bsdChecksum16(bytes.data(), kDualLength - 2));
    return bytes;
}

Bytes head(const Bytes& bytes, size_t length) { return Bytes(bytes.begin(), bytes.begin() + length); }

// Lines that get past option parsing run for real, so every one of them
// names a scratch store with --base (first, so that a "--" later on the
// line cannot turn it into a positional argument). Data file "a" passes the
// settings and LUT checks, "b" is an overlay.
//
// run() is for lines that get past parsing and so build the registry;
// runUnparsed() for lines that end in parsing, whose output is compared
// as it came.
class CliRun : public e2e::ScratchStore {
protected:
    const Bytes aBytes = settingsAndLut();
    const Bytes bBytes = e2e::overlayFile(16, 300);
    const std::string a = dataFile("a", aBytes);
    const std::string b = dataFile("b", bBytes);

    ProcessResult run(const std::vector<std::string>& args) const {
        return runAccepted(concat({"--base", base.string()}, args));
    }

    ProcessResult runUnparsed(const std::vector<std::string>& args) const {
        return runTool(concat({"--base", base.string()}, args));
    }

    // A valid query: the fresh slot is absent, and a query stores nothing.
    void expectQueried(const std::vector<std::string>& args) const {
        SCOPED_TRACE(describe(args));
        const ProcessResult result = run(args);
        EXPECT_EQ(result.exitStatus, 10);
        EXPECT_EQ(result.out, "");
        EXPECT_EQ(result.err, "");
        EXPECT_EQ(storedFiles(base), Files{});
    }

    // A valid migration: `stored` lands in copy "2" of `slotDirectory`.
    void expectMigrated(const std::vector<std::string>& args, const std::string& slotDirectory,
                        const Bytes& stored) const {
        SCOPED_TRACE(describe(args));
        const ProcessResult result = run(args);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.out, "");
        EXPECT_EQ(result.err, "");
        const std::string dataPath = slotDirectory + "/2/data";
        EXPECT_EQ(storedFiles(base), (Files{dataPath, dataPath + ".chk"}));
        if (fs::exists(base / dataPath)) {
            EXPECT_EQ(readBytes(base / dataPath), stored);
        }
        fs::remove_all(base);
    }

    // Rejected while parsing: no store is built.
    void expectRejected(const std::vector<std::string>& args, const std::string& message) const {
        SCOPED_TRACE(describe(args));
        const ProcessResult result = runUnparsed(args);
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_EQ(result.out, message + kUsage);
        EXPECT_EQ(result.err, "");
        EXPECT_FALSE(fs::exists(base));
    }
};

const std::vector<std::string> kValidQuery = {"--target", "settings", "--query-present"};

// ---------------------------------------------------------------------------
// Help

using MigrateSettingsHelp = CliRun;

TEST_F(MigrateSettingsHelp, PrintsTheUsageAndExitsZero) {
    for (const std::vector<std::string>& args :
         std::vector<std::vector<std::string>>{{"-h"}, {"--help"}, {"-vh"}, {"pos", "-h"}}) {
        SCOPED_TRACE(describe(args));
        const ProcessResult result = runUnparsed(args);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.out, kUsage);
        EXPECT_EQ(result.err, "");
    }
    EXPECT_FALSE(fs::exists(base));
}

TEST_F(MigrateSettingsHelp, WinsWhenParsedEvenIfLaterOptionsAreBad) {
    for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
             {"-h", "--type", "foo"},
             {"-h", "--bogus"},
             {"--target", "settings", "-h", "--index", "12abc"},
             {"--target", "settings", "--query-present", "-h"},
             {"--target", "settings", "--type", "simple", "--data", a, "--help"},
             {"--help", "--check"},
         }) {
        SCOPED_TRACE(describe(args));
        const ProcessResult result = runUnparsed(args);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.out, kUsage);
        EXPECT_EQ(result.err, "");  // getopt_long never reached the bad option
    }
    EXPECT_FALSE(fs::exists(base));
}

TEST_F(MigrateSettingsHelp, AnErrorBeforeHelpWins) {
    expectRejected({"--type", "foo", "-h"}, "Invalid migration type 'foo'\n");
    expectRejected({"--index", "12abc", "--help"}, "");

    const ProcessResult unknown = runUnparsed({"--bogus", "-h"});
    EXPECT_EQ(unknown.exitStatus, 1);
    EXPECT_EQ(unknown.out, "Unexpected option 63 ?\n" + kUsage);
    EXPECT_NE(unknown.err, "");
    EXPECT_FALSE(fs::exists(base));
}

// ---------------------------------------------------------------------------
// Missing options (checked after all options were read)

using MigrateSettingsRequired = CliRun;

TEST_F(MigrateSettingsRequired, EachMissingPieceIsNamed) {
    struct Case {
        std::vector<std::string> args;
        const char* message;
    };
    const std::vector<Case> cases = {
        {{}, "Please specify a target\n"},
        {{"--query-present"}, "Please specify a target\n"},
        {{"--type", "simple", "--data", a, "--if-not-present"}, "Please specify a target\n"},
        {{"--target", "settings"}, "Please specify a migration type\n"},
        {{"--target", "settings", "--if-not-present", "--data", a}, "Please specify a migration type\n"},
        {{"--target", "settings", "--type", "simple"}, "Please specify a path to migration data\n"},
        {{"--target", "settings", "--type", "checked", "--data2", b}, "Please specify a path to migration data\n"},
        {{"--target", "settings", "--type", "simple", "--data", ""}, "Please specify a path to migration data\n"},
        {{"--type", "redundant", "--target", "lut", "--data", a},
         "Please specify a path to 2nd migration data block\n"},
        {{"--type", "redundant", "--target", "lut", "-m", a, "-n", ""},
         "Please specify a path to 2nd migration data block\n"},
    };
    for (const Case& c : cases) expectRejected(c.args, c.message);
}

TEST_F(MigrateSettingsRequired, QueryPresentWithTargetNeedsNothingElse) {
    expectQueried(kValidQuery);
    expectQueried({"--query-present", "--target", "lut"});
    expectQueried({"--query-present", "--target", "overlay", "--type", "redundant"});
}

TEST_F(MigrateSettingsRequired, CompleteMigrationLinesAreAccepted) {
    expectMigrated({"--target", "settings", "--type", "simple", "--data", a}, "settings", aBytes);
    expectMigrated({"--target", "lut", "--type", "checked", "--check", "lut", "-m", a}, "app/luts/0", aBytes);
    // Without --check the settings check picks "a", cut to its declared length.
    expectMigrated({"--target", "overlay", "--type", "redundant", "--data", a, "--data2", b}, "app/overlays/0",
                   head(aBytes, kDualLength));
    expectMigrated({"--target", "overlay", "--type", "redundant", "-m", a, "-n", b, "--check", "overlay"},
                   "app/overlays/0", bBytes);
    // --data2 is accepted with every type.
    expectMigrated({"--target", "settings", "--type", "simple", "--data", a, "--data2", b}, "settings", aBytes);
}

TEST_F(MigrateSettingsRequired, EqualsFormsAndTheLastBaseWin) {
    const fs::path x = scratch / "x";
    const fs::path y = scratch / "y";
    const ProcessResult result = runAccepted({"--target=settings", "--type=checked", "--data=" + a, "--if-not-present",
                                              "--base=" + x.string(), "-b", y.string(), "-i", "0", "--check=settings"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
    EXPECT_FALSE(fs::exists(x));
    EXPECT_EQ(storedFiles(y), (Files{"settings/2/data", "settings/2/data.chk"}));
    EXPECT_EQ(readBytes(y / "settings/2/data"), head(aBytes, kDualLength));
}

TEST_F(MigrateSettingsRequired, PositionalArgumentsAreIgnored) {
    expectQueried({"extra", "--target", "settings", "more", "--query-present", "words"});
    expectQueried({"--target", "settings", "--query-present", "--", "--bogus"});
    expectMigrated({"--target", "settings", "--type", "simple", "--data", a, "--", "--data", b}, "settings", aBytes);
}

TEST_F(MigrateSettingsRequired, ARepeatedOptionOverwritesTheEarlierValue) {
    expectMigrated({"--type", "redundant", "--type", "simple", "--target", "settings", "--data", a}, "settings",
                   aBytes);
    expectMigrated({"--target", "lut", "--target", "overlay", "--type", "simple", "--data", b, "--data", a},
                   "app/overlays/0", aBytes);
    expectRejected({"--type", "simple", "--type", "redundant", "--target", "settings", "--data", a},
                   "Please specify a path to 2nd migration data block\n");
    expectRejected({"--data", a, "--data", "", "--target", "settings", "--type", "simple"},
                   "Please specify a path to migration data\n");
    expectRejected({"--target", "settings", "--type", "redundant", "-m", a, "-n", b, "--data2", ""},
                   "Please specify a path to 2nd migration data block\n");
}

// ---------------------------------------------------------------------------
// Choice options

using MigrateSettingsChoices = CliRun;

TEST_F(MigrateSettingsChoices, EveryTypeWordIsAccepted) {
    expectMigrated({"--target", "lut", "--type", "simple", "--data", a}, "app/luts/0", aBytes);
    expectMigrated({"--target", "lut", "--type", "checked", "--data", a}, "app/luts/0", head(aBytes, kDualLength));
    expectMigrated({"--target", "lut", "--type", "redundant", "--data", b, "--data2", a}, "app/luts/0",
                   head(aBytes, kDualLength));
}

TEST_F(MigrateSettingsChoices, EveryNamedTargetIsAccepted) {
    for (const char* target : {"settings", "lut", "overlay", "calib_save", "calib_extra", "util_save",
                               "application_internal", "reboot_persistent"}) {
        expectQueried({"--query-present", "--target", target});
    }
}

TEST_F(MigrateSettingsChoices, EveryCheckWordIsAccepted) {
    for (const char* check : {"settings", "lut", "overlay"}) expectQueried(concat(kValidQuery, {"--check", check}));
    // Each word selects its own check: only "overlay" accepts "b".
    expectMigrated({"--target", "overlay", "--type", "checked", "--check", "overlay", "--data", b}, "app/overlays/0",
                   bBytes);
    // The overlay's magic reads as LUT version 0x089C.
    for (const auto& [check, out] :
         {std::pair{"settings", ""}, std::pair{"lut", "Unable to parse LUT header at index 0\n"}}) {
        SCOPED_TRACE(check);
        const ProcessResult result = run({"--target", "overlay", "--type", "checked", "--check", check, "--data", b});
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_EQ(result.out, out);
        EXPECT_EQ(storedFiles(base), Files{});
    }
}

TEST_F(MigrateSettingsChoices, UnknownWordsAreNamedWithTheirOption) {
    struct Case {
        std::vector<std::string> args;
        const char* message;
    };
    const std::vector<Case> cases = {
        {{"--type", "foo"}, "Invalid migration type 'foo'\n"},
        {{"--type", "Simple"}, "Invalid migration type 'Simple'\n"},
        {{"--type="}, "Invalid migration type ''\n"},
        {{"--type", "0"}, "Invalid migration type '0'\n"},
        {{"--target", "boot"}, "Invalid target type 'boot'\n"},
        {{"--target", "Settings"}, "Invalid target type 'Settings'\n"},
        {{"--target", "8"}, "Invalid target type '8'\n"},
        {{"--target", "kIpiStorageTargetBootVector"}, "Invalid target type 'kIpiStorageTargetBootVector'\n"},
        {{"--query-present", "--target="}, "Invalid target type ''\n"},
        {{"--check", "foo"}, "Invalid check type 'foo'\n"},
        {{"--target", "settings", "--query-present", "--check", "settings "}, "Invalid check type 'settings '\n"},
        // The first bad value ends the parse.
        {{"--type", "foo", "--target", "bar"}, "Invalid migration type 'foo'\n"},
        {{"--target", "bar", "--type", "foo"}, "Invalid target type 'bar'\n"},
    };
    for (const Case& c : cases) expectRejected(c.args, c.message);
}

// ---------------------------------------------------------------------------
// Options that getopt_long itself rejects

using MigrateSettingsUnexpected = CliRun;

TEST_F(MigrateSettingsUnexpected, UnknownOptionsAndMissingArgumentsArriveAsQuestionMark) {
    struct Case {
        std::vector<std::string> args;
        const char* inDiagnostic;  // part of getopt_long's own message on stderr
    };
    const std::vector<Case> cases = {
        {{"--bogus"}, "--bogus"},
        {{"-x"}, "'x'"},
        {concat(kValidQuery, {"--bogus"}), "--bogus"},
        {{"-b"}, "'b'"},
        {{"--base"}, "--base"},
        {{"--target", "settings", "--query-present", "--index"}, "--index"},
        {{"-i"}, "'i'"},
        {{"--type"}, "--type"},
        {{"--data"}, "--data"},
        {{"--help=yes"}, "--help"},
        {{"--d", "x"}, "--d"},  // ambiguous: --data, --data2, --debug
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(describe(c.args));
        const ProcessResult result = runUnparsed(c.args);
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_EQ(result.out, "Unexpected option 63 ?\n" + kUsage);
        EXPECT_NE(result.err.find(c.inDiagnostic), std::string::npos) << result.err;
    }
    EXPECT_FALSE(fs::exists(base));
}

// ---------------------------------------------------------------------------
// --index

using MigrateSettingsIndex = CliRun;

// Each accepted form is told by its effect on the 26-slot LUT target: below
// 26 the block lands in that slot; above, the range test names the count.
TEST_F(MigrateSettingsIndex, AcceptedForms) {
    struct Case {
        std::vector<std::string> indexArgs;
        unsigned long value;
    };
    const std::vector<Case> cases = {
        {{"--index", "0"}, 0},
        {{"--index", "25"}, 25},
        {{"--index", "31"}, 31},
        {{"--index", "0x1f"}, 31},
        {{"--index", "0X1F"}, 31},
        {{"--index", "0x19"}, 25},
        {{"--index", "010"}, 8},
        {{"--index", "031"}, 25},
        {{"--index", "4294967295"}, 4294967295},
        {{"--index", "0xffffffff"}, 4294967295},
        {{"--index", "037777777777"}, 4294967295},
        {{"--index", "+7"}, 7},
        {{"--index", " 7"}, 7},
        {{"--index", "-0"}, 0},
        {{"-i", "5"}, 5},
        {{"--index=0x10"}, 16},
        {{"-i010"}, 8},
    };
    for (const Case& c : cases) {
        const std::vector<std::string> args = concat({"--target", "lut", "--type", "simple", "--data", b}, c.indexArgs);
        if (c.value < 26) {
            expectMigrated(args, "app/luts/" + std::to_string(c.value), bBytes);
        } else {
            SCOPED_TRACE(describe(args));
            const ProcessResult result = run(concat(args, {"--verbose"}));
            EXPECT_EQ(result.exitStatus, 1);
            EXPECT_EQ(result.out, registerLines(base) + "index is out of range of available slots 26\n");
            EXPECT_EQ(storedFiles(base), Files{});
        }
    }
}

TEST_F(MigrateSettingsIndex, RejectedFormsPrintOnlyTheUsage) {
    for (const char* index : {"12abc", "", "4294967296", "0x100000000", "-1", "-4294967295", "18446744073709551616",
                              "0x", "08", "7 ", "abc", " ", "1.0"}) {
        expectRejected(concat(kValidQuery, {"--index", index}), "");
    }
    expectRejected(concat(kValidQuery, {"-i", "-1"}), "");
    expectRejected(concat(kValidQuery, {"--index="}), "");
}

// ---------------------------------------------------------------------------
// Logging level once the line is accepted

using MigrateSettingsLevel = CliRun;

TEST_F(MigrateSettingsLevel, VerboseOrDebugListsTheStores) {
    for (const std::vector<std::string>& levels :
         std::vector<std::vector<std::string>>{{"--verbose"}, {"-v"}, {"--debug"}, {"--debug", "--verbose"}}) {
        SCOPED_TRACE(describe(levels));
        const ProcessResult result = run(concat(kValidQuery, levels));
        EXPECT_EQ(result.exitStatus, 10);
        EXPECT_EQ(result.out, registerLines(base));
        EXPECT_EQ(result.err, "");
    }
}

TEST_F(MigrateSettingsLevel, WithoutVerboseNoTargetIsListed) {
    const ProcessResult result = run(kValidQuery);
    EXPECT_EQ(result.exitStatus, 10);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
}

}  // namespace
