// Wrappers for a target whose files live on a file system that is mounted
// read-only in normal operation: the file system is remounted read-write
// exactly while at least one slot of the target is being modified.
//
//   Storage::PartitionWriteAdaptor<Storage::DualFileTarget> store(
//       "/media/resources", "/media/resources/settings", 1);
//   store.getSlot(0)->write(data, size);  // rw before, ro after
//
// An incremental write holds the file system writable from beginWrite
// until finalise (whatever finalise returns); write, writeAt and erase hold
// it for the duration of the call. Writes to different slots overlap
// freely; nested starts on one slot are counted. A failed remount is
// logged and otherwise ignored, so the slot operation then fails with the
// file system's own error.
#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>

#include "lib/storage/storage_target.h"

namespace Storage {

// Owns a target of class T and hands out its slots wrapped in a
// TargetSlotAdaptor that reports to writeStarted / writeEnded.
template <typename T>
class TargetWriteAdaptor : public Target, private TargetSlotObserver {
public:
    template <typename... Args>
    explicit TargetWriteAdaptor(Args&&... args) : target_(std::forward<Args>(args)...) {}

    // An owning handle to an adaptor over the inner slot, or a null handle.
    SlotHandle getSlot(size_t index) override {
        if (index >= target_.getSlotCount()) return SlotHandle();
        TargetSlotObserver& observer = *this;  // a private base: convertible only in here
        return SlotHandle::own(std::make_unique<TargetSlotAdaptor>(target_.getSlot(index), index, observer));
    }
    size_t getSlotCount() const override { return target_.getSlotCount(); }
    std::string getDescription() const override { return target_.getDescription(); }
    // Slots are never removed through the adaptor; observers hear of the
    // attempt all the same.
    Status removeAllSlots() override {
        onRemoveAllSlots();
        return STATUS_NOT_IMPLEMENTED;
    }

protected:
    // A modification of slot `index` begins / has ended.
    virtual void writeStarted(size_t index) = 0;
    virtual void writeEnded(size_t index) = 0;

private:
    void onBeginWrite(size_t index, bool skip) override {
        if (!skip) writeStarted(index);
    }
    void onFinalised(size_t index, bool skip) override {
        if (!skip) writeEnded(index);
    }
    void beforeRead(size_t) override {}
    void afterRead(size_t) override {}

    T target_;
};

// The bookkeeping of active writes and the remount commands, shared by
// every PartitionWriteAdaptor<T>. Thread-safe: one mutex guards the
// bookkeeping and the remount commands run under it.
class PartitionWriteAdaptor_ {
public:
    // The file system at `mountPoint` is assumed read-only to begin with.
    explicit PartitionWriteAdaptor_(std::filesystem::path mountPoint) : mountPoint_(std::move(mountPoint)) {}
    // Remounts read-only when an unfinished write left it writable.
    ~PartitionWriteAdaptor_();
    PartitionWriteAdaptor_(const PartitionWriteAdaptor_&) = delete;
    PartitionWriteAdaptor_& operator=(const PartitionWriteAdaptor_&) = delete;

    // Counts a modification of `index`; remounts read-write when it is the
    // first active one.
    void acquire(size_t index);
    // Ends one; remounts read-only when the last active one ends. A release
    // without an acquire only logs a warning.
    void release(size_t index);
    // Runs "mount -o remount,rw|ro <mount point>"; logs a failure.
    void setWritable(bool writable);

private:
    void updateMountState();

    std::mutex mutex_;
    std::filesystem::path mountPoint_;
    std::map<size_t, uint32_t> activeWrites_;
    bool writable_ = false;
};

// A TargetWriteAdaptor that keeps the partition at `mountPoint` writable
// while its slots are modified. The wrapped target is destroyed before the
// final read-only remount (the bookkeeping base comes first).
template <typename T>
class PartitionWriteAdaptor : private PartitionWriteAdaptor_, public TargetWriteAdaptor<T> {
public:
    template <typename... Args>
    explicit PartitionWriteAdaptor(std::filesystem::path mountPoint, Args&&... args)
        : PartitionWriteAdaptor_(std::move(mountPoint)), TargetWriteAdaptor<T>(std::forward<Args>(args)...) {}

protected:
    void writeStarted(size_t index) override { acquire(index); }
    void writeEnded(size_t index) override { release(index); }

private:
    void onRemoveAllSlots() override {}
    void beforeModify(size_t index) override { writeStarted(index); }
    void afterModify(size_t index) override { writeEnded(index); }
};

}  // namespace Storage
