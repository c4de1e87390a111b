#include "lib/util/log.h"
#include "options.h"

int main(int argc, char** argv) {
    setLogOutput(LOG_OUTPUT_STDOUT);

    const Options options(argc, argv);
    if (options.debug) {
        setLogLevel(LOG_PRIORITY_DEBUG);
    } else if (options.verbose) {
        setLogLevel(LOG_PRIORITY_INFO);
    }

    // No storage target is registered yet, so none is available.
    LOGI << "Target not available";
    return 1;
}
