// The boot-vector record checks and the sector parser.
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

#include "fuzz_support.h"
#include "lib/storage/boot_vector_record.h"

namespace {

void checkRecord(const uint8_t* data, size_t size) {
    if (size < Storage::kBootVectorRecordSize) return;
    // Exactly 20 bytes on the heap: any read beyond the record is caught.
    std::unique_ptr<uint8_t[]> record(new uint8_t[Storage::kBootVectorRecordSize]);
    for (size_t i = 0; i < Storage::kBootVectorRecordSize; ++i) record[i] = data[i];

    uint8_t headerSum = 0;
    for (size_t i = 0; i < 8; ++i) headerSum = static_cast<uint8_t>(headerSum + record[i]);
    const bool expectedValid = headerSum == record[8] && fuzz_support::referenceBsd16(record.get(), 18) ==
                                                             static_cast<uint16_t>(record[18] | record[19] << 8);
    FUZZ_CHECK(Storage::isValidBootVectorRecord(record.get()) == expectedValid);

    const uint32_t expectedValue = static_cast<uint32_t>(record[0]) << 24 | static_cast<uint32_t>(record[1]) << 16 |
                                   static_cast<uint32_t>(record[2]) << 8 | record[3];
    FUZZ_CHECK(Storage::bootVectorValue(record.get()) == expectedValue);
}

void checkSector(const uint8_t* data, size_t size) {
    const std::string text(reinterpret_cast<const char*>(data), size);
    uint64_t sector = 12345;
    const Storage::SectorParse result = Storage::parseBootVectorSector(text, sector);

    char* end = nullptr;
    const long double number = std::strtold(text.c_str(), &end);
    if (end == text.c_str()) {
        FUZZ_CHECK(result == Storage::SectorParse::kNotANumber);
        return;
    }
    const bool inRange = !std::isnan(number) && number >= Storage::kBootVectorFirstSector &&
                         number < Storage::kBootVectorLastSector + 1.0L;
    if (inRange) {
        FUZZ_CHECK(result == Storage::SectorParse::kOk);
        FUZZ_CHECK(sector == static_cast<uint64_t>(number));
    } else {
        FUZZ_CHECK(result == Storage::SectorParse::kOutOfRange);
    }
}

}  // namespace

// The input's first 20 bytes are a record; the whole input is also the
// partitioning tool's line.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    checkRecord(data, size);
    checkSector(data, size);
    return 0;
}
