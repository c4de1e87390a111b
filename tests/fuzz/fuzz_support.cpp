#include "fuzz_support.h"

#include "lib/util/log.h"

namespace fuzz_support {

void quietProductOutput() {
    static const bool done = [] {
        // Standard output carries nothing the fuzzers look at.
        if (std::freopen("/dev/null", "w", stdout) == nullptr) std::abort();
        Syslog::outputMode = LOG_OUTPUT_STDOUT;
        Syslog::threshold = LOG_PRIORITY_DEBUG;
        return true;
    }();
    (void)done;
}

}  // namespace fuzz_support
