// Replaces a boot file on "/media/boot": slot 0 is "BOOT.BIN", slot 1
// "BOOT0010.BIN". New contents are streamed into an unnamed temporary file;
// finalise compares them with the boot file and only when they differ makes
// the boot file system writable, rewrites the file and reads it back (up to
// five attempts), then makes it read-only again.
//
// Implemented in storage_target.cpp.
#pragma once

#include <filesystem>
#include <string>

#include "lib/storage/storage_target.h"
#include "lib/util/fd.h"

namespace Storage {

class FirmwareUpdateBootTarget : public Target {
public:
    FirmwareUpdateBootTarget();

    SlotHandle getSlot(size_t index) override;
    size_t getSlotCount() const override { return 2; }
    std::string getDescription() const override;
    Status removeAllSlots() override { return STATUS_NOTHING_TO_DO; }

    class Slot : public TargetSlot {
    public:
        explicit Slot(const char* fileName);

        bool exists() const override { return true; }
        // An update is being received.
        bool isValid() const override { return receive_.valid(); }
        // Opens a new temporary file, throwing away any update in progress.
        // The file is unlinked at once, so nothing is left in /tmp.
        Status beginWrite() override;
        // pwrite into the temporary file. A failure ends the update.
        Status writeAt(int64_t offset, const uint8_t* data, size_t size) override;
        // Writes the boot file when it differs from what was received.
        // STATUS_NOT_FOUND without an update; the update ends on every path.
        Status finalise() override;
        // Abandons the update; STATUS_INVALID_OPERATION without one.
        Status erase() override { return close(); }

    private:
        Status close();
        Status compareWithDestination();
        Status copyToDestination(int destination, uint32_t& written);
        Status writeDestination();

        std::filesystem::path destination_;
        std::string temporaryPath_;
        UniqueFd receive_;
        uint32_t bytesReceived_ = 0;  // sizes are 32-bit here; wraps
    };

private:
    Slot slots_[2];
};

}  // namespace Storage
