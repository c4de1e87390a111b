#include "target_registry.h"

#include "lib/storage/boot_vector_target.h"
#include "lib/storage/dual_file_target.h"
#include "lib/storage/file_read_target.h"
#include "lib/storage/firmware_update_boot_target.h"
#include "lib/storage/firmware_update_partition_target.h"
#include "lib/util/log.h"

namespace {

struct PartitionRow {
    StorageTarget id;
    const char* path;
};

// In registration order.
constexpr DualFileRows kDualFileRows = {{
    {kIpiStorageTargetSettings, "settings", 1},
    {kIpiStorageTargetOverlay, "app/overlays", 8},
    {kIpiStorageTargetLUT, "app/luts", 26},
    {kIpiStorageTargetCalibSave, "app/calibSave", 1},
    {kIpiStorageTargetCalibExtra, "app/calibExtra", 1},
    {kIpiStorageTargetUtilSave, "app/utilSave", 1},
    {kIpiStorageTargetApplicationInternal, "app/internal", 1},
    {kIpiStorageTargetRebootPersistent, "app/rebootPersistent", 1},
}};

// Read-only access to the device's partitions, after the dual-file stores.
constexpr PartitionRow kPartitionRows[] = {
    {kIpiStorageTargetBootPartition, "/media/boot"},
    {kIpiStorageTargetResourcePartition, "/media/resources"},
    {kIpiStorageTargetResourceManufacturingPartition, "/media/static"},
};

}  // namespace

const DualFileRows& dualFileRows() { return kDualFileRows; }

const char* storageTargetName(StorageTarget id) {
    switch (id) {
        case kIpiStorageTargetLUT:
            return "kIpiStorageTargetLUT";
        case kIpiStorageTargetOverlay:
            return "kIpiStorageTargetOverlay";
        case kIpiStorageTargetCalibSave:
            return "kIpiStorageTargetCalibSave";
        case kIpiStorageTargetCalibExtra:
            return "kIpiStorageTargetCalibExtra";
        case kIpiStorageTargetUtilSave:
            return "kIpiStorageTargetUtilSave";
        case kIpiStorageTargetApplicationInternal:
            return "kIpiStorageTargetApplicationInternal";
        case kIpiStorageTargetRebootPersistent:
            return "kIpiStorageTargetRebootPersistent";
        case kIpiStorageTargetBootPartition:
            return "kIpiStorageTargetBootPartition";
        case kIpiStorageTargetResourcePartition:
            return "kIpiStorageTargetResourcePartition";
        case kIpiStorageTargetResourceManufacturingPartition:
            return "kIpiStorageTargetResourceManufacturingPartition";
        case kIpiStorageTargetBootVector:
            return "kIpiStorageTargetBootVector";
        case kIpiStorageTargetFirmwareUpdateBootFile:
            return "kIpiStorageTargetFirmwareUpdateBootFile";
        case kIpiStorageTargetFirmwareUpdateResourcePartition:
            return "kIpiStorageTargetFirmwareUpdateResourcePartition";
        default:
            return "kIpiStorageTargetSettings";
    }
}

void registerTarget(TargetRegistry& registry, StorageTarget id, std::unique_ptr<Storage::Target>&& target) {
    LOGI << "Register " << storageTargetName(id) << " = " << target->getDescription() << " [" << target->getSlotCount()
         << "]";
    registry[id] = std::move(target);
}

std::unique_ptr<Storage::Target> makeDualFileTarget(std::filesystem::path&& location, const unsigned& slotCount) {
    return std::make_unique<Storage::DualFileTarget>(std::move(location), slotCount);
}

void registerTargets(std::filesystem::path base, TargetRegistry& registry) {
    for (const DualFileRow& row : dualFileRows()) {
        registerTarget(registry, row.id, makeDualFileTarget(base / row.location, row.slotCount));
    }
    for (const PartitionRow& row : kPartitionRows) {
        registerTarget(registry, row.id, std::make_unique<Storage::FileReadTarget>(row.path));
    }
    // Reads the boot vector from the flash device on every run.
    registerTarget(registry, kIpiStorageTargetBootVector, std::make_unique<Storage::BootVectorTarget>());
    registerTarget(registry, kIpiStorageTargetFirmwareUpdateBootFile,
                   std::make_unique<Storage::FirmwareUpdateBootTarget>());
    registerTarget(registry, kIpiStorageTargetFirmwareUpdateResourcePartition,
                   std::make_unique<Storage::FirmwareUpdatePartitionTarget>());
}
