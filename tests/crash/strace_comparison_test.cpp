// The shim's record checked against strace: the same real work (the built
// migrate_settings and dual_file_driver writing a store in a scratch
// directory) is run once recorded by the shim and once, on an identical
// copy of the starting directory, under strace; both must show the same
// changes below the directory, in the same order, with the same bytes.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <functional>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "fault_injection.h"
#include "files.h"
#include "fs_record.h"
#include "scratch_dir.h"
#include "strace_trace.h"

namespace {

namespace fs = std::filesystem;
using crash::FsOp;
using crash::FsOpKind;
using testing_support::Bytes;
using testing_support::ProcessResult;
using testing_support::runProgram;
using testing_support::ScratchDir;

using Command = std::function<std::vector<std::string>(const fs::path& root)>;

// Check files made to look older or newer than any commit of the run, so
// that whether the store moves a new check file's time is decided by the
// starting directory, never by how fast the run is.
const time_t kPast = 1000000000;    // 2001
const time_t kFuture = 4102444800;  // 2100

std::string straceProgram() {
    const char* path = std::getenv("PATH");
    std::istringstream directories(path != nullptr ? path : "");
    for (std::string directory; std::getline(directories, directory, ':');) {
        const std::string candidate = directory + "/strace";
        if (!directory.empty() && access(candidate.c_str(), X_OK) == 0) return candidate;
    }
    return "";
}

// Why strace cannot be used here, or "".
std::string straceProblem() {
    const std::string strace = straceProgram();
    if (strace.empty()) return "strace is not installed (scripts/install-deps.sh tests installs it)";
    const ProcessResult probe = runProgram({strace, "-qq", "-o", "/dev/null", "/bin/true"});
    if (probe.exitStatus != 0) return "strace cannot trace a program here (is ptrace permitted?): " + probe.err;
    return "";
}

void setModificationTime(const fs::path& path, const struct timespec& time) {
    const struct timespec times[2] = {time, time};
    if (utimensat(AT_FDCWD, path.c_str(), times, 0) != 0) throw std::runtime_error("utimensat " + path.string());
}

// A copy with the files' modification times, which the store compares.
void copyTree(const fs::path& from, const fs::path& to) {
    fs::copy(from, to, fs::copy_options::recursive);
    for (const auto& entry : fs::recursive_directory_iterator(from)) {
        if (!entry.is_regular_file()) continue;
        struct stat status {};
        if (stat(entry.path().c_str(), &status) != 0) throw std::runtime_error("stat " + entry.path().string());
        setModificationTime(to / entry.path().lexically_relative(from), status.st_mtim);
    }
}

std::set<std::string> entriesBelow(const fs::path& root) {
    std::set<std::string> entries;
    for (const auto& entry : fs::recursive_directory_iterator(root)) entries.insert(entry.path().string());
    return entries;
}

// Relative path to contents, "<dir>" for a directory.
std::map<std::string, std::string> snapshot(const fs::path& root) {
    std::map<std::string, std::string> state;
    for (const auto& entry : fs::recursive_directory_iterator(root)) {
        const std::string name = entry.path().lexically_relative(root).string();
        state[name] = entry.is_directory() ? "<dir>" : testing_support::readText(entry.path());
    }
    return state;
}

bool below(const std::string& path, const fs::path& root) { return path.rfind(root.string() + "/", 0) == 0; }

// The operations below `root` (and every syncfs), with paths relative to
// it and what strace cannot see (inodes, times of files the kernel
// stamped) left out; written bytes as their count and first bytes, since
// they are compared whole separately.
std::vector<std::string> comparable(const std::vector<FsOp>& ops, const fs::path& root,
                                    std::vector<const FsOp*>& kept) {
    std::vector<std::string> lines;
    for (const FsOp& op : ops) {
        if (op.kind != FsOpKind::kSyncfs && !below(op.path, root) && !below(op.toPath, root)) continue;
        kept.push_back(&op);
        const std::string path = fs::path(op.path).lexically_relative(root).string();
        switch (op.kind) {
            case FsOpKind::kCreate:
                lines.push_back("create " + path);
                break;
            case FsOpKind::kTruncate:
                lines.push_back("truncate " + path + " to " + std::to_string(op.size));
                break;
            case FsOpKind::kWrite: {
                const std::vector<uint8_t> head(op.data.begin(),
                                                op.data.begin() + std::min<size_t>(16, op.data.size()));
                lines.push_back("write " + path + " at " + std::to_string(op.offset) + ": " +
                                std::to_string(op.data.size()) + " bytes " + testing_support::hex(head) + "...");
                break;
            }
            case FsOpKind::kUnlink:
                lines.push_back("unlink " + path);
                break;
            case FsOpKind::kRmdir:
                lines.push_back("rmdir " + path);
                break;
            case FsOpKind::kMkdir:
                lines.push_back("mkdir " + path);
                break;
            case FsOpKind::kRename:
                lines.push_back("rename " + path + " to " + fs::path(op.toPath).lexically_relative(root).string());
                break;
            case FsOpKind::kUtimens:
                lines.push_back("utimens " + path + " " + std::to_string(op.mtime.tv_sec) + "s " +
                                std::to_string(op.mtime.tv_nsec) + "ns");
                break;
            case FsOpKind::kFsync:
                lines.push_back("fsync " + path);
                break;
            case FsOpKind::kSyncfs:
                lines.push_back("syncfs");
                break;
            case FsOpKind::kChmod:
                lines.push_back("chmod " + path);
                break;
        }
    }
    return lines;
}

std::string replaced(std::string text, const std::string& from, const std::string& to) {
    for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size()) {
        text.replace(at, from.size(), to);
    }
    return text;
}

class StraceComparison : public ::testing::Test {
protected:
    void SetUp() override {
        if (!testing_support::programEmulator().empty()) {
            GTEST_SKIP() << "native builds only: under qemu-aarch64 the shim cannot be preloaded into the "
                            "emulated programs";
        }
        const std::string problem = straceProblem();
        if (problem.empty()) return;
        const char* required = std::getenv("REQUIRE_SIMULATED_DEVICE");
        if (required != nullptr && std::string(required) == "1") {
            FAIL() << problem << " (REQUIRE_SIMULATED_DEVICE=1: this comparison must run)";
        }
        GTEST_SKIP() << problem;
    }

    static void run(const std::vector<std::string>& argv) {
        const ProcessResult result = runProgram(argv);
        ASSERT_EQ(result.exitStatus, 0) << argv[0] << ": " << result.out << result.err;
    }

    void makeSettings(const std::string& name, size_t length) const {
        run({MAKE_EXAMPLE_DATA_BIN, "settings", (start_ / name).string(), std::to_string(length)});
    }

    void setCheckTimes(time_t seconds) const {
        for (const auto& entry : fs::recursive_directory_iterator(start_.path())) {
            if (entry.path().extension() == ".chk") setModificationTime(entry.path(), {seconds, 0});
        }
    }

    // Runs `command` on two copies of the starting directory, recorded by
    // the shim and traced by strace, and compares what they did. Below
    // `stores` (relative to the copy) nothing may be reached in a way that
    // could follow a planted link.
    void expectSameOperations(const std::string& stores, const Command& command) const {
        ScratchDir shimSide;
        ScratchDir straceSide;
        ScratchDir outputs;
        // Canonical, as the kernel shows the descriptors' paths.
        const fs::path shimRoot = fs::canonical(shimSide.path()) / "root";
        const fs::path straceRoot = fs::canonical(straceSide.path()) / "root";
        copyTree(start_.path(), shimRoot);
        copyTree(start_.path(), straceRoot);
        const std::set<std::string> existing = entriesBelow(straceRoot);

        const fs::path record = outputs / "record";
        const ProcessResult recorded =
            runProgram(command(shimRoot), testing_support::recordEnv(record.string(), shimRoot.string() + "/"));

        const fs::path trace = outputs / "trace";
        std::vector<std::string> argv = {straceProgram()};
        argv.insert(argv.end(), crash::kStraceOptions.begin(), crash::kStraceOptions.end());
        const std::vector<std::string> traceTo = {"-e", std::string("trace=") + crash::kStraceCalls, "-o",
                                                  trace.string()};
        argv.insert(argv.end(), traceTo.begin(), traceTo.end());
        const std::vector<std::string> traced = command(straceRoot);
        argv.insert(argv.end(), traced.begin(), traced.end());
        // LeakSanitizer stops the process with ptrace, which strace holds.
        const char* inherited = std::getenv("ASAN_OPTIONS");
        const std::string asanOptions = inherited != nullptr && *inherited != '\0' ? inherited + std::string(":") : "";
        const ProcessResult straced = runProgram(argv, {{"ASAN_OPTIONS", asanOptions + "detect_leaks=0"}});

        EXPECT_EQ(recorded.exitStatus, 0) << recorded.out << recorded.err;
        EXPECT_EQ(straced.exitStatus, 0) << straced.out << straced.err;
        EXPECT_EQ(replaced(recorded.out, shimRoot.string(), "ROOT"),
                  replaced(straced.out, straceRoot.string(), "ROOT"));
        EXPECT_EQ(recorded.err, straced.err);
        EXPECT_EQ(snapshot(shimRoot), snapshot(straceRoot));

        const std::vector<FsOp> shimOps = crash::readFsRecord(record);
        const std::vector<FsOp> straceOps =
            crash::parseStraceTrace(testing_support::readText(trace), straceRoot.string(), existing);
        std::vector<const FsOp*> shimKept;
        std::vector<const FsOp*> straceKept;
        const std::vector<std::string> shimLines = comparable(shimOps, shimRoot, shimKept);
        const std::vector<std::string> straceLines = comparable(straceOps, straceRoot, straceKept);
        EXPECT_FALSE(shimLines.empty());
        EXPECT_EQ(crash::linkFollowingCalls(testing_support::readText(trace), (straceRoot / stores).string()),
                  std::vector<std::string>{});
        ASSERT_EQ(shimLines, straceLines);
        for (size_t i = 0; i < shimKept.size(); ++i) {
            EXPECT_TRUE(shimKept[i]->data == straceKept[i]->data) << "the bytes of " << shimLines[i] << " differ";
        }
    }

    ScratchDir start_;
};

std::vector<std::string> tool(const fs::path& root, std::vector<std::string> args) {
    args.insert(args.begin(), {MIGRATE_SETTINGS_BIN, "--base", (root / "base").string()});
    return args;
}

std::vector<std::string> driver(const fs::path& root, const std::vector<std::string>& steps) {
    std::vector<std::string> argv = {DUAL_FILE_DRIVER, (root / "store").string(), "1", "0"};
    for (const std::string& step : steps)
        argv.push_back(step.rfind("@", 0) == 0 ? (root / step.substr(1)).string() : step);
    return argv;
}

TEST_F(StraceComparison, CheckedMigrationIntoAnEmptyStore) {
    makeSettings("settings.bin", 4096);
    expectSameOperations("base", [](const fs::path& root) {
        return tool(root, {"--target", "settings", "--type", "checked", "--data", (root / "settings.bin").string()});
    });
}

// Both copies exist with check files from the future: the data file is
// truncated, its check file removed, and the new check file's time moved
// past the old one's.
TEST_F(StraceComparison, SimpleMigrationOverAStoreWithBothCopies) {
    makeSettings("first.bin", 2048);
    makeSettings("second.bin", 1000);
    makeSettings("third.bin", 3000);
    for (const char* data : {"first.bin", "second.bin"}) {
        run(tool(start_.path(), {"--target", "calib_save", "--type", "simple", "--data", (start_ / data).string()}));
    }
    setCheckTimes(kFuture);
    expectSameOperations("base", [](const fs::path& root) {
        return tool(root, {"--target", "calib_save", "--type", "simple", "--data", (root / "third.bin").string()});
    });
}

// Bytes that differ from offset to offset.
Bytes blob(size_t size, uint8_t seed) {
    Bytes bytes(size);
    for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<uint8_t>(i * 7 + seed + i / 251);
    return bytes;
}

class DriverComparison : public StraceComparison {
protected:
    // A slot whose two copies are both valid, copy 0 current. Copy 0 spans
    // two of the store's 64 KiB copy blocks, so that copying it writes at
    // a file position that has moved; the runs' own writes stay within the
    // string length strace shows.
    void SetUp() override {
        StraceComparison::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        testing_support::writeBytes(start_ / "a", blob(150000, 1));
        testing_support::writeBytes(start_ / "b", blob(70000, 2));
        testing_support::writeBytes(start_ / "c", blob(100, 3));
        testing_support::writeBytes(start_ / "d", blob(5, 4));
        run(driver(start_.path(), {"write", "@a"}));
        run(driver(start_.path(), {"write", "@b"}));
        setCheckTimes(kPast);
    }
};

TEST_F(DriverComparison, BegunWriteOfTwoBlocksThenFinalise) {
    expectSameOperations("store", [](const fs::path& root) {
        return driver(root, {"beginWrite", "writeAt", "0", "@c", "writeAt", "90000", "@d", "finalise"});
    });
}

TEST_F(DriverComparison, WriteAtOutsideABegunWriteCopiesTheBlobFirst) {
    expectSameOperations("store", [](const fs::path& root) { return driver(root, {"writeAt", "3", "@d"}); });
}

}  // namespace
