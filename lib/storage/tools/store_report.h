// The report of inspect_store on the dual-file stores: plain text for
// people, JSON for programs, and the exit status it amounts to.
#pragma once

#include <cstddef>
#include <filesystem>
#include <string>
#include <vector>

#include "lib/storage/store_inspection.h"

struct SlotReport {
    size_t index = 0;
    Storage::SlotInspection inspection;
};

struct TargetReport {
    const char* name = "";       // as --target names it
    std::filesystem::path path;  // the target's directory
    size_t slotCount = 0;
    int error = 0;  // errno when the directory could not be opened; then no slots
    std::vector<SlotReport> slots;
};

struct StoreReport {
    std::filesystem::path base;
    std::vector<TargetReport> targets;
};

// Why a copy is not valid, as the report words it ("no check file",
// "check file of 7 bytes", "data is a link", "CRC differs", ...); empty
// for a valid copy.
std::string copyReason(const Storage::CopyInspection& copy);

// The file or directory of slot `index`'s copy `copy` (0 or 1) below the
// target's directory `name`: "" (the copy directory), "data", ...
std::filesystem::path copyPath(const TargetReport& target, size_t index, unsigned copy, const char* name = "");

// Nanoseconds since the epoch as ISO 8601 UTC: "2026-11-25T08:10:02.123456789Z".
std::string isoTime(const struct timespec& time);

// One aligned line per slot, then one line per problem or note, each
// starting with the path it concerns.
std::string plainReport(const StoreReport& report);

// One JSON document, ending in a newline.
std::string jsonReport(const StoreReport& report);

// Whether the report shows damage: a target that cannot be opened, a lost
// slot, or a store entry that cannot be read or is of the wrong kind. An
// interrupted update (an invalid copy that is not current) is not damage.
bool showsDamage(const StoreReport& report);
