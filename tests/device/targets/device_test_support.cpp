#include "device_test_support.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <stdexcept>

#include "files.h"
#include "simulated_device.h"

namespace device_test {

void mustRun(const std::string& command) {
    const ProcessResult result = testing_support::runShell(command);
    if (result.exitStatus != 0) {
        throw std::runtime_error("'" + command + "' failed (" + std::to_string(result.exitStatus) + "): " + result.out +
                                 result.err);
    }
}

std::vector<std::string> temporaryFirmwareFiles() {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator("/tmp")) {
        const std::string name = entry.path().filename().string();
        if (name.rfind("firmware", 0) == 0) names.push_back(name);
    }
    std::sort(names.begin(), names.end());
    return names;
}

std::string temporaryFirmwareDescriptors() {
    std::string lines;
    for (const auto& entry : fs::directory_iterator("/proc/self/fd")) {
        std::error_code error;
        const fs::path target = fs::read_symlink(entry.path(), error);
        if (!error && target.string().rfind("/tmp/firmware", 0) == 0) lines += target.string() + "\n";
    }
    return lines;
}

Bytes pattern(size_t size, uint8_t seed) {
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<uint8_t>(seed + i * 13 + (i >> 9));
    return bytes;
}

Bytes fileBytes(const fs::path& path) { return testing_support::readBytes(path); }

void setImmutable(const fs::path& path, bool immutable) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) throw std::runtime_error("open " + path.string() + ": " + std::strerror(errno));
    int flags = 0;
    bool done = ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
    if (done) {
        flags = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
        done = ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
    }
    const int error = errno;
    ::close(fd);
    if (!done) throw std::runtime_error("immutable flag of " + path.string() + ": " + std::strerror(error));
}

void changeBootPartition(const std::function<void()>& change) {
    mustRun("mount -o remount,rw /media/boot");
    try {
        change();
    } catch (...) {
        (void)testing_support::runShell("mount -o remount,ro /media/boot");
        throw;
    }
    mustRun("mount -o remount,ro /media/boot");
}

void restoreBootFiles() {
    changeBootPartition([] {
        for (const char* name : {"BOOT.BIN", "BOOT0010.BIN"}) {
            const fs::path file = fs::path(simulated_device::kBootMount) / name;
            if (fs::is_regular_file(file)) setImmutable(file, false);
            fs::remove_all(file);
            fs::copy_file(simulated_device::originalBootFile(name), file);
        }
    });
}

dev_t blockDeviceNumber(const fs::path& node) {
    struct stat st {};
    if (::lstat(node.c_str(), &st) != 0 || !S_ISBLK(st.st_mode)) return 0;
    return st.st_rdev;
}

void makeBlockNode(const fs::path& node, dev_t number) {
    fs::remove_all(node);
    if (::mknod(node.c_str(), S_IFBLK | 0660, number) != 0) {
        throw std::runtime_error("mknod " + node.string() + ": " + std::strerror(errno));
    }
}

}  // namespace device_test
