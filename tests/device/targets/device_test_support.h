// Helpers for the device targets' tests on the simulated device: a recorder
// in front of the system's mount and umount, and small shell and
// device-node chores.
#pragma once

#include <sys/types.h>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "child_process.h"
#include "fake_mount_commands.h"
#include "files.h"
#include "lib/storage/storage_target.h"
#include "simulated_device.h"
#include "storage_log.h"

// The device targets' tests live in this namespace, beside the names they
// all use.
namespace device_test {

namespace fs = std::filesystem;
namespace sd = simulated_device;
using Bytes = std::vector<uint8_t>;
using Storage::TargetSlot;
using testing_support::normalisedStorageLog;
using testing_support::ProcessResult;

// As testing_support::runShell, but a failure throws std::runtime_error
// with its output.
void mustRun(const std::string& command);

// The stand-in mount and umount in front of the real ones: every call is
// recorded, then runs the real command unless FAKE_MOUNT_EXIT is set.
class MountRecorder : public testing_support::FakeMountCommands {
public:
    MountRecorder() : FakeMountCommands(Fallback::realCommand) {}
};

// Entries of /tmp whose names begin with "firmware", sorted.
std::vector<std::string> temporaryFirmwareFiles();

// "/tmp/firmware..." descriptors this process holds, as the kernel names
// them (" (deleted)" for a removed file), one per line.
std::string temporaryFirmwareDescriptors();

Bytes pattern(size_t size, uint8_t seed);
Bytes fileBytes(const std::filesystem::path& path);

// Sets or clears the immutable attribute of a file on a file system that is
// writable at the moment. Throws on failure.
void setImmutable(const std::filesystem::path& path, bool immutable);

// Makes /media/boot writable for `change`, then read-only again.
void changeBootPartition(const std::function<void()>& change);

// Puts both boot files back as the device was made, clearing the immutable
// attribute first, and leaves /media/boot read-only. Throws on failure.
void restoreBootFiles();

// The device number of a block device node; 0 when it is not one.
dev_t blockDeviceNumber(const std::filesystem::path& node);
// Replaces whatever is at `node` with a block device node (mode 0660).
void makeBlockNode(const std::filesystem::path& node, dev_t number);

using testing_support::hex;

}  // namespace device_test
