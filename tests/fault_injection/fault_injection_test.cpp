#include "fault_injection.h"

#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "child_process.h"
#include "fault_injection_test_names.h"
#include "files.h"
#include "lib/util/fd.h"
#include "scratch_dir.h"

namespace {

using namespace fault_injection_test;

// The steps of "fault_probe script", in order, each making one counted call.
struct ScriptStep {
    const char* name;
    const char* result;  // printed on success
    bool mutating;
};

const std::vector<ScriptStep> kScript = {
    {"mkdir", "0", true},     {"create", "0", true}, {"write", "11", true},     {"pwrite", "2", true},
    {"ftruncate", "0", true}, {"fsync", "0", true},  {"open-read", "0", false}, {"syncfs", "0", true},
    {"utimensat", "0", true}, {"rename", "0", true}, {"unlink", "0", true},     {"fopen", "0", true},
    {"remove", "0", true},
};

// Lines of the first `end` steps, with step `changed` printing `result`.
std::string scriptOutput(size_t end = kScript.size(), const std::string& changed = "", const std::string& result = "") {
    std::string out;
    for (size_t i = 0; i < end; ++i) {
        out += kScript[i].name;
        out += ' ';
        out += kScript[i].name == changed ? result : kScript[i].result;
        out += '\n';
    }
    return out;
}

// Index of the step that makes the nth mutating call.
size_t stepOfMutatingCall(unsigned long nth) {
    unsigned long seen = 0;
    for (size_t i = 0; i < kScript.size(); ++i) {
        if (kScript[i].mutating && ++seen == nth) return i;
    }
    return kScript.size();
}

std::set<std::string> stepsBefore(size_t end) {
    std::set<std::string> steps;
    for (size_t i = 0; i < end; ++i) steps.insert(kScript[i].name);
    return steps;
}

std::set<std::string> allStepsExcept(const std::string& skipped) {
    std::set<std::string> steps = stepsBefore(kScript.size());
    steps.erase(skipped);
    return steps;
}

// Directory contents: file name to content, "<dir>" for directories, and
// for the data file whether its time was set by the utimensat step.
using Snapshot = std::map<std::string, std::string>;

const time_t kProbeTime = 1000000000;

Snapshot snapshot(const fs::path& dir) {
    Snapshot state;
    for (const auto& entry : fs::directory_iterator(dir)) {
        const std::string name = entry.path().filename().string();
        if (entry.is_directory()) {
            state[name] = "<dir>";
            continue;
        }
        state[name] = testing_support::readText(entry.path());
        if (name == "target.dat" || name == "renamed.dat") {
            struct stat status {};
            if (stat(entry.path().c_str(), &status) != 0) throw std::runtime_error("stat failed");
            state[name + " time"] = status.st_mtim.tv_sec == kProbeTime ? "set" : "unset";
        }
    }
    return state;
}

// What the script leaves behind after the given steps took effect.
Snapshot scriptState(const std::set<std::string>& done, size_t writeLength = 11) {
    Snapshot state{{"victim", "victim\n"}, {"victim2", "victim2\n"}};
    const auto performed = [&](const char* step) { return done.count(step) != 0; };
    if (performed("mkdir")) state["made"] = "<dir>";
    if (performed("create")) {
        std::string content;
        if (performed("write")) content = std::string("hello world").substr(0, writeLength);
        if (performed("pwrite")) {
            if (content.size() < 3) content.resize(3, '\0');
            content.replace(1, 2, "XY");
        }
        if (performed("ftruncate")) content.resize(5, '\0');
        const std::string name = performed("rename") ? "renamed.dat" : "target.dat";
        state[name] = content;
        state[name + " time"] = performed("utimensat") ? "set" : "unset";
    }
    if (performed("unlink")) state.erase("victim");
    if (performed("fopen")) state["stream.txt"] = "stream\n";
    if (performed("remove")) state.erase("victim2");
    return state;
}

void prepareScriptDir(const fs::path& dir) {
    fs::create_directories(dir);
    writeText(dir / "victim", "victim\n");
    writeText(dir / "victim2", "victim2\n");
}

// The steps of "fault_probe library"; owner of each mutating call in turn.
const std::vector<std::string> kLibrarySteps = {"create_directory", "copy_file", "last_write_time", "resize_file",
                                                "rename",           "remove",    "remove_all"};
const std::vector<std::string> kLibraryMutatingCallOwners = {"create_directory", "copy_file",       "copy_file",
                                                             "copy_file",        "last_write_time", "resize_file",
                                                             "rename",           "remove",          "remove_all"};

std::string libraryOutput(const std::string& failing = "", int error = 0) {
    std::string out;
    for (const std::string& step : kLibrarySteps) {
        if (step == failing) return out + step + " failed " + std::to_string(error) + "\n";
        out += step + " 0\n";
    }
    return out;
}

class FaultInjection : public ::testing::TestWithParam<const char*> {
protected:
    void SetUp() override {
        if (!testing_support::programEmulator().empty()) {
            GTEST_SKIP() << "native builds only: under qemu-aarch64 the host's loader sees LD_PRELOAD too and "
                            "reports the ARM64 shim on standard error, in the probe and in what it starts";
        }
        prepareScriptDir(dir_.path());
    }

    ProcessResult runScript(const fs::path& dir, const Environment& env) {
        return runProgram({GetParam(), "script", dir.string()}, env);
    }
    ProcessResult runScript(const Environment& env) { return runScript(dir_.path(), env); }

    // Outside the probe's directory, so that snapshots do not see it.
    std::string countFile() const { return (counts_ / "count").string(); }
    unsigned long count() const { return readFaultCount(countFile()); }

    ScratchDir dir_;
    ScratchDir counts_;
};

TEST_P(FaultInjection, ScriptRunsCleanWithoutTheShim) {
    const ProcessResult result = runScript({});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, scriptOutput());
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(snapshot(dir_.path()), scriptState(stepsBefore(kScript.size())));
}

TEST_P(FaultInjection, ShimWithoutSettingsOnlyForwards) {
    const ProcessResult result = runScript(preloadEnv());
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, scriptOutput());
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(snapshot(dir_.path()), scriptState(stepsBefore(kScript.size())));
}

struct FaultRow {
    const char* call;
    unsigned long nth;
    const char* action;
    const char* pathSubstr;
    const char* step;     // the step that sees the fault; "" for none
    const char* result;   // what that step prints
    unsigned long count;  // matching calls in the whole run
};

TEST_P(FaultInjection, ActsOnExactlyTheNthMatchingCall) {
    const std::vector<FaultRow> rows = {
        {"mkdir", 1, "errno:EROFS", "", "mkdir", "failed 30", 1},
        {"open", 2, "errno:EACCES", "", "open-read", "failed 13", 3},
        {"open", 3, "errno:ENOSPC", "", "fopen", "failed 28", 3},
        {"fopen", 1, "errno:EMFILE", "", "fopen", "failed 24", 1},
        {"write", 1, "errno:EIO", "", "write", "failed 5", 1},
        {"write", 1, "short:4", "", "write", "4", 1},
        {"pwrite", 1, "errno:ENOSPC", "", "pwrite", "failed 28", 1},
        {"truncate", 1, "errno:EPERM", "", "ftruncate", "failed 1", 1},
        {"ftruncate", 1, "errno:EFBIG", "", "ftruncate", "failed 27", 1},
        {"sync", 1, "errno:EIO", "", "fsync", "failed 5", 2},
        {"sync", 2, "errno:EIO", "", "syncfs", "failed 5", 2},
        {"syncfs", 1, "errno:EROFS", "", "syncfs", "failed 30", 1},
        {"fdatasync", 1, "errno:EIO", "", "", "", 0},
        {"utimens", 1, "errno:EPERM", "", "utimensat", "failed 1", 1},
        {"rename", 1, "errno:EXDEV", "", "rename", "failed 18", 1},
        {"unlink", 1, "errno:ENOENT", "", "unlink", "failed 2", 2},
        {"unlink", 2, "errno:EACCES", "", "remove", "failed 13", 2},
        {"remove", 1, "errno:EINTR", "", "remove", "failed 4", 1},
        {"mutating", 7, "errno:EINTR", "", "syncfs", "failed 4", 12},
        {"mutating", 12, "errno:28", "", "remove", "failed 28", 12},
        {"mutating", 13, "errno:EIO", "", "", "", 12},
        {"unlink", 1, "errno:EACCES", "victim2", "remove", "failed 13", 1},
        {"mutating", 1, "errno:EIO", "renamed.dat", "rename", "failed 5", 1},
        {"sync", 1, "errno:EIO", "target.dat", "fsync", "failed 5", 1},
        {"sync", 2, "errno:EIO", "target.dat", "", "", 1},
        {"write", 1, "errno:EIO", "no-such-name", "", "", 0},
    };
    for (const FaultRow& row : rows) {
        const std::string label =
            std::string(row.call) + " #" + std::to_string(row.nth) + " " + row.action + " [" + row.pathSubstr + "]";
        ScratchDir dir;
        prepareScriptDir(dir.path());
        const ProcessResult result =
            runScript(dir.path(), faultEnv(row.call, row.nth, row.action, row.pathSubstr, countFile()));
        EXPECT_EQ(result.exitStatus, 0) << label;
        EXPECT_EQ(result.out, scriptOutput(kScript.size(), row.step, row.result)) << label;
        EXPECT_EQ(result.err, "") << label;
        EXPECT_EQ(count(), row.count) << label;
        const bool shortened = std::string(row.action).rfind("short:", 0) == 0;
        const Snapshot expected =
            shortened ? scriptState(allStepsExcept(""), 4) : scriptState(allStepsExcept(row.step));
        EXPECT_EQ(snapshot(dir.path()), expected) << label;
    }
}

// "N+": the unlink and the remove of the script both fail from the first on;
// from the second on only the remove.
TEST_P(FaultInjection, ActsOnEveryCallFromTheNthOn) {
    for (const unsigned long nth : {1ul, 2ul}) {
        ScratchDir dir;
        prepareScriptDir(dir.path());
        const ProcessResult result =
            runScript(dir.path(), testing_support::faultFromEnv("unlink", nth, "errno:EACCES", "", countFile()));
        EXPECT_EQ(result.exitStatus, 0) << nth;
        std::string expected = scriptOutput(kScript.size(), "remove", "failed 13");
        if (nth == 1) {
            const std::string ok = "\nunlink 0\n";
            const size_t at = expected.find(ok);
            ASSERT_NE(at, std::string::npos);
            expected.replace(at, ok.size(), "\nunlink failed 13\n");
        }
        EXPECT_EQ(result.out, expected) << nth;
        EXPECT_EQ(count(), 2u) << nth;
    }
}

TEST_P(FaultInjection, CountsWithoutActing) {
    const std::vector<std::pair<const char*, unsigned long>> rows = {
        {"mutating", 12}, {"open", 3},    {"openat", 0}, {"write", 1},  {"pwrite", 1}, {"truncate", 1},
        {"sync", 2},      {"utimens", 1}, {"rename", 1}, {"unlink", 2}, {"mkdir", 1},  {"copy", 0},
    };
    for (const auto& [call, expected] : rows) {
        ScratchDir dir;
        prepareScriptDir(dir.path());
        const ProcessResult result = runScript(dir.path(), faultCountEnv(call, countFile()));
        EXPECT_EQ(result.exitStatus, 0) << call;
        EXPECT_EQ(result.out, scriptOutput()) << call;
        EXPECT_EQ(count(), expected) << call;
    }
}

TEST_P(FaultInjection, CrashAtEachMutatingCallLeavesOnlyTheEarlierEffects) {
    const ProcessResult clean = runScript(faultCountEnv("mutating", countFile()));
    ASSERT_EQ(clean.out, scriptOutput());
    const unsigned long total = count();
    ASSERT_EQ(total, 12u);

    for (unsigned long nth = 1; nth <= total; ++nth) {
        ScratchDir dir;
        prepareScriptDir(dir.path());
        const size_t crashStep = stepOfMutatingCall(nth);
        const ProcessResult result = runScript(dir.path(), faultEnv("mutating", nth, "crash", "", countFile()));
        EXPECT_EQ(result.signal, SIGKILL) << "call " << nth;
        EXPECT_EQ(result.exitStatus, -1) << "call " << nth;
        EXPECT_EQ(result.out, scriptOutput(crashStep)) << "call " << nth;
        EXPECT_EQ(result.err, "") << "call " << nth;
        EXPECT_EQ(count(), nth) << "call " << nth;
        EXPECT_EQ(snapshot(dir.path()), scriptState(stepsBefore(crashStep))) << "call " << nth;
    }
}

TEST_P(FaultInjection, CrashAtTheNthCallOfOneFamily) {
    const ProcessResult result = runScript(faultEnv("unlink", 2, "crash", "", countFile()));
    const size_t removeStep = kScript.size() - 1;
    EXPECT_EQ(result.signal, SIGKILL);
    EXPECT_EQ(result.out, scriptOutput(removeStep));
    EXPECT_EQ(count(), 2u);
    EXPECT_EQ(snapshot(dir_.path()), scriptState(stepsBefore(removeStep)));
}

TEST_P(FaultInjection, ProgramsStartedByTheProcessRunUnaffected) {
    prepareScriptDir(dir_ / "child");
    const ProcessResult result =
        runProgram({GetParam(), "spawn", dir_.path().string()}, faultEnv("mkdir", 1, "errno:EROFS", "", countFile()));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, scriptOutput() + "child exit 0\nmkdir failed 30\n");
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(count(), 1u);
    EXPECT_EQ(snapshot(dir_ / "child"), scriptState(stepsBefore(kScript.size())));
    EXPECT_FALSE(fs::exists(dir_ / "parent-made"));
}

TEST_P(FaultInjection, BadSettingsEndTheProcessAtLoad) {
    struct Row {
        Environment settings;
        std::string message;
    };
    const std::vector<Row> rows = {
        {{{"FAULT_CALL", "bogus"}}, "fault_injection: FAULT_CALL=\"bogus\": names no call family or function\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_NTH", "0"}, {"FAULT_ACTION", "crash"}},
         "fault_injection: FAULT_NTH=\"0\": expected a number from 1, or one followed by +\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_NTH", "2x"}, {"FAULT_ACTION", "crash"}},
         "fault_injection: FAULT_NTH=\"2x\": expected a number from 1, or one followed by +\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_NTH", "+"}, {"FAULT_ACTION", "crash"}},
         "fault_injection: FAULT_NTH=\"+\": expected a number from 1, or one followed by +\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_NTH", "1"}, {"FAULT_ACTION", "errno:EWHAT"}},
         "fault_injection: FAULT_ACTION=\"errno:EWHAT\": unknown errno\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_NTH", "1"}, {"FAULT_ACTION", "explode"}},
         "fault_injection: FAULT_ACTION=\"explode\": expected errno:NAME, errno:NUMBER, crash, short:BYTES or stop\n"},
        {{{"FAULT_WRITE_ERRORS", "on"}}, "fault_injection: FAULT_WRITE_ERRORS=\"on\": expected ignore\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_NTH", "1"}},
         "fault_injection: FAULT_ACTION: missing, but FAULT_NTH is set\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_ACTION", "crash"}},
         "fault_injection: FAULT_NTH: missing, but FAULT_ACTION is set\n"},
        {{{"FAULT_NTH", "1"}, {"FAULT_ACTION", "crash"}},
         "fault_injection: FAULT_CALL: missing, but other FAULT_ variables are set\n"},
        {{{"FAULT_CALL", "rename"}, {"FAULT_COUNT_FILE", "/nonexistent-dir/count"}},
         "fault_injection: FAULT_COUNT_FILE=\"/nonexistent-dir/count\": cannot be written\n"},
    };
    for (const Row& row : rows) {
        Environment env = preloadEnv();
        env.insert(row.settings.begin(), row.settings.end());
        const ProcessResult result = runScript(env);
        EXPECT_EQ(result.exitStatus, 98) << row.message;
        EXPECT_EQ(result.out, "") << row.message;
        EXPECT_EQ(result.err, row.message);
    }
    EXPECT_EQ(snapshot(dir_.path()), scriptState({}));
}

// The std::filesystem calls behind the store's directory, copy, time and
// removal helpers reach the shim.
TEST_P(FaultInjection, LibraryCallsAreCountedByFamily) {
    const std::vector<std::pair<const char*, unsigned long>> rows = {
        {"mkdir", 1},  {"open", 3},   {"chmod", 1}, {"copy", 1}, {"utimens", 1},  {"truncate", 1},
        {"rename", 1}, {"unlink", 2}, {"write", 0}, {"sync", 0}, {"mutating", 9},
    };
    for (const auto& [call, expected] : rows) {
        ScratchDir dir;
        writeText(dir / "source", "source\n");
        const ProcessResult result =
            runProgram({GetParam(), "library", dir.path().string()}, faultCountEnv(call, countFile()));
        EXPECT_EQ(result.exitStatus, 0) << call;
        EXPECT_EQ(result.out, libraryOutput()) << call;
        EXPECT_EQ(count(), expected) << call;
        EXPECT_EQ(snapshot(dir.path()), (Snapshot{{"source", "source\n"}})) << call;
    }
}

// Reads are no mutating calls; a card that cannot read one file fails
// only that file's reads.
TEST_P(FaultInjection, ReadsFailOnlyWhenTheirFamilyIsNamed) {
    struct Row {
        const char* call;
        const char* pathSubstr;
        unsigned long counted;
        const char* out;
    };
    const Row rows[] = {
        {"read", "", 2, "read 7\npread failed 5\n"},
        {"read", "source", 2, "read 7\npread failed 5\n"},
        {"read", "elsewhere", 0, "read 7\npread 6\n"},
        {"mutating", "", 0, "read 7\npread 6\n"},
    };
    for (const Row& row : rows) {
        ScratchDir dir;
        writeText(dir / "source", "source\n");
        const ProcessResult result = runProgram({GetParam(), "read", dir.path().string()},
                                                faultEnv(row.call, 2, "errno:EIO", row.pathSubstr, countFile()));
        EXPECT_EQ(result.exitStatus, 0) << row.call << " " << row.pathSubstr;
        EXPECT_EQ(result.out, row.out) << row.call << " " << row.pathSubstr;
        EXPECT_EQ(count(), row.counted) << row.call << " " << row.pathSubstr;
    }
}

TEST_P(FaultInjection, LibraryReportsEachFailedMutatingCall) {
    for (size_t i = 0; i < kLibraryMutatingCallOwners.size(); ++i) {
        const std::string& owner = kLibraryMutatingCallOwners[i];
        ScratchDir dir;
        writeText(dir / "source", "source\n");
        const ProcessResult result = runProgram({GetParam(), "library", dir.path().string()},
                                                faultEnv("mutating", i + 1, "errno:EIO", "", countFile()));
        EXPECT_EQ(result.exitStatus, 0) << "call " << i + 1;
        const std::string expected = libraryOutput(owner, 5);
        EXPECT_EQ(result.out.substr(0, expected.size()), expected) << "call " << i + 1;
    }
}

// gcov's count files, which a coverage build opens at exit, are passed
// through: never failed, counted or recorded.
TEST_P(FaultInjection, CoverageCountFilesAreNeverFailedCountedOrRecorded) {
    for (const char* call : {"mutating", "open", "rename", "unlink"}) {
        ScratchDir dir;
        const fs::path record = counts_ / "record";
        const ProcessResult result =
            runProgram({GetParam(), "gcda", dir.path().string()},
                       testing_support::recordEnv(record.string(), "", std::nullopt,
                                                  faultEnv(call, 1, "errno:EIO", "", countFile())));
        EXPECT_EQ(result.exitStatus, 0) << call;
        EXPECT_EQ(result.out, "create 0\nfopen 0\nrename 0\nunlink 0\n") << call;
        EXPECT_EQ(result.err, "") << call;
        EXPECT_EQ(count(), 0u) << call;
        EXPECT_EQ(fs::exists(record) ? testing_support::readText(record) : "", "") << call;
        EXPECT_EQ(snapshot(dir.path()), Snapshot{}) << call;
    }
}

// FAULT_WRITE_ERRORS=ignore: a failed write or sync says it succeeded (a
// write as though every byte went), while the failure still took effect;
// other calls fail as before.
TEST_P(FaultInjection, IgnoredWriteErrorsReportSuccess) {
    const std::vector<FaultRow> rows = {
        {"write", 1, "errno:EIO", "", "write", "11", 1},
        {"pwrite", 1, "errno:ENOSPC", "", "pwrite", "2", 1},
        {"fsync", 1, "errno:EIO", "", "fsync", "0", 1},
        {"syncfs", 1, "errno:EROFS", "", "syncfs", "0", 1},
        {"rename", 1, "errno:EXDEV", "", "rename", "failed 18", 1},
    };
    for (const FaultRow& row : rows) {
        ScratchDir dir;
        prepareScriptDir(dir.path());
        Environment env = faultEnv(row.call, row.nth, row.action, "", countFile());
        env["FAULT_WRITE_ERRORS"] = "ignore";
        const ProcessResult result = runScript(dir.path(), env);
        EXPECT_EQ(result.exitStatus, 0) << row.call;
        EXPECT_EQ(result.out, scriptOutput(kScript.size(), row.step, row.result)) << row.call;
        EXPECT_EQ(result.err, "") << row.call;
        EXPECT_EQ(snapshot(dir.path()), scriptState(allStepsExcept(row.step))) << row.call;
    }
}

// FAULT_ACTION=stop: the process stops before the nth call, with only the
// earlier steps done, and makes the call once continued.
TEST_P(FaultInjection, StopsBeforeTheNthCallUntilContinued) {
    const fs::path out = counts_ / "out";
    const Environment env = faultEnv("mutating", 3, "stop", "", countFile());
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        for (const auto& [name, value] : env) setenv(name.c_str(), value.c_str(), 1);
        const int fd = open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        if (fd < 0 || dup2(fd, STDOUT_FILENO) < 0) _exit(97);
        execl(GetParam(), GetParam(), "script", dir_.path().c_str(), static_cast<char*>(nullptr));
        _exit(96);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, WUNTRACED), child);
    ASSERT_TRUE(WIFSTOPPED(status)) << status;
    EXPECT_EQ(WSTOPSIG(status), SIGSTOP);
    const size_t stopped = stepOfMutatingCall(3);
    EXPECT_EQ(testing_support::readText(out), scriptOutput(stopped));
    EXPECT_EQ(snapshot(dir_.path()), scriptState(stepsBefore(stopped)));
    EXPECT_EQ(count(), 3u);

    ASSERT_EQ(kill(child, SIGCONT), 0);
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status)) << status;
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(testing_support::readText(out), scriptOutput());
    EXPECT_EQ(snapshot(dir_.path()), scriptState(stepsBefore(kScript.size())));
}

INSTANTIATE_TEST_SUITE_P(Probes, FaultInjection, ::testing::Values(FAULT_PROBE, FAULT_PROBE_INSTRUMENTED),
                         [](const ::testing::TestParamInfo<const char*>& info) {
                             return info.index == 0 ? std::string("Plain") : std::string("Instrumented");
                         });

}  // namespace

// FAULT_LOCKS, tried on this test program itself started again under the
// shim: in that copy the test only takes locks and prints how it fared.
namespace {

constexpr char kLockProbeFile[] = "FAULT_LOCKS_PROBE_FILE";

std::string ownProgram() {
    std::string path(4096, '\0');
    const ssize_t length = readlink("/proc/self/exe", path.data(), path.size());
    if (length <= 0) throw std::runtime_error("readlink /proc/self/exe failed");
    path.resize(static_cast<size_t>(length));
    return path;
}

// Two exclusive locks without waiting, each through a description of its
// own: the process that started this one holds a lock on the file, and the
// first lock, when held, would keep the second out. The descriptors stay
// open so that nothing is dropped before the process ends.
void probeLocks(const char* path) {
    for (const char* name : {"flock", "second flock"}) {
        const int fd = open(path, O_RDONLY | O_CLOEXEC);
        if (fd < 0 || flock(fd, LOCK_EX | LOCK_NB) != 0) {
            std::printf("%s failed %d\n", name, errno);
        } else {
            std::printf("%s 0\n", name);
        }
    }
    std::fflush(stdout);
}

TEST(FaultLocks, OffGrantsEveryFlockWithoutHoldingIt) {
    if (const char* probed = std::getenv(kLockProbeFile)) {
        probeLocks(probed);
        return;
    }
    if (!testing_support::programEmulator().empty()) {
        GTEST_SKIP() << "native builds only: under qemu-aarch64 the host's loader sees LD_PRELOAD too and "
                        "reports the ARM64 shim on standard error";
    }

    const ScratchDir dir;
    const fs::path file = dir / "locked";
    writeText(file, "");
    const UniqueFd held(open(file.c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(held);
    ASSERT_EQ(flock(held.get(), LOCK_EX | LOCK_NB), 0);
    const auto probe = [&](Environment env) {
        env[kLockProbeFile] = file.string();
        return runProgram({ownProgram(), "--gtest_filter=FaultLocks.OffGrantsEveryFlockWithoutHoldingIt"}, env, 60);
    };

    const ProcessResult forwarded = probe(preloadEnv());
    EXPECT_EQ(forwarded.exitStatus, 0) << forwarded.out << forwarded.err;
    EXPECT_NE(forwarded.out.find("flock failed " + std::to_string(EWOULDBLOCK) + "\nsecond flock failed " +
                                 std::to_string(EWOULDBLOCK) + "\n"),
              std::string::npos)
        << forwarded.out;

    const ProcessResult off = probe(testing_support::locksOffEnv());
    EXPECT_EQ(off.exitStatus, 0) << off.out << off.err;
    EXPECT_NE(off.out.find("flock 0\nsecond flock 0\n"), std::string::npos) << off.out;

    // The variable's only value.
    Environment on = preloadEnv();
    on["FAULT_LOCKS"] = "on";
    const ProcessResult refused = probe(on);
    EXPECT_EQ(refused.exitStatus, 98);
    EXPECT_EQ(refused.err, "fault_injection: FAULT_LOCKS=\"on\": expected off\n");
}

}  // namespace
