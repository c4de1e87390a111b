// The registry of the device's storage targets, built whole on every run.
#pragma once

#include <array>
#include <filesystem>
#include <memory>

#include "lib/storage/storage_target.h"
#include "storage_target_id.h"

// One owning entry per StorageTarget value; values without a target stay
// null. Destroyed from the highest value down to 0 (array elements die in
// reverse order).
using TargetRegistry = std::array<std::unique_ptr<Storage::Target>, kStorageTargetCount>;

// A dual-file store below the base directory.
struct DualFileRow {
    StorageTarget id;
    const char* location;  // below the base directory
    unsigned slotCount;
};

// The dual-file stores, in registration order.
using DualFileRows = std::array<DualFileRow, 8>;
const DualFileRows& dualFileRows();

// The enumerator's name as printed in the log; values without a name print
// as the first one.
const char* storageTargetName(StorageTarget id);

// Logs "Register <name> = <description> [<slots>]" at info priority and
// stores the target, destroying any target the entry held.
void registerTarget(TargetRegistry& registry, StorageTarget id, std::unique_ptr<Storage::Target>&& target);

// A dual-file target at `location` with `slotCount` slots.
std::unique_ptr<Storage::Target> makeDualFileTarget(std::filesystem::path&& location, const unsigned& slotCount);

// Builds and registers every target: the dual-file stores below `base`,
// then the partitions, the boot vector and the firmware-update targets.
// Building creates the stores' directories and reads the boot vector.
void registerTargets(std::filesystem::path base, TargetRegistry& registry);
