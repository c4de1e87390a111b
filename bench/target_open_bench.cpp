// Opening populated stores: one dual-file target, and the whole registry as
// the tool builds it on every run. Opening checksums both copies of every
// slot, so its cost should follow the stored bytes. The files are in the
// page cache (they were just written): these are warm openings. Fifteen
// repetitions: the registry's child processes make single runs vary on a
// busy host.
#include <benchmark/benchmark.h>
#include <map>
#include <memory>
#include <utility>

#include "lib/storage/dual_file_target.h"
#include "populated_stores.h"
#include "quiet_stderr.h"
#include "scratch_dir.h"
#include "target_registry.h"

namespace {

// A store populated once per process and shape, however often the library
// calls the benchmark; removed at exit.
struct Populated {
    testing_support::ScratchDir dir;
    Status status = STATUS_OK;
    std::string problem;
    uint64_t storedBytes = 0;
};

const Populated& populatedTarget(size_t slotCount, size_t blobSize) {
    static std::map<std::pair<size_t, size_t>, std::unique_ptr<Populated>> cache;
    std::unique_ptr<Populated>& entry = cache[{slotCount, blobSize}];
    if (!entry) {
        entry = std::make_unique<Populated>();
        entry->status = bench::populateDualFileTarget(entry->dir / "store", slotCount, blobSize);
        entry->storedBytes = 2 * uint64_t{slotCount} * blobSize;
    }
    return *entry;
}

const Populated& populatedRegistry(size_t scale) {
    static std::map<size_t, std::unique_ptr<Populated>> cache;
    std::unique_ptr<Populated>& entry = cache[scale];
    if (!entry) {
        entry = std::make_unique<Populated>();
        entry->status = bench::populateRegistryStores(entry->dir.path(), scale, entry->storedBytes);
        if (entry->status == STATUS_OK) {
            const bench::QuietStderr quiet;
            entry->problem = bench::checkRegistryPopulated(entry->dir.path());
        }
    }
    return *entry;
}

void reportStoredBytes(benchmark::State& state, uint64_t storedBytes) {
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * storedBytes));
    state.counters["stored_bytes"] = static_cast<double>(storedBytes);
}

// Arguments: slot count, blob size.
void open_dual_file_target(benchmark::State& state) {
    const size_t slotCount = static_cast<size_t>(state.range(0));
    const Populated& store = populatedTarget(slotCount, static_cast<size_t>(state.range(1)));
    if (store.status != STATUS_OK) {
        state.SkipWithError("populating the store failed");
        return;
    }
    const std::filesystem::path base = store.dir / "store";
    for (auto _ : state) {
        Storage::DualFileTarget target(base, slotCount);
        benchmark::DoNotOptimize(target);
    }
    reportStoredBytes(state, store.storedBytes);
}

// Argument: the factor applied to every typical blob size.
void open_registry(benchmark::State& state) {
    const Populated& stores = populatedRegistry(static_cast<size_t>(state.range(0)));
    if (stores.status != STATUS_OK || !stores.problem.empty()) {
        state.SkipWithError(stores.problem.empty() ? "populating the stores failed" : stores.problem.c_str());
        return;
    }
    const bench::QuietStderr quiet;
    for (auto _ : state) {
        TargetRegistry registry;
        registerTargets(stores.dir.path(), registry);
        benchmark::DoNotOptimize(registry);
    }
    reportStoredBytes(state, stores.storedBytes);
}

}  // namespace

BENCHMARK(open_dual_file_target)
    ->Args({26, 19784})
    ->Args({8, 1 << 20})
    ->Repetitions(15)
    ->UseRealTime()
    ->Unit(benchmark::kMicrosecond);
BENCHMARK(open_registry)->Arg(1)->Arg(10)->Arg(100)->Repetitions(15)->UseRealTime()->Unit(benchmark::kMicrosecond);
