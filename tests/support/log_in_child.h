// Running code in a child process with the log set up as a test wants it.
#pragma once

#include <functional>

#include "child_process.h"

namespace testing_support {

// Runs `body` in a child (runInChild) whose log goes to `output`
// (LOG_OUTPUT_*) at threshold `threshold`; the child exits with 0.
ProcessResult logInChild(int output, int threshold, const std::function<void()>& body);

}  // namespace testing_support
