// Writes a whole file-system image onto the resource partition
// "/dev/mmcblk0p2": begin unmounts "/media/resources" and opens the raw
// device, blocks go straight to the device at the caller's offsets, and
// finalise closes it and mounts the partition again.
//
// Implemented in storage_target.cpp.
#pragma once

#include <filesystem>

#include "lib/storage/slot_lock.h"
#include "lib/storage/storage_target.h"
#include "lib/util/fd.h"

namespace Storage {

class FirmwareUpdatePartitionTarget : public Target {
public:
    FirmwareUpdatePartitionTarget() = default;

    SlotHandle getSlot(size_t index) override { return index == 0 ? SlotHandle::borrow(&slot_) : SlotHandle(); }
    size_t getSlotCount() const override { return 1; }
    std::string getDescription() const override { return "FirmwareUpdatePartitionTarget"; }
    Status removeAllSlots() override { return STATUS_NOTHING_TO_DO; }

    class Slot : public TargetSlot {
    public:
        Slot();

        bool exists() const override { return true; }
        // An update is in progress.
        bool isValid() const override { return device_.valid(); }
        // Unmounts the partition and opens the device; a second begin
        // restarts (its unmount failure is ignored).
        Status beginWrite() override;
        // pwrite to the device; a failure does not end the update.
        Status writeAt(int64_t offset, const uint8_t* data, size_t size) override;
        // Closes the device and mounts the partition; STATUS_NOT_FOUND
        // without an update.
        Status finalise() override;

    private:
        std::filesystem::path mountPath_;
        std::filesystem::path devicePath_;
        UniqueFd device_;
        // Held from beginWrite to finalise: one update of the partition at a
        // time.
        SlotLock updateLock_;
        uint32_t bytesWritten_ = 0;  // wraps
    };

private:
    Slot slot_;
};

}  // namespace Storage
