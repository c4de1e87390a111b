// The storage model: every persistent store of the device is a Target made
// of numbered TargetSlots, each slot one blob that can be queried, read,
// replaced in one call, or written incrementally and then committed.
//
// Failures are returned as Status codes (errno values), never thrown; an
// operation a concrete class does not support returns STATUS_NOT_IMPLEMENTED
// without side effects. A slot object serves one thread at a time; the
// dual-file store's slots are safe across processes and objects
// (dual_file_target.h), the device targets each serialise their own update.
//
// The targets, each declared in its own header and implemented in
// storage_target.cpp (whose error lines carry its name):
//
//   DualFileTarget                 dual_file_target.h             the crash-safe stores
//   FileReadTarget                 file_read_target.h             read-only files on a partition
//   BootVectorTarget               boot_vector_target.h           the boot-vector record on the eMMC
//   FirmwareUpdateBootTarget       firmware_update_boot_target.h  a boot file, rewritten and read back
//   FirmwareUpdatePartitionTarget  firmware_update_partition_target.h  the resource partition's image
//   TargetWriteAdaptor             write_adaptors.h               an observer around another target
//
// What is declared here is implemented in storage_target_interfaces.cpp.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

#include "lib/util/status.h"

namespace Storage {

class TargetSlot;

// What getSlot returns: a slot pointer and whether the handle owns it.
// A null handle (no slot) means there is no slot at that index. Move-only;
// an owning handle destroys its slot when released or destroyed.
class SlotHandle {
public:
    SlotHandle() = default;
    // A slot that belongs to its target and lives as long as the target.
    static SlotHandle borrow(TargetSlot* slot) { return SlotHandle(slot, 0); }
    // A slot the handle destroys, e.g. a slot adaptor.
    static SlotHandle own(std::unique_ptr<TargetSlot> slot) { return SlotHandle(slot.release(), 1); }

    SlotHandle(SlotHandle&& other) noexcept : slot_(other.slot_), owned_(other.owned_) { other.forget(); }
    SlotHandle& operator=(SlotHandle&& other) noexcept;
    SlotHandle(const SlotHandle&) = delete;
    SlotHandle& operator=(const SlotHandle&) = delete;
    ~SlotHandle() { reset(); }

    TargetSlot* get() const { return slot_; }
    TargetSlot* operator->() const { return slot_; }
    explicit operator bool() const { return slot_ != nullptr; }
    bool ownsSlot() const { return owned_ != 0; }

    // Destroys an owned slot; leaves the handle null either way.
    void reset();

private:
    SlotHandle(TargetSlot* slot, uint32_t owned) : slot_(slot), owned_(owned) {}
    void forget() {
        slot_ = nullptr;
        owned_ = 0;
    }

    TargetSlot* slot_ = nullptr;
    uint32_t owned_ = 0;
};

class Target {
public:
    virtual ~Target() = default;

    // The slot at `index`, or a null handle when there is none.
    virtual SlotHandle getSlot(size_t index) = 0;
    virtual size_t getSlotCount() const = 0;
    // Class name, a blank and the target's path; used in log lines.
    virtual std::string getDescription() const = 0;

    // Opens `name` below the target's path as a new slot; reports its index
    // and size. Only FileReadTarget has slots that come and go; every other
    // target returns STATUS_NOT_IMPLEMENTED from addSlot and removeSlot.
    [[nodiscard]] virtual Status addSlot(const char* name, size_t& index, size_t& size);
    // STATUS_INVALID_PARAMETER when no slot has that index.
    [[nodiscard]] virtual Status removeSlot(size_t index);
    // FileReadTarget: STATUS_OK, every slot closed. The targets with a fixed
    // set of slots have nothing to remove: STATUS_NOTHING_TO_DO from the
    // device targets, STATUS_NOT_IMPLEMENTED from DualFileTarget (and from a
    // write adaptor, after telling its observer).
    [[nodiscard]] virtual Status removeAllSlots();
};

// One blob of a target. The calling orders the slots support:
//
//   query        exists(), then isValid(): a caller treats the slot as
//                holding data only when both are true
//   replace      write(data, size)
//   incremental  beginWrite(), any number of writeAt(), then finalise();
//                erase() drops the pending update where the slot has one
//   read         read() or readSome() at any time: the committed content,
//                never the pending one
//
// What each operation does per target, and which it does not implement
// (STATUS_NOT_IMPLEMENTED, nothing changed):
//
//                  DualFile  FileRead  BootVector  BootFile  Partition
//   beginWrite     yes       -         -           yes       yes
//   writeAt        yes       -         -           yes       yes
//   finalise       yes       -         -           yes       yes
//   write          yes       -         yes         -         -
//   read/readSome  yes       yes       yes         -         -
//   erase          yes       -         -           yes       -
//
// exists() and isValid() mean, per target:
//   DualFile    the current copy is valid and has a data file / the
//               current copy is valid (an erased slot: valid, not existing)
//   FileRead    both: the file is open
//   BootVector  both: a boot-vector record was located, read and valid
//   BootFile,   exists() always; isValid(): an update is in progress
//   Partition
class TargetSlot {
public:
    virtual ~TargetSlot() = default;

    // The slot holds stored data that a read can serve.
    virtual bool exists() const = 0;
    // The slot's current content is consistent (see above per target).
    virtual bool isValid() const = 0;

    // Starts an incremental write. Again while one is begun: STATUS_OK,
    // and the dual-file slot does not restart it (the firmware slots do).
    [[nodiscard]] virtual Status beginWrite();
    // Makes the incremental write the current content. Without a begun
    // write: STATUS_INVALID_OPERATION (dual-file), STATUS_NOT_FOUND
    // (firmware slots).
    [[nodiscard]] virtual Status finalise();
    // Replaces the whole content in one call (begin, write, commit).
    [[nodiscard]] virtual Status write(const uint8_t* data, size_t size);
    // Writes one block at `offset` into the pending content; the dual-file
    // slot also takes it outside a begun write, as a whole commit of the
    // changed blob. A failing call returns its errno, a short write
    // STATUS_FAILED; the firmware slots without an update
    // STATUS_INVALID_OPERATION.
    [[nodiscard]] virtual Status writeAt(int64_t offset, const uint8_t* data, size_t size);
    // Reads committed content, never pending content.
    [[nodiscard]] virtual Status read(uint8_t* buffer, size_t size, int64_t offset);
    // As read, and reports the count. On failure the file-read slot sets it
    // to 0 and the dual-file slot leaves it unchanged.
    [[nodiscard]] virtual Status readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead);
    // Discards the content (the dual-file slot commits the absent blob) or
    // the pending update (the boot-file slot).
    [[nodiscard]] virtual Status erase();
};

// Told before and after the operations on a slot reached through a
// TargetSlotAdaptor. `skip` asks the observer to take no action.
class TargetSlotObserver {
public:
    virtual ~TargetSlotObserver() = default;

    virtual void onBeginWrite(size_t index, bool skip) = 0;
    virtual void onFinalised(size_t index, bool skip) = 0;
    virtual void onRemoveAllSlots() = 0;
    virtual void beforeModify(size_t index) = 0;
    virtual void afterModify(size_t index) = 0;
    virtual void beforeRead(size_t index) = 0;
    virtual void afterRead(size_t index) = 0;
};

// Forwards every operation to an inner slot and brackets it with the
// observer's calls; the inner status is returned unchanged and the
// after-calls are made whatever it was.
class TargetSlotAdaptor : public TargetSlot {
public:
    TargetSlotAdaptor(SlotHandle inner, size_t index, TargetSlotObserver& observer)
        : inner_(std::move(inner)), index_(index), observer_(observer) {}

    bool exists() const override { return inner_ && inner_->exists(); }
    bool isValid() const override { return inner_ && inner_->isValid(); }
    Status beginWrite() override;
    Status finalise() override;
    Status write(const uint8_t* data, size_t size) override;
    Status writeAt(int64_t offset, const uint8_t* data, size_t size) override;
    Status read(uint8_t* buffer, size_t size, int64_t offset) override;
    Status readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) override;
    Status erase() override;

private:
    template <typename Operation>
    Status modify(Operation operation);
    template <typename Operation>
    Status observeRead(Operation operation);

    SlotHandle inner_;
    size_t index_;
    TargetSlotObserver& observer_;
};

}  // namespace Storage
