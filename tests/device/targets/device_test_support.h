// Helpers for the device targets' tests on the simulated device: product log
// lines made comparable, a recorder in front of the system's mount and
// umount, and small shell and device-node chores.
#pragma once

#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <sys/types.h>
#include <vector>

#include "child_process.h"
#include "scratch_dir.h"

namespace device_test {

using Bytes = std::vector<uint8_t>;
using testing_support::ProcessResult;

// Line numbers of lib/storage/storage_target error lines become N (in the
// "<source>:<line> " prefix and in "[<source>:<line>]" reports), and each
// distinct "/tmp/firmwareXXXXXX" name becomes #1, #2, ... in order of first
// appearance. Everything else is left exactly as it was.
std::string normalised(const std::string& text);

// Runs `command` with /bin/sh -c; the result as it came.
ProcessResult shell(const std::string& command);
// As shell, but a failure throws std::runtime_error with its output.
void mustRun(const std::string& command);

// "mount" and "umount" in a scratch directory, to be put first on PATH:
// each call appends its name and every argument in brackets to a record
// ("mount [-o] [remount,rw] [/media/boot]"), then runs the real command, or
// exits with FAKE_MOUNT_EXIT when that is set.
class MountRecorder {
public:
    MountRecorder();

    std::string calls() const;
    void clear() const;
    // PATH with the recorder's directory in front.
    std::string path() const;

private:
    testing_support::ScratchDir dir_;
};

// Runs `body` in a child with the recorder first on PATH, the extra
// variables set, and the log on standard output at `threshold`.
ProcessResult runLogged(const MountRecorder& recorder, int threshold, const std::function<int()>& body,
                        const std::map<std::string, std::string>& env = {});

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

std::string hex(const Bytes& bytes);

}  // namespace device_test
