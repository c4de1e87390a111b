// Read-only access to files below one base directory. Slots are opened by
// name with addSlot, get a fresh index each (indices are not reused until
// the 32-bit counter wraps) and keep their file open until removed.
//
// The bases are the device's own partitions, which applications cannot
// write, and nothing is ever written here: names may be links and are
// followed. Opening never waits, though: a FIFO opens at once and, like a
// directory, then has no file size.
//
// Implemented in storage_target.cpp.
#pragma once

#include <filesystem>
#include <map>
#include <memory>

#include "lib/storage/storage_target.h"
#include "lib/util/fd.h"

namespace Storage {

class FileReadTarget : public Target {
public:
    explicit FileReadTarget(std::filesystem::path basePath) : basePath_(std::move(basePath)) {}

    // The index is taken modulo 2^32.
    SlotHandle getSlot(size_t index) override;
    // The number of open slots.
    size_t getSlotCount() const override { return slots_.size(); }
    std::string getDescription() const override { return "FileReadTarget " + basePath_.string(); }

    // Opens basePath/name (an absolute name replaces the base). STATUS_FAILED
    // after logging the open failure. The size query throws
    // std::filesystem::filesystem_error for a name that opens but has no
    // file size, such as a directory or a FIFO.
    Status addSlot(const char* name, size_t& index, size_t& size) override;
    // STATUS_INVALID_PARAMETER for an index that is not open.
    Status removeSlot(size_t index) override;
    // Closes every slot; the next index keeps counting.
    Status removeAllSlots() override;

    class Slot : public TargetSlot {
    public:
        explicit Slot(UniqueFd fd) : fd_(std::move(fd)) {}

        bool exists() const override { return fd_.valid(); }
        bool isValid() const override { return fd_.valid(); }
        // A short read, or none at the end, is STATUS_OK; errors are errno.
        Status read(uint8_t* buffer, size_t size, int64_t offset) override;
        // Sets bytesRead to the count, or to 0 on failure.
        Status readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) override;

    private:
        UniqueFd fd_;
    };

private:
    std::filesystem::path basePath_;
    uint32_t nextIndex_ = 0;
    std::map<uint32_t, std::unique_ptr<Slot>> slots_;
};

}  // namespace Storage
