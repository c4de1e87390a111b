#include "options.h"

#include "slot_index.h"

#include <array>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>
#include <utility>

namespace {

constexpr int kOptionBase = 'b';
constexpr int kOptionHelp = 'h';
constexpr int kOptionIndex = 'i';
constexpr int kOptionData = 'm';
constexpr int kOptionData2 = 'n';
constexpr int kOptionVerbose = 'v';
constexpr int kOptionType = 1000;
constexpr int kOptionTarget = 1001;
constexpr int kOptionCheck = 1003;
constexpr int kOptionDebug = 1004;
constexpr int kOptionIfNotPresent = 1005;
constexpr int kOptionQueryPresent = 1006;

constexpr unsigned kHelpColumn = 26;
constexpr unsigned kUsageWidth = 80;

using Kind = GetOptHelper::OptionKind;
using Choices = std::map<std::string, int32_t>;

template <typename Value, size_t N>
Choices choices(const std::pair<const char*, Value> (&words)[N]) {
    Choices map;
    for (const auto& [word, value] : words) map.emplace(word, static_cast<int32_t>(value));
    return map;
}

constexpr std::pair<const char*, MigrationType> kTypeWords[] = {
    {"simple", MigrationType::simple}, {"checked", MigrationType::checked}, {"redundant", MigrationType::redundant}};
constexpr std::pair<const char*, CheckType> kCheckWords[] = {
    {"settings", CheckType::settings}, {"lut", CheckType::lut}, {"overlay", CheckType::overlay}};

// Only the targets that have a command-line name can be chosen.
Choices targetChoices() {
    Choices map;
    for (uint32_t value = 0; value < kStorageTargetCount; ++value) {
        if (const char* name = commandLineName(static_cast<StorageTarget>(value))) {
            map.emplace(name, static_cast<int32_t>(value));
        }
    }
    return map;
}

constexpr size_t kOptionCount = 12;

// In the order of the usage text. Made when an Options is, not at start-up:
// the choice maps are built on the heap.
std::array<GetOptHelper::OptionSpec, kOptionCount> optionTable() {
    return {{
        {kOptionBase, "base", "/var/nonvolatile/app", 1, "Base path for storage.", Kind::Plain, {}, nullptr},
        {kOptionType, "type", "", 1, "Migration type to perform", Kind::Choice, choices(kTypeWords), nullptr},
        {kOptionTarget, "target", "", 1, "Target to assign result to", Kind::Choice, targetChoices(), nullptr},
        {kOptionCheck, "check", "settings", 1, "Check to apply in checked/redundant mode", Kind::Choice,
         choices(kCheckWords), nullptr},
        {kOptionQueryPresent,
         "query-present",
         "",
         0,
         "Don't migrate, return success if target exists, failure otherwise.  For scripting.",
         Kind::Plain,
         {},
         nullptr},
        {kOptionIfNotPresent, "if-not-present", "", 0, "Only migrate if not already present", Kind::Plain, {}, nullptr},
        {kOptionIndex, "index", "0", 1, "Slot index within target.", Kind::Plain, {}, nullptr},
        {kOptionData, "data", "", 1, "Path to file to read for migration data.", Kind::Plain, {}, nullptr},
        {kOptionData2,
         "data2",
         "",
         1,
         "Path to file to read for 2nd block of migration data.  Required for 'redundant' migration type.",
         Kind::Plain,
         {},
         nullptr},
        {kOptionVerbose, "verbose", "", 0, "Runs with extra logging.", Kind::Plain, {}, nullptr},
        {kOptionDebug, "debug", "", 0, "Runs with extra debug logging.", Kind::Plain, {}, nullptr},
        {kOptionHelp, "help", "", 0, "Print usage instructions.", Kind::Plain, {}, nullptr},
    }};
}

}  // namespace

// The base copies the rows before the temporary table goes.
Options::Options(int argc, char** argv) : GetOptHelper(optionTable().data(), kOptionCount) {
    if (const OptionSpec* base = optFor(kOptionBase)) basePath = base->defaultValue;
    programName = argv[0];
    if (parse(argc, argv) != STATUS_OK) printUsage(1);
}

Options::~Options() = default;

Status Options::handleOption(int id, const char* argument) {
    switch (id) {
        case -1:
            return STATUS_OK;
        case kOptionBase:
            basePath = argument;
            return STATUS_OK;
        case kOptionHelp:
            printUsage(0);
        case kOptionIndex:
            return parseSlotIndex(argument, slotIndex);
        case kOptionData:
            dataPath = argument;
            return STATUS_OK;
        case kOptionData2:
            data2Path = argument;
            return STATUS_OK;
        case kOptionVerbose:
            verbose = true;
            return STATUS_OK;
        case kOptionDebug:
            debug = true;
            return STATUS_OK;
        case kOptionIfNotPresent:
            ifNotPresent = true;
            return STATUS_OK;
        case kOptionQueryPresent:
            queryPresent = true;
            return STATUS_OK;
        default:
            // getopt_long has already explained '?' on standard error.
            std::printf("Unexpected option %d %c\n", id, id);
            return STATUS_INVALID_PARAMETER;
    }
}

Status Options::handleChoice(int id, const char*, int value) {
    switch (id) {
        case kOptionType:
            migrationType = static_cast<MigrationType>(value);
            migrationTypeSet = true;
            return STATUS_OK;
        case kOptionTarget:
            target = static_cast<StorageTarget>(value);
            targetSet = true;
            return STATUS_OK;
        case kOptionCheck:
            // No "set" flag: the start value already means the settings check.
            checkType = static_cast<CheckType>(value);
            return STATUS_OK;
        default:
            std::printf("Invalid option %d\n", id);
            return STATUS_INVALID_PARAMETER;
    }
}

Status Options::invalidChoice(int id, const char* argument) {
    switch (id) {
        case kOptionType:
            std::printf("Invalid migration type '%s'\n", argument);
            break;
        case kOptionTarget:
            std::printf("Invalid target type '%s'\n", argument);
            break;
        case kOptionCheck:
            std::printf("Invalid check type '%s'\n", argument);
            break;
        default:
            std::printf("Invalid option %d\n", id);
            break;
    }
    return STATUS_INVALID_PARAMETER;
}

// The positional arguments are ignored.
Status Options::finish(char**, int) {
    const char* missing = nullptr;
    if (!targetSet) {
        missing = "Please specify a target";
    } else if (queryPresent) {
        return STATUS_OK;  // a query needs nothing else
    } else if (!migrationTypeSet) {
        missing = "Please specify a migration type";
    } else if (dataPath.empty()) {
        missing = "Please specify a path to migration data";
    } else if (migrationType == MigrationType::redundant && data2Path.empty()) {
        missing = "Please specify a path to 2nd migration data block";
    } else {
        return STATUS_OK;
    }
    std::printf("%s\n", missing);
    return STATUS_INVALID_PARAMETER;
}

void Options::printUsage(int status) const {
    std::printf("Usage: %s [OPTIONS]\n", programName != nullptr ? programName : "");
    std::fputs(usageText(kHelpColumn, kUsageWidth).c_str(), stdout);
    std::fputs("\n", stdout);
    std::exit(status);
}
