// The "Register " lines that building the tool's registry logs at the
// informational threshold, in registration order, written once for the
// registry's unit tests, the runs of the tool and the device tests.
#pragma once

#include <filesystem>
#include <string>

namespace testing_support {

// The eight dual-file stores below `base`.
std::string dualFileRegisterLines(const std::filesystem::path& base);

// The three file-read targets, then the three device targets.
extern const char kFileReadRegisterLines[];
extern const char kDeviceTargetRegisterLines[];

// All fourteen: the stores, the file-read targets, the device targets.
std::string registerLines(const std::filesystem::path& base);

}  // namespace testing_support
