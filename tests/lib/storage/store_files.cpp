#include "store_files.h"

#include "lib/storage/store_names.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <algorithm>
#include <cerrno>
#include <memory>
#include <ostream>
#include <sstream>
#include <stdexcept>

namespace store_test {
namespace fs = std::filesystem;

Bytes bytesOf(const std::string& text) { return Bytes(text.begin(), text.end()); }

Bytes patternBytes(size_t count, uint32_t seed) {
    Bytes bytes(count);
    uint32_t state = seed * 2654435761u + 1;
    for (auto& byte : bytes) {
        state = state * 1103515245u + 12345u;
        byte = static_cast<uint8_t>(state >> 16);
    }
    return bytes;
}

uint32_t referenceCrc32(const Bytes& data) {
    uint32_t crc = 0xFFFFFFFFu;
    for (const uint8_t byte : data) {
        crc ^= byte;
        for (int bit = 0; bit < 8; ++bit) crc = (crc & 1) ? (crc >> 1) ^ 0xEDB88320u : crc >> 1;
    }
    return ~crc;
}

Bytes expectedCheckFile(const Bytes& data) {
    const uint32_t size = static_cast<uint32_t>(data.size());
    const uint32_t crc = referenceCrc32(data);
    Bytes bytes;
    for (int i = 0; i < 4; ++i) bytes.push_back(static_cast<uint8_t>(size >> (8 * i)));
    for (int i = 0; i < 4; ++i) bytes.push_back(static_cast<uint8_t>(crc >> (8 * i)));
    return bytes;
}

Bytes absentCheckFile() { return Bytes(8, 0xFF); }

int64_t mtimeNs(const fs::path& path) {
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0) throw std::runtime_error("cannot stat " + path.string());
    return status.st_mtim.tv_sec * kSecond + status.st_mtim.tv_nsec;
}

void setMtimeNs(const fs::path& path, int64_t ns) {
    struct timespec times[2];
    times[0].tv_sec = 0;
    times[0].tv_nsec = UTIME_OMIT;
    times[1].tv_sec = ns / kSecond;
    times[1].tv_nsec = ns % kSecond;
    if (::utimensat(AT_FDCWD, path.c_str(), times, 0) != 0) {
        throw std::runtime_error("cannot set the time of " + path.string());
    }
}

int64_t nowNs() {
    struct timespec now {};
    clock_gettime(CLOCK_REALTIME, &now);
    return now.tv_sec * kSecond + now.tv_nsec;
}

int64_t touchNow(const fs::path& path) {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
    if (fd < 0) throw std::runtime_error("cannot create " + path.string());
    ::close(fd);
    return mtimeNs(path);
}

std::string copyLines(const std::string& copy, const Bytes& blob) {
    return "f " + copy + "/" + Storage::kDataName + " " + hex(blob) + "\nf " + copy + "/" + Storage::kCheckName + " " +
           hex(expectedCheckFile(blob)) + "\n";
}

std::string describeTree(const fs::path& root, bool withTimes) {
    std::vector<std::string> lines;
    for (const auto& entry : fs::recursive_directory_iterator(root)) {
        const std::string relative = entry.path().lexically_relative(root).string();
        std::string line;
        if (entry.is_directory()) {
            line = "d " + relative;
        } else {
            line = "f " + relative + " " + hex(testing_support::readBytes(entry.path()));
        }
        if (withTimes) line += " @" + std::to_string(mtimeNs(entry.path()));
        lines.push_back(line);
    }
    std::sort(lines.begin(), lines.end());
    std::string text;
    for (const auto& line : lines) text += line + "\n";
    return text;
}

void writeCopy(const fs::path& copyDir, const Bytes& data, int64_t checkTimeNs) {
    fs::create_directories(copyDir);
    testing_support::writeBytes(copyDir / Storage::kDataName, data);
    testing_support::writeBytes(copyDir / Storage::kCheckName, expectedCheckFile(data));
    setMtimeNs(copyDir / Storage::kCheckName, checkTimeNs);
}

void writeAbsentCopy(const fs::path& copyDir, int64_t checkTimeNs) {
    fs::create_directories(copyDir);
    fs::remove(copyDir / Storage::kDataName);
    testing_support::writeBytes(copyDir / Storage::kCheckName, absentCheckFile());
    setMtimeNs(copyDir / Storage::kCheckName, checkTimeNs);
}

bool SlotContent::operator==(const SlotContent& other) const {
    return exists == other.exists && valid == other.valid && status == other.status && data == other.data;
}

std::ostream& operator<<(std::ostream& out, const SlotContent& content) {
    return out << "{exists=" << content.exists << " valid=" << content.valid << " status=" << content.status
               << " data=" << hex(content.data) << "}";
}

SlotContent contentOf(Storage::TargetSlot& slot) {
    SlotContent content;
    content.exists = slot.exists();
    content.valid = slot.isValid();
    // Left uninitialised: clearing a mebibyte for every opening of a small
    // blob dominated the crash exploration.
    constexpr size_t kLargestRead = size_t{1} << 20;
    const std::unique_ptr<uint8_t[]> buffer(new uint8_t[kLargestRead]);
    size_t count = 0;
    content.status = slot.readSome(buffer.get(), kLargestRead, 0, count);
    if (content.status == STATUS_OK) content.data.assign(buffer.get(), buffer.get() + count);
    return content;
}

SlotContent holding(const Bytes& data) { return SlotContent{true, true, STATUS_OK, data}; }
SlotContent absentBlob() { return SlotContent{false, true, STATUS_NOT_FOUND, {}}; }
SlotContent nothingStored() { return SlotContent{false, false, STATUS_NOT_FOUND, {}}; }

void copyTree(const fs::path& from, const fs::path& to) {
    fs::copy(from, to, fs::copy_options::recursive | fs::copy_options::copy_symlinks);
    for (const auto& entry : fs::recursive_directory_iterator(from)) {
        if (entry.is_regular_file() && !entry.is_symlink()) {
            setMtimeNs(to / entry.path().lexically_relative(from), mtimeNs(entry.path()));
        }
    }
}

void flipByte(const fs::path& path, size_t offset) {
    Bytes bytes = testing_support::readBytes(path);
    bytes.at(offset) ^= 0x01;
    const int64_t time = mtimeNs(path);
    testing_support::writeBytes(path, bytes);
    setMtimeNs(path, time);
}

void damageAtRandom(const fs::path& slotDirectory, std::mt19937& random) {
    for (int damage = 1 + static_cast<int>(random() % 3); damage > 0; --damage) {
        const unsigned pick = random() % 4;
        const fs::path file = slotDirectory / Storage::kCopyDirectoryNames[pick / 2] /
                              (pick % 2 == 0 ? Storage::kDataName : Storage::kCheckName);
        if (!fs::exists(file)) continue;
        switch (random() % 4) {
            case 0:
                fs::resize_file(file, random() % (fs::file_size(file) + 1));
                break;
            case 1:
                if (fs::file_size(file) > 0) flipByte(file, random() % fs::file_size(file));
                break;
            case 2:
                fs::remove(file);
                break;
            default:
                setMtimeNs(file, kPast + static_cast<int64_t>(random() % 3) * kSecond);
                break;
        }
    }
}

}  // namespace store_test
