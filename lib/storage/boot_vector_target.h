// The boot-vector record on the raw eMMC "/dev/mmcblk0", as a one-slot
// target. The record is located and read once, at construction; a slot
// whose record could not be located, read or validated stays unusable and
// refuses every read and write (the reason was logged at construction).
//
// Implemented in storage_target.cpp.
#pragma once

#include "lib/storage/boot_vector_record.h"
#include "lib/storage/storage_target.h"

namespace Storage {

// Asks the partitioning tool for the record's sector, the start of the
// last free area of "/dev/mmcblk0"; logs why when it cannot be found.
[[nodiscard]] Status locateBootVector(uint64_t& sector);

// Reads the record at `sector` of "/dev/mmcblk0", which is opened
// read-only. STATUS_FAILED on a failed open (logged), seek or short read;
// the record is not validated.
[[nodiscard]] Status readBootVectorRecord(uint64_t sector, uint8_t (&record)[kBootVectorRecordSize]);

class BootVectorTarget : public Target {
public:
    BootVectorTarget() = default;

    SlotHandle getSlot(size_t index) override { return index == 0 ? SlotHandle::borrow(&slot_) : SlotHandle(); }
    size_t getSlotCount() const override { return 1; }
    std::string getDescription() const override { return "BootVectorTarget"; }
    Status removeAllSlots() override { return STATUS_NOTHING_TO_DO; }

    class Slot : public TargetSlot {
    public:
        // Locates the record through the partitioning tool and reads it.
        Slot();

        bool exists() const override { return sector_ != 0; }
        bool isValid() const override { return sector_ != 0; }
        // Validates a whole 20-byte record and writes it synchronously to
        // the device. The cache takes the record before the device is
        // written, so a read after a failed write returns the new record.
        Status write(const uint8_t* data, size_t size) override;
        // Copies the cached record: exactly 20 bytes at offset 0.
        Status read(uint8_t* buffer, size_t size, int64_t offset) override;
        // As read; reports 20 bytes.
        Status readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) override;

    private:
        uint8_t record_[kBootVectorRecordSize] = {};
        uint64_t sector_ = 0;  // 0: no usable boot vector
    };

private:
    Slot slot_;
};

}  // namespace Storage
