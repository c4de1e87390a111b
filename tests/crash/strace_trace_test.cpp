#include "strace_trace.h"

#include <stdexcept>
#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace {

using crash::describe;
using crash::parseStraceTrace;

// What strace -xx prints for these bytes.
std::string hexBytes(const std::string& bytes) {
    static const char kDigits[] = "0123456789abcdef";
    std::string text;
    for (const char c : bytes) {
        const auto byte = static_cast<unsigned char>(c);
        text += std::string("\\x") + kDigits[byte >> 4] + kDigits[byte & 0xF];
    }
    return text;
}

// A string argument, and a descriptor with the path -y shows for it.
std::string str(const std::string& bytes) { return "\"" + hexBytes(bytes) + "\""; }
std::string fd(const std::string& number, const std::string& path) { return number + "<" + hexBytes(path) + ">"; }

std::vector<std::string> described(const std::vector<crash::FsOp>& ops) {
    std::vector<std::string> lines;
    for (const crash::FsOp& op : ops) lines.push_back(describe(op));
    return lines;
}

const std::string kCwd = fd("AT_FDCWD", "/r");

TEST(StraceTrace, FollowsTheCallsBelowTheRoot) {
    const std::string trace =
        "10 openat(" + kCwd + ", " + str("/r/new") + ", O_RDWR|O_CREAT|O_TRUNC|O_CLOEXEC, 0666) = 3" +
        fd("", "/r/new") + "\n" + "10 write(" + fd("3", "/r/new") + ", " + str("hello") + ", 5) = 5\n" + "10 write(" +
        fd("3", "/r/new") + ", " + str("abc") + ", 3) = 2\n" + "10 lseek(" + fd("3", "/r/new") +
        ", 1, SEEK_SET) = 1\n" + "10 read(" + fd("3", "/r/new") + ", " + str("el") + ", 2) = 2\n" + "10 writev(" +
        fd("3", "/r/new") + ", [{iov_base=" + str("xy") + ", iov_len=2}, {iov_base=" + str("z") +
        ", iov_len=1}], 2) = 3\n" + "10 pwrite64(" + fd("3", "/r/new") + ", " + str("P") + ", 1, 40) = 1\n" +
        "10 pwritev(" + fd("3", "/r/new") + ", [{iov_base=" + str("Q") + ", iov_len=1}], 1, 50) = 1\n" +
        "10 ftruncate(" + fd("3", "/r/new") + ", 7) = 0\n" + "10 fdatasync(" + fd("3", "/r/new") + ") = 0\n" +
        // Another process starts a call that ends later.
        "11 openat(" + kCwd + ", " + str("old") + ", O_WRONLY|O_TRUNC <unfinished ...>\n" + "10 openat(" + kCwd + ", " +
        str("/r/new") + ", O_WRONLY|O_CREAT|O_CLOEXEC, 0666) = 4" + fd("", "/r/new") + "\n" +
        "11 <... openat resumed>) = 5" + fd("", "/r/old") + "\n" + "10 write(" + fd("1", "/elsewhere/log") + ", " +
        str("x") + ", 1) = 1\n" + "10 unlink(" + str("/r/missing") + ") = -1 ENOENT (No such file or directory)\n" +
        "10 mkdirat(" + fd("7", "/r") + ", " + str("d") + ", 0777) = 0\n" + "10 rename(" + str("/r/d") + ", " +
        str("/r/e") + ") = 0\n" + "10 openat(" + kCwd + ", " + str("/r/e/f") + ", O_WRONLY|O_CREAT, 0666) = 6" +
        fd("", "/r/e/f") + "\n" + "10 renameat2(" + kCwd + ", " + str("/r/e/f") + ", " + kCwd + ", " + str("/r/old") +
        ", RENAME_NOREPLACE) = 0\n" + "10 utimensat(" + kCwd + ", " + str("/r/old") +
        ", [UTIME_OMIT, {tv_sec=4102444802, tv_nsec=7} /* " + "2100-01-01T00:00:02.000000007+0000 */], 0) = 0\n" +
        "10 utimensat(" + kCwd + ", " + str("/elsewhere") + ", NULL, 0) = 0\n" + "10 unlinkat(" + kCwd + ", " +
        str("e") + ", AT_REMOVEDIR) = 0\n" + "10 unlinkat(" + fd("7", "/r") + ", " + str("new") + ", 0) = 0\n" +
        "10 fchmodat(" + fd("7", "/r") + ", " + str("old") + ", 0644) = 0\n" + "10 syncfs(" + fd("8", "/elsewhere") +
        ") = 0\n" + "10 --- SIGCHLD {si_signo=SIGCHLD} ---\n";
    EXPECT_EQ(described(parseStraceTrace(trace, "/r", {"/r", "/r/old"})), (std::vector<std::string>{
                                                                              "create /r/new 0 0.000000000",
                                                                              "write /r/new 0 0 68656c6c6f 0.000000000",
                                                                              "write /r/new 0 5 6162 0.000000000",
                                                                              "write /r/new 0 3 78797a 0.000000000",
                                                                              "write /r/new 0 40 50 0.000000000",
                                                                              "write /r/new 0 50 51 0.000000000",
                                                                              "truncate /r/new 0 7 0.000000000",
                                                                              "fsync /r/new 0",
                                                                              "truncate /r/old 0 0 0.000000000",
                                                                              "mkdir /r/d",
                                                                              "rename /r/d /r/e 0 0",
                                                                              "create /r/e/f 0 0.000000000",
                                                                              "rename /r/e/f /r/old 0 0",
                                                                              "utimens /r/old 0 4102444802.000000007",
                                                                              "rmdir /r/e",
                                                                              "unlink /r/new 0",
                                                                              "chmod /r/old 0",
                                                                              "syncfs",
                                                                          }));
}

TEST(StraceTrace, RejectsWhatItCannotFollowNamingTheLine) {
    const std::string openNew =
        "10 openat(" + kCwd + ", " + str("/r/new") + ", O_WRONLY|O_CREAT|O_APPEND, 0666) = 3" + fd("", "/r/new") + "\n";
    struct Row {
        std::string trace;
        std::string message;
    };
    const std::string cut = "10 write(" + fd("3", "/r/new") + ", " + str("ab") + "..., 5) = 5";
    const std::string unknown = "10 write(" + fd("4", "/r/x") + ", " + str("a") + ", 1) = 1";
    const std::string appended = "10 write(" + fd("3", "/r/new") + ", " + str("a") + ", 1) = 1";
    const std::string now = "10 utimensat(" + kCwd + ", " + str("/r/x") + ", NULL, 0) = 0";
    const std::string relative = "10 unlink(" + str("x") + ") = 0";
    const std::vector<Row> rows = {
        {openNew + cut + "\n", "strace line 2 \"" + cut + "\": not a whole string: " + str("ab") + "..."},
        {unknown + "\n", "strace line 1 \"" + unknown + "\": a write at an unknown file position"},
        {openNew + appended + "\n", "strace line 2 \"" + appended + "\": a write under O_APPEND"},
        {now + "\n", "strace line 1 \"" + now + "\": no explicit mtime: NULL"},
        {relative + "\n", "strace line 1 \"" + relative + "\": a relative path without its directory: x"},
        {"10 <... write resumed>) = 1\n", "strace line 1 \"10 <... write resumed>) = 1\": nothing to resume"},
        {"10 close(3) = 0\n", "strace line 1 \"10 close(3) = 0\": a call not in the traced set: close"},
        {"garbage\n", "strace line 1 \"garbage\": no process id"},
        {"10 syncfs(3\n", "strace line 1 \"10 syncfs(3\": no result"},
    };
    for (const Row& row : rows) {
        try {
            parseStraceTrace(row.trace, "/r", {"/r"});
            ADD_FAILURE() << "accepted: " << row.trace;
        } catch (const std::runtime_error& error) {
            EXPECT_EQ(std::string(error.what()), row.message);
        }
    }
}

}  // namespace

namespace {

const std::string kStoreDir = fd("5", "/r/s/1");

std::vector<std::string> following(const std::string& line) {
    return crash::linkFollowingCalls("10 " + line + "\n", "/r/s");
}

// What the store does below its base: directories one component at a time
// with O_NOFOLLOW, files relative to them with O_NOFOLLOW, removals,
// renames and times on descriptors; the base itself and its parents by
// path.
TEST(LinkFollowingCalls, TheStoresOwnCallsPass) {
    const std::string trace =
        "10 mkdir(" + str("/r/s") + ", 0777) = 0\n" + "10 openat(" + kCwd + ", " + str("/r/s") +
        ", O_RDONLY|O_CLOEXEC|O_DIRECTORY) = 4" + fd("", "/r/s") + "\n" + "10 openat(" + fd("4", "/r/s") + ", " +
        str("1") + ", O_RDONLY|O_NOFOLLOW|O_CLOEXEC|O_DIRECTORY) = 5" + fd("", "/r/s/1") + "\n" + "10 mkdirat(" +
        fd("4", "/r/s") + ", " + str("2") + ", 0777) = 0\n" + "10 openat(" + kStoreDir + ", " + str("data") +
        ", O_RDWR|O_CREAT|O_TRUNC|O_NOFOLLOW|O_CLOEXEC, 0666) = 6" + fd("", "/r/s/1/data") + "\n" + "10 unlinkat(" +
        kStoreDir + ", " + str("data.chk") + ", 0) = -1 ENOENT (No such file or directory)\n" + "10 openat2(" +
        fd("4", "/r/s") + ", " + str("1/data.chk") +
        ", {flags=O_RDONLY|O_NOFOLLOW|O_CLOEXEC, resolve=RESOLVE_NO_SYMLINKS|RESOLVE_BENEATH}, 24) = 9" +
        fd("", "/r/s/1/data.chk") + "\n" + "10 utimensat(" + fd("7", "/r/s/1/data.chk.tmp") +
        ", NULL, [UTIME_OMIT, {tv_sec=5, tv_nsec=0}], 0) = 0\n" + "10 renameat(" + kStoreDir + ", " +
        str("data.chk.tmp") + ", " + kStoreDir + ", " + str("data.chk") + ") = 0\n" +
        // Outside the stores anything goes.
        "10 openat(" + kCwd + ", " + str("/r/input") + ", O_RDONLY) = 8" + fd("", "/r/input") + "\n";
    EXPECT_EQ(crash::linkFollowingCalls(trace, "/r/s"), std::vector<std::string>{});
}

TEST(LinkFollowingCalls, EveryWayAroundADescriptorIsCaught) {
    EXPECT_EQ(following("openat(" + kCwd + ", " + str("/r/s/1/data") + ", O_RDONLY|O_NOFOLLOW) = 3"),
              std::vector<std::string>{"openat(/r/s/1/data): names a store entry by its path"});
    EXPECT_EQ(following("unlink(" + str("/r/s/1/data.chk") + ") = 0"),
              std::vector<std::string>{"unlink(/r/s/1/data.chk): names a store entry by its path"});
    EXPECT_EQ(following("openat(" + kCwd + ", " + str("s/7") + ", O_RDONLY|O_DIRECTORY) = 3"),
              std::vector<std::string>{"openat(s/7): reaches a slot or copy directory by its path"});
    EXPECT_EQ(following("mkdir(" + str("/r/s/app/2") + ", 0777) = 0"),
              std::vector<std::string>{"mkdir(/r/s/app/2): reaches a slot or copy directory by its path"});
    EXPECT_EQ(following("openat(" + fd("4", "/r/s") + ", " + str("1/data") + ", O_RDONLY|O_NOFOLLOW) = 3"),
              std::vector<std::string>{"openat(1/data): names more than one component below a directory"});
    EXPECT_EQ(following("openat(" + kStoreDir + ", " + str("data") + ", O_RDONLY|O_CLOEXEC) = 3"),
              std::vector<std::string>{"openat(data): opens without O_NOFOLLOW"});
    EXPECT_EQ(following("utimensat(" + kStoreDir + ", " + str("data.chk.tmp") + ", NULL, 0) = 0"),
              std::vector<std::string>{"utimensat(data.chk.tmp): sets a time without AT_SYMLINK_NOFOLLOW"});
    EXPECT_EQ(following("openat2(" + fd("4", "/r/s") + ", " + str("1/data") +
                        ", {flags=O_RDONLY|O_NOFOLLOW, resolve=RESOLVE_BENEATH}, 24) = 3"),
              std::vector<std::string>{"openat2(1/data): opens without RESOLVE_NO_SYMLINKS"});
    EXPECT_EQ(following("renameat(" + kStoreDir + ", " + str("a") + ", " + kCwd + ", " + str("/r/s/1/b") + ") = 0"),
              std::vector<std::string>{"renameat(/r/s/1/b): names a store entry by its path"});
}

}  // namespace
