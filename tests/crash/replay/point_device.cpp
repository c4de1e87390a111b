#include "point_device.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <system_error>

namespace replay {

namespace fs = std::filesystem;

namespace {

void writeOverlay(const fs::path& node, const SectorOverlay& overlay, uint32_t sectorSize) {
    const int fd = ::open(node.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0) throw std::system_error(errno, std::generic_category(), "open " + node.string());
    for (const auto& [sector, bytes] : overlay) {
        if (::pwrite(fd, bytes.data(), bytes.size(), static_cast<off_t>(sector * sectorSize)) !=
            static_cast<ssize_t>(bytes.size())) {
            const int error = errno;
            ::close(fd);
            throw std::system_error(error, std::generic_category(), "write " + node.string());
        }
    }
    // Closing the last descriptor writes the device's cache back and drops it.
    const bool synced = ::fsync(fd) == 0;
    const int error = errno;
    ::close(fd);
    if (!synced) throw std::system_error(error, std::generic_category(), "fsync " + node.string());
}

}  // namespace

PointDevices::PointDevices(const std::string& prefix, const fs::path& origin, const std::vector<fs::path>& cows,
                           uint64_t sectors)
    : prefix_(prefix), origin_(origin), cows_(cows), sectors_(sectors), remover_([this] { removeReleased(); }) {
    if (cows_.empty()) throw std::invalid_argument("point devices need a cow device");
}

PointDevices::~PointDevices() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        closing_ = true;
    }
    changed_.notify_all();
    remover_.join();
}

std::unique_ptr<MappedDevice> PointDevices::make(const SectorOverlay& overlay, uint32_t sectorSize) {
    const fs::path& cow = cows_[made_ % cows_.size()];
    {
        // Two snapshots on one cow device at once would hand the older
        // one's changes over to the newer: the device that last used this
        // cow must be gone.
        std::unique_lock<std::mutex> lock(mutex_);
        changed_.wait(lock, [this] { return removing_ < cows_.size(); });
    }
    // Non-persistent: the exceptions live in memory, so a cow device is
    // reused as it is.
    auto device = std::make_unique<MappedDevice>(prefix_ + "-" + std::to_string(made_++), sectors_,
                                                 "snapshot " + origin_.string() + " " + cow.string() + " N 8");
    writeOverlay(device->node(), overlay, sectorSize);
    return device;
}

void PointDevices::release(std::unique_ptr<MappedDevice> device) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        released_.push_back(std::move(device));
        ++removing_;
    }
    changed_.notify_all();
}

void PointDevices::removeReleased() {
    std::unique_lock<std::mutex> lock(mutex_);
    for (;;) {
        changed_.wait(lock, [this] { return closing_ || !released_.empty(); });
        if (released_.empty()) return;
        std::unique_ptr<MappedDevice> device = std::move(released_.front());
        released_.pop_front();
        lock.unlock();
        device.reset();
        lock.lock();
        --removing_;
        changed_.notify_all();
    }
}

}  // namespace replay
