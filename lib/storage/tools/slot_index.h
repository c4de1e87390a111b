// The slot index of a command line.
#pragma once

#include <cstdint>

#include "lib/util/status.h"

// Parses `text` as decimal, hexadecimal ("0x10") or octal ("010") into
// `slotIndex`; STATUS_INVALID_PARAMETER, leaving it unchanged, for anything
// else or a value beyond 32 bits.
[[nodiscard]] Status parseSlotIndex(const char* text, uint32_t& slotIndex);
