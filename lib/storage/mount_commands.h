// Mount state changes of device partitions, through the system's mount and
// umount commands (device and type come from the mount table).
#pragma once

#include <string>

#include "lib/util/status.h"

namespace Storage {

// Where the boot partition is mounted.
extern const char kBootMountPoint[];

// Runs "mount -o remount,rw|ro /media/boot" through system(), after the
// warning "Remounting "/media/boot" as rw|ro". STATUS_FAILED (and an error
// line) when the command does not succeed.
[[nodiscard]] Status remountBootPartition(bool writable);

// Runs "mount <mountPoint>" after the warning "Mounting <quoted>"; returns
// runCommand's status and reports a failure.
[[nodiscard]] Status mountPartition(const std::string& mountPoint);

// As mountPartition, with "umount" and "Unmounting ".
[[nodiscard]] Status unmountPartition(const std::string& mountPoint);

}  // namespace Storage
