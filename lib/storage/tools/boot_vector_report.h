// The report of inspect_store on the boot-vector record.
#pragma once

#include <cstdint>
#include <string>

// The sector, the value (bytes 0..3, big-endian) and both checksums,
// stored and computed, with whether each holds; one line each.
std::string plainBootVector(uint64_t sector, const uint8_t* record);

// The same as one JSON document, ending in a newline.
std::string jsonBootVector(uint64_t sector, const uint8_t* record);
