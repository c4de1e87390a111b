#include "lib/util/run_command.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>
#include <csignal>
#include <cstdio>
#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"

namespace {

using testing_support::ProcessResult;
using testing_support::runInChild;

struct Row {
    std::string command;
    bool ignoreStatus;
    Status expected;
    std::string output;
};

void expectRows(const std::vector<Row>& rows) {
    for (const Row& row : rows) {
        std::string output = "stale";
        EXPECT_EQ(runCommand(row.command.c_str(), output, row.ignoreStatus), row.expected)
            << row.command << (row.ignoreStatus ? " (ignoring status)" : "");
        EXPECT_EQ(output, row.output) << row.command;
    }
}

TEST(RunCommand, ExitStatusMapping) {
    expectRows({
        {"true", false, STATUS_OK, ""},
        {"exit 0", false, STATUS_OK, ""},
        {"printf 'a\\nb\\n'", false, STATUS_OK, "a\nb\n"},
        {"printf 'no newline'", false, STATUS_OK, "no newline"},
        {"exit 1", false, STATUS_FAILED, ""},
        {"printf 'partial\\n'; exit 1", false, STATUS_FAILED, "partial\n"},
        {"printf 'half'; exit 2", false, STATUS_FAILED, "half"},
        {"exit 127", false, STATUS_FAILED, ""},
        {"exit 255", false, STATUS_FAILED, ""},
    });
}

TEST(RunCommand, EndedBySignalIsNotFound) {
    expectRows({
        {"kill -TERM $$", false, STATUS_NOT_FOUND, ""},
        {"printf 'before'; kill -TERM $$; printf 'after'", false, STATUS_NOT_FOUND, "before"},
        {"kill -9 $$", false, STATUS_NOT_FOUND, ""},
        {"printf 'x\\n'; kill -HUP $$", false, STATUS_NOT_FOUND, "x\n"},
        {"kill -USR1 $$", false, STATUS_NOT_FOUND, ""},
    });
}

TEST(RunCommand, IgnoreStatusReturnsOkButKeepsOutput) {
    expectRows({
        {"printf 'kept'; exit 3", true, STATUS_OK, "kept"},
        {"exit 1", true, STATUS_OK, ""},
        {"printf 'x'; kill -TERM $$", true, STATUS_OK, "x"},
        {"kill -9 $$", true, STATUS_OK, ""},
        {"printf 'fine\\n'", true, STATUS_OK, "fine\n"},
    });
}

TEST(RunCommand, OutputIsEmptiedBeforeFilling) {
    std::string output = "previous content that must go";
    EXPECT_EQ(runCommand("printf 'new'", output, false), STATUS_OK);
    EXPECT_EQ(output, "new");
    output = "previous";
    EXPECT_EQ(runCommand("exit 4", output, false), STATUS_FAILED);
    EXPECT_EQ(output, "");
}

TEST(RunCommand, StringOverloadDoesNotIgnoreStatus) {
    std::string output = "stale";
    const std::string failing = "printf 'abc'; exit 1";
    EXPECT_EQ(runCommand(failing, output), STATUS_FAILED);
    EXPECT_EQ(output, "abc");
    const std::string signalled = "printf 'sig'; kill -TERM $$";
    EXPECT_EQ(runCommand(signalled, output), STATUS_NOT_FOUND);
    EXPECT_EQ(output, "sig");
    const std::string fine = "printf 'one\\ntwo'";
    EXPECT_EQ(runCommand(fine, output), STATUS_OK);
    EXPECT_EQ(output, "one\ntwo");
}

// fgets reads at most 255 characters at a time; longer lines come in pieces.
TEST(RunCommand, LongLinesArriveWhole) {
    for (const int length : {1, 2, 254, 255, 256, 257, 510, 511, 512, 513, 1000, 5000}) {
        const std::string digits = std::string(static_cast<size_t>(length) - 1, '0') + "7";
        std::string output;
        const std::string withNewline = "printf '%0" + std::to_string(length) + "d\\n' 7";
        EXPECT_EQ(runCommand(withNewline.c_str(), output, false), STATUS_OK) << length;
        EXPECT_EQ(output, digits + "\n") << length;
        const std::string withoutNewline = "printf '%0" + std::to_string(length) + "d' 7";
        EXPECT_EQ(runCommand(withoutNewline.c_str(), output, false), STATUS_OK) << length;
        EXPECT_EQ(output, digits) << length;
    }
}

TEST(RunCommand, SeveralLongLines) {
    std::string expected;
    for (int i = 1; i <= 5; ++i) expected += std::string(599, '0') + std::to_string(i) + "\n";
    expected += std::string(299, '0') + "9";
    std::string output;
    EXPECT_EQ(runCommand("for i in 1 2 3 4 5; do printf '%0600d\\n' $i; done; printf '%0300d' 9", output, false),
              STATUS_OK);
    EXPECT_EQ(output, expected);
}

TEST(RunCommand, LargeOutput) {
    std::string output;
    EXPECT_EQ(runCommand("head -c 1000000 /dev/zero | tr '\\000' 'z'", output, false), STATUS_OK);
    EXPECT_EQ(output, std::string(1000000, 'z'));
}

// Child's standard output carries "<status>|<output>".
ProcessResult runInChildReporting(
    const std::string& command, bool ignoreStatus, const std::function<bool()>& prepare = [] { return true; }) {
    return runInChild([&] {
        if (!prepare()) return 90;
        std::string output = "untouched";
        const Status status = runCommand(command.c_str(), output, ignoreStatus);
        std::printf("%u|%s", status, output.c_str());
        return 0;
    });
}

TEST(RunCommand, UnknownCommandFails) {
    const std::string command = "no_such_command_for_run_command_test";
    const ProcessResult result = runInChildReporting(command, false);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "52|");
    // The shell's complaint is not captured; it reaches our standard error.
    EXPECT_NE(result.err.find(command), std::string::npos) << result.err;

    const ProcessResult ignored = runInChildReporting(command, true);
    EXPECT_EQ(ignored.out, "0|");
}

TEST(RunCommand, StandardErrorIsNotCaptured) {
    const ProcessResult result = runInChildReporting("echo out; echo err >&2", false);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "0|out\n");
    EXPECT_EQ(result.err, "err\n");
}

// Occupies every descriptor below a small limit, so popen cannot make its pipe.
bool exhaustDescriptors() {
    constexpr int kLimit = 64;
    for (;;) {
        const int fd = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
        if (fd < 0) return false;
        if (fd >= kLimit) {
            ::close(fd);
            break;
        }
    }
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return false;
    limit.rlim_cur = kLimit;
    if (setrlimit(RLIMIT_NOFILE, &limit) != 0) return false;
    int probe[2];
    return pipe(probe) != 0;  // the set-up only counts if a pipe really fails now
}

TEST(RunCommand, FailingPopenLeavesOutputUntouched) {
    for (const bool ignoreStatus : {false, true}) {
        const ProcessResult result = runInChildReporting("printf 'ran'", ignoreStatus, exhaustDescriptors);
        ASSERT_EQ(result.exitStatus, 0) << "descriptor exhaustion could not be set up";
        EXPECT_EQ(result.out, "52|untouched") << (ignoreStatus ? "ignoring status" : "");
    }
}

// With SIGCHLD ignored the shell is reaped by the kernel and pclose returns -1.
TEST(RunCommand, PcloseFailureCountsAsFailed) {
    auto ignoreChildren = [] { return std::signal(SIGCHLD, SIG_IGN) != SIG_ERR; };
    const ProcessResult result = runInChildReporting("printf 'kept'", false, ignoreChildren);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "52|kept");

    const ProcessResult ignored = runInChildReporting("printf 'kept'", true, ignoreChildren);
    EXPECT_EQ(ignored.out, "0|kept");
}

}  // namespace
