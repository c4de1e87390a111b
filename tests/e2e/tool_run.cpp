#include "tool_run.h"

#include <algorithm>
#include <cstdlib>
#include <regex>
#include <utility>

#include <gtest/gtest.h>

#include "registration_log.h"

namespace e2e {
namespace fs = std::filesystem;

const std::string kBinary = MIGRATE_SETTINGS_BIN;
const std::string kInspectStore = INSPECT_STORE_BIN;

const std::string kLastFileReadRegisterLine =
    "Register kIpiStorageTargetResourceManufacturingPartition = FileReadTarget /media/static [0]\n";

const std::vector<std::string> kSfdiskComplaints = {
    "sfdisk: cannot open /dev/mmcblk0: No such file or directory",
    // The shell of the command pipeline, when sfdisk is not installed:
    // dash, then bash.
    "sh: 1: /usr/sbin/sfdisk: not found",
    "sh: line 1: /usr/sbin/sfdisk: No such file or directory",
};

namespace {

// The source line is left open: it moves with every edit of the file.
const std::regex kBootVectorFailure("lib/storage/storage_target:[0-9]+ Failed to parse flash size ''\n");

// Each line keeps its newline; a last line without one is kept as it is.
std::vector<std::string> splitLines(const std::string& text) {
    std::vector<std::string> lines;
    size_t start = 0;
    while (start < text.size()) {
        const size_t newline = text.find('\n', start);
        const size_t end = newline == std::string::npos ? text.size() : newline + 1;
        lines.push_back(text.substr(start, end - start));
        start = end;
    }
    return lines;
}

std::string joinLines(const std::vector<std::string>& lines) {
    std::string text;
    for (const std::string& line : lines) text += line;
    return text;
}

bool isSfdiskComplaint(const std::string& line) {
    return std::any_of(kSfdiskComplaints.begin(), kSfdiskComplaints.end(),
                       [&](const std::string& complaint) { return line == complaint + "\n"; });
}

}  // namespace

ProcessResult runTool(std::vector<std::string> args, unsigned timeLimitSeconds) {
    args.insert(args.begin(), kBinary);
    return testing_support::runProgram(args, {}, timeLimitSeconds);
}

Host currentHost() {
    const char* value = std::getenv("SIMULATED_DEVICE");
    return value != nullptr && std::string(value) == "1" ? Host::kSimulatedDevice : Host::kWithoutDevice;
}

ProcessResult withoutBootVectorFailure(ProcessResult result, Host host) {
    std::vector<std::string> lines = splitLines(result.out);
    std::vector<size_t> found;
    for (size_t i = 0; i < lines.size(); ++i) {
        if (std::regex_match(lines[i], kBootVectorFailure)) found.push_back(i);
    }
    if (host == Host::kSimulatedDevice) {
        EXPECT_EQ(found.size(), 0u) << "the simulated device's boot vector must be found:\n" << result.out;
        return result;
    }
    if (found.size() != 1) {
        ADD_FAILURE() << "expected the boot-vector failure line once, found it " << found.size() << " times in:\n"
                      << result.out
                      << (fs::exists("/dev/mmcblk0") ? "(this host has a /dev/mmcblk0: run on the simulated device)\n"
                                                     : "");
        return result;
    }
    const size_t at = found.front();
    // Without --verbose only the errors of building the stores before it
    // tell where it belongs, and those are compared by the caller.
    const bool listed = std::any_of(lines.begin(), lines.end(),
                                    [](const std::string& line) { return line.rfind("Register ", 0) == 0; });
    EXPECT_TRUE(!listed || (at > 0 && lines[at - 1] == kLastFileReadRegisterLine))
        << "the boot-vector failure line must come right after the file-read targets:\n"
        << result.out;
    lines.erase(lines.begin() + static_cast<std::ptrdiff_t>(at));
    result.out = joinLines(lines);

    std::vector<std::string> errLines = splitLines(result.err);
    const auto complaint = std::find_if(errLines.begin(), errLines.end(), isSfdiskComplaint);
    const std::ptrdiff_t complaints = std::count_if(errLines.begin(), errLines.end(), isSfdiskComplaint);
    if (complaints != 1) {
        ADD_FAILURE() << "expected one complaint about /dev/mmcblk0 on standard error, found " << complaints << " in:\n"
                      << result.err;
        return result;
    }
    errLines.erase(complaint);
    result.err = joinLines(errLines);
    return result;
}

ProcessResult runAccepted(std::vector<std::string> args) { return withoutBootVectorFailure(runTool(std::move(args))); }

std::string describe(const std::vector<std::string>& args) {
    std::string text;
    for (const std::string& arg : args) text += " '" + arg + "'";
    return text;
}

std::vector<std::string> concat(std::vector<std::string> head, const std::vector<std::string>& tail) {
    head.insert(head.end(), tail.begin(), tail.end());
    return head;
}

std::string registerLines(const fs::path& base) { return testing_support::registerLines(base); }

Files storedFiles(const fs::path& base) {
    std::vector<std::string> files;
    std::error_code error;
    if (!fs::is_directory(base, error)) return files;
    for (const fs::directory_entry& entry : fs::recursive_directory_iterator(base)) {
        if (!entry.is_directory()) files.push_back(entry.path().lexically_relative(base).generic_string());
    }
    std::sort(files.begin(), files.end());
    return files;
}

uint32_t crc32(const Bytes& bytes) {
    uint32_t crc = 0xFFFFFFFFu;
    for (const uint8_t byte : bytes) {
        crc ^= byte;
        for (int bit = 0; bit < 8; ++bit) crc = (crc & 1u) != 0 ? (crc >> 1) ^ 0xEDB88320u : crc >> 1;
    }
    return ~crc;
}

Bytes checkFileFor(const Bytes& data) {
    Bytes check(8);
    putLe32(check, 0, static_cast<uint32_t>(data.size()));
    putLe32(check, 4, crc32(data));
    return check;
}

uint16_t bsdChecksum16(const uint8_t* data, size_t count) {
    uint16_t sum = 0;
    for (size_t i = 0; i < count; ++i) {
        sum = static_cast<uint16_t>((sum >> 1) | ((sum & 1u) << 15));
        sum = static_cast<uint16_t>(sum + data[i]);
    }
    return sum;
}

Bytes pattern(size_t size, uint8_t seed) {
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<uint8_t>(i * 7 + i / 251 + seed * 13);
    return bytes;
}

void putLe16(Bytes& bytes, size_t offset, uint16_t value) {
    bytes.at(offset) = static_cast<uint8_t>(value);
    bytes.at(offset + 1) = static_cast<uint8_t>(value >> 8);
}

void putLe32(Bytes& bytes, size_t offset, uint32_t value) {
    for (size_t i = 0; i < 4; ++i) bytes.at(offset + i) = static_cast<uint8_t>(value >> (8 * i));
}

Bytes settingsBlock(uint16_t declared, size_t fileSize, uint8_t seed) {
    Bytes bytes = pattern(fileSize, seed);
    std::fill(bytes.begin() + declared, bytes.end(), 0xEE);
    putLe16(bytes, 0, declared);
    putLe16(bytes, declared - 2u, bsdChecksum16(bytes.data(), declared - 2u));
    return bytes;
}

Bytes lutFile(size_t size, uint8_t seed) {
    Bytes bytes = pattern(size, seed);
    const uint8_t header[] = {0x80, 0x11, 0x02, 0x00};
    std::copy(std::begin(header), std::end(header), bytes.begin());
    return bytes;
}

Bytes overlayFile(uint32_t payload, size_t fileSize, uint8_t seed) {
    Bytes bytes = pattern(fileSize, seed);
    putLe32(bytes, 0, 0x089CC2CBu);
    putLe16(bytes, 6, 5);
    putLe32(bytes, 8, 1);
    putLe32(bytes, 280, payload);
    return bytes;
}

}  // namespace e2e
