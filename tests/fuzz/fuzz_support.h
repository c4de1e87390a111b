// Shared by the fuzz targets: invariant checks that end the run loudly,
// a bounded byte reader and independent reference checksums.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>

// abort() rather than a return value: libFuzzer and the replay driver both
// treat the signal as a finding and keep the input.
#define FUZZ_CHECK(condition)                                                                      \
    do {                                                                                           \
        if (!(condition)) {                                                                        \
            std::fprintf(stderr, "%s:%d: invariant failed: %s\n", __FILE__, __LINE__, #condition); \
            std::abort();                                                                          \
        }                                                                                          \
    } while (0)

namespace fuzz_support {

// Hands out the input front to back; past the end it yields zeros and empty
// runs, so every input decodes to something.
class ByteReader {
public:
    ByteReader(const uint8_t* data, size_t size) : data_(data), size_(size) {}

    uint8_t byte() { return pos_ < size_ ? data_[pos_++] : 0; }

    // Up to `count` bytes; fewer when the input runs out.
    const uint8_t* take(size_t count, size_t& taken) {
        taken = count < size_ - pos_ ? count : size_ - pos_;
        const uint8_t* start = data_ + pos_;
        pos_ += taken;
        return start;
    }

private:
    const uint8_t* data_;
    size_t size_;
    size_t pos_ = 0;
};

// Written out here rather than taken from the product, so that a fault in
// the product's version cannot hide itself.
inline uint16_t referenceBsd16(const uint8_t* data, size_t size) {
    uint16_t sum = 0;
    for (size_t i = 0; i < size; ++i) {
        sum = static_cast<uint16_t>((sum >> 1) | ((sum & 1u) << 15));
        sum = static_cast<uint16_t>(sum + data[i]);
    }
    return sum;
}

inline uint32_t referenceCrc32(const uint8_t* data, size_t size) {
    uint32_t crc = 0xFFFFFFFFu;
    for (size_t i = 0; i < size; ++i) {
        crc ^= data[i];
        for (int bit = 0; bit < 8; ++bit) crc = (crc >> 1) ^ (0xEDB88320u & (0u - (crc & 1u)));
    }
    return ~crc;
}

// Product code logs to syslog by default; one file is cheaper per input.
void quietProductOutput();

}  // namespace fuzz_support
