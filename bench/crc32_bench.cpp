// CRC-32 throughput on the same buffers: the project's crc32, zlib's crc32
// and the classic loop over one 256-entry table, one byte per step.
#include <benchmark/benchmark.h>
#include <zlib.h>
#include <array>
#include <cstdint>
#include <vector>

#include "lib/util/crc32.h"

namespace {

constexpr std::array<uint32_t, 256> makeByteTable() {
    std::array<uint32_t, 256> table{};
    for (uint32_t byte = 0; byte < 256; ++byte) {
        uint32_t value = byte;
        for (int bit = 0; bit < 8; ++bit) value = (value & 1u) ? (value >> 1) ^ 0xEDB88320u : value >> 1;
        table[byte] = value;
    }
    return table;
}

constexpr std::array<uint32_t, 256> kByteTable = makeByteTable();

uint32_t bytewiseCrc32(const uint8_t* data, size_t length) {
    uint32_t state = 0xFFFFFFFFu;
    for (size_t i = 0; i < length; ++i) state = (state >> 8) ^ kByteTable[(state ^ data[i]) & 0xFFu];
    return ~state;
}

uint32_t zlibCrc32(const uint8_t* data, size_t length) {
    return static_cast<uint32_t>(::crc32(0ul, data, static_cast<uInt>(length)));
}

std::vector<uint8_t> patternBuffer(size_t size) {
    std::vector<uint8_t> bytes(size);
    uint32_t x = 2463534242u;  // xorshift: no structure a CRC loop could exploit
    for (uint8_t& byte : bytes) {
        x ^= x << 13;
        x ^= x >> 17;
        x ^= x << 5;
        byte = static_cast<uint8_t>(x);
    }
    return bytes;
}

// The three agree on the buffer before any of them is timed.
template <uint32_t (*Crc)(const uint8_t*, size_t)>
void crc32Throughput(benchmark::State& state) {
    const std::vector<uint8_t> buffer = patternBuffer(static_cast<size_t>(state.range(0)));
    const uint32_t expected = bytewiseCrc32(buffer.data(), buffer.size());
    if (Crc(buffer.data(), buffer.size()) != expected || zlibCrc32(buffer.data(), buffer.size()) != expected) {
        state.SkipWithError("the CRC-32 implementations disagree");
        return;
    }
    for (auto _ : state) {
        benchmark::DoNotOptimize(buffer.data());
        benchmark::DoNotOptimize(Crc(buffer.data(), buffer.size()));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}

void crc32_project(benchmark::State& state) { crc32Throughput<crc32>(state); }
void crc32_zlib(benchmark::State& state) { crc32Throughput<zlibCrc32>(state); }
void crc32_bytewise(benchmark::State& state) { crc32Throughput<bytewiseCrc32>(state); }

void bufferSizes(benchmark::internal::Benchmark* benchmark) {
    for (const int64_t size : {int64_t{64}, int64_t{4} << 10, int64_t{64} << 10, int64_t{16} << 20}) {
        benchmark->Arg(size);
    }
}

}  // namespace

BENCHMARK(crc32_project)->Apply(bufferSizes);
BENCHMARK(crc32_zlib)->Apply(bufferSizes);
BENCHMARK(crc32_bytewise)->Apply(bufferSizes);
