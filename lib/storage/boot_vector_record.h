// The boot-vector record: 20 bytes kept raw on the eMMC, in the first
// sector of the last unpartitioned area.
//
//   0..3   boot vector value, big-endian
//   8      sum of bytes 0..7, modulo 256
//   18..19 BSD 16-bit checksum of bytes 0..17, little-endian
// The other bytes belong to the boot loader and are carried unchanged.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace Storage {

constexpr size_t kBootVectorRecordSize = 20;
constexpr uint64_t kSectorSize = 512;
// The record's sector lies between 3 GiB and 16 GiB of the device.
constexpr uint64_t kBootVectorFirstSector = 6291456;
constexpr uint64_t kBootVectorLastSector = 33554432;

// The header checksum that byte 8 must hold: bytes 0..7 summed modulo 256.
uint8_t bootVectorHeaderSum(const uint8_t* record);

// The record checksum that bytes 18..19 must hold, and the one they hold.
uint16_t bootVectorRecordChecksum(const uint8_t* record);
uint16_t storedBootVectorRecordChecksum(const uint8_t* record);

// Both checksums hold; the 16-bit one is only computed when the 8-bit one
// does.
bool isValidBootVectorRecord(const uint8_t* record);

// The value in bytes 0..3.
uint32_t bootVectorValue(const uint8_t* record);

enum class SectorParse { kOk, kNotANumber, kOutOfRange };

// Reads the sector from the partitioning tool's last output line: the
// leading number (parsed as a long double, truncated toward zero, negative
// becoming 0). `sector` receives the number also when it is out of range.
SectorParse parseBootVectorSector(const std::string& text, uint64_t& sector);

}  // namespace Storage
