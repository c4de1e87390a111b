// The command line of migrate_settings.
//
// Constructing an Options either yields a complete, validated set of
// settings or ends the process: "--help" exits 0 after the usage text; an
// unknown option, a bad value or a missing required option exits 1 after
// its message (if any) and the usage text. All of this goes to standard
// output with printf, not to the log. A repeated option overwrites the
// earlier value.
#pragma once

#include <cstdint>
#include <string>

#include "lib/util/env/get_opt_helper.h"
#include "lib/util/status.h"
#include "storage_target_id.h"

// The values index tables elsewhere and are fixed.
enum class MigrationType : uint32_t { simple = 0, checked = 1, redundant = 2 };
enum class CheckType : uint32_t { settings = 0, lut = 1, overlay = 2 };

class Options : public GetOptHelper {
public:
    // Parses argc/argv; returns only when the command line is complete.
    // argv[0] must outlive the object.
    Options(int argc, char** argv);
    ~Options() override;

    // Prints "Usage: <program> [OPTIONS]", the option list and a blank line
    // to standard output, then exits with status.
    [[noreturn]] void printUsage(int status) const;

    std::string basePath;
    MigrationType migrationType = MigrationType::simple;  // meaningful when migrationTypeSet
    bool migrationTypeSet = false;
    StorageTarget target = kIpiStorageTargetSettings;  // meaningful when targetSet
    bool targetSet = false;
    CheckType checkType = CheckType::settings;
    uint32_t slotIndex = 0;
    bool queryPresent = false;
    bool ifNotPresent = false;
    std::string dataPath;
    std::string data2Path;
    bool verbose = false;
    bool debug = false;
    const char* programName = nullptr;

protected:
    Status handleOption(int id, const char* argument) override;
    Status finish(char** rest, int restCount) override;
    Status handleChoice(int id, const char* argument, int value) override;
    Status invalidChoice(int id, const char* argument) override;
};
