// The runs of a crash scenario: which program each update runs, on which
// blob and at which (fake) time, and what a run reports it left. Shared by
// the exploration under the model and the replay of real block logs.
#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "store_files.h"

namespace crash {

enum class Clock {
    kForward,   // every run ten seconds after the one before
    kEqual,     // every run at the same second
    kBackward,  // every run a hundred seconds before the one before
};

const char* clockName(Clock clock);

// The second of the fake clock that run `run` (0 for the first) sees.
int64_t clockOf(Clock clock, size_t run);
// The clock's second before the first run.
constexpr int64_t kClockStart = 1700000000;

// Multi-slot scenarios update this slot; the others hold a blob and an
// erased blob that must survive every crash untouched.
constexpr size_t kUpdatedSlot = 1;

// The programs the runs are made by: the store's driver and the words
// that start the test-only broken writer (its path and options).
struct ScenarioPrograms {
    std::string driver;
    std::vector<std::string> brokenWriter;
};

// A blob of a little over one 4 KiB block, different for every run.
std::vector<uint8_t> blobFor(size_t run, size_t salt);

// The command of one update (see Scenario) of `slot` in the store of
// `slotCount` slots at `root`, with `blob`; its input files are written
// into `inputs`.
std::vector<std::string> updateCommand(const ScenarioPrograms& programs, char update, const std::filesystem::path& root,
                                       size_t slotCount, size_t slot, const std::vector<uint8_t>& blob,
                                       const std::filesystem::path& inputs);

// The commands that give slot 0 a blob and slot 2 an erased blob before a
// multi-slot scenario starts, and what the slots hold then (every other
// slot nothing). The commands run at kClockStart.
std::vector<std::vector<std::string>> populateCommands(const ScenarioPrograms& programs,
                                                       const std::filesystem::path& root, size_t slotCount,
                                                       const std::filesystem::path& inputs,
                                                       std::vector<store_test::SlotContent>& initial);

// The "state:" line that the driver and the broken writer end with.
// Throws std::runtime_error when there is none or it is malformed.
store_test::SlotContent reportedState(const std::string& out);

// A slot's content as a report shows it: at most 120 characters.
std::string reportText(const store_test::SlotContent& content);

// What an update should leave, when the store's rules say so without
// looking at the copies: false for a writeAt outside a begun write when
// no blob is current (it starts from the other copy's leftover data).
bool expectedAfter(char update, const store_test::SlotContent& before, const std::vector<uint8_t>& blob,
                   store_test::SlotContent& expected);

}  // namespace crash
