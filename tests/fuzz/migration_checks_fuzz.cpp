// The three content checks against a reference model of the block formats.
#include <cstddef>
#include <cstdint>

#include "fuzz_support.h"
#include "migration_checks.h"

namespace {

uint16_t le16(const Block& b, size_t at) { return static_cast<uint16_t>(b[at] | b[at + 1] << 8); }
uint32_t le32(const Block& b, size_t at) {
    return static_cast<uint32_t>(b[at]) | static_cast<uint32_t>(b[at + 1]) << 8 |
           static_cast<uint32_t>(b[at + 2]) << 16 | static_cast<uint32_t>(b[at + 3]) << 24;
}

void checkSettings(const Block& block) {
    size_t length = block.size();
    const Status status = checkSettingsBlock(block, length);
    Status expected;
    size_t expectedLength = block.size();
    if (block.empty() || block.size() % 4 != 0) {
        expected = STATUS_INVALID_PARAMETER;
    } else if (le16(block, 0) < 2 || le16(block, 0) > block.size()) {
        expected = STATUS_OVERFLOW;
    } else {
        const size_t declared = le16(block, 0);
        const bool match = fuzz_support::referenceBsd16(block.data(), declared - 2) == le16(block, declared - 2);
        expected = match ? STATUS_OK : STATUS_FAILED;
        if (match) expectedLength = declared;
    }
    FUZZ_CHECK(status == expected);
    if (status == STATUS_OK) FUZZ_CHECK(length == expectedLength);
}

void checkLut(const Block& block, uint32_t slotIndex) {
    size_t length = block.size();
    const Status status = checkLutHeader(block, length, slotIndex);
    Status expected;
    if (block.size() <= 3) {
        expected = STATUS_INVALID_PARAMETER;
    } else if (le32(block, 0) == 0) {
        expected = STATUS_NOT_FOUND;
    } else if (le16(block, 2) != 2 || block[0] != 0x80 || block[1] != 0x11 || block.size() < 19784) {
        expected = STATUS_FAILED;
    } else {
        expected = STATUS_OK;
    }
    FUZZ_CHECK(status == expected);
    if (status == STATUS_OK) FUZZ_CHECK(length == block.size());
}

void checkOverlay(const Block& block, uint32_t slotIndex) {
    size_t length = block.size();
    const Status status = checkOverlayHeader(block, length, slotIndex);
    Status expected;
    if (block.size() < 284) {
        expected = STATUS_INVALID_PARAMETER;
    } else if (le32(block, 0) != 0x089CC2CBu) {
        expected = STATUS_NOT_FOUND;
    } else if (le16(block, 6) != 5) {
        expected = STATUS_NOT_IMPLEMENTED;
    } else if (le32(block, 8) == 0) {
        expected = STATUS_NOT_FOUND;
    } else if (284 + uint64_t{le32(block, 280)} > block.size()) {
        expected = STATUS_OVERFLOW;
    } else {
        expected = STATUS_OK;
    }
    FUZZ_CHECK(status == expected);
    if (status == STATUS_OK) FUZZ_CHECK(length == block.size());
}

}  // namespace

// The whole input is the block; each check sees its own exact-size copy so
// that a read past the end is caught by the address sanitizer.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    fuzz_support::quietProductOutput();
    const Block block(data, data + size);
    const uint32_t slotIndex = size > 0 ? data[size - 1] : 0;
    checkSettings(block);
    checkLut(block, slotIndex);
    checkOverlay(block, slotIndex);
    return 0;
}
