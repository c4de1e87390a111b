#include "strace_trace.h"

#include <cstdlib>
#include <functional>
#include <map>
#include <stdexcept>
#include <utility>

namespace crash {

// '?': calls that some architectures lack (ARM64 has only the *at forms).
const char* const kStraceCalls =
    "?open,openat,openat2,?creat,read,readv,lseek,write,writev,pwrite64,pwritev,pwritev2,ftruncate,?truncate,?unlink,"
    "unlinkat,?rmdir,?mkdir,mkdirat,?rename,renameat,renameat2,utimensat,fsync,fdatasync,syncfs,?chmod,fchmod,"
    "fchmodat";

const std::vector<std::string> kStraceOptions = {"-f", "-y", "-qq", "-xx", "-v", "-s", "65536", "-e", "signal=none"};

namespace {

// A problem with one line; the caller names the line.
struct LineError : std::runtime_error {
    using std::runtime_error::runtime_error;
};

int hexDigit(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    throw LineError(std::string("not a hex digit: ") + c);
}

// The bytes of text[begin, end), which -xx writes as \xNN each.
std::string unhex(const std::string& text, size_t begin, size_t end) {
    std::string bytes;
    for (size_t i = begin; i < end; i += 4) {
        if (end - i < 4 || text[i] != '\\' || text[i + 1] != 'x') {
            throw LineError("not \\xNN bytes: " + text.substr(begin, end - begin));
        }
        bytes += static_cast<char>(hexDigit(text[i + 2]) * 16 + hexDigit(text[i + 3]));
    }
    return bytes;
}

// A string argument; one strace cut short ends in "..." after its quote.
std::string stringArg(const std::string& arg) {
    if (arg.size() < 2 || arg.front() != '"' || arg.back() != '"') throw LineError("not a whole string: " + arg);
    return unhex(arg, 1, arg.size() - 1);
}

// "3<path>" or "AT_FDCWD<path>": what comes before the path, and the path.
struct Described {
    std::string head;
    std::string path;
    bool hasPath = false;
};

Described described(const std::string& arg) {
    const size_t open = arg.find('<');
    if (open == std::string::npos || arg.back() != '>') return {arg, "", false};
    return {arg.substr(0, open), unhex(arg, open + 1, arg.size() - 1), true};
}

long long number(const std::string& text) {
    char* end = nullptr;
    const long long value = std::strtoll(text.c_str(), &end, 10);
    if (text.empty() || *end != '\0') throw LineError("not a number: " + text);
    return value;
}

// Splits "a, b, c" at the commas outside brackets and strings.
std::vector<std::string> splitTopLevel(const std::string& text) {
    std::vector<std::string> parts;
    int depth = 0;
    size_t start = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (c == '"') {
            const size_t close = text.find('"', i + 1);
            if (close == std::string::npos) throw LineError("unterminated string");
            i = close;
        } else if (c == '(' || c == '[' || c == '{') {
            ++depth;
        } else if (c == ')' || c == ']' || c == '}') {
            --depth;
        } else if (c == ',' && depth == 0) {
            parts.push_back(text.substr(start, i - start));
            start = i + 2;  // ", "
        }
    }
    if (start < text.size()) parts.push_back(text.substr(start));
    return parts;
}

struct Call {
    std::string name;
    std::vector<std::string> args;
    long long result = -1;
    std::string resultPath;  // the path shown with a returned descriptor
};

// "name(args) = result".
Call parseCall(const std::string& text) {
    const size_t open = text.find('(');
    if (open == std::string::npos || open == 0) throw LineError("no call");
    Call call;
    call.name = text.substr(0, open);
    int depth = 0;
    size_t close = open + 1;
    for (; close < text.size(); ++close) {
        const char c = text[close];
        if (c == '"') {
            close = text.find('"', close + 1);
            if (close == std::string::npos) throw LineError("unterminated string");
        } else if (c == '(' || c == '[' || c == '{') {
            ++depth;
        } else if (c == ']' || c == '}') {
            --depth;
        } else if (c == ')' && depth-- == 0) {
            break;
        }
    }
    // Short lines have their results aligned with spaces.
    const size_t equals = close < text.size() ? text.find_first_not_of(' ', close + 1) : std::string::npos;
    if (equals == std::string::npos || text.compare(equals, 2, "= ") != 0) throw LineError("no result");
    call.args = splitTopLevel(text.substr(open + 1, close - open - 1));
    const std::string result = text.substr(equals + 2);
    if (result == "?" || result.rfind("? ", 0) == 0) return call;  // never returned: its process ended
    const size_t end = result.find_first_of(" <");
    call.result = number(result.substr(0, end));
    if (end != std::string::npos && result[end] == '<') call.resultPath = described(result).path;
    return call;
}

// A field of a struct argument, "{name=value, ...}": the value, or "".
std::string field(const std::string& arg, const std::string& name) {
    if (arg.size() < 2 || arg.front() != '{' || arg.back() != '}') throw LineError("not a struct: " + arg);
    for (const std::string& part : splitTopLevel(arg.substr(1, arg.size() - 2))) {
        if (part.rfind(name + "=", 0) == 0) return part.substr(name.size() + 1);
    }
    return "";
}

bool hasFlag(const std::string& flags, const std::string& flag) {
    for (size_t start = 0, end = 0; end != std::string::npos; start = end + 1) {
        end = flags.find('|', start);
        if (flags.compare(start, end == std::string::npos ? std::string::npos : end - start, flag) == 0) return true;
    }
    return false;
}

// "[{iov_base="...", iov_len=N}, ...]": the bytes of all buffers.
std::string iovecBytes(const std::string& arg) {
    if (arg.size() < 2 || arg.front() != '[' || arg.back() != ']') throw LineError("not an iovec array: " + arg);
    std::string bytes;
    for (const std::string& element : splitTopLevel(arg.substr(1, arg.size() - 2))) {
        if (element.size() < 2 || element.front() != '{') throw LineError("not a whole iovec array: " + arg);
        const std::vector<std::string> fields = splitTopLevel(element.substr(1, element.size() - 2));
        if (fields.empty() || fields[0].rfind("iov_base=", 0) != 0) throw LineError("no iov_base: " + element);
        bytes += stringArg(fields[0].substr(9));
    }
    return bytes;
}

// The mtime of utimensat's "[atime, mtime]"; UTIME_NOW and UTIME_OMIT
// leave a time that is not in the trace.
struct timespec modificationTime(const std::string& times) {
    const std::vector<std::string> both = times.size() > 2 && times.front() == '['
                                              ? splitTopLevel(times.substr(1, times.size() - 2))
                                              : std::vector<std::string>{};
    if (both.size() != 2 || both[1].rfind("{tv_sec=", 0) != 0) throw LineError("no explicit mtime: " + times);
    const size_t comma = both[1].find(", tv_nsec=");
    const size_t close = both[1].find('}');
    if (comma == std::string::npos || close == std::string::npos) throw LineError("bad timespec: " + both[1]);
    struct timespec time {};
    time.tv_sec = static_cast<time_t>(number(both[1].substr(8, comma - 8)));
    time.tv_nsec = static_cast<long>(number(both[1].substr(comma + 10, close - comma - 10)));
    return time;
}

class TraceReader {
public:
    TraceReader(std::string root, std::set<std::string> existing)
        : root_(std::move(root)), existing_(std::move(existing)) {}

    void apply(long pid, const Call& call);
    std::vector<FsOp> takeOps() { return std::move(ops_); }

private:
    struct Position {
        long long offset = 0;
        bool append = false;
    };

    bool below(const std::string& path) const { return path.rfind(root_ + "/", 0) == 0; }

    // A path argument, joined to the directory argument's path when relative.
    static std::string pathOf(const std::string& directoryArg, const std::string& pathArg) {
        const std::string path = stringArg(pathArg);
        if (!path.empty() && path[0] == '/') return path;
        const Described directory = described(directoryArg);
        if (!directory.hasPath) throw LineError("a relative path without its directory: " + path);
        return path.empty() ? directory.path : directory.path + "/" + path;
    }

    static std::string descriptorPath(const std::string& arg) {
        const Described descriptor = described(arg);
        if (!descriptor.hasPath) throw LineError("a descriptor without its path: " + arg);
        return descriptor.path;
    }

    void add(FsOpKind kind, const std::string& path, const std::function<void(FsOp&)>& fill = nullptr) {
        FsOp op;
        op.kind = kind;
        op.path = path;
        if (fill) fill(op);
        if (kind == FsOpKind::kSyncfs || below(op.path) || below(op.toPath)) ops_.push_back(std::move(op));
    }

    void opened(long pid, const Call& call, const std::string& path, const std::string& flags);
    void wrote(long pid, const Call& call, const std::string& bytes, const long long* offset);
    void renamed(const std::string& from, const std::string& to);

    std::string root_;
    std::set<std::string> existing_;
    std::map<std::pair<long, long long>, Position> positions_;
    std::vector<FsOp> ops_;
};

void TraceReader::opened(long pid, const Call& call, const std::string& path, const std::string& flags) {
    positions_[{pid, call.result}] = Position{0, hasFlag(flags, "O_APPEND")};
    if (!below(path) || hasFlag(flags, "O_TMPFILE")) return;
    const bool existed = existing_.count(path) != 0;
    if (!existed && hasFlag(flags, "O_CREAT")) {
        existing_.insert(path);
        add(FsOpKind::kCreate, path);
    } else if (existed && hasFlag(flags, "O_TRUNC")) {
        add(FsOpKind::kTruncate, path);
    }
}

// write and writev at the file position when `offset` is null.
void TraceReader::wrote(long pid, const Call& call, const std::string& bytes, const long long* offset) {
    const std::string path = descriptorPath(call.args.at(0));
    const auto position = positions_.find({pid, number(described(call.args.at(0)).head)});
    const bool known = position != positions_.end();
    long long at = 0;
    if (offset != nullptr) {
        at = *offset;
    } else if (known && !position->second.append) {
        at = position->second.offset;
    } else if (below(path)) {
        throw LineError(known ? "a write under O_APPEND" : "a write at an unknown file position");
    }
    if (static_cast<size_t>(call.result) > bytes.size()) throw LineError("fewer bytes shown than written");
    add(FsOpKind::kWrite, path, [&](FsOp& op) {
        op.offset = at;
        op.data.assign(bytes.begin(), bytes.begin() + call.result);
    });
    if (offset == nullptr && known) position->second.offset += call.result;
}

void TraceReader::renamed(const std::string& from, const std::string& to) {
    add(FsOpKind::kRename, from, [&](FsOp& op) { op.toPath = to; });
    std::set<std::string> moved;
    for (auto it = existing_.begin(); it != existing_.end();) {
        if (*it == from || it->rfind(from + "/", 0) == 0) {
            moved.insert(to + it->substr(from.size()));
            it = existing_.erase(it);
        } else {
            ++it;
        }
    }
    existing_.insert(moved.begin(), moved.end());
}

void TraceReader::apply(long pid, const Call& call) {
    if (call.result < 0) return;
    const std::string& name = call.name;
    const std::vector<std::string>& args = call.args;
    if (name == "open") {
        opened(pid, call, pathOf("", args.at(0)), args.at(1));
    } else if (name == "openat") {
        opened(pid, call, pathOf(args.at(0), args.at(1)), args.at(2));
    } else if (name == "openat2") {
        opened(pid, call, pathOf(args.at(0), args.at(1)), field(args.at(2), "flags"));
    } else if (name == "creat") {
        opened(pid, call, pathOf("", args.at(0)), "O_WRONLY|O_CREAT|O_TRUNC");
    } else if (name == "read" || name == "readv" || name == "lseek") {
        const auto position = positions_.find({pid, number(described(args.at(0)).head)});
        if (position == positions_.end()) return;
        position->second.offset = name == "lseek" ? call.result : position->second.offset + call.result;
    } else if (name == "write") {
        wrote(pid, call, stringArg(args.at(1)), nullptr);
    } else if (name == "writev") {
        wrote(pid, call, iovecBytes(args.at(1)), nullptr);
    } else if (name == "pwrite64") {
        const long long offset = number(args.at(3));
        wrote(pid, call, stringArg(args.at(1)), &offset);
    } else if (name == "pwritev" || name == "pwritev2") {
        const long long offset = number(args.at(3));
        wrote(pid, call, iovecBytes(args.at(1)), &offset);
    } else if (name == "ftruncate" || name == "truncate") {
        const std::string path = name == "ftruncate" ? descriptorPath(args.at(0)) : pathOf("", args.at(0));
        add(FsOpKind::kTruncate, path, [&](FsOp& op) { op.size = static_cast<uint64_t>(number(args.at(1))); });
    } else if (name == "unlink" || name == "rmdir" || name == "unlinkat") {
        const std::string path = name == "unlinkat" ? pathOf(args.at(0), args.at(1)) : pathOf("", args.at(0));
        const bool directory = name == "rmdir" || (name == "unlinkat" && hasFlag(args.at(2), "AT_REMOVEDIR"));
        existing_.erase(path);
        add(directory ? FsOpKind::kRmdir : FsOpKind::kUnlink, path);
    } else if (name == "mkdir" || name == "mkdirat") {
        const std::string path = name == "mkdirat" ? pathOf(args.at(0), args.at(1)) : pathOf("", args.at(0));
        existing_.insert(path);
        add(FsOpKind::kMkdir, path);
    } else if (name == "rename") {
        renamed(pathOf("", args.at(0)), pathOf("", args.at(1)));
    } else if (name == "renameat" || name == "renameat2") {
        renamed(pathOf(args.at(0), args.at(1)), pathOf(args.at(2), args.at(3)));
    } else if (name == "utimensat") {
        const std::string path = args.at(1) == "NULL" ? descriptorPath(args.at(0)) : pathOf(args.at(0), args.at(1));
        if (below(path)) add(FsOpKind::kUtimens, path, [&](FsOp& op) { op.mtime = modificationTime(args.at(2)); });
    } else if (name == "fsync" || name == "fdatasync") {
        add(FsOpKind::kFsync, descriptorPath(args.at(0)));
    } else if (name == "syncfs") {
        add(FsOpKind::kSyncfs, "");
    } else if (name == "chmod" || name == "fchmod" || name == "fchmodat") {
        const std::string path = name == "fchmod"     ? descriptorPath(args.at(0))
                                 : name == "fchmodat" ? pathOf(args.at(0), args.at(1))
                                                      : pathOf("", args.at(0));
        add(FsOpKind::kChmod, path);
    } else {
        throw LineError("a call not in the traced set: " + name);
    }
}

}  // namespace

namespace {

// Calls `visit` with each call of `trace` (unfinished ones joined to their
// resumption) and its process; a problem with a line is rethrown naming it.
void forEachCall(const std::string& trace, const std::function<void(long, const Call&)>& visit) {
    std::map<long, std::string> unfinished;
    size_t start = 0;
    for (size_t number = 1; start < trace.size(); ++number) {
        const size_t end = trace.find('\n', start);
        const std::string line = trace.substr(start, end == std::string::npos ? std::string::npos : end - start);
        start = end == std::string::npos ? trace.size() : end + 1;
        try {
            const size_t space = line.find(' ');
            const long pid = space == std::string::npos ? -1 : std::strtol(line.c_str(), nullptr, 10);
            const size_t text = line.find_first_not_of(' ', space);
            if (pid <= 0 || text == std::string::npos) throw LineError("no process id");
            std::string call = line.substr(text);
            if (call.rfind("--- ", 0) == 0 || call.rfind("+++ ", 0) == 0) continue;
            static const std::string kUnfinished = " <unfinished ...>";
            if (call.size() > kUnfinished.size() &&
                call.compare(call.size() - kUnfinished.size(), kUnfinished.size(), kUnfinished) == 0) {
                unfinished[pid] = call.substr(0, call.size() - kUnfinished.size());
                continue;
            }
            if (call.rfind("<... ", 0) == 0) {
                const size_t resumed = call.find(" resumed>");
                const auto first = unfinished.find(pid);
                if (resumed == std::string::npos || first == unfinished.end()) throw LineError("nothing to resume");
                call = first->second + call.substr(resumed + 9);
                unfinished.erase(first);
            }
            visit(pid, parseCall(call));
        } catch (const std::exception& problem) {
            // Lines carry whole writes: only their starts are shown.
            const std::string shown = line.size() > 200 ? line.substr(0, 200) + "..." : line;
            throw std::runtime_error("strace line " + std::to_string(number) + " \"" + shown + "\": " + problem.what());
        }
    }
}

// The name a call gives for a path, with the directory argument it is
// relative to ("" for the working directory's calls that have none).
struct Named {
    std::string directoryArg;
    std::string nameArg;
};

// Every path a call names; utimensat with a NULL path names none.
std::vector<Named> namesOf(const Call& call) {
    const std::string& name = call.name;
    const std::vector<std::string>& args = call.args;
    if (name == "open" || name == "creat" || name == "unlink" || name == "rmdir" || name == "mkdir" ||
        name == "truncate" || name == "chmod") {
        return {{"", args.at(0)}};
    }
    if (name == "rename") return {{"", args.at(0)}, {"", args.at(1)}};
    if (name == "renameat" || name == "renameat2") return {{args.at(0), args.at(1)}, {args.at(2), args.at(3)}};
    if (name == "utimensat" && args.at(1) == "NULL") return {};
    if (name == "openat" || name == "openat2" || name == "unlinkat" || name == "mkdirat" || name == "utimensat" ||
        name == "fchmodat") {
        return {{args.at(0), args.at(1)}};
    }
    return {};
}

bool decimal(const std::string& component) {
    return !component.empty() && component.find_first_not_of("0123456789") == std::string::npos;
}

// Why a call that names `named` below `root` could follow a link planted
// there, or "".
std::string followingProblem(const Call& call, const Named& named, const std::string& root) {
    const std::string name = stringArg(named.nameArg);
    const Described directory = described(named.directoryArg);
    const bool absolute = !name.empty() && name.front() == '/';
    const bool fromWorkingDirectory = absolute || !directory.hasPath || directory.head == "AT_FDCWD";
    const std::string path = absolute ? name : directory.path + "/" + name;
    if (path.rfind(root + "/", 0) != 0) return "";
    const bool opens = call.name == "open" || call.name == "openat" || call.name == "openat2";
    const std::string flags = call.name == "openat2" ? field(call.args.at(2), "flags")
                              : opens                ? call.args.at(call.name == "open" ? 1 : 2)
                                                     : "";
    if (fromWorkingDirectory) {
        // Only the stores' own base directories, whose names are never numbers, are made or opened by path.
        const bool directoryOnly = call.name == "mkdir" || call.name == "mkdirat" ||
                                   (opens && hasFlag(flags, "O_DIRECTORY") && !hasFlag(flags, "O_CREAT"));
        if (!directoryOnly) return "names a store entry by its path";
        const std::string below = path.substr(root.size() + 1);
        for (size_t start = 0, end = 0; end != std::string::npos; start = end + 1) {
            end = below.find('/', start);
            if (decimal(below.substr(start, end == std::string::npos ? std::string::npos : end - start))) {
                return "reaches a slot or copy directory by its path";
            }
        }
        return "";
    }
    if (call.name == "openat2") {
        // Any number of components, none of them followed if a link.
        return hasFlag(field(call.args.at(2), "resolve"), "RESOLVE_NO_SYMLINKS") ? ""
                                                                                 : "opens without RESOLVE_NO_SYMLINKS";
    }
    if (name.find('/') != std::string::npos) return "names more than one component below a directory";
    if (opens && !hasFlag(flags, "O_NOFOLLOW")) return "opens without O_NOFOLLOW";
    if (call.name == "utimensat" && !hasFlag(call.args.at(3), "AT_SYMLINK_NOFOLLOW")) {
        return "sets a time without AT_SYMLINK_NOFOLLOW";
    }
    return "";
}

}  // namespace

std::vector<FsOp> parseStraceTrace(const std::string& trace, const std::string& root, std::set<std::string> existing) {
    TraceReader reader(root, std::move(existing));
    forEachCall(trace, [&](long pid, const Call& call) { reader.apply(pid, call); });
    return reader.takeOps();
}

std::vector<std::string> linkFollowingCalls(const std::string& trace, const std::string& root) {
    std::vector<std::string> found;
    forEachCall(trace, [&](long, const Call& call) {
        for (const Named& named : namesOf(call)) {
            const std::string problem = followingProblem(call, named, root);
            if (!problem.empty()) found.push_back(call.name + "(" + stringArg(named.nameArg) + "): " + problem);
        }
    });
    return found;
}

}  // namespace crash
