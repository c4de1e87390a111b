#include "point_device.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <new>
#include <stdexcept>
#include <system_error>

namespace replay {

namespace fs = std::filesystem;

namespace {

// The snapshots' chunk.
constexpr size_t kChunkBytes = 4096;

// Whole chunks, straight to the device: a cached partial page would be read
// before it is written, a round trip to the origin for every page.
void writeRuns(const fs::path& node, const std::vector<PageRun>& runs) {
    size_t largest = 0;
    for (const PageRun& run : runs) largest = std::max(largest, run.bytes.size());
    if (largest == 0) return;
    void* memory = nullptr;
    if (::posix_memalign(&memory, kChunkBytes, largest) != 0) throw std::bad_alloc();
    const std::unique_ptr<void, decltype(&std::free)> buffer(memory, &std::free);
    const int fd = ::open(node.c_str(), O_WRONLY | O_DIRECT | O_CLOEXEC);
    if (fd < 0) throw std::system_error(errno, std::generic_category(), "open " + node.string());
    for (const PageRun& run : runs) {
        std::memcpy(memory, run.bytes.data(), run.bytes.size());
        if (::pwrite(fd, memory, run.bytes.size(), static_cast<off_t>(run.offset)) !=
            static_cast<ssize_t>(run.bytes.size())) {
            const int error = errno;
            ::close(fd);
            throw std::system_error(error, std::generic_category(), "write " + node.string());
        }
    }
    ::close(fd);
}

}  // namespace

PointDevices::PointDevices(const std::string& prefix, const fs::path& origin, const std::vector<uint8_t>& base,
                           const std::vector<fs::path>& cows)
    : prefix_(prefix), origin_(origin), base_(base), cows_(cows), remover_([this] { removeReleased(); }) {
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
    auto device = std::make_unique<MappedDevice>(
        prefix_ + "-" + std::to_string(made_++), base_.size() / 512,
        "snapshot " + origin_.string() + " " + cow.string() + " N " + std::to_string(kChunkBytes / 512));
    writeRuns(device->node(), pageRuns(overlay, sectorSize, base_, kChunkBytes));
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
