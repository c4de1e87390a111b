// A one-shot write into a one-slot dual-file target against the floor: the
// same system calls with nothing else (floor_commit.h), in the same scratch
// directory. Both alternate between two copies, as the store does.
//
// The commit syncs the whole file system, so its time includes whatever
// else the machine has left dirty. Each timed write therefore starts after
// an untimed sync(), as on a device where nothing else writes. On a busy
// host single syncs still stall now and then, so the figure is the median
// of many short repetitions, which such stalls cannot move, rather than
// the mean of one long one. The stores live across repetitions and are
// primed with two writes, so every timed write replaces an existing copy.
#include <benchmark/benchmark.h>
#include <unistd.h>
#include <map>
#include <memory>
#include <vector>

#include "floor_commit.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"

namespace {

std::vector<uint8_t> blob(size_t size) {
    std::vector<uint8_t> bytes(size);
    for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<uint8_t>(i * 31 + 7);
    return bytes;
}

// What one write writes, and where; one per benchmark and size, kept until
// the process ends.
struct StoreWriter {
    explicit StoreWriter(size_t size) : bytes(blob(size)), target(dir / "store", 1) {}
    Status write() { return target.getSlot(0)->write(bytes.data(), bytes.size()); }

    testing_support::ScratchDir dir;
    std::vector<uint8_t> bytes;
    Storage::DualFileTarget target;
};

struct FloorWriter {
    explicit FloorWriter(size_t size) : bytes(blob(size)), copies{makeCopy("1"), makeCopy("2")} {}
    bench::FloorCopy makeCopy(const char* name) {
        std::filesystem::create_directories(dir / name);
        return bench::FloorCopy(dir / name);
    }
    Status write() {
        const int error = bench::floorCommit(copies[next], bytes.data(), bytes.size());
        next ^= 1;
        return static_cast<Status>(error);
    }

    testing_support::ScratchDir dir;
    std::vector<uint8_t> bytes;
    bench::FloorCopy copies[2];
    size_t next = 0;
};

template <typename Writer>
Writer& primedWriter(size_t size) {
    static std::map<size_t, std::unique_ptr<Writer>> writers;
    std::unique_ptr<Writer>& writer = writers[size];
    if (!writer) {
        writer = std::make_unique<Writer>(size);
        for (int copy = 0; copy < 2; ++copy) (void)writer->write();  // a failure shows in the timed writes
    }
    return *writer;
}

template <typename Writer>
void timedWrites(benchmark::State& state) {
    Writer& writer = primedWriter<Writer>(static_cast<size_t>(state.range(0)));
    for (auto _ : state) {
        state.PauseTiming();
        ::sync();
        state.ResumeTiming();
        if (writer.write() != STATUS_OK) {
            state.SkipWithError("the write failed");
            break;
        }
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}

void write_store(benchmark::State& state) { timedWrites<StoreWriter>(state); }
void write_floor(benchmark::State& state) { timedWrites<FloorWriter>(state); }

void writeSizes(benchmark::internal::Benchmark* benchmark) {
    benchmark->Arg(4 << 10)->Arg(64 << 10)->Arg(1 << 20)->Iterations(5)->Repetitions(400)->UseRealTime()->Unit(
        benchmark::kMicrosecond);
}

}  // namespace

BENCHMARK(write_store)->Apply(writeSizes);
BENCHMARK(write_floor)->Apply(writeSizes);
