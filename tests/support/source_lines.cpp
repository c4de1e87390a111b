#include "source_lines.h"

#include <cstdlib>
#include <fstream>
#include <stdexcept>

namespace testing_support {

namespace {

// An installed test suite (a ptest) reads the sources it was shipped with.
std::string sourceRoot() {
    const char* root = std::getenv("MIGRATE_SETTINGS_SOURCE_ROOT");
    return root != nullptr ? root : SOURCE_ROOT;
}

}  // namespace

int sourceLineOf(const std::string& sourcePath, const std::string& text) {
    std::ifstream in(sourceRoot() + "/" + sourcePath);
    if (!in) throw std::runtime_error("cannot read " + sourcePath);
    int found = 0;
    int number = 0;
    for (std::string line; std::getline(in, line);) {
        ++number;
        if (line.find(text) == std::string::npos) continue;
        if (found != 0) throw std::runtime_error("more than one line of " + sourcePath + " contains " + text);
        found = number;
    }
    if (found == 0) throw std::runtime_error("no line of " + sourcePath + " contains " + text);
    return found;
}

std::string errorPrefixOf(const std::string& sourcePath, const std::string& text) {
    const size_t dot = sourcePath.rfind('.');
    return sourcePath.substr(0, dot) + ":" + std::to_string(sourceLineOf(sourcePath, text)) + " ";
}

std::string openFailurePrefix() {
    return errorPrefixOf("libcommon/lib/util/fd.cpp", "<< \"Failed to open \"") + "Failed to open ";
}

}  // namespace testing_support
