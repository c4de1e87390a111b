// Error log lines begin with "<source path without extension>:<line> ",
// where most line numbers are simply where the statement stands in its
// source file. Tests take such a number from the source, so that an edit
// above the statement does not break them.
#pragma once

#include <string>

namespace testing_support {

// The number of the one line of `sourcePath` (relative to the top of the
// source tree, e.g. "libcommon/lib/util/fd.cpp"; the tree is the build's, or
// $MIGRATE_SETTINGS_SOURCE_ROOT when set) that contains `text`.
// Throws std::runtime_error when the file cannot be read or not exactly one
// line contains `text`.
int sourceLineOf(const std::string& sourcePath, const std::string& text);

// "<sourcePath without extension>:<line> " for the statement on the one
// line containing `text`: the prefix of the error line it writes.
std::string errorPrefixOf(const std::string& sourcePath, const std::string& text);

// "libcommon/lib/util/fd:<line> Failed to open ": how the lines of
// logOpenFailure begin.
std::string openFailurePrefix();

}  // namespace testing_support
