// The command line of inspect_store.
//
// Parsing never prints and never exits: a bad command line leaves its
// message in `error` for the caller to print with the usage text.
#pragma once

#include <cstdint>
#include <string>

#include "lib/util/env/get_opt_helper.h"
#include "lib/util/status.h"
#include "target_registry.h"

class InspectOptions : public GetOptHelper {
public:
    InspectOptions();
    ~InspectOptions() override;

    // STATUS_OK for a usable command line (or --help), else
    // STATUS_INVALID_PARAMETER with the reason in `error` (empty when
    // getopt_long has already explained it on standard error).
    [[nodiscard]] Status parseCommandLine(int argc, char** argv);

    // "Usage: <program> ..." with the option list.
    std::string usage() const;

    std::string basePath;
    const DualFileRow* target = nullptr;  // --target, else every dual-file target
    bool indexSet = false;
    uint32_t slotIndex = 0;
    bool json = false;
    bool dump = false;
    std::string dumpPath;  // "-": standard output
    bool bootVector = false;
    bool help = false;
    std::string error;
    const char* programName = "inspect_store";

protected:
    Status handleOption(int id, const char* argument) override;
    Status finish(char** rest, int restCount) override;
    Status handleChoice(int id, const char* argument, int value) override;
    Status invalidChoice(int id, const char* argument) override;

private:
    bool baseSet_ = false;
};
