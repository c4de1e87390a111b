#include "overlap_blob.h"

#include <cstring>

namespace overlap {
namespace {

constexpr uint8_t kMagic[4] = {'O', 'V', 'L', 'P'};

uint64_t mix(uint64_t value) {
    value += 0x9E3779B97F4A7C15ull;
    value = (value ^ (value >> 30)) * 0xBF58476D1CE4E5B9ull;
    value = (value ^ (value >> 27)) * 0x94D049BB133111EBull;
    return value ^ (value >> 31);
}

void putLe32(uint8_t* at, uint32_t value) {
    for (size_t i = 0; i < 4; ++i) at[i] = static_cast<uint8_t>(value >> (8 * i));
}

uint32_t le32(const uint8_t* at) {
    return uint32_t{at[0]} | uint32_t{at[1]} << 8 | uint32_t{at[2]} << 16 | uint32_t{at[3]} << 24;
}

}  // namespace

Bytes makeBlob(BlobId id, size_t size) {
    Bytes blob(size < kBlobHeaderSize ? kBlobHeaderSize : size);
    std::memcpy(blob.data(), kMagic, sizeof kMagic);
    putLe32(&blob[4], id);
    putLe32(&blob[8], static_cast<uint32_t>(blob.size()));
    const uint64_t seed = mix(id);
    for (size_t at = kBlobHeaderSize; at < blob.size(); at += 8) {
        const uint64_t word = mix(seed ^ at);
        for (size_t i = 0; i < 8 && at + i < blob.size(); ++i) blob[at + i] = static_cast<uint8_t>(word >> (8 * i));
    }
    return blob;
}

size_t blobSize(BlobId id, size_t largest) {
    const size_t least = largest / 2 < kBlobHeaderSize ? kBlobHeaderSize : largest / 2;
    return largest <= least ? least : least + mix(~uint64_t{id}) % (largest - least + 1);
}

int64_t identifyBlob(const uint8_t* data, size_t size) {
    if (size < kBlobHeaderSize || std::memcmp(data, kMagic, sizeof kMagic) != 0) return kNotABlob;
    const BlobId id = le32(data + 4);
    if (le32(data + 8) != size) return kNotABlob;
    const Bytes expected = makeBlob(id, size);
    return std::memcmp(expected.data(), data, size) == 0 ? int64_t{id} : kNotABlob;
}

std::string describeBytes(const uint8_t* data, size_t size) {
    std::string text = std::to_string(size) + " bytes";
    if (size >= kBlobHeaderSize && std::memcmp(data, kMagic, sizeof kMagic) == 0) {
        text += " beginning like blob " + std::to_string(le32(data + 4)) + " of " + std::to_string(le32(data + 8));
    }
    return text;
}

}  // namespace overlap
