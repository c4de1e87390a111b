// The command line of migrate_settings, seen from outside: the built binary
// runs as a child process and its output is compared byte for byte.

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"

namespace {

using testing_support::ProcessResult;
using testing_support::runProgram;

const std::string kBinary = MIGRATE_SETTINGS_BIN;

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

const std::string kUsage = "Usage: " + kBinary + " [OPTIONS]\n" + kOptionList + "\n";

ProcessResult run(std::vector<std::string> args) {
    args.insert(args.begin(), kBinary);
    return runProgram(args);
}

std::string describe(const std::vector<std::string>& args) {
    std::string text;
    for (const std::string& arg : args) text += " '" + arg + "'";
    return text;
}

// A line that passes all option checks; no target is registered yet, so the
// run ends there with status 1 and, without --verbose, says nothing.
const std::vector<std::string> kValidQuery = {"--target", "settings", "--query-present"};

void expectAccepted(const std::vector<std::string>& args) {
    SCOPED_TRACE(describe(args));
    const ProcessResult result = run(args);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
}

void expectRejected(const std::vector<std::string>& args, const std::string& message) {
    SCOPED_TRACE(describe(args));
    const ProcessResult result = run(args);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, message + kUsage);
    EXPECT_EQ(result.err, "");
}

std::vector<std::string> concat(std::vector<std::string> head, const std::vector<std::string>& tail) {
    head.insert(head.end(), tail.begin(), tail.end());
    return head;
}

// ---------------------------------------------------------------------------
// Help

TEST(MigrateSettingsHelp, PrintsTheUsageAndExitsZero) {
    for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
             {"-h"}, {"--help"}, {"-vh"}, {"pos", "-h"}}) {
        SCOPED_TRACE(describe(args));
        const ProcessResult result = run(args);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.out, kUsage);
        EXPECT_EQ(result.err, "");
    }
}

TEST(MigrateSettingsHelp, WinsWhenParsedEvenIfLaterOptionsAreBad) {
    for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
             {"-h", "--type", "foo"},
             {"-h", "--bogus"},
             {"--target", "settings", "-h", "--index", "12abc"},
             {"--target", "settings", "--query-present", "-h"},
             {"--help", "--check"},
         }) {
        SCOPED_TRACE(describe(args));
        const ProcessResult result = run(args);
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.out, kUsage);
        EXPECT_EQ(result.err, "");  // getopt_long never reached the bad option
    }
}

TEST(MigrateSettingsHelp, AnErrorBeforeHelpWins) {
    expectRejected({"--type", "foo", "-h"}, "Invalid migration type 'foo'\n");
    expectRejected({"--index", "12abc", "--help"}, "");

    const ProcessResult unknown = run({"--bogus", "-h"});
    EXPECT_EQ(unknown.exitStatus, 1);
    EXPECT_EQ(unknown.out, "Unexpected option 63 ?\n" + kUsage);
    EXPECT_NE(unknown.err, "");
}

// ---------------------------------------------------------------------------
// Missing options (checked after all options were read)

TEST(MigrateSettingsRequired, EachMissingPieceIsNamed) {
    struct Case {
        std::vector<std::string> args;
        const char* message;
    };
    const std::vector<Case> cases = {
        {{}, "Please specify a target\n"},
        {{"--query-present"}, "Please specify a target\n"},
        {{"--type", "simple", "--data", "a", "--if-not-present"}, "Please specify a target\n"},
        {{"--target", "settings"}, "Please specify a migration type\n"},
        {{"--target", "settings", "--if-not-present", "--data", "a"}, "Please specify a migration type\n"},
        {{"--target", "settings", "--type", "simple"}, "Please specify a path to migration data\n"},
        {{"--target", "settings", "--type", "checked", "--data2", "b"}, "Please specify a path to migration data\n"},
        {{"--target", "settings", "--type", "simple", "--data", ""}, "Please specify a path to migration data\n"},
        {{"--type", "redundant", "--target", "lut", "--data", "a"},
         "Please specify a path to 2nd migration data block\n"},
        {{"--type", "redundant", "--target", "lut", "-m", "a", "-n", ""},
         "Please specify a path to 2nd migration data block\n"},
    };
    for (const Case& c : cases) expectRejected(c.args, c.message);
}

TEST(MigrateSettingsRequired, QueryPresentWithTargetNeedsNothingElse) {
    expectAccepted(kValidQuery);
    expectAccepted({"--query-present", "--target", "lut"});
    expectAccepted({"--query-present", "--target", "overlay", "--type", "redundant"});
}

TEST(MigrateSettingsRequired, CompleteMigrationLinesAreAccepted) {
    expectAccepted({"--target", "settings", "--type", "simple", "--data", "a"});
    expectAccepted({"--target", "lut", "--type", "checked", "--check", "lut", "-m", "a"});
    expectAccepted({"--target", "overlay", "--type", "redundant", "--data", "a", "--data2", "b"});
    expectAccepted({"--target", "overlay", "--type", "redundant", "-m", "a", "-n", "b", "--check", "overlay"});
    // --data2 is accepted with every type.
    expectAccepted({"--target", "settings", "--type", "simple", "--data", "a", "--data2", "b"});
    expectAccepted({"--target=settings", "--type=checked", "--data=a", "--if-not-present", "--base=/tmp/x",
                    "-b", "/tmp/y", "-i", "0", "--check=settings"});
}

TEST(MigrateSettingsRequired, PositionalArgumentsAreIgnored) {
    expectAccepted({"extra", "--target", "settings", "more", "--query-present", "words"});
    expectAccepted({"--target", "settings", "--query-present", "--", "--bogus"});
}

TEST(MigrateSettingsRequired, ARepeatedOptionOverwritesTheEarlierValue) {
    expectAccepted({"--type", "redundant", "--type", "simple", "--target", "settings", "--data", "a"});
    expectRejected({"--type", "simple", "--type", "redundant", "--target", "settings", "--data", "a"},
                   "Please specify a path to 2nd migration data block\n");
    expectRejected({"--data", "a", "--data", "", "--target", "settings", "--type", "simple"},
                   "Please specify a path to migration data\n");
    expectRejected({"--target", "settings", "--type", "redundant", "-m", "a", "-n", "b", "--data2", ""},
                   "Please specify a path to 2nd migration data block\n");
}

// ---------------------------------------------------------------------------
// Choice options

TEST(MigrateSettingsChoices, EveryTypeWordIsAccepted) {
    for (const char* type : {"simple", "checked"}) expectAccepted({"--target", "lut", "--type", type, "--data", "a"});
    expectAccepted({"--target", "lut", "--type", "redundant", "--data", "a", "--data2", "b"});
}

TEST(MigrateSettingsChoices, EveryNamedTargetIsAccepted) {
    for (const char* target : {"settings", "lut", "overlay", "calib_save", "calib_extra", "util_save",
                               "application_internal", "reboot_persistent"}) {
        expectAccepted({"--query-present", "--target", target});
    }
}

TEST(MigrateSettingsChoices, EveryCheckWordIsAccepted) {
    for (const char* check : {"settings", "lut", "overlay"}) expectAccepted(concat(kValidQuery, {"--check", check}));
}

TEST(MigrateSettingsChoices, UnknownWordsAreNamedWithTheirOption) {
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

TEST(MigrateSettingsUnexpected, UnknownOptionsAndMissingArgumentsArriveAsQuestionMark) {
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
        const ProcessResult result = run(c.args);
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_EQ(result.out, "Unexpected option 63 ?\n" + kUsage);
        EXPECT_NE(result.err.find(c.inDiagnostic), std::string::npos) << result.err;
    }
}

// ---------------------------------------------------------------------------
// --index

TEST(MigrateSettingsIndex, AcceptedForms) {
    for (const char* index : {"0", "31", "0x1f", "0X1F", "010", "4294967295", "0xffffffff", "037777777777", "+7",
                              " 7", "-0"}) {
        expectAccepted(concat(kValidQuery, {"--index", index}));
    }
    expectAccepted(concat(kValidQuery, {"-i", "5"}));
    expectAccepted(concat(kValidQuery, {"--index=0x10"}));
    expectAccepted(concat(kValidQuery, {"-i010"}));
}

TEST(MigrateSettingsIndex, RejectedFormsPrintOnlyTheUsage) {
    for (const char* index : {"12abc", "", "4294967296", "0x100000000", "-1", "-4294967295", "18446744073709551616",
                              "0x", "08", "7 ", "abc", " ", "1.0"}) {
        expectRejected(concat(kValidQuery, {"--index", index}), "");
    }
    expectRejected(concat(kValidQuery, {"-i", "-1"}), "");
    expectRejected(concat(kValidQuery, {"--index="}), "");
}

// ---------------------------------------------------------------------------
// Logging level and the run after parsing

TEST(MigrateSettingsRun, VerboseOrDebugShowsThatTheTargetIsNotAvailable) {
    for (const char* option : {"--verbose", "-v", "--debug"}) {
        SCOPED_TRACE(option);
        const ProcessResult result = run(concat(kValidQuery, {option}));
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_EQ(result.out, "Target not available\n");
        EXPECT_EQ(result.err, "");
    }
    const ProcessResult both = run(concat(kValidQuery, {"--debug", "--verbose"}));
    EXPECT_EQ(both.exitStatus, 1);
    EXPECT_EQ(both.out, "Target not available\n");
}

TEST(MigrateSettingsRun, WithoutVerboseNothingIsPrinted) {
    const ProcessResult result = run(kValidQuery);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
}

}  // namespace
