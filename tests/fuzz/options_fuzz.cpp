// The tool's command line. Options ends the process on --help and on
// errors, so the parse runs through a subclass that keeps the tool's table
// and handlers but records --help instead of printing the usage and
// exiting; one object is built from a valid command line and then
// re-parsed for every input.
#include <getopt.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "fuzz_support.h"
#include "options.h"

namespace {

constexpr size_t kMaxArguments = 64;
char gProgramName[] = "migrate_settings";

class RecordingOptions : public Options {
public:
    using Options::Options;

    // The values the constructor starts from before parsing.
    void resetForParse() {
        basePath = optFor('b')->defaultValue;
        migrationType = MigrationType::simple;
        migrationTypeSet = false;
        target = kIpiStorageTargetSettings;
        targetSet = false;
        checkType = CheckType::settings;
        slotIndex = 0;
        queryPresent = false;
        ifNotPresent = false;
        dataPath.clear();
        data2Path.clear();
        verbose = false;
        debug = false;
        helpSeen = false;
    }

    int helpId() const {
        for (const OptionSpec& row : options) {
            if (row.name != nullptr && std::strcmp(row.name, "help") == 0) return row.id;
        }
        return -2;
    }

    bool helpSeen = false;

protected:
    Status handleOption(int id, const char* argument) override {
        if (id == helpId()) {
            helpSeen = true;
            return STATUS_EXIT;
        }
        return Options::handleOption(id, argument);
    }
};

RecordingOptions& parser() {
    static RecordingOptions* instance = [] {
        fuzz_support::quietProductOutput();
        opterr = 0;  // getopt_long's own messages would flood standard error
        std::string targetName;
        for (uint32_t value = 0; value < kStorageTargetCount && targetName.empty(); ++value) {
            if (const char* name = commandLineName(static_cast<StorageTarget>(value))) targetName = name;
        }
        FUZZ_CHECK(!targetName.empty());
        static std::string targetArg = "--target=" + targetName;
        static char query[] = "--query-present";
        char* argv[] = {gProgramName, targetArg.data(), query, nullptr};
        optind = 0;
        return new RecordingOptions(3, argv);
    }();
    return *instance;
}

}  // namespace

// Arguments are the input split at NUL bytes.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    RecordingOptions& options = parser();

    std::vector<std::string> words(1);
    for (size_t i = 0; i < size && words.size() <= kMaxArguments; ++i) {
        if (data[i] == 0) {
            words.emplace_back();
        } else {
            words.back().push_back(static_cast<char>(data[i]));
        }
    }
    if (size == 0) words.clear();
    std::vector<char*> argv{gProgramName};
    for (std::string& word : words) argv.push_back(word.data());
    argv.push_back(nullptr);

    options.resetForParse();
    optind = 0;
    const Status status = options.parse(static_cast<int>(argv.size() - 1), argv.data());

    FUZZ_CHECK(status == STATUS_OK || status == STATUS_INVALID_PARAMETER || status == STATUS_EXIT);
    FUZZ_CHECK((status == STATUS_EXIT) == options.helpSeen);
    FUZZ_CHECK(static_cast<uint32_t>(options.migrationType) <= 2);
    FUZZ_CHECK(static_cast<uint32_t>(options.checkType) <= 2);
    FUZZ_CHECK(static_cast<uint32_t>(options.target) < kStorageTargetCount);
    if (options.targetSet) FUZZ_CHECK(commandLineName(options.target) != nullptr);
    if (status == STATUS_OK) {
        FUZZ_CHECK(options.targetSet);
        if (!options.queryPresent) {
            FUZZ_CHECK(options.migrationTypeSet);
            FUZZ_CHECK(!options.dataPath.empty());
            if (options.migrationType == MigrationType::redundant) FUZZ_CHECK(!options.data2Path.empty());
        }
    }
    return 0;
}
