#include "simulated_device.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "enum_names.h"
#include "files.h"

namespace simulated_device {
namespace {

std::string requireEnv(const char* name) {
    const char* value = std::getenv(name);
    if (value == nullptr) throw std::runtime_error(std::string(name) + " is not set: not on the simulated device");
    return value;
}

uint64_t requireNumber(const char* name) {
    const std::string text = requireEnv(name);
    size_t used = 0;
    const unsigned long long value = std::stoull(text, &used, 10);
    if (used != text.size()) throw std::runtime_error(std::string(name) + " is not a number: " + text);
    return value;
}

[[noreturn]] void throwErrno(const std::string& what, int error) {
    throw std::runtime_error(what + ": " + std::strerror(error));
}

class Fd {
public:
    Fd(const std::string& path, int flags) : fd_(::open(path.c_str(), flags | O_CLOEXEC)) {
        if (fd_ < 0) throwErrno("open " + path, errno);
    }
    ~Fd() { ::close(fd_); }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int get() const { return fd_; }

private:
    int fd_;
};

Bytes preadAll(const std::string& path, uint64_t offset, size_t size) {
    Fd fd(path, O_RDONLY);
    Bytes bytes(size);
    size_t done = 0;
    while (done < size) {
        const ssize_t got = ::pread(fd.get(), bytes.data() + done, size - done, static_cast<off_t>(offset + done));
        if (got < 0 && errno == EINTR) continue;
        if (got < 0) throwErrno("read " + path, errno);
        if (got == 0) throw std::runtime_error("read " + path + ": ends before " + std::to_string(offset + size));
        done += static_cast<size_t>(got);
    }
    return bytes;
}

void pwriteAll(const std::string& path, uint64_t offset, const Bytes& bytes) {
    Fd fd(path, O_WRONLY);
    size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t put =
            ::pwrite(fd.get(), bytes.data() + done, bytes.size() - done, static_cast<off_t>(offset + done));
        if (put < 0 && errno == EINTR) continue;
        if (put <= 0) throwErrno("write " + path, errno);
        done += static_cast<size_t>(put);
    }
    if (::fsync(fd.get()) != 0) throwErrno("fsync " + path, errno);
}

void dropCache(const std::string& device) {
    Fd fd(device, O_RDONLY);
    if (::ioctl(fd.get(), BLKFLSBUF, 0) != 0) throwErrno("BLKFLSBUF " + device, errno);
}

// /proc/self/mounts writes blank, tab, newline and backslash as \ooo.
std::string unescapeMountField(const std::string& field) {
    std::string out;
    for (size_t i = 0; i < field.size(); ++i) {
        if (field[i] == '\\' && i + 3 < field.size()) {
            const std::string octal = field.substr(i + 1, 3);
            if (octal.find_first_not_of("01234567") == std::string::npos) {
                out += static_cast<char>(std::stoi(octal, nullptr, 8));
                i += 3;
                continue;
            }
        }
        out += field[i];
    }
    return out;
}

}  // namespace

bool onSimulatedDevice() {
    const char* value = std::getenv("SIMULATED_DEVICE");
    return value != nullptr && std::strcmp(value, "1") == 0;
}

std::string variant() { return requireEnv("SIMULATED_DEVICE_VARIANT"); }
std::filesystem::path scratchDir() { return requireEnv("SIMULATED_DEVICE_DIR"); }
std::filesystem::path imagePath() { return requireEnv("SIMULATED_DEVICE_IMAGE"); }
std::string diskLoop() { return requireEnv("SIMULATED_DEVICE_LOOP"); }
std::string bootLoop() { return requireEnv("SIMULATED_DEVICE_BOOT_LOOP"); }
std::string resourcesLoop() { return requireEnv("SIMULATED_DEVICE_RESOURCES_LOOP"); }
uint64_t bootPartitionOffset() { return requireNumber("SIMULATED_DEVICE_BOOT_OFFSET"); }
uint64_t bootPartitionSize() { return requireNumber("SIMULATED_DEVICE_BOOT_SIZE"); }
uint64_t resourcesPartitionOffset() { return requireNumber("SIMULATED_DEVICE_RESOURCES_OFFSET"); }
uint64_t resourcesPartitionSize() { return requireNumber("SIMULATED_DEVICE_RESOURCES_SIZE"); }
uint64_t bootVectorSector() { return requireNumber("SIMULATED_DEVICE_BOOT_VECTOR_SECTOR"); }
uint64_t bootVectorOffset() { return bootVectorSector() * 512; }
Bytes writtenBootVectorRecord() { return testing_support::fromHex(requireEnv("SIMULATED_DEVICE_BOOT_VECTOR_RECORD")); }

std::filesystem::path originalBootFile(const std::string& name) {
    if (name == "BOOT.BIN") return requireEnv("SIMULATED_DEVICE_BOOT_BIN");
    if (name == "BOOT0010.BIN") return requireEnv("SIMULATED_DEVICE_BOOT0010_BIN");
    throw std::invalid_argument("no boot file " + name);
}

Bytes readImageBytes(uint64_t offset, size_t size) { return preadAll(imagePath().string(), offset, size); }

void writeImageBytes(uint64_t offset, const Bytes& bytes) {
    pwriteAll(imagePath().string(), offset, bytes);
    dropDeviceCaches();
}

Bytes readDeviceBytes(const std::string& device, uint64_t offset, size_t size) {
    dropCache(device);
    return preadAll(device, offset, size);
}

void writeDeviceBytes(const std::string& device, uint64_t offset, const Bytes& bytes) {
    pwriteAll(device, offset, bytes);
}

void dropDeviceCaches() {
    for (const std::string& loop : {diskLoop(), bootLoop(), resourcesLoop()}) dropCache(loop);
}

bool MountEntry::readOnly() const {
    for (const std::string& option : options) {
        if (option == "ro") return true;
    }
    return false;
}

std::vector<MountEntry> readMounts() {
    std::ifstream in("/proc/self/mounts");
    if (!in) throw std::runtime_error("cannot read /proc/self/mounts");
    std::vector<MountEntry> mounts;
    std::string line;
    while (std::getline(in, line)) {
        std::istringstream fields(line);
        MountEntry entry;
        std::string options;
        if (!(fields >> entry.source >> entry.mountPoint >> entry.type >> options)) continue;
        entry.source = unescapeMountField(entry.source);
        entry.mountPoint = unescapeMountField(entry.mountPoint);
        std::istringstream list(options);
        for (std::string option; std::getline(list, option, ',');) entry.options.push_back(option);
        mounts.push_back(std::move(entry));
    }
    return mounts;
}

std::optional<MountEntry> findMount(const std::string& mountPoint) {
    std::optional<MountEntry> found;
    for (MountEntry& entry : readMounts()) {
        if (entry.mountPoint == mountPoint) found = std::move(entry);
    }
    return found;
}

MountState mountState(const std::string& mountPoint) {
    const std::optional<MountEntry> entry = findMount(mountPoint);
    if (!entry) return MountState::kNotMounted;
    return entry->readOnly() ? MountState::kReadOnly : MountState::kReadWrite;
}

const char* toString(MountState state) {
    static constexpr testing_support::EnumName<MountState> kNames[] = {{MountState::kNotMounted, "not mounted"},
                                                                       {MountState::kReadOnly, "read-only"},
                                                                       {MountState::kReadWrite, "read-write"}};
    return testing_support::nameIn(kNames, state);
}

Bytes makeBootVectorRecord(uint32_t value, uint8_t seed) {
    Bytes record(20);
    record[0] = static_cast<uint8_t>(value >> 24);
    record[1] = static_cast<uint8_t>(value >> 16);
    record[2] = static_cast<uint8_t>(value >> 8);
    record[3] = static_cast<uint8_t>(value);
    for (size_t i = 4; i < 8; ++i) record[i] = static_cast<uint8_t>(seed + 0x31 * i);
    unsigned sum = 0;
    for (size_t i = 0; i < 8; ++i) sum += record[i];
    record[8] = static_cast<uint8_t>(sum);
    for (size_t i = 9; i < 18; ++i) record[i] = static_cast<uint8_t>(seed ^ (0x17 * i));
    unsigned c = 0;
    for (size_t i = 0; i < 18; ++i) c = ((((c >> 1) | ((c & 1) << 15)) + record[i]) & 0xFFFF);
    record[18] = static_cast<uint8_t>(c);
    record[19] = static_cast<uint8_t>(c >> 8);
    return record;
}

bool isValidBootVectorRecord(const Bytes& record) {
    if (record.size() != 20) return false;
    unsigned sum = 0;
    for (size_t i = 0; i < 8; ++i) sum += record[i];
    if ((sum & 0xFF) != record[8]) return false;
    unsigned c = 0;
    for (size_t i = 0; i < 18; ++i) c = ((((c >> 1) | ((c & 1) << 15)) + record[i]) & 0xFFFF);
    return c == (record[18] | (static_cast<unsigned>(record[19]) << 8));
}

std::filesystem::path runnerPath() { return SIMULATED_DEVICE_RUNNER; }

}  // namespace simulated_device
