// The fixed numbering of the device's storage targets.
//
// The values index the target registry and must never be renumbered;
// 11 to 13 are unused.
#pragma once

#include <cstdint>

enum StorageTarget : uint32_t {
    kIpiStorageTargetSettings = 0,
    kIpiStorageTargetLUT = 1,
    kIpiStorageTargetOverlay = 2,
    kIpiStorageTargetCalibSave = 3,
    kIpiStorageTargetCalibExtra = 4,
    kIpiStorageTargetUtilSave = 5,
    kIpiStorageTargetApplicationInternal = 6,
    kIpiStorageTargetRebootPersistent = 7,
    kIpiStorageTargetBootPartition = 8,
    kIpiStorageTargetResourcePartition = 9,
    kIpiStorageTargetResourceManufacturingPartition = 10,
    kIpiStorageTargetBootVector = 14,
    kIpiStorageTargetFirmwareUpdateBootFile = 15,
    kIpiStorageTargetFirmwareUpdateResourcePartition = 16,
};

// One past the highest value: the size of a table indexed by StorageTarget.
constexpr uint32_t kStorageTargetCount = kIpiStorageTargetFirmwareUpdateResourcePartition + 1;

// The word that selects the target on the command line ("--target"), or
// null for targets that cannot be chosen there (and for unused values).
constexpr const char* commandLineName(StorageTarget target) {
    switch (target) {
        case kIpiStorageTargetSettings:
            return "settings";
        case kIpiStorageTargetLUT:
            return "lut";
        case kIpiStorageTargetOverlay:
            return "overlay";
        case kIpiStorageTargetCalibSave:
            return "calib_save";
        case kIpiStorageTargetCalibExtra:
            return "calib_extra";
        case kIpiStorageTargetUtilSave:
            return "util_save";
        case kIpiStorageTargetApplicationInternal:
            return "application_internal";
        case kIpiStorageTargetRebootPersistent:
            return "reboot_persistent";
        default:
            return nullptr;
    }
}
