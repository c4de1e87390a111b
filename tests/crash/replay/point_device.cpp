#include "point_device.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <system_error>

#include "files.h"
#include "page_runs.h"

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

// The origin as the log started, before any snapshot is made over it.
const fs::path& filledWith(const fs::path& origin, const std::vector<uint8_t>& base) {
    testing_support::writeBytes(origin, base);
    return origin;
}

}  // namespace

PointDevice::PointDevice(const std::string& name, const fs::path& origin, const std::vector<uint8_t>& base,
                         const std::array<fs::path, 2>& cows)
    : origin_(filledWith(origin, base)), base_(base), cows_(cows), device_(name, base.size() / 512, snapshotOn(0)) {}

std::string PointDevice::snapshotOn(size_t cow) const {
    // Non-persistent: the exceptions live in memory, so a cow device is
    // reused as it is.
    return "snapshot " + origin_.string() + " " + cows_[cow].string() + " N " + std::to_string(kChunkBytes / 512);
}

void PointDevice::lay(const SectorOverlay& overlay, uint32_t sectorSize) {
    // A new snapshot on the cow the live one does not use: one on the same
    // cow would take over the live one's changes. The live one, and what
    // the last point wrote, goes when the new one replaces it.
    if (laid_ > 0) device_.reload(snapshotOn(laid_ % cows_.size()));
    ++laid_;
    writeRuns(device_.node(), pageRuns(overlay, sectorSize, base_, kChunkBytes));
}

}  // namespace replay
