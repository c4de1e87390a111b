#include "fs_record.h"

#include <algorithm>
#include <fstream>
#include <iterator>
#include <limits>
#include <stdexcept>

#include "files.h"

namespace crash {
namespace {

struct KindInfo {
    const char* name;
    FsOpKind kind;
    size_t fields;  // after the kind
};

const KindInfo kKinds[] = {
    {"create", FsOpKind::kCreate, 3}, {"truncate", FsOpKind::kTruncate, 4}, {"write", FsOpKind::kWrite, 5},
    {"unlink", FsOpKind::kUnlink, 2}, {"rmdir", FsOpKind::kRmdir, 1},       {"mkdir", FsOpKind::kMkdir, 1},
    {"rename", FsOpKind::kRename, 4}, {"utimens", FsOpKind::kUtimens, 3},   {"fsync", FsOpKind::kFsync, 2},
    {"syncfs", FsOpKind::kSyncfs, 0}, {"chmod", FsOpKind::kChmod, 2},
};

const KindInfo& infoOf(FsOpKind kind) {
    for (const KindInfo& info : kKinds) {
        if (info.kind == kind) return info;
    }
    throw std::logic_error("FsOpKind without a name");
}

// The reason a field is malformed; the caller names the line.
struct BadField : std::runtime_error {
    using std::runtime_error::runtime_error;
};

std::vector<std::string> splitFields(const std::string& line) {
    std::vector<std::string> fields;
    size_t start = 0;
    for (;;) {
        const size_t end = line.find(' ', start);
        fields.push_back(line.substr(start, end - start));
        if (fields.back().empty()) throw BadField("empty field");
        if (end == std::string::npos) return fields;
        start = end + 1;
    }
}

std::string unescapePath(const std::string& field) {
    if (field.empty() || field[0] != '/') throw BadField("path not absolute: " + field);
    std::string path;
    for (size_t i = 0; i < field.size(); ++i) {
        if (field[i] != '%') {
            path += field[i];
            continue;
        }
        const std::string code = field.substr(i + 1, 2);
        if (code == "25") {
            path += '%';
        } else if (code == "20") {
            path += ' ';
        } else if (code == "0A") {
            path += '\n';
        } else {
            throw BadField("bad escape in path: " + field);
        }
        i += 2;
    }
    return path;
}

uint64_t parseUnsigned(const std::string& field, uint64_t limit = std::numeric_limits<uint64_t>::max()) {
    if (field.empty() || field.find_first_not_of("0123456789") != std::string::npos) {
        throw BadField("not a decimal number: " + field);
    }
    uint64_t value = 0;
    for (const char c : field) {
        const uint64_t digit = static_cast<uint64_t>(c - '0');
        if (value > (limit - digit) / 10) throw BadField("number out of range: " + field);
        value = value * 10 + digit;
    }
    return value;
}

struct timespec parseTime(const std::string& field) {
    const size_t dot = field.find('.');
    if (dot == std::string::npos || field.size() - dot - 1 != 9) throw BadField("time not SEC.NNNNNNNNN: " + field);
    const bool negative = field[0] == '-';
    const std::string seconds = field.substr(negative ? 1 : 0, dot - (negative ? 1 : 0));
    const uint64_t magnitude = parseUnsigned(seconds, static_cast<uint64_t>(std::numeric_limits<time_t>::max()));
    struct timespec time {};
    time.tv_sec = negative ? -static_cast<time_t>(magnitude) : static_cast<time_t>(magnitude);
    time.tv_nsec = static_cast<long>(parseUnsigned(field.substr(dot + 1)));
    return time;
}

std::vector<uint8_t> parseHex(const std::string& field) {
    if (field == "-") return {};
    if (field == "?") throw BadField("bytes that were not read back");
    if (field.size() % 2 != 0) throw BadField("hex of odd length");
    std::vector<uint8_t> bytes;
    for (size_t i = 0; i < field.size(); i += 2) {
        uint8_t byte = 0;
        for (size_t j = i; j < i + 2; ++j) {
            const char c = field[j];
            if (c >= '0' && c <= '9') {
                byte = static_cast<uint8_t>(byte * 16 + (c - '0'));
            } else if (c >= 'a' && c <= 'f') {
                byte = static_cast<uint8_t>(byte * 16 + (c - 'a' + 10));
            } else {
                throw BadField("not lowercase hex: " + field);
            }
        }
        bytes.push_back(byte);
    }
    return bytes;
}

FsOp parseLine(const std::string& line) {
    const std::vector<std::string> fields = splitFields(line);
    const KindInfo* info = nullptr;
    for (const KindInfo& candidate : kKinds) {
        if (fields[0] == candidate.name) info = &candidate;
    }
    if (info == nullptr) throw BadField("unknown kind " + fields[0]);
    if (fields.size() != info->fields + 1) {
        throw BadField(fields[0] + " takes " + std::to_string(info->fields) + " fields, not " +
                       std::to_string(fields.size() - 1));
    }
    FsOp op;
    op.kind = info->kind;
    if (op.kind == FsOpKind::kSyncfs) return op;
    op.path = unescapePath(fields[1]);
    switch (op.kind) {
        case FsOpKind::kCreate:
        case FsOpKind::kUtimens:
            op.inode = parseUnsigned(fields[2]);
            op.mtime = parseTime(fields[3]);
            break;
        case FsOpKind::kTruncate:
            op.inode = parseUnsigned(fields[2]);
            op.size = parseUnsigned(fields[3]);
            op.mtime = parseTime(fields[4]);
            break;
        case FsOpKind::kWrite:
            op.inode = parseUnsigned(fields[2]);
            op.offset = static_cast<int64_t>(
                parseUnsigned(fields[3], static_cast<uint64_t>(std::numeric_limits<int64_t>::max())));
            op.data = parseHex(fields[4]);
            op.mtime = parseTime(fields[5]);
            break;
        case FsOpKind::kRename:
            op.toPath = unescapePath(fields[2]);
            op.inode = parseUnsigned(fields[3]);
            op.replacedInode = parseUnsigned(fields[4]);
            break;
        case FsOpKind::kUnlink:
        case FsOpKind::kFsync:
        case FsOpKind::kChmod:
            op.inode = parseUnsigned(fields[2]);
            break;
        case FsOpKind::kRmdir:
        case FsOpKind::kMkdir:
        case FsOpKind::kSyncfs:
            break;
    }
    return op;
}

std::string escapePath(const std::string& path) {
    std::string field;
    for (const char c : path) {
        if (c == '%') {
            field += "%25";
        } else if (c == ' ') {
            field += "%20";
        } else if (c == '\n') {
            field += "%0A";
        } else {
            field += c;
        }
    }
    return field;
}

std::string formatTime(const struct timespec& time) {
    const std::string nanoseconds = std::to_string(time.tv_nsec);
    return std::to_string(time.tv_sec) + "." + std::string(9 - std::min<size_t>(9, nanoseconds.size()), '0') +
           nanoseconds;
}

std::string formatHex(const std::vector<uint8_t>& bytes) { return bytes.empty() ? "-" : testing_support::hex(bytes); }

}  // namespace

std::vector<FsOp> parseFsRecord(const std::string& text) {
    std::vector<FsOp> ops;
    size_t start = 0;
    for (size_t number = 1; start < text.size(); ++number) {
        const size_t end = text.find('\n', start);
        const std::string line = text.substr(start, end == std::string::npos ? std::string::npos : end - start);
        const std::string where = "fs record line " + std::to_string(number) + " \"" + line + "\": ";
        if (end == std::string::npos) throw std::runtime_error(where + "no newline at its end");
        try {
            ops.push_back(parseLine(line));
        } catch (const BadField& problem) {
            throw std::runtime_error(where + problem.what());
        }
        start = end + 1;
    }
    return ops;
}

std::vector<FsOp> readFsRecord(const std::filesystem::path& file) {
    std::ifstream in(file, std::ios::binary);
    if (!in) {
        if (!std::filesystem::exists(file)) return {};
        throw std::runtime_error("cannot read fs record " + file.string());
    }
    const std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (in.bad()) throw std::runtime_error("cannot read fs record " + file.string());
    return parseFsRecord(text);
}

std::string describe(const FsOp& op) {
    std::string line = infoOf(op.kind).name;
    if (op.kind == FsOpKind::kSyncfs) return line;
    line += " " + escapePath(op.path);
    const std::string inode = " " + std::to_string(op.inode);
    switch (op.kind) {
        case FsOpKind::kCreate:
        case FsOpKind::kUtimens:
            return line + inode + " " + formatTime(op.mtime);
        case FsOpKind::kTruncate:
            return line + inode + " " + std::to_string(op.size) + " " + formatTime(op.mtime);
        case FsOpKind::kWrite:
            return line + inode + " " + std::to_string(op.offset) + " " + formatHex(op.data) + " " +
                   formatTime(op.mtime);
        case FsOpKind::kRename:
            return line + " " + escapePath(op.toPath) + inode + " " + std::to_string(op.replacedInode);
        case FsOpKind::kUnlink:
        case FsOpKind::kFsync:
        case FsOpKind::kChmod:
            return line + inode;
        case FsOpKind::kRmdir:
        case FsOpKind::kMkdir:
        case FsOpKind::kSyncfs:
            break;
    }
    return line;
}

}  // namespace crash
