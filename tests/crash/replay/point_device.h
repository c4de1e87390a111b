// A crash point's device on a real kernel: a copy-on-write snapshot of the
// device as the log started, with the point's sectors laid on top. The
// file system's recovery and the store may write to it as they like; the
// origin stays as it was for the next point.
#pragma once

#include <cstdint>
#include <filesystem>
#include <string>

#include "crash_points.h"

namespace replay {

class PointDevice {
public:
    // A snapshot named `name` of `origin` (`sectors` 512-byte sectors)
    // whose changes go to `cow`, at least as large; `overlay` written onto
    // it in sectors of `sectorSize` bytes.
    PointDevice(const std::string& name, const std::filesystem::path& origin, const std::filesystem::path& cow,
                uint64_t sectors, const SectorOverlay& overlay, uint32_t sectorSize);
    ~PointDevice();
    PointDevice(const PointDevice&) = delete;
    PointDevice& operator=(const PointDevice&) = delete;

    // The device's node (devtmpfs makes one for every mapped device).
    const std::filesystem::path& node() const { return node_; }

private:
    std::string name_;
    std::filesystem::path node_;
};

}  // namespace replay
