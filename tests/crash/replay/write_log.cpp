#include "write_log.h"

#include <fcntl.h>
#include <unistd.h>

#include <cstring>
#include <functional>
#include <stdexcept>
#include <system_error>

namespace replay {

namespace {

constexpr size_t kSuperSize = 8 + 8 + 8 + 4;
constexpr size_t kHeaderSize = 8 * 4;
constexpr uint64_t kKnownFlags = kFlush | kFua | kDiscard | kMark | kMetadata;

// Reads `size` bytes at `offset`; false when they are not all there.
using ReadAt = std::function<bool(uint64_t offset, void* buffer, size_t size)>;

uint64_t little(const uint8_t* bytes, int size) {
    uint64_t value = 0;
    for (int i = size - 1; i >= 0; --i) value = value << 8 | bytes[i];
    return value;
}

uint64_t little64(const uint8_t* bytes) { return little(bytes, 8); }

void putLittle64(uint64_t value, uint8_t* bytes) {
    for (int i = 0; i < 8; ++i) bytes[i] = static_cast<uint8_t>(value >> (8 * i));
}

[[noreturn]] void fail(const std::string& what) { throw std::runtime_error("write log: " + what); }

WriteLog parse(const ReadAt& readAt) {
    uint8_t super[kSuperSize];
    if (!readAt(0, super, sizeof super)) fail("shorter than its super block");
    if (little64(super) != kWriteLogMagic) fail("bad magic");
    if (little64(super + 8) != kWriteLogVersion) fail("version " + std::to_string(little64(super + 8)) + ", not 1");
    const uint64_t count = little64(super + 16);
    WriteLog log;
    log.sectorSize = static_cast<uint32_t>(little(super + 24, 4));
    if (log.sectorSize < 512 || (log.sectorSize & (log.sectorSize - 1)) != 0) {
        fail("sector size " + std::to_string(log.sectorSize));
    }
    std::vector<uint8_t> header(log.sectorSize);
    uint64_t at = log.sectorSize;
    for (uint64_t index = 0; index < count; ++index) {
        const std::string where = "entry " + std::to_string(index);
        if (!readAt(at, header.data(), header.size())) fail(where + " lies beyond the end");
        LogEntry entry;
        entry.sector = little64(header.data());
        entry.sectorCount = little64(header.data() + 8);
        entry.flags = little64(header.data() + 16);
        const uint64_t textLength = little64(header.data() + 24);
        if ((entry.flags & ~kKnownFlags) != 0) fail(where + " has unknown flags " + std::to_string(entry.flags));
        if (textLength > log.sectorSize - kHeaderSize) fail(where + " has text longer than its sector");
        at += log.sectorSize;
        if (entry.isMark()) {
            entry.mark.assign(reinterpret_cast<const char*>(header.data() + kHeaderSize), textLength);
            // The target counts the terminating zero in the length.
            while (!entry.mark.empty() && entry.mark.back() == '\0') entry.mark.pop_back();
        } else if (!entry.isDiscard() && entry.sectorCount > 0) {
            if (entry.sectorCount > (uint64_t{1} << 32) / log.sectorSize) fail(where + " is implausibly long");
            entry.data.resize(entry.sectorCount * log.sectorSize);
            if (!readAt(at, entry.data.data(), entry.data.size())) fail(where + "'s data lies beyond the end");
            at += entry.data.size();
        }
        log.entries.push_back(std::move(entry));
    }
    return log;
}

}  // namespace

WriteLog parseWriteLog(const std::vector<uint8_t>& bytes) {
    return parse([&bytes](uint64_t offset, void* buffer, size_t size) {
        if (offset > bytes.size() || size > bytes.size() - offset) return false;
        std::memcpy(buffer, bytes.data() + offset, size);
        return true;
    });
}

WriteLog readWriteLog(const std::filesystem::path& path) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) throw std::system_error(errno, std::generic_category(), "open " + path.string());
    try {
        WriteLog log = parse([fd](uint64_t offset, void* buffer, size_t size) {
            auto* bytes = static_cast<uint8_t*>(buffer);
            while (size > 0) {
                const ssize_t got = ::pread(fd, bytes, size, static_cast<off_t>(offset));
                if (got < 0 && errno == EINTR) continue;
                if (got <= 0) return false;
                bytes += got;
                size -= static_cast<size_t>(got);
                offset += static_cast<uint64_t>(got);
            }
            return true;
        });
        ::close(fd);
        return log;
    } catch (...) {
        ::close(fd);
        throw;
    }
}

std::vector<uint8_t> encodeWriteLog(const WriteLog& log) {
    std::vector<uint8_t> bytes(log.sectorSize, 0);
    putLittle64(kWriteLogMagic, bytes.data());
    putLittle64(kWriteLogVersion, bytes.data() + 8);
    putLittle64(log.entries.size(), bytes.data() + 16);
    for (int i = 0; i < 4; ++i) bytes[24 + i] = static_cast<uint8_t>(log.sectorSize >> (8 * i));
    for (const LogEntry& entry : log.entries) {
        std::vector<uint8_t> header(log.sectorSize, 0);
        putLittle64(entry.sector, header.data());
        putLittle64(entry.sectorCount, header.data() + 8);
        putLittle64(entry.flags, header.data() + 16);
        if (entry.isMark()) {
            const std::string text = entry.mark + '\0';
            putLittle64(text.size(), header.data() + 24);
            std::memcpy(header.data() + kHeaderSize, text.data(), text.size());
        }
        bytes.insert(bytes.end(), header.begin(), header.end());
        bytes.insert(bytes.end(), entry.data.begin(), entry.data.end());
    }
    return bytes;
}

}  // namespace replay
