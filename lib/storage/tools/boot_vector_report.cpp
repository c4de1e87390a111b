#include "boot_vector_report.h"

#include <cstdio>

#include "lib/storage/boot_vector_record.h"

namespace {

std::string hexText(unsigned value, int digits) {
    char text[16];
    std::snprintf(text, sizeof text, "0x%0*x", digits, value);
    return text;
}

struct Checksum {
    const char* name;
    std::string stored;
    std::string computed;
    bool holds;
};

Checksum headerChecksum(const uint8_t* record) {
    const uint8_t computed = Storage::bootVectorHeaderSum(record);
    return {"header_checksum", hexText(record[8], 2), hexText(computed, 2), computed == record[8]};
}

Checksum recordChecksum(const uint8_t* record) {
    const uint16_t computed = Storage::bootVectorRecordChecksum(record);
    const uint16_t stored = Storage::storedBootVectorRecordChecksum(record);
    return {"record_checksum", hexText(stored, 4), hexText(computed, 4), computed == stored};
}

}  // namespace

std::string plainBootVector(uint64_t sector, const uint8_t* record) {
    std::string text = "sector " + std::to_string(sector) + " (byte " + std::to_string(sector * Storage::kSectorSize) +
                       " of /dev/mmcblk0)\nvalue " + std::to_string(Storage::bootVectorValue(record)) + "\n";
    for (const Checksum& checksum : {headerChecksum(record), recordChecksum(record)}) {
        text += std::string(checksum.name) + " stored " + checksum.stored + " computed " + checksum.computed + " " +
                (checksum.holds ? "holds" : "does not hold") + "\n";
    }
    return text + (Storage::isValidBootVectorRecord(record) ? "record valid\n" : "record invalid\n");
}

std::string jsonBootVector(uint64_t sector, const uint8_t* record) {
    std::string json = "{\"sector\":" + std::to_string(sector) +
                       ",\"offset\":" + std::to_string(sector * Storage::kSectorSize) +
                       ",\"value\":" + std::to_string(Storage::bootVectorValue(record));
    for (const Checksum& checksum : {headerChecksum(record), recordChecksum(record)}) {
        json += ",\"" + std::string(checksum.name) + "\":{\"stored\":\"" + checksum.stored + "\",\"computed\":\"" +
                checksum.computed + "\",\"holds\":" + (checksum.holds ? "true" : "false") + "}";
    }
    return json + ",\"valid\":" + (Storage::isValidBootVectorRecord(record) ? "true" : "false") + "}\n";
}
