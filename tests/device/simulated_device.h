// Test-side access to the simulated device that tests/device/run_on_device.sh
// builds: whether a test runs inside it, where its image and loop devices
// are, raw bytes of the image, and the mount table as the device sees it.
//
// The accessors for the device's environment throw std::runtime_error when a
// variable is missing; call them only after SKIP_UNLESS_ON_SIMULATED_DEVICE.
#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace simulated_device {

using Bytes = std::vector<uint8_t>;

inline constexpr const char* kNotOnDeviceReason =
    "needs the simulated device; run it through tests/device/run_on_device.sh";

// The device's fixed paths.
inline constexpr const char* kDisk = "/dev/mmcblk0";
inline constexpr const char* kBootPartition = "/dev/mmcblk0p1";
inline constexpr const char* kResourcePartition = "/dev/mmcblk0p2";
inline constexpr const char* kBootMount = "/media/boot";
inline constexpr const char* kResourcesMount = "/media/resources";
inline constexpr const char* kStaticDir = "/media/static";
// A file of known text on the resource partition, to tell it is mounted.
inline constexpr const char* kResourcesMarker = "/media/resources/resources.id";
inline constexpr const char* kResourcesMarkerText = "simulated resource partition\n";

// True inside run_on_device.sh (SIMULATED_DEVICE=1).
bool onSimulatedDevice();

// Ends the current test (or SetUp) as skipped when not on the device.
#define SKIP_UNLESS_ON_SIMULATED_DEVICE()                                                                     \
    do {                                                                                                      \
        if (!::simulated_device::onSimulatedDevice()) GTEST_SKIP() << ::simulated_device::kNotOnDeviceReason; \
    } while (0)

// "normal", "low", "badrecord", "norecord" or "nofree".
std::string variant();

// The scratch directory of this run and the image file in it (the eMMC).
std::filesystem::path scratchDir();
std::filesystem::path imagePath();

// Loop devices behind /dev/mmcblk0, /dev/mmcblk0p1 and /dev/mmcblk0p2.
std::string diskLoop();
std::string bootLoop();
std::string resourcesLoop();

// Byte ranges of the boot and resource partitions inside the image.
uint64_t bootPartitionOffset();
uint64_t bootPartitionSize();
uint64_t resourcesPartitionOffset();
uint64_t resourcesPartitionSize();

// Start of the last free area, where the record lies; 0 when the image has
// no free area ("nofree").
uint64_t bootVectorSector();
uint64_t bootVectorOffset();  // sector × 512
// The 20 bytes written there; empty when none were written ("norecord",
// "nofree": the sector then reads as zeros).
Bytes writtenBootVectorRecord();

// Unchanged copies of the boot files as the boot partition was made.
std::filesystem::path originalBootFile(const std::string& name);

// Raw bytes of the image file. Writing also drops the loop devices' caches,
// so that the device nodes see the new bytes at once.
Bytes readImageBytes(uint64_t offset, size_t size);
void writeImageBytes(uint64_t offset, const Bytes& bytes);

// Raw bytes through a device node (for example kDisk); reading drops that
// device's cache first, writing syncs it.
Bytes readDeviceBytes(const std::string& device, uint64_t offset, size_t size);
void writeDeviceBytes(const std::string& device, uint64_t offset, const Bytes& bytes);

// Flushes and drops the cached blocks of the three loop devices. Each loop
// device caches on its own, unlike a disk and its partitions.
void dropDeviceCaches();

// One line of /proc/self/mounts, with the octal escapes decoded.
struct MountEntry {
    std::string source;
    std::string mountPoint;
    std::string type;
    std::vector<std::string> options;
    bool readOnly() const;
};

std::vector<MountEntry> readMounts();
// The entry on top at mountPoint (the last one listed), if any.
std::optional<MountEntry> findMount(const std::string& mountPoint);

enum class MountState { kNotMounted, kReadOnly, kReadWrite };
MountState mountState(const std::string& mountPoint);
const char* toString(MountState state);

// A boot-vector record built and checked independently of the product:
// value big-endian in bytes 0-3, `seed`-derived opaque bytes, byte 8 the sum
// of bytes 0-7, bytes 18-19 the 16-bit rotate-right-and-add sum, little-endian.
Bytes makeBootVectorRecord(uint32_t value, uint8_t seed = 0);
bool isValidBootVectorRecord(const Bytes& record);

// The runner script, for tests that start a device of their own from outside.
std::filesystem::path runnerPath();

}  // namespace simulated_device
