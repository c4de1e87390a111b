#include "lib/storage/write_adaptors.h"

#include <iomanip>

#include "lib/util/log.h"
#include "lib/util/run_command.h"

namespace Storage {

PartitionWriteAdaptor_::~PartitionWriteAdaptor_() {
    activeWrites_.clear();
    if (writable_) {
        setWritable(false);
        writable_ = false;
    }
}

void PartitionWriteAdaptor_::acquire(size_t index) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto [entry, inserted] = activeWrites_.try_emplace(index, 1);
    if (!inserted) {
        ++entry->second;
        return;
    }
    updateMountState();
}

void PartitionWriteAdaptor_::release(size_t index) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto entry = activeWrites_.find(index);
    if (entry == activeWrites_.end()) {
        LOGW << "WriteAdaptor: index " << index << " was finalised, but doesn't appear to be active";
        return;
    }
    if (entry->second > 1) {
        --entry->second;
        return;
    }
    activeWrites_.erase(entry);
    updateMountState();
}

// A failed remount is not retried until the next transition.
void PartitionWriteAdaptor_::updateMountState() {
    if (writable_ && activeWrites_.empty()) {
        setWritable(false);
        writable_ = false;
    } else if (!writable_ && !activeWrites_.empty()) {
        setWritable(true);
        writable_ = true;
    }
}

void PartitionWriteAdaptor_::setWritable(bool writable) {
    // The mount point goes to the shell as it stands.
    const std::string command = std::string("mount -o remount,r") + (writable ? "w" : "o") + " " + mountPoint_.string();
    std::string ignoredOutput;
    if (runCommand(command, ignoredOutput) != STATUS_OK) {
        LOGE << "Failed to set " << std::quoted(mountPoint_.string()) << " to "
             << (writable ? "writable" : "not writable");
    }
}

}  // namespace Storage
