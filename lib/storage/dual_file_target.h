// A crash-safe store that keeps each slot's blob as two complete copies,
// each with an 8-byte check file beside it. Reads see the current copy;
// every change goes to the other one and makes it current only once it is
// complete on the medium, so a power cut at any instant leaves the blob
// acknowledged last or the one in flight. Any number of processes, and
// target objects in one process, may use one store at once: flock locks
// on the store's own directories serialise the changes of a slot, and
// reads go on beside them. No operation waits for a lock longer than
// kSlotLockWait (kOpeningLockWait for opening); then it fails with
// STATUS_TIMEOUT.
//
// The layout, the check value, the commit with each sync, which copy wins,
// what opening cleans up, the locks and the log lines are in
// docs/STORE_FORMAT.md; what the store trusts is in docs/SECURITY.md.
// Nothing below the base directory is reached through a symbolic link, and
// nothing but a regular file with one name is read or written as a data or
// check file.
//
// The store relies on its file system: a torn write of the file system's
// own super block or group descriptors loses it whole, and ext4 writes
// them in place. Devices need an eMMC that does not tear a write when its
// power fails (reliable write for every write, or power-loss protection)
// and the store's file system mounted with barriers on: never barrier=0 or
// nobarrier.
//
// Failures are returned as errno values or STATUS_FAILED; nothing is
// thrown but allocation failures. Implemented in storage_target.cpp, with
// the copies' judgement in copy_check.cpp and the directories in
// slot_directories.cpp.
#pragma once

#include <array>
#include <filesystem>
#include <string>
#include <vector>

#include "lib/storage/copy_check.h"
#include "lib/storage/slot_lock.h"
#include "lib/storage/storage_target.h"
#include "lib/util/fd.h"

namespace Storage {

class SlotDirectories;

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
        // Opens the slot that lives in `baseDirectory` itself (empty
        // `name`) or in its subdirectory `name`. `base`, when not negative,
        // is an open descriptor of the base directory, borrowed for the
        // construction only. Waits for a copy's lock until `deadline`.
        Slot(std::filesystem::path baseDirectory, std::string name, int base = -1,
             LockDeadline deadline = std::chrono::steady_clock::now() + kOpeningLockWait);

        // The current copy is valid and its data file exists.
        bool exists() const override;
        // The current copy is valid.
        bool isValid() const override;

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
            CheckIdentity identity;  // of the check file, as this slot last knew it
        };

        unsigned otherIndex() const { return (current_ + 1) % 2; }
        // Each operation reaches the slot's directories afresh.
        SlotDirectories directories() const;
        // Judges both copies and picks the current one. With a `cleanUp`
        // deadline, removes check files that do not vouch for their data.
        void judge(SlotDirectories& directories, const LockDeadline* cleanUp = nullptr) const;
        // Decides whether the copy is valid and, with a `cleanUp` deadline,
        // removes a check file that does not vouch for its data once it
        // has judged the copy again under the copy's lock.
        CopyCheck validate(unsigned index, SlotDirectories& directories, const LockDeadline* cleanUp) const;
        // Judges again when a check file is no longer the one last judged.
        void refresh(SlotDirectories& directories) const;
        // For a read: holds the current copy's lock shared in `lock`, the
        // judgement refreshed under it.
        Status lockCurrent(SlotDirectories& directories, SlotLock& lock) const;
        // For a change: holds the slot's lock and then the other copy's
        // exclusive in `locks`, the judgement refreshed between the two.
        struct ChangeLocks {
            SlotLock slot;
            SlotLock copy;
        };
        Status lockForChange(SlotDirectories& directories, ChangeLocks& locks);
        // Logs that the slot's lock was not granted in time.
        Status busy() const;
        void invalidate(unsigned index, SlotDirectories& directories);
        Status openCopyData(unsigned index, SlotDirectories& directories, int flags, UniqueFd& fd);
        Status commit(unsigned index, SlotDirectories& directories, const CheckTime& previousTime);
        Status commitOther(SlotDirectories& directories, const CheckTime& previousTime);
        CheckTime currentCheckTime(SlotDirectories& directories);
        std::filesystem::path directoryPath() const;

        // Judged again by the queries too, which are const: another process
        // may have committed since.
        mutable std::array<Copy, 2> copies_;
        mutable unsigned current_ = 0;
        bool writing_ = false;
        // Held from beginWrite to finalise.
        ChangeLocks writeLocks_;
        std::filesystem::path baseDirectory_;
        std::string name_;
    };

private:
    std::vector<Slot> slots_;
    std::filesystem::path basePath_;
};

}  // namespace Storage
