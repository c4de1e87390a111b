#include "slot_index.h"

#include <cstdlib>

// Base 0, so "0x10" is 16 and "010" is 8. strtoul takes "-1" as the largest
// unsigned long, which the range test then rejects.
Status parseSlotIndex(const char* text, uint32_t& slotIndex) {
    char* end = nullptr;
    const unsigned long value = std::strtoul(text, &end, 0);
    if (end == text || *end != '\0' || value > UINT32_MAX) return STATUS_INVALID_PARAMETER;
    slotIndex = static_cast<uint32_t>(value);
    return STATUS_OK;
}
