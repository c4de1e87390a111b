#include "point_device.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <stdexcept>
#include <system_error>
#include <vector>

#include "child_process.h"

namespace replay {

namespace fs = std::filesystem;

namespace {

void dmsetup(const std::vector<std::string>& words) {
    std::vector<std::string> command = {"/sbin/dmsetup"};
    command.insert(command.end(), words.begin(), words.end());
    const testing_support::ProcessResult result = testing_support::runProgram(command);
    if (result.exitStatus != 0) throw std::runtime_error("dmsetup " + words.at(0) + " failed: " + result.err);
}

// Without udev nothing appears under /dev/mapper; the kernel's name for
// the mapped device is in sysfs.
fs::path nodeOf(const std::string& name) {
    for (const fs::directory_entry& entry : fs::directory_iterator("/sys/block")) {
        std::ifstream file(entry.path() / "dm" / "name");
        std::string text;
        if (std::getline(file, text) && text == name) return fs::path("/dev") / entry.path().filename();
    }
    throw std::runtime_error("no block device for the mapped device " + name);
}

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

PointDevice::PointDevice(const std::string& name, const fs::path& origin, const fs::path& cow, uint64_t sectors,
                         const SectorOverlay& overlay, uint32_t sectorSize)
    : name_(name) {
    // Non-persistent: the exceptions live in memory, so the cow device is
    // reused as it is.
    dmsetup({"create", name_, "--table",
             "0 " + std::to_string(sectors) + " snapshot " + origin.string() + " " + cow.string() + " N 8"});
    try {
        node_ = nodeOf(name_);
        writeOverlay(node_, overlay, sectorSize);
    } catch (...) {
        dmsetup({"remove", "--retry", name_});
        throw;
    }
}

PointDevice::~PointDevice() {
    try {
        dmsetup({"remove", "--retry", name_});
    } catch (const std::exception&) {
        // The next creation under this name fails and says so.
    }
}

}  // namespace replay
