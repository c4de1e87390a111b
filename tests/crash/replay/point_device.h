// The device of a scenario's crash points on a real kernel: a copy-on-write
// snapshot of the device as the log started, with a point's sectors laid
// on top. The file system's recovery and the store may write to it as they
// like; the origin stays as it was, and the next point gets a new snapshot
// under the same mapped device.
#pragma once

#include <array>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "crash_points.h"
#include "mapped_device.h"

namespace replay {

class PointDevice {
public:
    // Writes `base` (kept by reference) onto the block device `origin`, and
    // makes the mapped device `name` over it. Its snapshots keep their
    // changes on the two `cows` in turn, each at least as large as `base`.
    // Throws std::system_error when the kernel refuses, std::runtime_error
    // when the origin cannot be written.
    PointDevice(const std::string& name, const std::filesystem::path& origin, const std::vector<uint8_t>& base,
                const std::array<std::filesystem::path, 2>& cows);

    // Makes the device the origin with `overlay` written onto it in sectors
    // of `sectorSize` bytes, whatever the last point left on it gone. The
    // device must not be open. Throws std::system_error when the kernel
    // refuses.
    void lay(const SectorOverlay& overlay, uint32_t sectorSize);

    const std::filesystem::path& node() const { return device_.node(); }

private:
    std::string snapshotOn(size_t cow) const;

    std::filesystem::path origin_;
    const std::vector<uint8_t>& base_;
    std::array<std::filesystem::path, 2> cows_;
    MappedDevice device_;
    size_t laid_ = 0;
};

}  // namespace replay
