// Content checks on migration data.
//
// A check validates one block and tells how many of its leading bytes are
// to be stored: on entry `length` is the block's size; on STATUS_OK the
// first `length` bytes are what is written. Checks read only the bytes they
// test, never throw and never write.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <vector>

#include "lib/util/status.h"

using Block = std::vector<uint8_t>;
using MigrationCheck = std::function<Status(const Block& block, size_t& length)>;

// Accepts everything; leaves `length` as the caller set it.
Status acceptAll(const Block& block, size_t& length);

// Settings block: bytes 0-1 hold its length L (little-endian, counting
// itself and the trailing checksum), bytes L-2..L-1 the BSD checksum of
// bytes 0..L-3; the file size must be a multiple of 4. Sets `length` to L.
//   STATUS_INVALID_PARAMETER  empty, or size not a multiple of 4
//   STATUS_OVERFLOW           L < 2 or L beyond the block
//   STATUS_FAILED             checksum mismatch (always for L = 2)
Status checkSettingsBlock(const Block& block, size_t& length);

// Lookup table: bytes 80 11 02 00 and at least 19784 bytes.
//   STATUS_INVALID_PARAMETER  3 bytes or fewer
//   STATUS_NOT_FOUND          first word all zero
//   STATUS_FAILED             version not 2 (logs a warning naming
//                             `slotIndex`), or wrong type bytes or size
Status checkLutHeader(const Block& block, size_t& length, uint32_t slotIndex);

// Overlay: a 284-byte header (magic 0x089CC2CB, format 5, a non-zero word
// at 8, payload length P at 280) and 284 + P bytes at least. `slotIndex`
// is not used.
//   STATUS_INVALID_PARAMETER  shorter than the header
//   STATUS_NOT_FOUND          wrong magic, or zero word at 8
//   STATUS_NOT_IMPLEMENTED    format not 5
//   STATUS_OVERFLOW           payload beyond the block
Status checkOverlayHeader(const Block& block, size_t& length, uint32_t slotIndex);
