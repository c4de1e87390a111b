// Threads of one process that write and read the round's slots, each
// through target objects of its own, as the application does beside the
// tool. Also in a process of its own, started with the plan as arguments,
// when it has to run under the fault-injection shim.
#pragma once

#include <cstddef>
#include <filesystem>
#include <string>
#include <vector>

#include "overlap_blob.h"
#include "overlap_judge.h"

namespace overlap {

struct DriverStep {
    size_t slot = 0;  // in kSlots
    BlobId blob = 0;  // of blobSize(blob, largestBlob) bytes
};

struct DriverPlan {
    std::filesystem::path base;
    size_t largestBlob = 0;
    std::vector<std::vector<DriverStep>> threads;  // each thread's steps
};

// Runs every thread of the plan at once. A thread opens its own targets
// on the base directory, then for each step writes the step's blob and
// reads every slot whole with one readSome. Returns what they recorded.
std::vector<Operation> runDriver(const DriverPlan& plan);

// The plan as program arguments, and back; parsePlan throws
// std::invalid_argument for anything planArguments does not make.
std::vector<std::string> planArguments(const DriverPlan& plan);
DriverPlan parsePlan(const std::vector<std::string>& arguments);

// Operations one line each, and back; parseOperations throws
// std::invalid_argument for a line that operationsText does not make.
std::string operationsText(const std::vector<Operation>& operations);
std::vector<Operation> parseOperations(const std::string& text);

}  // namespace overlap
