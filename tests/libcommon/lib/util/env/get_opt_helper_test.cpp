#include "lib/util/env/get_opt_helper.h"

#include <getopt.h>

#include <cstdint>
#include <cstring>
#include <initializer_list>
#include <map>
#include <regex>
#include <stdexcept>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "lib/util/log.h"
#include "lib/util/status.h"

namespace {

using testing_support::ProcessResult;
using testing_support::runInChild;
using Row = GetOptHelper::OptionSpec;
using Kind = GetOptHelper::OptionKind;

const Kind kUnknownKind = static_cast<Kind>(9);

Row row(int32_t id, const char* name, int32_t hasArg, Kind kind, const char* help = "", const char* defaultValue = "") {
    return Row{id, name, defaultValue, hasArg, help, kind, {}, nullptr};
}

Row choiceRow(int32_t id, const char* name, std::map<std::string, int32_t> values, int32_t hasArg = 1) {
    Row entry = row(id, name, hasArg, Kind::Choice);
    entry.values = std::move(values);
    return entry;
}

Row flagRow(int32_t id, const char* name, uint8_t* flag, int32_t hasArg = 0) {
    Row entry = row(id, name, hasArg, Kind::Flag);
    entry.flag = flag;
    return entry;
}

// A mutable argv with its terminating null, as getopt_long permutes it.
class Argv {
public:
    explicit Argv(const std::vector<std::string>& args) : strings_(args) {
        for (std::string& s : strings_) pointers_.push_back(s.data());
        pointers_.push_back(nullptr);
    }
    Argv(const Argv&) = delete;
    Argv& operator=(const Argv&) = delete;

    int argc() const { return static_cast<int>(strings_.size()); }
    char** argv() { return pointers_.data(); }

private:
    std::vector<std::string> strings_;
    std::vector<char*> pointers_;
};

std::string show(const char* text) { return text != nullptr ? std::string(text) : std::string("<null>"); }

// Records every plain option and the call of finish; choices go to the base.
class RecordingHelper : public GetOptHelper {
public:
    explicit RecordingHelper(const std::vector<Row>& table) : GetOptHelper(table.data(), table.size()) {}
    RecordingHelper(const Row* table, size_t count) : GetOptHelper(table, count) {}

    using GetOptHelper::longOptions;
    using GetOptHelper::options;
    using GetOptHelper::shortOptions;

    Status parseArgs(const std::vector<std::string>& args) {
        optind = 0;  // getopt keeps its position in a global
        Argv argv(args);
        return parse(argv.argc(), argv.argv());
    }

    std::string eventText() const {
        std::string text;
        for (const std::string& event : events) text += event + "\n";
        return text;
    }

    std::vector<std::string> events;
    std::map<int, Status> optionResults;  // handleOption's result by id; default STATUS_OK
    Status finishResult = STATUS_OK;

protected:
    Status handleOption(int id, const char* arg) override {
        events.push_back("option " + std::to_string(id) + " " + show(arg));
        const auto result = optionResults.find(id);
        return result == optionResults.end() ? STATUS_OK : result->second;
    }

    Status finish(char** rest, int count) override {
        std::string event = "finish";
        for (int i = 0; i < count; ++i) event += std::string(" ") + rest[i];
        events.push_back(event);
        return finishResult;
    }
};

class ChoiceRecorder : public RecordingHelper {
public:
    using RecordingHelper::RecordingHelper;

    Status choiceResult = STATUS_OK;
    Status invalidResult = STATUS_OK;

protected:
    Status handleChoice(int id, const char* arg, int value) override {
        events.push_back("choice " + std::to_string(id) + " " + show(arg) + " " + std::to_string(value));
        return choiceResult;
    }

    Status invalidChoice(int id, const char* arg) override {
        events.push_back("invalid " + std::to_string(id) + " " + show(arg));
        return invalidResult;
    }
};

// Runs a parse in a child with the log on standard output; the child prints
// the recorded events after the log and exits with the parse's status.
ProcessResult parseInChild(const std::vector<Row>& table, const std::vector<std::string>& args,
                           int logLevel = LOG_PRIORITY_WARNING) {
    return runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(logLevel);
        RecordingHelper helper(table);
        const Status status = helper.parseArgs(args);
        std::fputs(helper.eventText().c_str(), stdout);
        return static_cast<int>(status);
    });
}

bool isErrorLine(const std::string& text, const std::string& message) {
    return std::regex_match(text, std::regex("libcommon/lib/util/env/get_opt_helper:[0-9]+ " + message + "\n"));
}

const std::string kHelpIndent(26, ' ');

// ---------------------------------------------------------------------------
// Building the getopt tables

TEST(GetOptHelperTables, EmptyTableHasEmptyShortOptionsAndOnlyTheTerminator) {
    RecordingHelper helper(std::vector<Row>{});
    EXPECT_EQ(helper.shortOptions, "");
    ASSERT_EQ(helper.longOptions.size(), 1u);
    EXPECT_EQ(helper.longOptions[0].name, nullptr);
    EXPECT_EQ(helper.longOptions[0].has_arg, 0);
    EXPECT_EQ(helper.longOptions[0].flag, nullptr);
    EXPECT_EQ(helper.longOptions[0].val, 0);
    EXPECT_TRUE(helper.options.empty());
}

TEST(GetOptHelperTables, EmptyTableParseCallsEndOfOptionsThenFinishWithAllArguments) {
    RecordingHelper helper(std::vector<Row>{});
    helper.finishResult = 77;
    EXPECT_EQ(helper.parseArgs({"prog", "one", "two"}), 77u);
    EXPECT_EQ(helper.eventText(), "option -1 <null>\nfinish one two\n");
}

// Every kind of row, short and long ids, names and none: the rows that
// both option tables are built from.
std::vector<Row> mixedTable(uint8_t* seen) {
    return {
        row('a', "alpha", 0, Kind::Plain),       row('b', nullptr, 1, Kind::Plain),
        row('c', "gamma", 2, Kind::Plain),  // optional argument: one ':' only
        choiceRow(1000, "thousand", {{"x", 1}}), flagRow('d', "delta", seen),
        row('t', "text", 1, Kind::Text),         row('u', "unknown", 1, kUnknownKind),
        choiceRow('e', "", {{"y", 2}}),          row(7, "bell", 0, Kind::Plain),
        row(200, "high", 1, Kind::Plain),
    };
}

TEST(GetOptHelperTables, ShortOptionStringTakesPrintableIdsOfRegisteredRows) {
    uint8_t seen = 0;
    RecordingHelper helper(mixedTable(&seen));
    EXPECT_EQ(helper.shortOptions, "ab:c:de:");
}

TEST(GetOptHelperTables, LongOptionsHoldNamedRegisteredRowsWithNullFlagAndEndWithTerminator) {
    uint8_t seen = 0;
    const std::vector<Row> table = mixedTable(&seen);
    RecordingHelper helper(table);
    struct Expected {
        const char* name;
        int hasArg;
        int val;
    };
    const std::vector<Expected> expected = {
        {table[0].name, 0, 'a'}, {table[2].name, 2, 'c'}, {table[3].name, 1, 1000},
        {table[4].name, 0, 'd'}, {table[8].name, 0, 7},   {table[9].name, 1, 200},
    };
    ASSERT_EQ(helper.longOptions.size(), expected.size() + 1);
    for (size_t i = 0; i < expected.size(); ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(helper.longOptions[i].name, expected[i].name);  // the caller's text, not a copy
        EXPECT_EQ(helper.longOptions[i].has_arg, expected[i].hasArg);
        EXPECT_EQ(helper.longOptions[i].flag, nullptr);
        EXPECT_EQ(helper.longOptions[i].val, expected[i].val);
    }
    const struct option& last = helper.longOptions.back();
    EXPECT_EQ(last.name, nullptr);
    EXPECT_EQ(last.has_arg, 0);
    EXPECT_EQ(last.flag, nullptr);
    EXPECT_EQ(last.val, 0);
}

TEST(GetOptHelperTables, TableIsCopiedDeeply) {
    std::vector<Row> table = {choiceRow(1000, "type", {{"simple", 0}})};
    ChoiceRecorder helper(table);
    table[0].values.clear();
    table[0].values["other"] = 5;
    ASSERT_EQ(helper.options.size(), 1u);
    EXPECT_NE(&helper.options[0], &table[0]);
    EXPECT_EQ(helper.options[0].name, table[0].name);
    EXPECT_EQ(helper.options[0].values, (std::map<std::string, int32_t>{{"simple", 0}}));
    EXPECT_EQ(helper.parseArgs({"prog", "--type", "simple", "--type", "other"}), STATUS_OK);
    EXPECT_EQ(helper.eventText(), "choice 1000 simple 0\ninvalid 1000 other\noption -1 <null>\nfinish\n");
}

TEST(GetOptHelperTables, AbsurdCountThrowsLengthError) {
    const Row entry = row('a', "alpha", 0, Kind::Plain);
    try {
        RecordingHelper helper(&entry, SIZE_MAX);
        FAIL() << "no exception";
    } catch (const std::length_error& error) {
        EXPECT_STREQ(error.what(), "cannot create std::vector larger than max_size()");
    }
}

// ---------------------------------------------------------------------------
// Parsing and dispatch

const std::vector<Row> kPlainSpecs = {
    row('a', "alpha", 0, Kind::Plain),
    row('b', "bee", 1, Kind::Plain),
};

TEST(GetOptHelperParse, NoArgumentsStillEndsWithMinusOneThenFinish) {
    RecordingHelper helper(kPlainSpecs);
    EXPECT_EQ(helper.parseArgs({"prog"}), STATUS_OK);
    EXPECT_EQ(helper.eventText(), "option -1 <null>\nfinish\n");
}

TEST(GetOptHelperParse, OptionsInCommandLineOrderThenMinusOneThenFinishWithPermutedRest) {
    RecordingHelper helper(kPlainSpecs);
    EXPECT_EQ(helper.parseArgs({"prog", "-a", "pos1", "--bee", "x", "pos2", "-b", "y", "--bee=z", "--alpha", "-by"}),
              STATUS_OK);
    EXPECT_EQ(helper.eventText(),
              "option 97 <null>\n"
              "option 98 x\n"
              "option 98 y\n"
              "option 98 z\n"
              "option 97 <null>\n"
              "option 98 y\n"
              "option -1 <null>\n"
              "finish pos1 pos2\n");
}

TEST(GetOptHelperParse, DoubleDashEndsTheOptions) {
    RecordingHelper helper(kPlainSpecs);
    EXPECT_EQ(helper.parseArgs({"prog", "-a", "--", "-b", "x"}), STATUS_OK);
    EXPECT_EQ(helper.eventText(), "option 97 <null>\noption -1 <null>\nfinish -b x\n");
}

TEST(GetOptHelperParse, FinishResultIsReturned) {
    RecordingHelper helper(kPlainSpecs);
    helper.finishResult = STATUS_NOT_FOUND;
    EXPECT_EQ(helper.parseArgs({"prog", "-a"}), STATUS_NOT_FOUND);
    EXPECT_EQ(helper.eventText(), "option 97 <null>\noption -1 <null>\nfinish\n");
}

TEST(GetOptHelperParse, FirstNonZeroHandleOptionResultEndsTheParse) {
    RecordingHelper helper(kPlainSpecs);
    helper.optionResults['b'] = STATUS_OUT_OF_RANGE;
    EXPECT_EQ(helper.parseArgs({"prog", "-a", "-b", "1", "-a", "--bee", "2"}), STATUS_OUT_OF_RANGE);
    EXPECT_EQ(helper.eventText(), "option 97 <null>\noption 98 1\n");
}

TEST(GetOptHelperParse, NonZeroResultAtEndOfOptionsSkipsFinish) {
    RecordingHelper helper(kPlainSpecs);
    helper.optionResults[-1] = STATUS_FAILED;
    EXPECT_EQ(helper.parseArgs({"prog", "-a", "rest"}), STATUS_FAILED);
    EXPECT_EQ(helper.eventText(), "option 97 <null>\noption -1 <null>\n");
}

TEST(GetOptHelperParse, UnknownOptionReachesHandleOptionAsQuestionMark) {
    const ProcessResult result = parseInChild(kPlainSpecs, {"prog", "--bogus", "-a", "pos"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "option 63 <null>\noption 97 <null>\noption -1 <null>\nfinish pos\n");
    // getopt_long's own diagnostic is left on.
    EXPECT_NE(result.err.find("--bogus"), std::string::npos) << result.err;
}

TEST(GetOptHelperParse, UnknownShortOptionReachesHandleOptionAsQuestionMark) {
    const ProcessResult result = parseInChild(kPlainSpecs, {"prog", "-x"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "option 63 <null>\noption -1 <null>\nfinish\n");
    EXPECT_NE(result.err.find("'x'"), std::string::npos) << result.err;
}

TEST(GetOptHelperParse, MissingArgumentReachesHandleOptionAsQuestionMark) {
    const ProcessResult shortForm = parseInChild(kPlainSpecs, {"prog", "-a", "-b"});
    EXPECT_EQ(shortForm.exitStatus, 0);
    EXPECT_EQ(shortForm.out, "option 97 <null>\noption 63 <null>\noption -1 <null>\nfinish\n");
    EXPECT_NE(shortForm.err.find("requires an argument"), std::string::npos) << shortForm.err;

    const ProcessResult longForm = parseInChild(kPlainSpecs, {"prog", "--bee"});
    EXPECT_EQ(longForm.exitStatus, 0);
    EXPECT_EQ(longForm.out, "option 63 <null>\noption -1 <null>\nfinish\n");
    EXPECT_NE(longForm.err.find("--bee"), std::string::npos) << longForm.err;
}

TEST(GetOptHelperParse, QuestionMarkResultEndsTheParse) {
    RecordingHelper helper(kPlainSpecs);
    helper.optionResults['?'] = STATUS_INVALID_PARAMETER;
    const ProcessResult result = runInChild([&] {
        const Status status = helper.parseArgs({"prog", "--bogus", "-a"});
        std::fputs(helper.eventText().c_str(), stdout);
        return static_cast<int>(status);
    });
    EXPECT_EQ(result.exitStatus, static_cast<int>(STATUS_INVALID_PARAMETER));
    EXPECT_EQ(result.out, "option 63 <null>\n");
}

const std::vector<Row> kChoiceSpecs = {
    row('a', "alpha", 0, Kind::Plain),
    choiceRow(1000, "type", {{"simple", 0}, {"checked", 1}, {"redundant", 2}}),
    choiceRow('k', nullptr, {{"lut", 11}}),
};

TEST(GetOptHelperParse, ChoiceHitCallsHandleChoiceWithItsValue) {
    ChoiceRecorder helper(kChoiceSpecs);
    EXPECT_EQ(helper.parseArgs({"prog", "--type", "checked", "-a", "--type=redundant", "-k", "lut"}), STATUS_OK);
    EXPECT_EQ(helper.eventText(),
              "choice 1000 checked 1\n"
              "option 97 <null>\n"
              "choice 1000 redundant 2\n"
              "choice 107 lut 11\n"
              "option -1 <null>\n"
              "finish\n");
}

TEST(GetOptHelperParse, ChoiceMissCallsInvalidChoiceWithExactMatchingOnly) {
    ChoiceRecorder helper(kChoiceSpecs);
    EXPECT_EQ(
        helper.parseArgs({"prog", "--type=bogus", "--type", "Simple", "--type", "simple ", "--type", "", "-k", "lu"}),
        STATUS_OK);
    EXPECT_EQ(helper.eventText(),
              "invalid 1000 bogus\n"
              "invalid 1000 Simple\n"
              "invalid 1000 simple \n"
              "invalid 1000 \n"
              "invalid 107 lu\n"
              "option -1 <null>\n"
              "finish\n");
}

TEST(GetOptHelperParse, NonZeroChoiceResultsEndTheParse) {
    ChoiceRecorder hit(kChoiceSpecs);
    hit.choiceResult = STATUS_NOT_READY;
    EXPECT_EQ(hit.parseArgs({"prog", "--type", "simple", "-a"}), STATUS_NOT_READY);
    EXPECT_EQ(hit.eventText(), "choice 1000 simple 0\n");

    ChoiceRecorder miss(kChoiceSpecs);
    miss.invalidResult = STATUS_INVALID_PARAMETER;
    EXPECT_EQ(miss.parseArgs({"prog", "-a", "--type=bogus", "-a"}), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(miss.eventText(), "option 97 <null>\ninvalid 1000 bogus\n");
}

TEST(GetOptHelperParse, BaseHandleChoiceIsNotImplemented) {
    RecordingHelper helper(kChoiceSpecs);
    EXPECT_EQ(helper.parseArgs({"prog", "-a", "--type", "simple", "-a"}), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(helper.eventText(), "option 97 <null>\n");
}

TEST(GetOptHelperParse, BaseInvalidChoiceLogsTheLongNameAndFails) {
    const ProcessResult result = parseInChild(kChoiceSpecs, {"prog", "--type=bogus", "-a"});
    EXPECT_EQ(result.exitStatus, static_cast<int>(STATUS_INVALID_PARAMETER));
    EXPECT_TRUE(isErrorLine(result.out, "Invalid value for --type: 'bogus'")) << result.out;
}

TEST(GetOptHelperParse, BaseInvalidChoiceWithoutLongNameLogsTheIdInDecimal) {
    const std::vector<Row> nullName = {choiceRow('x', nullptr, {{"a", 1}})};
    const ProcessResult shortOnly = parseInChild(nullName, {"prog", "-x", "bogus"});
    EXPECT_EQ(shortOnly.exitStatus, static_cast<int>(STATUS_INVALID_PARAMETER));
    EXPECT_TRUE(isErrorLine(shortOnly.out, "Invalid value for -120: 'bogus'")) << shortOnly.out;

    const std::vector<Row> emptyName = {choiceRow('y', "", {{"a", 1}})};
    const ProcessResult empty = parseInChild(emptyName, {"prog", "-y", "b"});
    EXPECT_EQ(empty.exitStatus, static_cast<int>(STATUS_INVALID_PARAMETER));
    EXPECT_TRUE(isErrorLine(empty.out, "Invalid value for -121: 'b'")) << empty.out;
}

TEST(GetOptHelperParse, BaseInvalidChoiceIsSilentBelowErrorThreshold) {
    const ProcessResult result = parseInChild(kChoiceSpecs, {"prog", "--type=bogus"}, LOG_PRIORITY_CRITICAL);
    EXPECT_EQ(result.exitStatus, static_cast<int>(STATUS_INVALID_PARAMETER));
    EXPECT_EQ(result.out, "");
}

TEST(GetOptHelperParse, ChoiceWithoutArgumentThrowsLogicError) {
    const std::vector<Row> noArg = {choiceRow(1000, "kind", {{"a", 1}}, 0)};
    ChoiceRecorder withoutArg(noArg);
    EXPECT_THROW((void)withoutArg.parseArgs({"prog", "--kind"}), std::logic_error);

    const std::vector<Row> optionalArg = {choiceRow(1000, "kind", {{"a", 1}}, 2)};
    ChoiceRecorder optional(optionalArg);
    EXPECT_THROW((void)optional.parseArgs({"prog", "--kind"}), std::logic_error);
}

TEST(GetOptHelperParse, FlagRowStoresOneAndCallsNoHandler) {
    uint8_t flag = 0;
    uint8_t other = 0;
    const std::vector<Row> table = {flagRow('f', "flag", &flag), flagRow(1000, "other", &other, 1)};
    ChoiceRecorder helper(table);
    EXPECT_EQ(helper.parseArgs({"prog", "-f", "pos"}), STATUS_OK);
    EXPECT_EQ(flag, 1);
    EXPECT_EQ(other, 0);
    EXPECT_EQ(helper.eventText(), "option -1 <null>\nfinish pos\n");

    flag = 0;
    ChoiceRecorder longForm(table);
    EXPECT_EQ(longForm.parseArgs({"prog", "--flag", "--other", "value"}), STATUS_OK);
    EXPECT_EQ(flag, 1);
    EXPECT_EQ(other, 1);
    EXPECT_EQ(longForm.eventText(), "option -1 <null>\nfinish\n");
}

TEST(GetOptHelperParse, FlagRowWithNullFlagIsAcceptedWithoutEffect) {
    const std::vector<Row> table = {flagRow('f', "flag", nullptr), row('a', "alpha", 0, Kind::Plain)};
    ChoiceRecorder helper(table);
    EXPECT_EQ(helper.parseArgs({"prog", "-f", "--flag", "-a"}), STATUS_OK);
    EXPECT_EQ(helper.eventText(), "option 97 <null>\noption -1 <null>\nfinish\n");
}

TEST(GetOptHelperParse, TextAndUnknownKindRowsAreNotOptions) {
    const std::vector<Row> table = {row('t', "text", 0, Kind::Text, "Heading\n"), row('u', "unknown", 0, kUnknownKind)};
    const ProcessResult result = parseInChild(table, {"prog", "-t", "--unknown"});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "option 63 <null>\noption 63 <null>\noption -1 <null>\nfinish\n");
    EXPECT_NE(result.err.find("'t'"), std::string::npos) << result.err;
    EXPECT_NE(result.err.find("--unknown"), std::string::npos) << result.err;
}

TEST(GetOptHelperParse, FirstRowWithTheIdDecidesTheKind) {
    // 'a' is registered by its Plain row but the Text row comes first, so
    // the option is ignored; 'b' is Plain first and reaches handleOption.
    const std::vector<Row> table = {row('a', "", 0, Kind::Text, "Heading\n"), row('a', "alpha", 0, Kind::Plain),
                                    row('b', "bee", 0, Kind::Plain), row('b', "", 0, kUnknownKind)};
    RecordingHelper helper(table);
    EXPECT_EQ(helper.parseArgs({"prog", "-a", "--alpha", "-b"}), STATUS_OK);
    EXPECT_EQ(helper.eventText(), "option 98 <null>\noption -1 <null>\nfinish\n");
}

// ---------------------------------------------------------------------------
// optFor

TEST(GetOptHelperOptFor, FindsTheFirstRowWithTheCharacterAsId) {
    const std::vector<Row> table = {row('b', "base", 1, Kind::Plain, "first", "/var/x"),
                                    row('b', "other", 1, Kind::Plain, "second", "/y"),
                                    row(232, "high", 0, Kind::Plain)};
    RecordingHelper helper(table);
    const Row* found = helper.optFor('b');
    ASSERT_NE(found, nullptr);
    EXPECT_EQ(found, &helper.options[0]);
    EXPECT_EQ(found->defaultValue, table[0].defaultValue);
    EXPECT_STREQ(found->defaultValue, "/var/x");

    // The character is taken as unsigned.
    EXPECT_EQ(helper.optFor(static_cast<char>(0xE8)), &helper.options[2]);
}

TEST(GetOptHelperOptFor, MissingCharacterLogsAndReturnsNull) {
    const std::vector<Row> table = {row('b', "base", 1, Kind::Plain)};
    const ProcessResult result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        RecordingHelper helper(table);
        return helper.optFor('z') == nullptr ? 0 : 1;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_TRUE(isErrorLine(result.out, "Unable to find optFor 'z'")) << result.out;
}

TEST(GetOptHelperOptFor, IdsAbove255AreNeverFound) {
    const std::vector<Row> table = {row(1000, "type", 1, Kind::Plain), row(256 + 'b', "wide", 1, Kind::Plain)};
    const ProcessResult result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        RecordingHelper helper(table);
        const bool none = helper.optFor(static_cast<char>(1000 & 0xFF)) == nullptr && helper.optFor('b') == nullptr;
        return none ? 0 : 1;
    });
    EXPECT_EQ(result.exitStatus, 0);
    const std::regex twoLines(
        "libcommon/lib/util/env/get_opt_helper:[0-9]+ Unable to find optFor '\xE8'\n"
        "libcommon/lib/util/env/get_opt_helper:[0-9]+ Unable to find optFor 'b'\n");
    EXPECT_TRUE(std::regex_match(result.out, twoLines)) << result.out;
}

// ---------------------------------------------------------------------------
// Usage text

std::string usageOf(const std::vector<Row>& table, unsigned helpColumn = 26, unsigned width = 80) {
    RecordingHelper helper(table);
    return helper.usageText(helpColumn, width);
}

TEST(GetOptHelperUsage, EmptyTableGivesEmptyText) { EXPECT_EQ(usageOf({}), ""); }

TEST(GetOptHelperUsage, OptionPartForms) {
    uint8_t flag = 0;
    const std::vector<Row> table = {
        row('a', "alpha", 0, Kind::Plain, "Alpha help."),  choiceRow('b', "beta", {}),
        row(1000, "gamma", 1, Kind::Plain, "Gamma help."), flagRow(1001, "delta", &flag),
        row('e', nullptr, 1, Kind::Plain, "Eps help."),    row('f', "", 0, Kind::Plain, "Phi help."),
        row(1002, nullptr, 0, Kind::Plain, "Anonymous."),  row('g', nullptr, 2, Kind::Plain, "Optional."),
        row('h', "eta", 2, Kind::Plain, "Optional long."),
    };
    EXPECT_EQ(usageOf(table),
              "  -a, --alpha             Alpha help.\n"
              "  -b, --beta=arg\n"  // empty help: no padding
              "  --gamma=arg             Gamma help.\n"
              "  --delta\n"
              "  -e arg                  Eps help.\n"
              "  -f                      Phi help.\n"
              "                          Anonymous.\n"
              "  -g arg                  Optional.\n"
              "  -h, --eta=arg           Optional long.\n");
}

TEST(GetOptHelperUsage, TextRowsAreCopiedVerbatimAndUnknownKindsShowNothing) {
    const std::vector<Row> table = {
        row(0, nullptr, 0, Kind::Text, "Options:\n"),
        row('a', "alpha", 0, Kind::Plain, "Alpha help."),
        row('t', "text", 1, Kind::Text, "  no newline ", "ignored default"),
        row('u', "unknown", 1, kUnknownKind, "Hidden.", "hidden default"),
        row('b', "", 0, Kind::Plain, "B."),
        row(0, nullptr, 0, Kind::Text, ""),
    };
    EXPECT_EQ(usageOf(table),
              "Options:\n"
              "  -a, --alpha             Alpha help.\n"
              "  no newline   -b                      B.\n");
}

// Null texts count as empty ones: no help, no default, no text.
TEST(GetOptHelperUsage, NullHelpDefaultAndTextShowNothing) {
    const std::vector<Row> table = {
        row(0, nullptr, 0, Kind::Text, nullptr),
        row('a', "alpha", 1, Kind::Plain, nullptr, nullptr),
        row('b', "beta", 0, Kind::Plain, "Beta help.", nullptr),
    };
    EXPECT_EQ(usageOf(table),
              "  -a, --alpha=arg\n"
              "  -b, --beta              Beta help.\n");
}

TEST(GetOptHelperUsage, OptionPartOf24StaysOnTheLineAnd25MovesHelpToTheNextLine) {
    const std::vector<Row> table = {
        row('a', "sixteen-chars-ab", 0, Kind::Plain, "Fits."),         // col 24
        row('b', "seventeen-chars-a", 0, Kind::Plain, "Next line."),   // col 25
        row(1000, "seventeen-chars-b", 1, Kind::Plain, "Long only."),  // col 25
        row(1001, "a-name-of-thirty-characters-xx", 0, Kind::Plain, "Far."),
    };
    EXPECT_EQ(usageOf(table),
              "  -a, --sixteen-chars-ab  Fits.\n"
              "  -b, --seventeen-chars-a\n" +
                  kHelpIndent + "Next line.\n" + "  --seventeen-chars-b=arg\n" + kHelpIndent + "Long only.\n" +
                  "  --a-name-of-thirty-characters-xx\n" + kHelpIndent + "Far.\n");
}

TEST(GetOptHelperUsage, LongOptionPartWithEmptyHelpGivesAnEmptyLine) {
    const std::vector<Row> table = {row('b', "seventeen-chars-a", 0, Kind::Plain, ""),
                                    row('a', "alpha", 0, Kind::Plain, "")};
    EXPECT_EQ(usageOf(table), "  -b, --seventeen-chars-a\n\n  -a, --alpha\n");
}

TEST(GetOptHelperUsage, DefaultLines) {
    const std::vector<Row> table = {
        row('a', "alpha", 1, Kind::Plain, "Alpha help.", "/var/x"),
        row('b', "beta", 0, Kind::Plain, "Beta help.", ""),
        row('c', nullptr, 0, Kind::Plain, "", "7"),
        row('d', "seventeen-chars-a", 0, Kind::Plain, "", "long"),
        choiceRow(1000, "check", {{"settings", 0}}),
    };
    std::vector<Row> withChoiceDefault = table;
    withChoiceDefault[4].defaultValue = "settings";
    withChoiceDefault[4].help = "Check.";
    EXPECT_EQ(usageOf(withChoiceDefault),
              "  -a, --alpha=arg         Alpha help.\n" + kHelpIndent + "default: /var/x\n" +
                  "  -b, --beta              Beta help.\n"
                  "  -c\n" +
                  kHelpIndent + "default: 7\n" + "  -d, --seventeen-chars-a\n\n" + kHelpIndent + "default: long\n" +
                  "  --check=arg             Check.\n" + kHelpIndent + "default: settings\n");
}

std::string wrapped(const std::string& help, unsigned helpColumn = 26, unsigned width = 80) {
    const std::vector<Row> table = {row('a', "alpha", 0, Kind::Plain, help.c_str())};
    return usageOf(table, helpColumn, width);
}

const std::string kFirst = "  -a, --alpha             ";

TEST(GetOptHelperUsage, WrappingTable) {
    const std::string a26(26, 'a');
    const std::string b26(26, 'b');
    struct Case {
        const char* what;
        std::string help;
        std::string expected;
    };
    const std::vector<Case> cases = {
        {"52 characters fit", a26 + " " + std::string(25, 'b'), kFirst + a26 + " " + std::string(25, 'b') + "\n"},
        {"53 characters with a blank break at it (strict comparison)", a26 + " " + b26,
         kFirst + a26 + "\n" + kHelpIndent + b26 + "\n"},
        {"53 characters without a blank stay whole", std::string(53, 'x'), kFirst + std::string(53, 'x') + "\n"},
        {"the last blank before the first character that does not fit",
         std::string(50, 'w') + " " + std::string(10, 'x'),
         kFirst + std::string(50, 'w') + "\n" + kHelpIndent + std::string(10, 'x') + "\n"},
        {"a blank exactly at position 53", std::string(53, 'a') + " b",
         kFirst + std::string(53, 'a') + "\n" + kHelpIndent + "b\n"},
        {"a word longer than 53 is cut hard", std::string(60, 'h'),
         kFirst + std::string(53, 'h') + "\n" + kHelpIndent + std::string(7, 'h') + "\n"},
        {"a short word, then a hard cut", "ab " + std::string(60, 'c'),
         kFirst + "ab\n" + kHelpIndent + std::string(53, 'c') + "\n" + kHelpIndent + std::string(7, 'c') + "\n"},
        {"a blank at position 1 is still a break", "a " + std::string(60, 'c'),
         kFirst + "a\n" + kHelpIndent + std::string(53, 'c') + "\n" + kHelpIndent + std::string(7, 'c') + "\n"},
        {"a blank at position 0 is not a break", " " + std::string(60, 'h'),
         kFirst + " " + std::string(52, 'h') + "\n" + kHelpIndent + std::string(8, 'h') + "\n"},
        {"blanks and tabs after the break are skipped, those before it kept",
         std::string(40, 'a') + "  \t  " + std::string(20, 'b'),
         kFirst + std::string(40, 'a') + "  \t " + "\n" + kHelpIndent + std::string(20, 'b') + "\n"},
        {"a tab is a blank to break at", std::string(50, 'a') + "\t" + std::string(10, 'b'),
         kFirst + std::string(50, 'a') + "\n" + kHelpIndent + std::string(10, 'b') + "\n"},
        {"trailing blanks leave no empty line", "Help.   ", kFirst + "Help.   \n"},
        {"three lines", std::string(50, 'a') + " " + std::string(50, 'b') + " " + std::string(5, 'c'),
         kFirst + std::string(50, 'a') + "\n" + kHelpIndent + std::string(50, 'b') + "\n" + kHelpIndent +
             std::string(5, 'c') + "\n"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        EXPECT_EQ(wrapped(c.help), c.expected);
    }
}

TEST(GetOptHelperUsage, TrailingBlanksAtABreakAreSkippedToTheEnd) {
    // 53 characters then only blanks: the blanks after the piece are
    // skipped and nothing remains, so there is no continuation line.
    EXPECT_EQ(wrapped(std::string(53, 'a') + "    "), kFirst + std::string(53, 'a') + "\n");
}

TEST(GetOptHelperUsage, HelpColumnAndWidthAreParameters) {
    // avail = 30 - (10 + 1) = 19
    const std::vector<Row> table = {row('a', "al", 0, Kind::Plain, "one two three four five six", "x"),
                                    row('b', nullptr, 0, Kind::Plain, "short")};
    EXPECT_EQ(usageOf(table, 10, 30),
              "  -a, --al\n"
              "          one two three four\n"
              "          five six\n"
              "          default: x\n"
              "  -b      short\n");
}

}  // namespace
