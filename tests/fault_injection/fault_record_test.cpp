// The shim's record (FAULT_RECORD) and fake clock (FAULT_MTIME), in a plain
// and in a sanitized probe.
#include <sys/stat.h>

#include <csignal>
#include <cstdint>
#include <filesystem>
#include <map>
#include <stdexcept>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "fault_injection.h"
#include "fault_injection_test_names.h"
#include "files.h"
#include "scratch_dir.h"

namespace {

using namespace fault_injection_test;
using testing_support::readText;
using testing_support::recordEnv;

using Lines = std::vector<std::string>;

const int64_t kFakeTime = 1234;
const std::string kFakeStamp = "1234.000000000";

struct stat statOf(const fs::path& path) {
    struct stat status {};
    if (lstat(path.c_str(), &status) != 0) throw std::runtime_error("cannot stat " + path.string());
    return status;
}

std::string inode(const fs::path& path) { return std::to_string(statOf(path).st_ino); }

std::string stamp(const struct timespec& time) {
    std::string nanoseconds = std::to_string(time.tv_nsec);
    return std::to_string(time.tv_sec) + "." + std::string(9 - nanoseconds.size(), '0') + nanoseconds;
}

std::string escaped(const std::string& path) {
    std::string out;
    for (const char c : path) {
        if (c == '%') {
            out += "%25";
        } else if (c == ' ') {
            out += "%20";
        } else if (c == '\n') {
            out += "%0A";
        } else {
            out += c;
        }
    }
    return out;
}

Lines splitLines(const std::string& text) {
    Lines lines;
    size_t start = 0;
    while (start < text.size()) {
        const size_t end = text.find('\n', start);
        if (end == std::string::npos) throw std::runtime_error("record without a final newline: " + text);
        lines.push_back(text.substr(start, end - start));
        start = end + 1;
    }
    return lines;
}

Lines splitFields(const std::string& line) {
    Lines fields;
    for (size_t start = 0, end = 0; end != std::string::npos; start = end + 1) {
        end = line.find(' ', start);
        fields.push_back(line.substr(start, end - start));
    }
    return fields;
}

// Lines with the inode fields blanked, to compare records of runs that
// made their files anew.
Lines withoutInodes(Lines lines) {
    static const std::map<std::string, std::vector<size_t>> kInodeFields = {
        {"create", {2}}, {"truncate", {2}},  {"write", {2}}, {"unlink", {2}}, {"utimens", {2}}, {"fsync", {2}},
        {"chmod", {2}},  {"rename", {3, 4}}, {"mkdir", {}},  {"rmdir", {}},   {"syncfs", {}}};
    for (std::string& line : lines) {
        Lines fields = splitFields(line);
        for (const size_t i : kInodeFields.at(fields.at(0))) fields.at(i) = "#";
        line = fields[0];
        for (size_t i = 1; i < fields.size(); ++i) line += " " + fields[i];
    }
    return lines;
}

// What "fault_probe record" prints: each step and its result.
const std::string kRecordProbeOutput =
    "mkdir 0\nopen-sub 0\nopenat-create 0\nwrite 5\nwritev 4\npwrite 1\npwritev 2\nfdatasync 0\nftruncate 0\n"
    "fsync-dir 0\nopen-trunc 0\ncreate-append 0\nappend 3\nappend-rewound 3\nappend-pwrite 1\nopen-append 0\n"
    "append-existing 4\ntruncate 0\nchmod 0\nfchmod 0\nfchmodat 0\nutimensat 0\nfutimens 0\nopen-source 0\n"
    "create-copy 0\nsendfile 6\ncopy_file_range 4\ncreate-write-only 0\nsendfile-offset 5\nsendfile-position 5\n"
    "rename 0\nrenameat 0\nrenameat2 0\nunlink 0\nmkdirat 0\nunlinkat-dir 0\nunlinkat 0\nrmdir 0\nremove-dir 0\n"
    "remove 0\ncreat 0\ncreat-again 0\nfopen 0\nfopen-existing 0\nsyncfs 0\nunlink-missing failed 2\n"
    "create-in-missing failed 2\nrename-missing failed 2\nmkdir-existing failed 17\nwrite-bad-fd failed 9\n"
    "open-read 0\nwrite-read-only failed 9\npipe 0\nwrite-pipe 1\nopen-null 0\nwrite-null 1\n";

// The inodes of the files "fault_probe record" removes or replaces.
using Inodes = std::map<std::string, std::string>;

Inodes prepareRecordDir(const fs::path& dir) {
    writeText(dir / "old", "old content\n");
    writeText(dir / "log", "log\n");
    writeText(dir / "source", "source data\n");
    writeText(dir / "replaced", "replaced\n");
    Inodes inodes{{"replaced", inode(dir / "replaced")}};
    for (const char* name : {"gone", "gone2", "gone3"}) {
        writeText(dir / name, std::string(name) + "\n");
        inodes[name] = inode(dir / name);
    }
    fs::create_directory(dir / "emptydir");
    return inodes;
}

// The record of "fault_probe record" in `dir`, read after the run; `time`
// is what files the probe changed show.
Lines expectedRecord(const fs::path& dir, const Inodes& before, const std::string& time) {
    const std::string d = escaped(dir.string());
    const std::string a = inode(dir / "moved2.dat");
    const std::string odd = inode(dir / "odd %name\n");
    const std::string log = inode(dir / "log");
    const std::string old = inode(dir / "old");
    const std::string copy = inode(dir / "copy.dat");
    const std::string copy2 = inode(dir / "replaced");
    const std::string made = inode(dir / "made.dat");
    const std::string oddName = d + "/odd%20%25name%0A";
    return {
        "mkdir " + d + "/sub",
        "create " + d + "/sub/a.dat " + a + " " + time,
        "write " + d + "/sub/a.dat " + a + " 0 68656c6c6f " + time,
        "write " + d + "/sub/a.dat " + a + " 5 61626364 " + time,
        "write " + d + "/sub/a.dat " + a + " 1 5a " + time,
        "write " + d + "/sub/a.dat " + a + " 20 5859 " + time,
        "fsync " + d + "/sub/a.dat " + a,
        "truncate " + d + "/sub/a.dat " + a + " 3 " + time,
        "fsync " + d + " " + inode(dir),
        "truncate " + d + "/old " + old + " 0 " + time,
        "create " + oddName + " " + odd + " " + time,
        "write " + oddName + " " + odd + " 0 6f6e65 " + time,
        "write " + oddName + " " + odd + " 3 74776f " + time,
        "write " + oddName + " " + odd + " 6 33 " + time,
        "write " + d + "/log " + log + " 4 6d6f7265 " + time,
        "truncate " + d + "/log " + log + " 2 " + time,
        "chmod " + d + "/log " + log,
        "chmod " + d + "/log " + log,
        "chmod " + d + "/log " + log,
        "utimens " + d + "/log " + log + " 1000000000.000000005",
        "utimens " + d + "/log " + log + " 1500000000.123456789",
        "create " + d + "/copy.dat " + copy + " " + time,
        "write " + d + "/copy.dat " + copy + " 0 736f75726365 " + time,
        "write " + d + "/copy.dat " + copy + " 100 64617461 " + time,
        "create " + d + "/copy2.dat " + copy2 + " " + time,
        "write " + d + "/copy2.dat " + copy2 + " 0 7572636520 " + time,
        "write " + d + "/copy2.dat " + copy2 + " 5 2064617461 " + time,
        "rename " + d + "/sub/a.dat " + d + "/moved.dat " + a + " 0",
        "rename " + d + "/copy2.dat " + d + "/replaced " + copy2 + " " + before.at("replaced"),
        "rename " + d + "/moved.dat " + d + "/moved2.dat " + a + " 0",
        "unlink " + d + "/gone " + before.at("gone"),
        "mkdir " + d + "/sub2",
        "rmdir " + d + "/sub2",
        "unlink " + d + "/gone2 " + before.at("gone2"),
        "rmdir " + d + "/sub",
        "rmdir " + d + "/emptydir",
        "unlink " + d + "/gone3 " + before.at("gone3"),
        "create " + d + "/made.dat " + made + " " + time,
        "truncate " + d + "/made.dat " + made + " 0 " + time,
        "create " + d + "/stream.txt " + inode(dir / "stream.txt") + " " + time,
        "truncate " + d + "/old " + old + " 0 " + time,
        "syncfs",
    };
}

// The record of "fault_probe script" (see fault_injection_test.cpp), whose
// files are named absolutely.
Lines expectedScriptRecord(const fs::path& dir, const Inodes& before, const std::string& time) {
    const std::string d = escaped(dir.string());
    const std::string target = inode(dir / "renamed.dat");
    return {
        "mkdir " + d + "/made",
        "create " + d + "/target.dat " + target + " " + time,
        "write " + d + "/target.dat " + target + " 0 68656c6c6f20776f726c64 " + time,
        "write " + d + "/target.dat " + target + " 1 5859 " + time,
        "truncate " + d + "/target.dat " + target + " 5 " + time,
        "fsync " + d + "/target.dat " + target,
        "syncfs",
        "utimens " + d + "/target.dat " + target + " 1000000000.000000000",
        "rename " + d + "/target.dat " + d + "/renamed.dat " + target + " 0",
        "unlink " + d + "/victim " + before.at("victim"),
        "create " + d + "/stream.txt " + inode(dir / "stream.txt") + " " + time,
        "unlink " + d + "/victim2 " + before.at("victim2"),
    };
}

Inodes prepareScriptDir(const fs::path& dir) {
    fs::create_directories(dir);
    writeText(dir / "victim", "victim\n");
    writeText(dir / "victim2", "victim2\n");
    return {{"victim", inode(dir / "victim")}, {"victim2", inode(dir / "victim2")}};
}

class FaultRecording : public ::testing::TestWithParam<const char*> {
protected:
    void SetUp() override {
        if (!testing_support::programEmulator().empty()) {
            GTEST_SKIP() << "native builds only: under qemu-aarch64 the host's loader sees LD_PRELOAD too and "
                            "reports the ARM64 shim on standard error, in the probe and in what it starts";
        }
    }

    ProcessResult runProbe(const char* mode, const fs::path& dir, const Environment& env) const {
        return runProgram({GetParam(), mode, dir.string()}, env);
    }

    // Outside the probe's directory, so that the probe never sees it.
    std::string recordFile() const { return (records_ / "record").string(); }
    std::string countFile() const { return (records_ / "count").string(); }
    Lines record() const { return splitLines(readText(recordFile())); }

    ScratchDir dir_;
    ScratchDir records_;
};

TEST_P(FaultRecording, RecordsEveryKindOfCallWithTheFakeClock) {
    const Inodes before = prepareRecordDir(dir_.path());
    const ProcessResult result = runProbe("record", dir_.path(), recordEnv(recordFile(), "", kFakeTime));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, kRecordProbeOutput);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(record(), expectedRecord(dir_.path(), before, kFakeStamp));

    const struct stat written = statOf(dir_ / "moved2.dat");
    EXPECT_EQ(stamp(written.st_mtim), kFakeStamp);
    EXPECT_EQ(stamp(written.st_atim), kFakeStamp);
    EXPECT_EQ(stamp(statOf(dir_ / "log").st_mtim), "1500000000.123456789") << "the program's own time is kept";
    EXPECT_EQ(testing_support::readText(dir_ / "odd %name\n"), "onetwo3");
}

TEST_P(FaultRecording, RecordsTheRealTimesWithoutTheFakeClock) {
    prepareRecordDir(dir_.path());
    const ProcessResult result = runProbe("record", dir_.path(), recordEnv(recordFile()));
    ASSERT_EQ(result.out, kRecordProbeOutput);
    // The last time recorded for each file is the time it was left with.
    std::map<std::string, std::string> lastTime;
    for (const std::string& line : record()) {
        const Lines fields = splitFields(line);
        const std::string& kind = fields[0];
        if (kind == "create" || kind == "truncate" || kind == "write" || kind == "utimens") {
            lastTime[fields[2]] = fields.back();
        }
    }
    size_t compared = 0;
    for (const auto& entry : fs::directory_iterator(dir_.path())) {
        const struct stat status = statOf(entry.path());
        const auto found = lastTime.find(std::to_string(status.st_ino));
        if (found == lastTime.end()) continue;
        EXPECT_EQ(found->second, stamp(status.st_mtim)) << entry.path();
        ++compared;
    }
    // moved2.dat, odd name, log, old, copy.dat, replaced, made.dat, stream.txt
    EXPECT_EQ(compared, 8u);
}

TEST_P(FaultRecording, FakeClockWorksWithoutARecord) {
    prepareRecordDir(dir_.path());
    const ProcessResult result = runProbe("record", dir_.path(), recordEnv("", "", kFakeTime));
    EXPECT_EQ(result.out, kRecordProbeOutput);
    EXPECT_EQ(stamp(statOf(dir_ / "moved2.dat").st_mtim), kFakeStamp);
    EXPECT_EQ(stamp(statOf(dir_ / "replaced").st_mtim), kFakeStamp);
    EXPECT_EQ(stamp(statOf(dir_ / "log").st_mtim), "1500000000.123456789");
    EXPECT_FALSE(fs::exists(recordFile()));
}

TEST_P(FaultRecording, NegativeFakeTime) {
    const Inodes before = prepareScriptDir(dir_.path());
    const ProcessResult result = runProbe("script", dir_.path(), recordEnv(recordFile(), "", -5));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(record(), expectedScriptRecord(dir_.path(), before, "-5.000000000"));
}

TEST_P(FaultRecording, PathFilterKeepsMatchingCallsAndEverySyncfs) {
    // Texts that a scratch directory's random name cannot hold.
    for (const std::string filter : {"odd %name", ".dat", "no-such-name"}) {
        ScratchDir dir;
        const Inodes before = prepareRecordDir(dir.path());
        const ProcessResult result = runProbe("record", dir.path(), recordEnv(recordFile(), filter, kFakeTime));
        EXPECT_EQ(result.out, kRecordProbeOutput) << filter;
        Lines expected;
        for (const std::string& line : expectedRecord(dir.path(), before, kFakeStamp)) {
            if (line == "syncfs" || line.find(escaped(filter)) != std::string::npos) expected.push_back(line);
        }
        EXPECT_EQ(record(), expected) << filter;
        fs::remove(recordFile());
    }
}

// The script makes one recorded call per mutating call, so a call the shim
// crashes on ends the record and one it fails is the line missing from it.
TEST_P(FaultRecording, CallsTheShimFailsOrCrashesOnAreNotRecorded) {
    const Inodes before = prepareScriptDir(dir_.path());
    ASSERT_EQ(runProbe("script", dir_.path(), recordEnv(recordFile(), "", kFakeTime)).exitStatus, 0);
    const Lines full = record();
    ASSERT_EQ(full, expectedScriptRecord(dir_.path(), before, kFakeStamp));

    for (size_t nth = 1; nth <= full.size(); ++nth) {
        for (const std::string action : {"errno:EIO", "crash"}) {
            const bool crash = action == "crash";
            fs::remove_all(dir_.path());
            prepareScriptDir(dir_.path());
            fs::remove(recordFile());
            const Environment env =
                recordEnv(recordFile(), "", kFakeTime, faultEnv("mutating", nth, action, "", countFile()));
            const ProcessResult result = runProbe("script", dir_.path(), env);
            EXPECT_EQ(result.signal, crash ? SIGKILL : 0) << nth << action;
            EXPECT_EQ(readFaultCount(countFile()), crash ? nth : full.size()) << nth << action;
            // A failed create leaves no target.dat for the calls after it.
            const auto onTarget = [](const std::string& line) {
                return line.find("/target.dat ") != std::string::npos;
            };
            const bool createFailed = !crash && full[nth - 1].rfind("create ", 0) == 0 && onTarget(full[nth - 1]);
            Lines expected;
            for (size_t i = 0; i < full.size() && !(crash && i + 1 == nth); ++i) {
                if (i + 1 != nth && !(createFailed && onTarget(full[i]))) expected.push_back(full[i]);
            }
            EXPECT_EQ(withoutInodes(record()), withoutInodes(expected)) << "call " << nth << " " << action;
        }
    }
}

TEST_P(FaultRecording, ShortWriteRecordsTheBytesWritten) {
    const Inodes before = prepareScriptDir(dir_.path());
    const Environment env = recordEnv(recordFile(), "", kFakeTime, faultEnv("write", 1, "short:4"));
    const ProcessResult result = runProbe("script", dir_.path(), env);
    EXPECT_EQ(result.exitStatus, 0);
    Lines expected = expectedScriptRecord(dir_.path(), before, kFakeStamp);
    const std::string target = inode(dir_ / "renamed.dat");
    expected[2] = "write " + escaped((dir_ / "target.dat").string()) + " " + target + " 0 68656c6c " + kFakeStamp;
    EXPECT_EQ(record(), expected);
}

TEST_P(FaultRecording, CountsAndRecordsTogether) {
    const Inodes before = prepareScriptDir(dir_.path());
    const Environment env = recordEnv(recordFile(), "", std::nullopt, faultCountEnv("mutating", countFile()));
    EXPECT_EQ(runProbe("script", dir_.path(), env).exitStatus, 0);
    EXPECT_EQ(readFaultCount(countFile()), 12u);
    const Lines lines = record();
    ASSERT_EQ(lines.size(), 12u);
    EXPECT_EQ(lines[0], "mkdir " + escaped((dir_ / "made").string()));
    EXPECT_EQ(lines[9], "unlink " + escaped((dir_ / "victim").string()) + " " + before.at("victim"));
}

TEST_P(FaultRecording, ProgramsStartedByTheProcessAreNotRecorded) {
    prepareScriptDir(dir_ / "child");
    const ProcessResult result = runProbe("spawn", dir_.path(), recordEnv(recordFile(), "", kFakeTime));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_TRUE(fs::exists(dir_ / "child" / "renamed.dat"));
    EXPECT_EQ(record(), Lines{"mkdir " + escaped((dir_ / "parent-made").string())});
    EXPECT_NE(stamp(statOf(dir_ / "child" / "stream.txt").st_mtim), kFakeStamp);
}

TEST_P(FaultRecording, BadSettingsEndTheProcessAtLoad) {
    struct Row {
        Environment settings;
        std::string message;
    };
    const std::vector<Row> rows = {
        {{{"FAULT_RECORD", "relative/record"}},
         "fault_injection: FAULT_RECORD=\"relative/record\": not an absolute path\n"},
        {{{"FAULT_RECORD", "/nonexistent-dir/record"}},
         "fault_injection: FAULT_RECORD=\"/nonexistent-dir/record\": cannot be written\n"},
        {{{"FAULT_MTIME", "12x"}}, "fault_injection: FAULT_MTIME=\"12x\": expected whole seconds\n"},
        {{{"FAULT_MTIME", "--5"}}, "fault_injection: FAULT_MTIME=\"--5\": expected whole seconds\n"},
        {{{"FAULT_MTIME", "-"}}, "fault_injection: FAULT_MTIME=\"-\": expected whole seconds\n"},
        {{{"FAULT_PATH_SUBSTR", "x"}}, "fault_injection: FAULT_CALL: missing, but other FAULT_ variables are set\n"},
        {{{"FAULT_RECORD", "/tmp/record"}, {"FAULT_NTH", "1"}},
         "fault_injection: FAULT_CALL: missing, but other FAULT_ variables are set\n"},
    };
    prepareScriptDir(dir_.path());
    for (const Row& row : rows) {
        Environment env = preloadEnv();
        env.insert(row.settings.begin(), row.settings.end());
        const ProcessResult result = runProbe("script", dir_.path(), env);
        EXPECT_EQ(result.exitStatus, 98) << row.message;
        EXPECT_EQ(result.out, "") << row.message;
        EXPECT_EQ(result.err, row.message);
    }
    EXPECT_FALSE(fs::exists(dir_ / "made"));
}

TEST(FaultRecordEnv, SharesTheFaultsPathFilter) {
    const Environment env = recordEnv("/r", "store", 7, faultEnv("rename", 2, "crash", "store"));
    EXPECT_EQ(env.at("FAULT_RECORD"), "/r");
    EXPECT_EQ(env.at("FAULT_MTIME"), "7");
    EXPECT_EQ(env.at("FAULT_PATH_SUBSTR"), "store");
    EXPECT_EQ(env.at("FAULT_CALL"), "rename");
    EXPECT_EQ(env.at("LD_PRELOAD"), testing_support::faultInjectionLibrary());
    EXPECT_THROW(recordEnv("/r", "other", 7, faultEnv("rename", 2, "crash", "store")), std::invalid_argument);
    EXPECT_EQ(recordEnv("/r").count("FAULT_MTIME"), 0u);
    EXPECT_EQ(recordEnv("/r").count("FAULT_PATH_SUBSTR"), 0u);
}

INSTANTIATE_TEST_SUITE_P(Probes, FaultRecording, ::testing::Values(FAULT_PROBE, FAULT_PROBE_INSTRUMENTED),
                         [](const ::testing::TestParamInfo<const char*>& info) {
                             return info.index == 0 ? std::string("Plain") : std::string("Instrumented");
                         });

}  // namespace
