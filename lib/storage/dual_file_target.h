// A crash-safe store that keeps each slot's blob as two complete copies,
// each with an 8-byte check file beside it (see check_value.h).
//
// Layout of a target with base directory B: a one-slot target uses B as
// its slot directory, an n-slot target B/0 ... B/(n-1). In a slot
// directory D: copy 0 is "D/1/data" with "D/1/data.chk", copy 1 is
// "D/2/data" with "D/2/data.chk"; "<check>.tmp" exists only while a commit
// is under way.
//
// Reads see the current copy; every change goes to the other one and
// becomes current only when its check file has been written under the
// temporary name, renamed into place and the file system synced. At
// opening, a copy is valid when its check file matches its data, invalid
// check files are deleted, and the valid copy whose check file is strictly
// newer wins (equal times: copy 0). A power cut at any instant therefore
// leaves at least the previous version readable.
//
// Failures are returned as errno values or STATUS_FAILED; nothing is
// thrown but allocation failures.
#pragma once

#include <array>
#include <filesystem>
#include <vector>

#include "lib/storage/storage_target.h"
#include "lib/util/fd.h"

namespace Storage {

struct CheckTime;

class DualFileTarget : public Target {
public:
    // Creates `basePath` with its parents (a failure shows in the slots'
    // operations) and opens `slotCount` slots.
    DualFileTarget(std::filesystem::path basePath, size_t slotCount);

    SlotHandle getSlot(size_t index) override;
    size_t getSlotCount() const override { return slots_.size(); }
    std::string getDescription() const override { return "DualFileTarget " + basePath_.string(); }

    class Slot : public TargetSlot {
    public:
        explicit Slot(const std::filesystem::path& directory);

        // The current copy is valid and its data file exists.
        bool exists() const override;
        // The current copy is valid.
        bool isValid() const override { return copies_[current_].valid; }

        // Removes the other copy's data; STATUS_OK also when already begun.
        Status beginWrite() override;
        // Commits the begun write; STATUS_INVALID_OPERATION without one.
        Status finalise() override;
        // Replaces the blob: truncate-write the other copy, then commit.
        Status write(const uint8_t* data, size_t size) override;
        // Inside a begun write: a positioned write into the pending copy.
        // Outside: copies the current blob, writes the block and commits.
        Status writeAt(int64_t offset, const uint8_t* data, size_t size) override;
        // STATUS_NOT_FOUND without a data file, STATUS_FAILED for an
        // invalid copy; a read at or past the end is STATUS_OK with 0 bytes.
        Status read(uint8_t* buffer, size_t size, int64_t offset) override;
        Status readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) override;
        // Commits an absent blob.
        Status erase() override;

    private:
        struct Copy {
            std::filesystem::path dataPath;
            std::filesystem::path checkPath;
            bool valid = false;
        };

        Copy& other() { return copies_[(current_ + 1) % 2]; }
        // Decides whether the copy is valid; returns its check file's time.
        CheckTime validate(Copy& copy);
        void invalidate(Copy& copy);
        Status openCopyData(Copy& copy, int flags, UniqueFd& fd);
        Status commit(Copy& copy, std::filesystem::file_time_type previousTime);
        Status commitOther(std::filesystem::file_time_type previousTime);
        std::filesystem::file_time_type currentCheckTime() const;

        std::array<Copy, 2> copies_;
        unsigned current_ = 0;
        bool writing_ = false;
    };

private:
    std::vector<Slot> slots_;
    std::filesystem::path basePath_;
};

}  // namespace Storage
