// Running shell commands with captured output.
#pragma once

#include <string>

#include "lib/util/status.h"

// Runs `command` through the shell (popen). `output` is emptied and then
// receives everything the command writes to its standard output; its
// standard error is not captured. Returns:
//   STATUS_FAILED     popen failed (output untouched), or the command
//                     exited non-zero (including 127 for "not found");
//   STATUS_NOT_FOUND  the command was ended by a signal;
//   STATUS_OK         it exited 0, or `ignoreStatus` is true.
Status runCommand(const char* command, std::string& output, bool ignoreStatus);

// runCommand(command, output, false).
Status runCommand(const std::string& command, std::string& output);
