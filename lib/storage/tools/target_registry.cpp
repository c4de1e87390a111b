#include "target_registry.h"

#include "lib/storage/dual_file_target.h"
#include "lib/util/log.h"

namespace {

struct DualFileRow {
    StorageTarget id;
    const char* location;  // below the base directory
    unsigned slotCount;
};

// In registration order.
constexpr DualFileRow kDualFileRows[] = {
    {kIpiStorageTargetSettings, "settings", 1},
    {kIpiStorageTargetOverlay, "app/overlays", 8},
    {kIpiStorageTargetLUT, "app/luts", 26},
    {kIpiStorageTargetCalibSave, "app/calibSave", 1},
    {kIpiStorageTargetCalibExtra, "app/calibExtra", 1},
    {kIpiStorageTargetUtilSave, "app/utilSave", 1},
    {kIpiStorageTargetApplicationInternal, "app/internal", 1},
    {kIpiStorageTargetRebootPersistent, "app/rebootPersistent", 1},
};

}  // namespace

const char* storageTargetName(StorageTarget id) {
    switch (id) {
        case kIpiStorageTargetLUT: return "kIpiStorageTargetLUT";
        case kIpiStorageTargetOverlay: return "kIpiStorageTargetOverlay";
        case kIpiStorageTargetCalibSave: return "kIpiStorageTargetCalibSave";
        case kIpiStorageTargetCalibExtra: return "kIpiStorageTargetCalibExtra";
        case kIpiStorageTargetUtilSave: return "kIpiStorageTargetUtilSave";
        case kIpiStorageTargetApplicationInternal: return "kIpiStorageTargetApplicationInternal";
        case kIpiStorageTargetRebootPersistent: return "kIpiStorageTargetRebootPersistent";
        case kIpiStorageTargetBootPartition: return "kIpiStorageTargetBootPartition";
        case kIpiStorageTargetResourcePartition: return "kIpiStorageTargetResourcePartition";
        case kIpiStorageTargetResourceManufacturingPartition: return "kIpiStorageTargetResourceManufacturingPartition";
        case kIpiStorageTargetBootVector: return "kIpiStorageTargetBootVector";
        case kIpiStorageTargetFirmwareUpdateBootFile: return "kIpiStorageTargetFirmwareUpdateBootFile";
        case kIpiStorageTargetFirmwareUpdateResourcePartition: return "kIpiStorageTargetFirmwareUpdateResourcePartition";
        default: return "kIpiStorageTargetSettings";
    }
}

void registerTarget(TargetRegistry& registry, StorageTarget id, std::unique_ptr<Storage::Target>&& target) {
    LOGI << "Register " << storageTargetName(id) << " = " << target->getDescription() << " ["
         << target->getSlotCount() << "]";
    registry[id] = std::move(target);
}

std::unique_ptr<Storage::Target> makeDualFileTarget(std::filesystem::path&& location, const unsigned& slotCount) {
    return std::make_unique<Storage::DualFileTarget>(std::move(location), slotCount);
}

void registerTargets(std::filesystem::path base, TargetRegistry& registry) {
    for (const DualFileRow& row : kDualFileRows) {
        registerTarget(registry, row.id, makeDualFileTarget(base / row.location, row.slotCount));
    }
    // The device targets (partitions, boot vector, firmware update) follow
    // here, after the stores under the base directory.
}
