// Running code and programs in child processes with their output captured.
#pragma once

#include <functional>
#include <map>
#include <string>
#include <vector>

namespace testing_support {

struct ProcessResult {
    int exitStatus = -1;  // exit code, or -1 when ended by a signal
    int signal = 0;       // the signal that ended it, else 0
    std::string out;      // everything written to standard output
    std::string err;      // everything written to standard error
};

// Runs `body` in a forked child whose standard output and error go to
// files; the child exits with body's return value. Use it for code that
// changes process-wide state (log output mode, umask) or that must crash.
ProcessResult runInChild(const std::function<int()>& body);

// The words that runProgram puts before every program: the emulator of a
// cross build (qemu-aarch64 and its options), else none.
const std::vector<std::string>& programEmulator();

// Runs a program (argv[0] is its path) with extra environment variables,
// through programEmulator(). With a time limit, a program still running
// after that many seconds is ended by SIGALRM (result.signal).
ProcessResult runProgram(const std::vector<std::string>& argv, const std::map<std::string, std::string>& extraEnv = {},
                         unsigned timeLimitSeconds = 0);

// Runs `command` with /bin/sh -c; the result as it came.
ProcessResult runShell(const std::string& command);

}  // namespace testing_support
