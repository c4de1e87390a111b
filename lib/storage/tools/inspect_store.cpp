// inspect_store: shows what the dual-file stores (or the boot-vector
// record) hold, and why a slot is not present, without changing anything.
#include <cstdio>

#include "inspect_options.h"
#include "inspect_run.h"
#include "lib/util/log.h"

int main(int argc, char** argv) {
    // Standard output carries the report or the dumped bytes alone.
    setLogOutput(LOG_OUTPUT_STDERR);
    InspectOptions options;
    if (options.parseCommandLine(argc, argv) != STATUS_OK) {
        if (!options.error.empty()) std::fprintf(stderr, "%s: %s\n", options.programName, options.error.c_str());
        std::fputs(options.usage().c_str(), stderr);
        return kInspectUsage;
    }
    if (options.help) {
        std::fputs(options.usage().c_str(), stdout);
        return kInspectClean;
    }
    if (options.bootVector) return reportBootVector(options.json);
    if (options.dump) return dumpSlot(options);
    return reportStores(options);
}
