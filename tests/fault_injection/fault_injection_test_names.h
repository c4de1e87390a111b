// The names the shim's own tests share: each test file takes them with one
// using-directive instead of repeating the list.
#pragma once

#include <filesystem>

#include "child_process.h"
#include "fault_injection.h"
#include "files.h"
#include "scratch_dir.h"

namespace fault_injection_test {

namespace fs = std::filesystem;
using testing_support::Environment;
using testing_support::faultCountEnv;
using testing_support::faultEnv;
using testing_support::preloadEnv;
using testing_support::ProcessResult;
using testing_support::readFaultCount;
using testing_support::runProgram;
using testing_support::ScratchDir;
using testing_support::writeText;

}  // namespace fault_injection_test
