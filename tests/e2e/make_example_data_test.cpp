// The example data generator: what it writes at the edges of each kind's
// SIZE, and that every refusal says why on standard error.

#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "scratch_dir.h"
#include "tool_run.h"

namespace {

namespace fs = std::filesystem;
using e2e::concat;
using e2e::ProcessResult;
using testing_support::readBytes;
using testing_support::ScratchDir;

const std::string kUsage = "Usage: make_example_data settings|lut|overlay FILE [SIZE]\n";

class MakeExampleData : public ::testing::Test {
protected:
    ScratchDir scratch;
    const fs::path file = scratch / "data.bin";

    static ProcessResult generate(const std::vector<std::string>& args) {
        return testing_support::runProgram(concat({MAKE_EXAMPLE_DATA_BIN}, args));
    }
};

struct Written {
    const char* name;
    std::vector<std::string> args;  // after KIND FILE
    const char* kind;
    size_t fileSize;
};

class MakeExampleDataWrites : public MakeExampleData, public ::testing::WithParamInterface<Written> {};

TEST_P(MakeExampleDataWrites, SizeBoundaries) {
    const Written& row = GetParam();
    const ProcessResult result = generate(concat({row.kind, file.string()}, row.args));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(readBytes(file).size(), row.fileSize);
}

INSTANTIATE_TEST_SUITE_P(Kinds, MakeExampleDataWrites,
                         ::testing::Values(Written{"SettingsDefault", {}, "settings", 4096},
                                           Written{"SettingsSmallest", {"4"}, "settings", 4},
                                           Written{"SettingsPadded", {"5"}, "settings", 8},
                                           Written{"SettingsLargest", {"65535"}, "settings", 65536},
                                           Written{"SettingsHex", {"0x100"}, "settings", 256},
                                           Written{"Lut", {}, "lut", 19784},
                                           Written{"OverlayDefault", {}, "overlay", 284 + 1024},
                                           Written{"OverlayEmpty", {"0"}, "overlay", 284},
                                           Written{"OverlayOctal", {"010"}, "overlay", 284 + 8}),
                         [](const ::testing::TestParamInfo<Written>& info) { return std::string(info.param.name); });

struct Refused {
    const char* name;
    std::vector<std::string> args;  // "FILE" stands for the scratch file
    const char* reason;
};

class MakeExampleDataRefuses : public MakeExampleData, public ::testing::WithParamInterface<Refused> {};

TEST_P(MakeExampleDataRefuses, WithTheReasonOnStandardError) {
    const Refused& row = GetParam();
    std::vector<std::string> args = row.args;
    for (std::string& arg : args) {
        if (arg == "FILE") arg = file.string();
    }
    const ProcessResult result = generate(args);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "make_example_data: " + std::string(row.reason) + "\n" + kUsage);
    EXPECT_FALSE(fs::exists(file));
}

INSTANTIATE_TEST_SUITE_P(
    CommandLines, MakeExampleDataRefuses,
    ::testing::Values(
        Refused{"NoArguments", {}, "expected a kind and a file name"},
        Refused{"NoFile", {"settings"}, "expected a kind and a file name"},
        Refused{"TooMany", {"settings", "FILE", "8", "9"}, "too many arguments"},
        Refused{"UnknownKind", {"blob", "FILE"}, "unknown kind 'blob' (settings, lut or overlay)"},
        Refused{"LutWithSize", {"lut", "FILE", "19784"}, "lut takes no SIZE: a lookup table is always 19784 bytes"},
        Refused{"SizeNotANumber", {"settings", "FILE", "big"}, "SIZE 'big' is not a number"},
        Refused{"SizeTrailingText", {"settings", "FILE", "12k"}, "SIZE '12k' is not a number"},
        Refused{"SizeEmpty", {"overlay", "FILE", ""}, "SIZE '' is not a number"},
        Refused{"SizeNegative", {"overlay", "FILE", "-1"}, "SIZE '-1' is not a number"},
        Refused{"SizeLeadingBlank", {"overlay", "FILE", " 1"}, "SIZE ' 1' is not a number"},
        Refused{"SettingsTooShort", {"settings", "FILE", "3"}, "settings length must be 4 to 65535, not 3"},
        Refused{"SettingsTooLong", {"settings", "FILE", "65536"}, "settings length must be 4 to 65535, not 65536"},
        Refused{"SizeOverflows",
                {"settings", "FILE", "99999999999999999999999"},
                "settings length must be 4 to 65535, not 99999999999999999999999"},
        Refused{
            "OverlayTooLarge", {"overlay", "FILE", "67108865"}, "overlay payload must be 0 to 67108864, not 67108865"}),
    [](const ::testing::TestParamInfo<Refused>& info) { return std::string(info.param.name); });

TEST_F(MakeExampleData, UnwritableFileIsNamedWithTheReason) {
    const fs::path missing = scratch / "missing" / "data.bin";
    const ProcessResult result = generate({"lut", missing.string()});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "make_example_data: cannot write '" + missing.string() + "': No such file or directory\n");
}

// A full device takes what fits in the stream's buffer and fails at the
// close; a block larger than the buffer fails at the write.
TEST_F(MakeExampleData, FailedWritesAreNamedWithTheReason) {
    if (!fs::exists("/dev/full")) GTEST_SKIP() << "needs /dev/full";
    for (const std::vector<std::string>& args :
         {std::vector<std::string>{"settings", "/dev/full", "4"}, std::vector<std::string>{"lut", "/dev/full"}}) {
        const ProcessResult result = generate(args);
        EXPECT_EQ(result.exitStatus, 1) << args[0];
        EXPECT_EQ(result.out, "") << args[0];
        EXPECT_EQ(result.err, "make_example_data: cannot write '/dev/full': No space left on device\n") << args[0];
    }
}

TEST_F(MakeExampleData, HelpSaysWhatSizeMeansForEachKind) {
    for (const char* option : {"--help", "-h"}) {
        const ProcessResult result = generate({option});
        EXPECT_EQ(result.exitStatus, 0) << option;
        EXPECT_EQ(result.err, "") << option;
        EXPECT_EQ(result.out, kUsage +
                                  "\n"
                                  "Writes a valid example migration data file for migrate_settings.\n"
                                  "\n"
                                  "  settings FILE [SIZE]  settings block declaring SIZE bytes (4 to 65535, default\n"
                                  "                        4096), padded with 0xFF to a multiple of 4 bytes\n"
                                  "  lut FILE              lookup table of 19784 bytes; takes no SIZE\n"
                                  "  overlay FILE [SIZE]   overlay: 284-byte header, then SIZE payload bytes\n"
                                  "                        (0 to 67108864, default 1024)\n"
                                  "\n"
                                  "SIZE is decimal, 0x-prefixed hex or 0-prefixed octal.\n")
            << option;
    }
}

}  // namespace
