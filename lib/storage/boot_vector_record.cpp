#include "lib/storage/boot_vector_record.h"

#include <cstdint>
#include <cstdlib>

#include "lib/util/bsd_checksum.h"

namespace Storage {

uint8_t bootVectorHeaderSum(const uint8_t* record) {
    uint8_t headerSum = 0;
    for (size_t i = 0; i < 8; ++i) headerSum = static_cast<uint8_t>(headerSum + record[i]);
    return headerSum;
}

uint16_t bootVectorRecordChecksum(const uint8_t* record) { return bsdChecksum16(0, record, 18); }

uint16_t storedBootVectorRecordChecksum(const uint8_t* record) {
    return static_cast<uint16_t>(record[18] | record[19] << 8);
}

bool isValidBootVectorRecord(const uint8_t* record) {
    if (bootVectorHeaderSum(record) != record[8]) return false;
    return bootVectorRecordChecksum(record) == storedBootVectorRecordChecksum(record);
}

uint32_t bootVectorValue(const uint8_t* record) {
    return static_cast<uint32_t>(record[0]) << 24 | static_cast<uint32_t>(record[1]) << 16 |
           static_cast<uint32_t>(record[2]) << 8 | record[3];
}

SectorParse parseBootVectorSector(const std::string& text, uint64_t& sector) {
    char* end = nullptr;
    const long double number = std::strtold(text.c_str(), &end);
    if (end == text.c_str()) return SectorParse::kNotANumber;
    // Beyond 64 bits (or "inf") the conversion would be undefined; such a
    // sector is out of range anyway.
    constexpr long double kTwoTo64 = 18446744073709551616.0L;
    if (number >= kTwoTo64) {
        sector = UINT64_MAX;
    } else {
        sector = number > 0 ? static_cast<uint64_t>(number) : 0;  // NaN too becomes 0
    }
    // Unsigned wrap-around makes this one comparison a two-sided range check.
    if (sector - kBootVectorFirstSector > kBootVectorLastSector - kBootVectorFirstSector) {
        return SectorParse::kOutOfRange;
    }
    return SectorParse::kOk;
}

}  // namespace Storage
