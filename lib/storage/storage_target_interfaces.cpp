// What storage_target.h declares, shared by every target: slot handles, the
// defaults of optional operations and the observing slot adaptor.
#include "lib/storage/storage_target.h"

namespace Storage {

SlotHandle& SlotHandle::operator=(SlotHandle&& other) noexcept {
    if (this != &other) {
        reset();
        slot_ = other.slot_;
        owned_ = other.owned_;
        other.forget();
    }
    return *this;
}

void SlotHandle::reset() {
    if (owned_ != 0) delete slot_;
    forget();
}

Status Target::addSlot(const char*, size_t&, size_t&) { return STATUS_NOT_IMPLEMENTED; }
Status Target::removeSlot(size_t) { return STATUS_NOT_IMPLEMENTED; }
Status Target::removeAllSlots() { return STATUS_NOT_IMPLEMENTED; }

Status TargetSlot::beginWrite() { return STATUS_NOT_IMPLEMENTED; }
Status TargetSlot::finalise() { return STATUS_NOT_IMPLEMENTED; }
Status TargetSlot::write(const uint8_t*, size_t) { return STATUS_NOT_IMPLEMENTED; }
Status TargetSlot::writeAt(int64_t, const uint8_t*, size_t) { return STATUS_NOT_IMPLEMENTED; }
Status TargetSlot::read(uint8_t*, size_t, int64_t) { return STATUS_NOT_IMPLEMENTED; }
Status TargetSlot::readSome(uint8_t*, size_t, int64_t, size_t&) { return STATUS_NOT_IMPLEMENTED; }
Status TargetSlot::erase() { return STATUS_NOT_IMPLEMENTED; }

// An adaptor over a missing slot answers like a caller that got no slot.
template <typename Operation>
Status TargetSlotAdaptor::modify(Operation operation) {
    observer_.beforeModify(index_);
    const Status status = inner_ ? operation(*inner_.get()) : STATUS_INVALID_PARAMETER;
    observer_.afterModify(index_);
    return status;
}

template <typename Operation>
Status TargetSlotAdaptor::observeRead(Operation operation) {
    observer_.beforeRead(index_);
    const Status status = inner_ ? operation(*inner_.get()) : STATUS_INVALID_PARAMETER;
    observer_.afterRead(index_);
    return status;
}

Status TargetSlotAdaptor::beginWrite() {
    observer_.onBeginWrite(index_, false);
    return inner_ ? inner_->beginWrite() : STATUS_INVALID_PARAMETER;
}

Status TargetSlotAdaptor::finalise() {
    const Status status = inner_ ? inner_->finalise() : STATUS_INVALID_PARAMETER;
    observer_.onFinalised(index_, false);
    return status;
}

Status TargetSlotAdaptor::write(const uint8_t* data, size_t size) {
    return modify([&](TargetSlot& slot) { return slot.write(data, size); });
}

Status TargetSlotAdaptor::writeAt(int64_t offset, const uint8_t* data, size_t size) {
    return modify([&](TargetSlot& slot) { return slot.writeAt(offset, data, size); });
}

Status TargetSlotAdaptor::erase() {
    return modify([](TargetSlot& slot) { return slot.erase(); });
}

Status TargetSlotAdaptor::read(uint8_t* buffer, size_t size, int64_t offset) {
    return observeRead([&](TargetSlot& slot) { return slot.read(buffer, size, offset); });
}

Status TargetSlotAdaptor::readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) {
    return observeRead([&](TargetSlot& slot) { return slot.readSome(buffer, size, offset, bytesRead); });
}

}  // namespace Storage
