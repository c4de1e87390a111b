#include "fake_mount_commands.h"

#include <unistd.h>
#include <cstdlib>
#include <stdexcept>

#include "files.h"
#include "lib/util/log.h"

namespace testing_support {
namespace {

namespace fs = std::filesystem;

std::string pathWithFirst(const fs::path& first) {
    const char* path = std::getenv("PATH");
    return first.string() + ":" + (path != nullptr ? path : "/usr/sbin:/usr/bin:/sbin:/bin");
}

// Looked up by hand: PATH would find the fake itself.
std::string realCommand(const std::string& name) {
    for (const char* dir : {"/usr/bin/", "/bin/", "/usr/sbin/", "/sbin/"}) {
        const std::string candidate = dir + name;
        if (::access(candidate.c_str(), X_OK) == 0) return candidate;
    }
    throw std::runtime_error("no " + name + " command");
}

}  // namespace

ProcessResult runWithCommandsFirst(const fs::path& firstOnPath, int threshold, const std::function<int()>& body,
                                   const std::map<std::string, std::string>& env) {
    const std::string path = pathWithFirst(firstOnPath);
    return runInChild([&] {
        setenv("PATH", path.c_str(), 1);
        for (const auto& [name, value] : env) setenv(name.c_str(), value.c_str(), 1);
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(threshold);
        return body();
    });
}

FakeMountCommands::FakeMountCommands(Fallback fallback) {
    for (const std::string name : {"mount", "umount"}) {
        const std::string otherwise =
            fallback == Fallback::realCommand ? "exec " + realCommand(name) + " \"$@\"\n" : "exit 0\n";
        const fs::path script = dir_ / name;
        writeText(script,
                  "#!/bin/sh\n"
                  "{ printf '%s' \"${0##*/}\"; for a in \"$@\"; do printf ' [%s]' \"$a\"; done; echo; } >>'" +
                      record().string() +
                      "'\n"
                      "[ -z \"$FAKE_MOUNT_STDOUT\" ] || echo \"$FAKE_MOUNT_STDOUT\"\n"
                      "[ -z \"$FAKE_MOUNT_STDERR\" ] || echo \"$FAKE_MOUNT_STDERR\" >&2\n"
                      "if [ \"$FAKE_MOUNT_KILL\" = 1 ]; then\n"
                      "  read -r parent </proc/$PPID/comm\n"
                      "  case \"$parent\" in sh|dash|bash) kill -KILL $PPID ;; esac\n"
                      "  kill -KILL $$\n"
                      "fi\n"
                      "[ -z \"$FAKE_MOUNT_EXIT\" ] || exit \"$FAKE_MOUNT_EXIT\"\n" +
                      otherwise);
        fs::permissions(script, fs::perms::owner_all);
    }
    clear();
}

std::string FakeMountCommands::calls() const { return readText(record()); }

void FakeMountCommands::clear() const { writeText(record(), ""); }

std::string FakeMountCommands::searchPath() const { return pathWithFirst(directory()); }

ProcessResult FakeMountCommands::run(int threshold, const std::function<int()>& body,
                                     const std::map<std::string, std::string>& env) const {
    return runWithCommandsFirst(directory(), threshold, body, env);
}

}  // namespace testing_support
