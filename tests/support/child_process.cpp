#include "child_process.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>
#include <cstdio>
#include <cstdlib>
#include <sstream>
#include <stdexcept>

#include "files.h"
#include "scratch_dir.h"

#ifdef FLUSH_COVERAGE_BEFORE_EXIT
extern "C" void __gcov_dump();
#endif

namespace testing_support {
namespace {

ProcessResult runCaptured(const std::function<void()>& inChild) {
    ScratchDir dir;
    const std::string outPath = (dir / "stdout").string();
    const std::string errPath = (dir / "stderr").string();
    std::fflush(stdout);
    std::fflush(stderr);
    const pid_t pid = fork();
    if (pid < 0) throw std::runtime_error("fork failed");
    if (pid == 0) {
        const int out = open(outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        const int err = open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        const int in = open("/dev/null", O_RDONLY | O_CLOEXEC);
        if (out < 0 || err < 0 || in < 0 || dup2(out, 1) < 0 || dup2(err, 2) < 0 || dup2(in, 0) < 0) _exit(126);
        inChild();
        _exit(127);
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0) {}
    ProcessResult result;
    if (WIFEXITED(status)) result.exitStatus = WEXITSTATUS(status);
    if (WIFSIGNALED(status)) result.signal = WTERMSIG(status);
    result.out = readText(outPath);
    result.err = readText(errPath);
    return result;
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

ProcessResult execute(const std::vector<std::string>& command, const std::map<std::string, std::string>& extraEnv,
                      unsigned timeLimitSeconds = 0) {
    return runCaptured([&] {
        for (const auto& [name, value] : extraEnv) setenv(name.c_str(), value.c_str(), 1);
        // A pending alarm survives the exec; its default action ends the program.
        if (timeLimitSeconds != 0) alarm(timeLimitSeconds);
        std::vector<char*> args;
        for (const auto& arg : command) args.push_back(const_cast<char*>(arg.c_str()));
        args.push_back(nullptr);
        execv(args[0], args.data());
        _exit(127);
    });
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
