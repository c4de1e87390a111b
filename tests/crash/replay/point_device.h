// The devices of a scenario's crash points on a real kernel: each a
// copy-on-write snapshot of the device as the log started, with the
// point's sectors laid on top. The file system's recovery and the store
// may write to it as they like; the origin stays as it was for the next
// point.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "crash_points.h"
#include "mapped_device.h"
#include "page_runs.h"

namespace replay {

class PointDevices {
public:
    // Snapshots of `origin`, which holds `base` (kept by reference), named
    // `prefix`-N, whose changes go to each of `cows` in turn (each at least
    // as large).
    PointDevices(const std::string& prefix, const std::filesystem::path& origin, const std::vector<uint8_t>& base,
                 const std::vector<std::filesystem::path>& cows);
    // Waits until every device is removed.
    ~PointDevices();
    PointDevices(const PointDevices&) = delete;
    PointDevices& operator=(const PointDevices&) = delete;

    // A new device with `overlay` written onto it in sectors of
    // `sectorSize` bytes. Throws std::system_error when the kernel refuses.
    std::unique_ptr<MappedDevice> make(const SectorOverlay& overlay, uint32_t sectorSize);
    // Removes `device` on a thread of its own: a removal waits on the
    // kernel for longer than the checks of a point take.
    void release(std::unique_ptr<MappedDevice> device);

private:
    void removeReleased();

    std::string prefix_;
    std::filesystem::path origin_;
    const std::vector<uint8_t>& base_;
    std::vector<std::filesystem::path> cows_;
    size_t made_ = 0;

    std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<std::unique_ptr<MappedDevice>> released_;
    size_t removing_ = 0;  // released and not yet removed
    bool closing_ = false;
    std::thread remover_;
};

}  // namespace replay
