#include "child_process.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sstream>
#include <stdexcept>
#include <thread>

#include "files.h"
#include "scratch_dir.h"

#ifdef FLUSH_COVERAGE_BEFORE_EXIT
extern "C" void __gcov_dump();
#endif

namespace testing_support {
namespace {

// Where a child's standard output and error go, and what they held.
class CapturedOutput {
    ScratchDir dir_;  // first: the paths below are made from it

public:
    const std::string outPath = (dir_ / "stdout").string();
    const std::string errPath = (dir_ / "stderr").string();

    ProcessResult result(int status) const {
        ProcessResult result;
        if (WIFEXITED(status)) result.exitStatus = WEXITSTATUS(status);
        if (WIFSIGNALED(status)) result.signal = WTERMSIG(status);
        result.out = readText(outPath);
        result.err = readText(errPath);
        return result;
    }
};

ProcessResult runCaptured(const std::function<void()>& inChild) {
    const CapturedOutput output;
    std::fflush(stdout);
    std::fflush(stderr);
    const pid_t pid = fork();
    if (pid < 0) throw std::runtime_error("fork failed");
    if (pid == 0) {
        const int out = open(output.outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        const int err = open(output.errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        const int in = open("/dev/null", O_RDONLY | O_CLOEXEC);
        if (out < 0 || err < 0 || in < 0 || dup2(out, 1) < 0 || dup2(err, 2) < 0 || dup2(in, 0) < 0) _exit(126);
        inChild();
        _exit(127);
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {}
    return output.result(status);
}

}  // namespace

ProcessResult runInChild(const std::function<int()>& body) {
    return runCaptured([&] {
        const int code = body();
        std::fflush(stdout);
        std::fflush(stderr);
#ifdef FLUSH_COVERAGE_BEFORE_EXIT
        __gcov_dump();
#endif
        _exit(code);
    });
}

const std::vector<std::string>& programEmulator() {
    static const std::vector<std::string> words = [] {
        std::vector<std::string> result;
#ifdef PROGRAM_EMULATOR
        std::istringstream text(PROGRAM_EMULATOR);
        for (std::string word; text >> word;) result.push_back(word);
#endif
        return result;
    }();
    return words;
}

namespace {

// This process's environment with `extraEnv` laid over it.
std::vector<std::string> environmentWith(const std::map<std::string, std::string>& extraEnv) {
    std::vector<std::string> entries;
    for (char** entry = environ; *entry != nullptr; ++entry) {
        const std::string text = *entry;
        if (extraEnv.count(text.substr(0, text.find('='))) == 0) entries.push_back(text);
    }
    for (const auto& [name, value] : extraEnv) entries.push_back(name + "=" + value);
    return entries;
}

std::vector<char*> pointersTo(std::vector<std::string>& words) {
    std::vector<char*> pointers;
    for (std::string& word : words) pointers.push_back(word.data());
    pointers.push_back(nullptr);
    return pointers;
}

// Waits for `pid`; past the time limit (0: none) it is ended by SIGALRM.
int waitWithin(pid_t pid, unsigned timeLimitSeconds) {
    using Clock = std::chrono::steady_clock;
    const Clock::time_point deadline = Clock::now() + std::chrono::seconds(timeLimitSeconds);
    int status = 0;
    while (timeLimitSeconds != 0) {
        const pid_t ended = waitpid(pid, &status, WNOHANG);
        if (ended == pid) return status;
        if (ended < 0 && errno != EINTR) throw std::runtime_error("waitpid failed");
        if (Clock::now() >= deadline) {
            kill(pid, SIGALRM);
            break;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    while (waitpid(pid, &status, 0) < 0) {
        if (errno != EINTR) throw std::runtime_error("waitpid failed");
    }
    return status;
}

// posix_spawn, not fork: a fork copies the page tables of this process,
// which is large under the sanitizers and slow under an emulated CPU.
ProcessResult execute(std::vector<std::string> command, const std::map<std::string, std::string>& extraEnv,
                      unsigned timeLimitSeconds = 0) {
    const CapturedOutput output;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, output.outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    posix_spawn_file_actions_addopen(&actions, 2, output.errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    std::vector<std::string> environment = environmentWith(extraEnv);
    const std::vector<char*> args = pointersTo(command);
    const std::vector<char*> envp = pointersTo(environment);
    std::fflush(stdout);
    std::fflush(stderr);
    pid_t pid = 0;
    const int spawned = posix_spawn(&pid, args[0], &actions, nullptr, args.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    // As a shell reports a program it cannot start.
    if (spawned != 0) return ProcessResult{127, 0, "", std::string(std::strerror(spawned)) + "\n"};
    return output.result(waitWithin(pid, timeLimitSeconds));
}

}  // namespace

ProcessResult runProgram(const std::vector<std::string>& argv, const std::map<std::string, std::string>& extraEnv,
                         unsigned timeLimitSeconds) {
    std::vector<std::string> command = programEmulator();
    command.insert(command.end(), argv.begin(), argv.end());
    return execute(command, extraEnv, timeLimitSeconds);
}

// The host's own shell: never through the emulator.
ProcessResult runShell(const std::string& command) { return execute({"/bin/sh", "-c", command}, {}); }

}  // namespace testing_support
