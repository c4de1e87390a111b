#include "inspect_options.h"

#include <array>
#include <map>

#include "slot_index.h"

namespace {

constexpr int kOptionBase = 'b';
constexpr int kOptionHelp = 'h';
constexpr int kOptionIndex = 'i';
constexpr int kOptionTarget = 1001;
constexpr int kOptionJson = 1002;
constexpr int kOptionDump = 1003;
constexpr int kOptionBootVector = 1004;

constexpr unsigned kHelpColumn = 26;
constexpr unsigned kUsageWidth = 80;

using Kind = GetOptHelper::OptionKind;

// The dual-file targets, by their command-line names; the value is the row.
std::map<std::string, int32_t> targetChoices() {
    std::map<std::string, int32_t> choices;
    const DualFileRows& rows = dualFileRows();
    for (size_t i = 0; i < rows.size(); ++i) choices.emplace(commandLineName(rows[i].id), static_cast<int32_t>(i));
    return choices;
}

constexpr size_t kOptionCount = 7;

std::array<GetOptHelper::OptionSpec, kOptionCount> optionTable() {
    return {{
        {kOptionBase, "base", "/var/nonvolatile/app", 1, "Base path for storage.", Kind::Plain, {}, nullptr},
        {kOptionTarget, "target", "", 1, "Inspect only this target.", Kind::Choice, targetChoices(), nullptr},
        {kOptionIndex,
         "index",
         "",
         1,
         "Inspect only this slot of the target (decimal, 0x hex or 0 octal).",
         Kind::Plain,
         {},
         nullptr},
        {kOptionJson, "json", "", 0, "Print one JSON document instead of lines.", Kind::Plain, {}, nullptr},
        {kOptionDump, "dump", "", 1, "Write the slot's data to FILE ('-': standard output).", Kind::Plain, {}, nullptr},
        {kOptionBootVector,
         "boot-vector",
         "",
         0,
         "Inspect the boot-vector record instead of the stores.",
         Kind::Plain,
         {},
         nullptr},
        {kOptionHelp, "help", "", 0, "Print usage instructions.", Kind::Plain, {}, nullptr},
    }};
}

}  // namespace

// The base copies the rows before the temporary table goes.
InspectOptions::InspectOptions() : GetOptHelper(optionTable().data(), kOptionCount) {
    if (const OptionSpec* base = optFor(kOptionBase)) basePath = base->defaultValue;
}

InspectOptions::~InspectOptions() = default;

Status InspectOptions::parseCommandLine(int argc, char** argv) {
    if (argc > 0) programName = argv[0];
    return parse(argc, argv);
}

std::string InspectOptions::usage() const {
    const std::string program = programName;
    return "Usage: " + program + " [-b|--base=DIR] [--target=NAME [-i|--index=N]] [--json]\n       " + program +
           " [-b|--base=DIR] --target=NAME [-i|--index=N] --dump=FILE\n       " + program +
           " --boot-vector [--json]\n       " + program + " -h|--help\n" + usageText(kHelpColumn, kUsageWidth);
}

Status InspectOptions::handleOption(int id, const char* argument) {
    switch (id) {
        case -1:
            return STATUS_OK;
        case kOptionBase:
            basePath = argument;
            baseSet_ = true;
            return STATUS_OK;
        case kOptionHelp:
            help = true;
            return STATUS_OK;
        case kOptionIndex:
            indexSet = true;
            if (parseSlotIndex(argument, slotIndex) == STATUS_OK) return STATUS_OK;
            error = std::string("Invalid slot index '") + argument + "'";
            return STATUS_INVALID_PARAMETER;
        case kOptionJson:
            json = true;
            return STATUS_OK;
        case kOptionDump:
            dump = true;
            dumpPath = argument;
            return STATUS_OK;
        case kOptionBootVector:
            bootVector = true;
            return STATUS_OK;
        default:
            // getopt_long has already explained it on standard error.
            return STATUS_INVALID_PARAMETER;
    }
}

Status InspectOptions::handleChoice(int, const char*, int value) {
    target = &dualFileRows()[static_cast<size_t>(value)];
    return STATUS_OK;
}

Status InspectOptions::invalidChoice(int, const char* argument) {
    error = std::string("Invalid target '") + argument + "'";
    return STATUS_INVALID_PARAMETER;
}

Status InspectOptions::finish(char** rest, int restCount) {
    if (help) {
        error.clear();
    } else if (restCount > 0) {
        error = std::string("Unexpected argument '") + rest[0] + "'";
    } else if (bootVector && (baseSet_ || target != nullptr || indexSet || dump)) {
        error = "--boot-vector takes no other option but --json";
    } else if (indexSet && target == nullptr) {
        error = "--index needs --target";
    } else if (dump && target == nullptr) {
        error = "--dump needs --target";
    } else if (dump && json) {
        error = "--dump and --json exclude each other";
    } else if (dump && dumpPath.empty()) {
        error = "--dump needs a file name ('-' for standard output)";
    } else if (target != nullptr && slotIndex >= target->slotCount) {
        error = "Slot index " + std::to_string(slotIndex) + " out of range: " + commandLineName(target->id) +
                " has slots 0 to " + std::to_string(target->slotCount - 1);
    } else {
        return STATUS_OK;
    }
    return error.empty() ? STATUS_OK : STATUS_INVALID_PARAMETER;
}
