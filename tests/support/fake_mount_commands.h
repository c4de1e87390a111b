// Stand-ins for the system's "mount" and "umount", put first on PATH of a
// child that runs the code under test.
#pragma once

#include <filesystem>
#include <functional>
#include <map>
#include <string>

#include "child_process.h"
#include "scratch_dir.h"

namespace testing_support {

// Runs `body` with runInChild, with `firstOnPath` in front of PATH, the
// extra variables set, and the log on standard output at `threshold`.
ProcessResult runWithCommandsFirst(const std::filesystem::path& firstOnPath, int threshold,
                                   const std::function<int()>& body,
                                   const std::map<std::string, std::string>& env = {});

// "mount" and "umount" in a scratch directory. Each call appends its name
// and every argument in brackets to a record
// ("mount [-o] [remount,rw] [/media/boot]"), then obeys the caller's
// environment: FAKE_MOUNT_STDOUT and FAKE_MOUNT_STDERR are printed on the
// two streams; FAKE_MOUNT_KILL=1 ends the calling shell, when there is one
// between, and the command by SIGKILL, so that the command's runner sees a
// signal; FAKE_MOUNT_EXIT, when set, is the exit status. Without it the
// call exits 0, or with Fallback::realCommand runs the system's own
// command with the same arguments (the constructor throws
// std::runtime_error when there is none).
class FakeMountCommands {
public:
    enum class Fallback { succeed, realCommand };

    explicit FakeMountCommands(Fallback fallback = Fallback::succeed);

    const std::filesystem::path& directory() const { return dir_.path(); }
    // Everything recorded since construction or the last clear().
    std::string calls() const;
    void clear() const;
    // PATH with the fakes' directory in front.
    std::string searchPath() const;

    // runWithCommandsFirst with these fakes.
    ProcessResult run(int threshold, const std::function<int()>& body,
                      const std::map<std::string, std::string>& env = {}) const;

private:
    std::filesystem::path record() const { return dir_ / "record"; }

    ScratchDir dir_;
};

}  // namespace testing_support
