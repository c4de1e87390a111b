// Log text of lib/storage/storage_target made comparable with exact
// expectations.
#pragma once

#include <string>

namespace testing_support {

// The line numbers of lib/storage/storage_target error lines become N, in
// the "<source>:<line> " prefix and in "[<source>:<line>] " status reports,
// and so do those of the open failures that libcommon/lib/util/fd reports
// for the targets ("libcommon/lib/util/fd:N Failed to open "). Everything
// else is left exactly as it was.
std::string withoutStorageLineNumbers(const std::string& text);

// withoutStorageLineNumbers, and each distinct "/tmp/firmwareXXXXXX" name
// becomes #1, #2, ... in order of first appearance.
std::string normalisedStorageLog(const std::string& text);

}  // namespace testing_support
