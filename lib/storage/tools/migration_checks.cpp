#include "migration_checks.h"

#include "lib/util/bsd_checksum.h"
#include "lib/util/log.h"

namespace {

constexpr size_t kLutMinimumSize = 19784;
constexpr uint8_t kLutType = 0x80;
constexpr uint8_t kLutSecondByte = 0x11;
constexpr uint16_t kLutVersion = 2;

constexpr size_t kOverlayHeaderSize = 284;
constexpr uint32_t kOverlayMagic = 0x089CC2CB;
constexpr uint16_t kOverlayFormat = 5;
constexpr size_t kOverlayPayloadLengthOffset = 280;

uint16_t le16(const uint8_t* bytes) { return static_cast<uint16_t>(bytes[0] | bytes[1] << 8); }

uint32_t le32(const uint8_t* bytes) {
    return static_cast<uint32_t>(bytes[0]) | static_cast<uint32_t>(bytes[1]) << 8 |
           static_cast<uint32_t>(bytes[2]) << 16 | static_cast<uint32_t>(bytes[3]) << 24;
}

}  // namespace

Status acceptAll(const Block&, size_t&) { return STATUS_OK; }

Status checkSettingsBlock(const Block& block, size_t& length) {
    length = block.size();
    if (block.empty() || block.size() % 4 != 0) return STATUS_INVALID_PARAMETER;
    const uint16_t declared = le16(block.data());
    if (declared < 2 || declared > block.size()) return STATUS_OVERFLOW;
    const uint16_t checksum = bsdChecksum16(0, block.data(), declared - 2u);
    if (checksum != le16(block.data() + declared - 2)) return STATUS_FAILED;
    length = declared;
    return STATUS_OK;
}

Status checkLutHeader(const Block& block, size_t& length, uint32_t slotIndex) {
    length = block.size();
    if (block.size() <= 3) return STATUS_INVALID_PARAMETER;
    const uint32_t header = le32(block.data());
    if (header == 0) return STATUS_NOT_FOUND;
    if ((header >> 16) != kLutVersion) {
        // Only a version mismatch is worth a line: it means a newer format.
        LOGW << "Unable to parse LUT header at index " << slotIndex;
        return STATUS_FAILED;
    }
    if (block[0] == kLutType && block.size() >= kLutMinimumSize && block[1] == kLutSecondByte) return STATUS_OK;
    return STATUS_FAILED;
}

Status checkOverlayHeader(const Block& block, size_t& length, uint32_t) {
    length = block.size();
    if (block.size() < kOverlayHeaderSize) return STATUS_INVALID_PARAMETER;
    if (le32(block.data()) != kOverlayMagic) return STATUS_NOT_FOUND;
    if (block[7] != 0 || block[6] != kOverlayFormat) return STATUS_NOT_IMPLEMENTED;
    if (le32(block.data() + 8) == 0) return STATUS_NOT_FOUND;
    const uint64_t payloadEnd = kOverlayHeaderSize + uint64_t{le32(block.data() + kOverlayPayloadLengthOffset)};
    if (payloadEnd > block.size()) return STATUS_OVERFLOW;
    return STATUS_OK;
}
