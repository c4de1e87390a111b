#include "registration_log.h"

namespace testing_support {

std::string dualFileRegisterLines(const std::filesystem::path& base) {
    struct Row {
        const char* name;
        const char* location;
        const char* slots;
    };
    const Row rows[] = {
        {"kIpiStorageTargetSettings", "settings", "1"},
        {"kIpiStorageTargetOverlay", "app/overlays", "8"},
        {"kIpiStorageTargetLUT", "app/luts", "26"},
        {"kIpiStorageTargetCalibSave", "app/calibSave", "1"},
        {"kIpiStorageTargetCalibExtra", "app/calibExtra", "1"},
        {"kIpiStorageTargetUtilSave", "app/utilSave", "1"},
        {"kIpiStorageTargetApplicationInternal", "app/internal", "1"},
        {"kIpiStorageTargetRebootPersistent", "app/rebootPersistent", "1"},
    };
    std::string lines;
    for (const Row& row : rows) {
        lines += std::string("Register ") + row.name + " = DualFileTarget " + (base / row.location).string() + " [" +
                 row.slots + "]\n";
    }
    return lines;
}

const char kFileReadRegisterLines[] =
    "Register kIpiStorageTargetBootPartition = FileReadTarget /media/boot [0]\n"
    "Register kIpiStorageTargetResourcePartition = FileReadTarget /media/resources [0]\n"
    "Register kIpiStorageTargetResourceManufacturingPartition = FileReadTarget /media/static [0]\n";

const char kDeviceTargetRegisterLines[] =
    "Register kIpiStorageTargetBootVector = BootVectorTarget [1]\n"
    "Register kIpiStorageTargetFirmwareUpdateBootFile = FirmwareUpdateBootTarget /media/boot [2]\n"
    "Register kIpiStorageTargetFirmwareUpdateResourcePartition = FirmwareUpdatePartitionTarget [1]\n";

std::string registerLines(const std::filesystem::path& base) {
    return dualFileRegisterLines(base) + kFileReadRegisterLines + kDeviceTargetRegisterLines;
}

}  // namespace testing_support
