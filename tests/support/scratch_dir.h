// A scratch directory that is removed with everything in it when the test
// ends, whether or not its assertions held.
#pragma once

#include <filesystem>
#include <string>

namespace testing_support {

class ScratchDir {
public:
    // A new directory below `parent`, by default the system's temporary
    // directory.
    ScratchDir();
    explicit ScratchDir(const std::filesystem::path& parent);
    ~ScratchDir();
    ScratchDir(const ScratchDir&) = delete;
    ScratchDir& operator=(const ScratchDir&) = delete;

    const std::filesystem::path& path() const { return path_; }
    std::filesystem::path operator/(const std::string& name) const { return path_ / name; }

private:
    std::filesystem::path path_;
};

}  // namespace testing_support
