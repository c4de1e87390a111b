#include "lib/util/log.h"

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "lib/util/status.h"
#include "log_in_child.h"

namespace {

using testing_support::logInChild;
using testing_support::ProcessResult;
using testing_support::runInChild;

const std::string kThisFile = "tests/libcommon/lib/util/log_test";
const std::string kStreamFailed = "*-*-*ERROR*-*-* LOG stream has failed: ";

// Replaces descriptor `fd` by one end of a datagram socket pair while `body`
// runs, so that every write(2) to it stays a separate record; returns the
// records, each wrapped in braces. One record per line shows one emit per line.
std::string recordWrites(int fd, const std::function<void()>& body) {
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, pair) != 0) return "<socketpair failed>";
    const int saved = fcntl(fd, F_DUPFD_CLOEXEC, 0);
    if (saved < 0 || dup2(pair[1], fd) < 0) return "<dup failed>";
    body();
    std::fflush(stdout);
    std::fflush(stderr);
    dup2(saved, fd);
    close(saved);
    close(pair[1]);
    std::string records;
    std::vector<char> buffer(1 << 16);
    ssize_t length;
    while ((length = recv(pair[0], buffer.data(), buffer.size(), MSG_DONTWAIT)) >= 0) {
        records += '{';
        records.append(buffer.data(), static_cast<size_t>(length));
        records += '}';
    }
    close(pair[0]);
    return records;
}

// Child with the given output mode and threshold; its standard output
// carries the records written to the mode's sink while `body` ran.
ProcessResult recordInChild(int mode, int threshold, const std::function<void()>& body) {
    return runInChild([&] {
        setLogOutput(mode);
        setLogLevel(threshold);
        const std::string records = recordWrites(mode == LOG_OUTPUT_STDERR ? 2 : 1, body);
        std::fwrite(records.data(), 1, records.size(), stdout);
        return 0;
    });
}

// ---------------------------------------------------------------------------
// Defaults and threshold

TEST(LogDefaults, ThresholdFourAndSyslogOutput) {
    // Every test that changes logging state does so in a child process.
    EXPECT_EQ(Syslog::threshold, 4);
    EXPECT_EQ(Syslog::outputMode, LOG_OUTPUT_SYSLOG);
}

void logAtPriorities() {
    for (int priority = 2; priority <= 7; ++priority) LOG_STATEMENT(priority) << "priority " << priority;
    LOGE_AT(1) << "error";
    LOGW << "warning";
    LOGI << "info";
    LOGD << "debug";
}

TEST(LogThreshold, DefaultWritesPrioritiesTwoToFour) {
    const ProcessResult result = runInChild([] {
        if (Syslog::threshold != 4) return 3;
        setLogOutput(LOG_OUTPUT_STDOUT);
        logAtPriorities();
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "priority 2\npriority 3\npriority 4\n" + kThisFile + ":1 error\nwarning\n");
    EXPECT_EQ(result.err, "");
}

TEST(LogThreshold, LevelSevenWritesAll) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 7, logAtPriorities);
    EXPECT_EQ(result.out, "priority 2\npriority 3\npriority 4\npriority 5\npriority 6\npriority 7\n" + kThisFile +
                              ":1 error\nwarning\ninfo\ndebug\n");
}

TEST(LogThreshold, LevelSixWritesAllButDebug) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 6, logAtPriorities);
    EXPECT_EQ(result.out,
              "priority 2\npriority 3\npriority 4\npriority 5\npriority 6\n" + kThisFile + ":1 error\nwarning\ninfo\n");
}

TEST(LogThreshold, LevelTwoWritesOnlyCritical) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 2, logAtPriorities);
    EXPECT_EQ(result.out, "priority 2\n");
}

TEST(LogThreshold, SuppressedStatementEvaluatesNothing) {
    const ProcessResult result = runInChild([] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        int evaluated = 0;
        auto piece = [&evaluated] {
            ++evaluated;
            return "piece";
        };
        LOGI << piece();
        LOGD << piece();
        LOG_STATEMENT(5) << piece();
        if (evaluated != 0) return 10 + evaluated;
        LOGW << piece();
        return evaluated;
    });
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "piece\n");
}

TEST(LogThreshold, StatementBindsItsOwnElse) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 4, [] {
        for (const bool first : {true, false}) {
            if (first)
                LOGW << "first";
            else
                LOGW << "second";
        }
    });
    EXPECT_EQ(result.out, "first\nsecond\n");
}

// ---------------------------------------------------------------------------
// Output modes

// Mode 1 writes standard output, mode 2 standard error; nothing goes to
// the other stream.
TEST(LogOutput, ModesOneAndTwoWriteTheirStream) {
    for (const int mode : {LOG_OUTPUT_STDOUT, LOG_OUTPUT_STDERR}) {
        const ProcessResult result = logInChild(mode, 4, [mode] {
            LOGW << "to stream " << mode;
            LOG_STATEMENT(2) << "critical";
            logEmit(3, "emitted %s %d|", "raw", 7);
        });
        const std::string written = "to stream " + std::to_string(mode) + "\ncritical\nemitted raw 7|";
        EXPECT_EQ(result.out, mode == LOG_OUTPUT_STDOUT ? written : "") << "mode " << mode;
        EXPECT_EQ(result.err, mode == LOG_OUTPUT_STDERR ? written : "") << "mode " << mode;
    }
}

TEST(LogOutput, OtherNonNegativeModesWriteStandardOutput) {
    for (const int mode : {0, 3, 100}) {
        const ProcessResult result = logInChild(mode, 4, [] { LOGW << "line"; });
        EXPECT_EQ(result.out, "line\n") << "mode " << mode;
        EXPECT_EQ(result.err, "") << "mode " << mode;
    }
}

TEST(LogOutput, ModeOneMakesStandardOutputLineBuffered) {
    const ProcessResult result = runInChild([] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        LOGW << "seen";
        // Without line buffering the line would still sit in stdio's buffer.
        const int fd = open("/proc/self/fd/1", O_RDONLY | O_CLOEXEC);
        if (fd < 0) return 2;
        char buffer[64];
        const ssize_t length = read(fd, buffer, sizeof buffer);
        close(fd);
        if (length < 0) return 3;
        std::fprintf(stderr, "[%.*s]", static_cast<int>(length), buffer);
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.err, "[seen\n]");
    EXPECT_EQ(result.out, "seen\n");
}

TEST(LogOutput, EmitAddsNothing) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        logEmit(7, "%s", "no newline");
        logEmit(4, "%d-%u-%x\n", -1, 2u, 255u);
    });
    EXPECT_EQ(result.out, "{no newline}{-1-2-ff\n}");
}

// ---------------------------------------------------------------------------
// Cutting statements into lines

TEST(LogLines, EmbeddedNewlineGivesTwoLines) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 6, [] { LOGI << "a\nb"; });
    EXPECT_EQ(result.out, "{a\n}{b\n}");
}

TEST(LogLines, TrailingNewlineIsNotDoubled) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        LOGW << "done\n";
        LOGW << "split"
             << "\n";
        LOGW << "endl" << std::endl;
    });
    EXPECT_EQ(result.out, "{done\n}{split\n}{endl\n}");
}

TEST(LogLines, BlankLinesAreKept) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        LOGW << "x\n\n";
        LOGW << "\n";
    });
    EXPECT_EQ(result.out, "{x\n}{\n}{\n}");
}

TEST(LogLines, EmptyStatementEmitsNothing) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        LOGW;
        LOGW << "";
        LOGW << std::string();
        LOGW << "after";
    });
    EXPECT_EQ(result.out, "{after\n}");
}

TEST(LogLines, SeveralNewlinesInOnePiece) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        LOGW << "one\ntwo\nthree\nfour";
        LOGW << std::string("five\nsix\n");
    });
    EXPECT_EQ(result.out, "{one\n}{two\n}{three\n}{four\n}{five\n}{six\n}");
}

TEST(LogLines, PartialLineThenRest) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        LOGW << "par"
             << "tial\nrest\nmore";
        LOGW << "ab"
             << "cd" << 'e' << 42;
        LOGW << "x"
             << "y\n"
             << "z\n";
    });
    EXPECT_EQ(result.out, "{partial\n}{rest\n}{more\n}{abcde42\n}{xy\n}{z\n}");
}

TEST(LogLines, SingleCharactersGoThroughOverflow) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        LOGW.put('a').put('\n').put('b');
        LOGW << "c";
        LOGW.put('d').put('\n');
    });
    EXPECT_EQ(result.out, "{a\n}{b\n}{c\n}{d\n}");
}

TEST(LogLines, LongLinesArriveWhole) {
    const std::string eighty(80, 'e');
    const std::string threeHundred(300, 't');
    const std::string threeThousand(3000, 'k');
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [&] {
        LOGW << eighty;
        LOGW << eighty << "!";
        LOGW << threeHundred.substr(0, 100) << threeHundred.substr(100, 150) << threeHundred.substr(250);
        LOGW << threeThousand;
        LOGW << "short";
    });
    EXPECT_EQ(result.out,
              "{" + eighty + "\n}{" + eighty + "!\n}{" + threeHundred + "\n}{" + threeThousand + "\n}{short\n}");
}

TEST(LogLines, VeryLongLineInPieces) {
    std::string expected;
    for (int i = 0; i < 4000; ++i) expected += std::to_string(i % 10) + "ab";
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 4, [] {
        {
            Syslog::LogLine line(LOG_PRIORITY_WARNING);
            for (int i = 0; i < 4000; ++i) line.stream() << i % 10 << "ab";
        }
        LOGW << "next";
    });
    EXPECT_EQ(result.out, expected + "\nnext\n");
}

// ---------------------------------------------------------------------------
// The stream buffer itself

TEST(SyslogBuf, StartsAtInfoPriority) {
    Syslog::SyslogBuf buf;
    EXPECT_EQ(buf.priority(), LOG_PRIORITY_INFO);
    buf.setPriority(LOG_PRIORITY_DEBUG);
    EXPECT_EQ(buf.priority(), LOG_PRIORITY_DEBUG);
}

TEST(SyslogBuf, PutReturnsCountAndDestructionFlushes) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 7, [] {
        std::streamsize counts[3];
        {
            Syslog::SyslogBuf buf;
            counts[0] = buf.sputn("one\ntw", 6);
            counts[1] = buf.sputn("o", 1);
            counts[2] = buf.sputn("", 0);
            if (buf.sputc('!') != '!') std::abort();
        }
        std::fprintf(stdout, "%ld %ld %ld", static_cast<long>(counts[0]), static_cast<long>(counts[1]),
                     static_cast<long>(counts[2]));
    });
    // The counts reach standard output before the records are copied there.
    EXPECT_EQ(result.out, "6 1 0{one\n}{two!\n}");
}

TEST(SyslogBuf, FlushLineOnEmptyBufferEmitsNothing) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 7, [] {
        Syslog::SyslogBuf buf;
        buf.flushLine();
        buf.sputn("x\n", 2);
        buf.flushLine();
        buf.sputn("y", 1);
        buf.flushLine();
        buf.flushLine();
    });
    EXPECT_EQ(result.out, "{x\n}{y\n}");
}

// ---------------------------------------------------------------------------
// Stream failures

std::ostream& setEof(std::ostream& stream) {
    stream.setstate(std::ios_base::eofbit);
    return stream;
}

TEST(LogFailure, NullStringReportsBadStreamThenRecovers) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        const char* missing = nullptr;
        LOGW << "before " << missing << " after";
        LOGW << "next " << 7;
    });
    EXPECT_EQ(result.out, "{before \n}{" + kStreamFailed + "good=0 bad=1 fail=1 eof=0\n}{next 7\n}");
}

TEST(LogFailure, NullStringAloneStillReports) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        const char* missing = nullptr;
        LOGW << missing;
        LOGW << "ok";
    });
    EXPECT_EQ(result.out, "{" + kStreamFailed + "good=0 bad=1 fail=1 eof=0\n}{ok\n}");
}

TEST(LogFailure, FailBitAlone) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        std::stringbuf empty;
        LOGW << "copy:" << &empty;
        LOGW << "ok";
    });
    EXPECT_EQ(result.out, "{copy:\n}{" + kStreamFailed + "good=0 bad=0 fail=1 eof=0\n}{ok\n}");
}

TEST(LogFailure, EofBitAlone) {
    const ProcessResult result = recordInChild(LOG_OUTPUT_STDERR, 4, [] {
        LOGW << "end" << setEof;
        LOGW << "ok";
    });
    EXPECT_EQ(result.out, "{end\n}{" + kStreamFailed + "good=0 bad=0 fail=0 eof=1\n}{ok\n}");
}

// ---------------------------------------------------------------------------
// Number formatting

TEST(LogFormat, HexAndOctalCarryTheirPrefix) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 4, [] {
        LOGW << std::hex << 255;
        LOGW << std::hex << 0x1234abcdU;
        LOGW << std::oct << 8;
        LOGW << 255;
    });
    EXPECT_EQ(result.out, "0xff\n0x1234abcd\n010\n255\n");
}

TEST(LogFormat, FlagsAreRestoredAfterEachStatement) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 4, [] {
        LOGW << std::hex << 16 << ' ' << 17;
        LOGW << 16;
        LOGW << std::uppercase << std::hex << 255 << std::boolalpha << ' ' << true;
        LOGW << std::hex << 255;
        LOGW << true;
        LOGW << std::noshowbase << std::hex << 255;
        LOGW << std::hex << 255;
        LOGE_AT(12) << std::hex << 10;
        LOGE_AT(12) << 10;
    });
    EXPECT_EQ(result.out,
              "0x10 0x11\n16\n0XFF true\n0xff\n1\nff\n0xff\n" + kThisFile + ":12 0xa\n" + kThisFile + ":12 10\n");
}

// ---------------------------------------------------------------------------
// Source prefix of error lines

TEST(LogPrefix, ErrorLineNamesThisFileAndLine) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 4, [] { LOGE << "boom " << 1; });
    const int line = __LINE__ - 1;
    EXPECT_EQ(result.out, kThisFile + ":" + std::to_string(line) + " boom 1\n");
}

TEST(LogPrefix, FixedLineNumber) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 4, [] { LOGE_AT(334) << "fixed"; });
    EXPECT_EQ(result.out, kThisFile + ":334 fixed\n");
}

TEST(LogPrefix, OtherPrioritiesHaveNoPrefix) {
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 7, [] {
        LOGW << "w";
        LOGI << "i";
        LOGD << "d";
    });
    EXPECT_EQ(result.out, "w\ni\nd\n");
}

TEST(LogPrefix, SourcePathWithoutExtension) {
    static_assert(Syslog::withoutExtension("lib/storage/storage_target.cpp") == "lib/storage/storage_target");
    struct Row {
        const char* path;
        const char* expected;
    };
    const Row rows[] = {
        {"lib/storage/storage_target.cpp", "lib/storage/storage_target"},
        {"libcommon/lib/util/fd.h", "libcommon/lib/util/fd"},
        {"dir/archive.tar.gz", "dir/archive.tar"},
        {"noextension", "noextension"},
        {"dotted.dir/file", "dotted.dir/file"},
        {"file.cc", "file"},
        {"", ""},
    };
    for (const Row& row : rows) EXPECT_EQ(Syslog::withoutExtension(row.path), row.expected) << row.path;
    EXPECT_EQ(LOG_SOURCE_PATH, kThisFile);
}

// ---------------------------------------------------------------------------
// Threads

TEST(LogThreads, ConcurrentLinesStayIntact) {
    constexpr int kLines = 2000;
    const std::string padding(60, '.');
    const ProcessResult result = logInChild(LOG_OUTPUT_STDOUT, 4, [&] {
        auto worker = [&](char tag) {
            for (int i = 0; i < kLines; ++i) {
                LOGW << tag << ' ' << i << ' ' << padding << ' ' << std::hex << i << " end";
            }
        };
        std::thread first(worker, 'A');
        std::thread second(worker, 'B');
        first.join();
        second.join();
    });
    auto expectedLine = [&](char tag, int i) {
        std::ostringstream line;
        line << tag << ' ' << i << ' ' << padding << ' ' << std::showbase << std::hex << i << " end";
        return line.str();
    };
    std::istringstream lines(result.out);
    std::string line;
    int next[2] = {0, 0};
    int total = 0;
    while (std::getline(lines, line)) {
        ++total;
        ASSERT_FALSE(line.empty()) << "line " << total;
        const int which = line[0] == 'A' ? 0 : 1;
        ASSERT_EQ(line, expectedLine(which == 0 ? 'A' : 'B', next[which])) << "line " << total;
        ++next[which];
    }
    EXPECT_EQ(total, 2 * kLines);
    EXPECT_EQ(next[0], kLines);
    EXPECT_EQ(next[1], kLines);
    EXPECT_EQ(result.out.back(), '\n');
}

// ---------------------------------------------------------------------------
// Syslog output, observed through a private /dev/log

constexpr int kUnsharePermissionDenied = 77;
constexpr int kNoMountToMakePrivate = 78;

std::string ident() { return program_invocation_short_name; }

// "<PRI>Mmm dd hh:mm:ss ident: message" becomes "{PRI|message}".
std::string describeDatagram(const std::string& datagram) {
    const std::string unparsed = "{unparsed:" + datagram + "}";
    if (datagram.empty() || datagram[0] != '<') return unparsed;
    const size_t close = datagram.find('>');
    if (close == std::string::npos || close == 1) return unparsed;
    const std::string priority = datagram.substr(1, close - 1);
    if (priority.find_first_not_of("0123456789") != std::string::npos) return unparsed;
    // Timestamp "Nov 21 05:12:21" is 15 characters.
    const size_t stamp = close + 1;
    if (datagram.size() < stamp + 16 || datagram[stamp + 3] != ' ' || datagram[stamp + 6] != ' ' ||
        datagram[stamp + 9] != ':' || datagram[stamp + 12] != ':' || datagram[stamp + 15] != ' ') {
        return unparsed;
    }
    const std::string head = ident() + ": ";
    if (datagram.compare(stamp + 16, head.size(), head) != 0) return unparsed;
    return "{" + priority + "|" + datagram.substr(stamp + 16 + head.size()) + "}";
}

// Runs `body` in a child whose /dev/log is a socket of its own (private
// mount namespace, fresh /dev), with syslog output; the child's standard
// output carries what syslog delivered. Keep each body under ten lines: the
// sender blocks once that many datagrams wait unread.
ProcessResult syslogInChild(int threshold, const std::function<void()>& body) {
    return runInChild([&] {
        if (unshare(CLONE_NEWNS) != 0) return errno == EPERM ? kUnsharePermissionDenied : 90;
        // The tmpfs on /dev must not show outside. In a chroot "/" is no mount
        // point; a bind-mounted /dev (as build chroots have) is enough then.
        if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
            if (errno != EINVAL) return 91;
            if (mount(nullptr, "/dev", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
                return errno == EINVAL ? kNoMountToMakePrivate : 96;
            }
        }
        if (mount("tmpfs", "/dev", "tmpfs", 0, nullptr) != 0) return 92;
        const int sock = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        if (sock < 0) return 93;
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strcpy(address.sun_path, "/dev/log");
        if (bind(sock, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return 94;
        closelog();  // forget any connection made before the fork
        setLogOutput(LOG_OUTPUT_SYSLOG);
        setLogLevel(threshold);
        body();
        std::vector<char> buffer(1 << 16);
        ssize_t length;
        while ((length = recv(sock, buffer.data(), buffer.size(), MSG_DONTWAIT)) >= 0) {
            const std::string text = describeDatagram(std::string(buffer.data(), static_cast<size_t>(length)));
            std::fwrite(text.data(), 1, text.size(), stdout);
        }
        return errno == EAGAIN ? 0 : 95;
    });
}

#define SKIP_UNLESS_ROOT()                                                                          \
    if (geteuid() != 0) {                                                                           \
        GTEST_SKIP() << "needs root to give a child its own /dev/log in a private mount namespace"; \
    }

#define SKIP_IF_UNSHARE_REFUSED(result)                                                                   \
    if ((result).exitStatus == kUnsharePermissionDenied) {                                                \
        GTEST_SKIP() << "unshare(CLONE_NEWNS) refused with EPERM in this environment";                    \
    }                                                                                                     \
    if ((result).exitStatus == kNoMountToMakePrivate) {                                                   \
        GTEST_SKIP() << "neither / nor /dev is a mount point here (a chroot?): a private /dev/log would " \
                        "show outside the test";                                                          \
    }

TEST(LogSyslog, CriticalGoesToSyslogAndStandardErrorErrorOnlyToSyslog) {
    SKIP_UNLESS_ROOT();
    const ProcessResult result = syslogInChild(4, [] {
        logEmit(2, "critical %d\n", 2);
        logEmit(3, "error %s\n", "three");
    });
    SKIP_IF_UNSHARE_REFUSED(result);
    ASSERT_EQ(result.exitStatus, 0);
    // Facility user (8) plus the priority.
    EXPECT_EQ(result.out, "{10|critical 2\n}{11|error three\n}");
    EXPECT_EQ(result.err, "critical 2\n");
}

TEST(LogSyslog, StatementsCarryTheirPriority) {
    SKIP_UNLESS_ROOT();
    const ProcessResult result = syslogInChild(7, [] {
        LOG_STATEMENT(2) << "crit";
        LOGE_AT(12) << "err";
        LOGW << "warn";
        LOGI << "info";
        LOGD << "debug";
        LOGI << "a\nb";
        Syslog::SyslogBuf bare;
        bare.sputn("bare\n", 5);
    });
    SKIP_IF_UNSHARE_REFUSED(result);
    ASSERT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "{10|crit\n}{11|" + kThisFile +
                              ":12 err\n}{12|warn\n}{14|info\n}{15|debug\n}{14|a\n}{14|b\n}"
                              "{14|bare\n}");
    EXPECT_EQ(result.err, "crit\n");
}

TEST(LogSyslog, DefaultThresholdSendsNothingBelowWarning) {
    SKIP_UNLESS_ROOT();
    const ProcessResult result = syslogInChild(4, [] {
        LOGI << "info";
        LOGD << "debug";
        LOGW << "warn";
    });
    SKIP_IF_UNSHARE_REFUSED(result);
    ASSERT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "{12|warn\n}");
    EXPECT_EQ(result.err, "");
}

TEST(LogSyslog, StreamFailureIsCritical) {
    SKIP_UNLESS_ROOT();
    const ProcessResult result = syslogInChild(4, [] {
        const char* missing = nullptr;
        LOGW << "x" << missing;
        LOGW << "y";
    });
    SKIP_IF_UNSHARE_REFUSED(result);
    ASSERT_EQ(result.exitStatus, 0);
    const std::string failure = kStreamFailed + "good=0 bad=1 fail=1 eof=0\n";
    EXPECT_EQ(result.out, "{12|x\n}{10|" + failure + "}{12|y\n}");
    EXPECT_EQ(result.err, failure);
}

TEST(LogSyslog, StatusReportIsAnErrorLine) {
    SKIP_UNLESS_ROOT();
    const ProcessResult result = syslogInChild(4, [] {
        LOG_STATUS_AT(427, STATUS_NOT_AVAILABLE);
        setLogLevel(2);
        LOG_STATUS_AT(428, STATUS_NOT_AVAILABLE);
        setLogLevel(3);
        LOG_STATUS_AT(429, STATUS_FAILED);
    });
    SKIP_IF_UNSHARE_REFUSED(result);
    ASSERT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "{11|[" + kThisFile + ":427] err_code = 16 (STATUS_NOT_AVAILABLE)\n}{11|[" + kThisFile +
                              ":429] err_code = 52 (STATUS_FAILED)\n}");
    EXPECT_EQ(result.err, "");
}

}  // namespace
