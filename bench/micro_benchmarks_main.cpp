// The micro-benchmarks' entry point: the library's own, except that the
// store's log lines go to standard error instead of the system log.
#include <benchmark/benchmark.h>

#include "lib/util/log.h"

int main(int argc, char** argv) {
    setLogOutput(LOG_OUTPUT_STDERR);
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    return 0;
}
