// The storage model: every persistent store of the device is a Target made
// of numbered TargetSlots, each slot one blob that can be queried, read,
// replaced in one call, or written incrementally and then committed.
//
// Failures are returned as Status codes (errno values), never thrown; an
// operation a concrete class does not support returns STATUS_NOT_IMPLEMENTED
// without side effects. Slots have no locks: one operation on a slot at a
// time.
//
// What is declared here is implemented in storage_target_interfaces.cpp;
// storage_target.cpp holds the concrete targets, whose error lines carry
// its name.
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
    // and size.
    [[nodiscard]] virtual Status addSlot(const char* name, size_t& index, size_t& size);
    [[nodiscard]] virtual Status removeSlot(size_t index);
    [[nodiscard]] virtual Status removeAllSlots();
};

class TargetSlot {
public:
    virtual ~TargetSlot() = default;

    // The slot holds stored data that can be read.
    virtual bool exists() const = 0;
    // The slot's current content is consistent.
    virtual bool isValid() const = 0;

    // Starts an incremental write; again while begun is harmless.
    [[nodiscard]] virtual Status beginWrite();
    // Commits the incremental write.
    [[nodiscard]] virtual Status finalise();
    // Replaces the whole content in one call.
    [[nodiscard]] virtual Status write(const uint8_t* data, size_t size);
    // Writes one block at `offset`.
    [[nodiscard]] virtual Status writeAt(int64_t offset, const uint8_t* data, size_t size);
    // Reads committed content, never pending content.
    [[nodiscard]] virtual Status read(uint8_t* buffer, size_t size, int64_t offset);
    [[nodiscard]] virtual Status readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead);
    // Discards the content or the pending data.
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
