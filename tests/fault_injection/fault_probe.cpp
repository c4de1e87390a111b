// A fixed sequence of file-system calls for the fault-injection tests.
// Each step prints one line: "<step> <result>" when it succeeds (the byte
// count for writes, else 0) or "<step> failed <errno>". Standard output is
// unbuffered, so a killed run shows exactly the steps that finished.
//
//   fault_probe script DIR   one counted call per step, POSIX only; expects
//                            DIR/victim and DIR/victim2 to exist
//   fault_probe library DIR  the std::filesystem calls the store relies on;
//                            expects DIR/source to exist
//   fault_probe spawn DIR    runs "script DIR/child" as a new program, then
//                            makes DIR/parent-made itself
//   fault_probe record DIR   every call the shim records (fault_probe.h)
//   fault_probe gcda DIR     what gcov does to its count files: creates,
//                            renames and removes DIR/probe.gcda
//   fault_probe read DIR     reads DIR/source with read, then pread
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <string>
#include <system_error>

#include <fcntl.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include "fault_probe.h"

extern char** environ;

namespace fault_probe {

void step(const char* name, const std::function<long()>& call) {
    errno = 0;
    const long result = call();
    const int error = errno;
    if (result < 0) {
        std::printf("%s failed %d\n", name, error);
    } else {
        std::printf("%s %ld\n", name, result);
    }
}

long succeeded(bool ok) { return ok ? 0 : -1; }

}  // namespace fault_probe

namespace {

namespace fs = std::filesystem;
using fault_probe::step;
using fault_probe::succeeded;

void libraryStep(const char* name, const std::function<void(std::error_code&)>& call) {
    std::error_code error;
    call(error);
    if (error) {
        std::printf("%s failed %d\n", name, error.value());
    } else {
        std::printf("%s 0\n", name);
    }
}

int runScript(const std::string& dir) {
    const std::string made = dir + "/made";
    const std::string file = dir + "/target.dat";
    const std::string renamed = dir + "/renamed.dat";
    const std::string victim = dir + "/victim";
    const std::string victim2 = dir + "/victim2";
    const std::string stream = dir + "/stream.txt";

    step("mkdir", [&] { return mkdir(made.c_str(), 0777); });
    int fd = -1;
    step("create", [&] {
        fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
        return succeeded(fd >= 0);
    });
    step("write", [&] { return static_cast<long>(write(fd, "hello world", 11)); });
    step("pwrite", [&] { return static_cast<long>(pwrite(fd, "XY", 2, 1)); });
    step("ftruncate", [&] { return ftruncate(fd, 5); });
    step("fsync", [&] { return fsync(fd); });
    if (fd >= 0) close(fd);
    step("open-read", [&] {
        const int readFd = open(file.c_str(), O_RDONLY | O_CLOEXEC);
        if (readFd < 0) return -1L;
        close(readFd);
        return 0L;
    });
    step("syncfs", [&] {
        // Opened past the shim, so that this step makes one counted call.
        const int dirFd =
            static_cast<int>(syscall(SYS_openat, AT_FDCWD, dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (dirFd < 0) return -1L;
        const long result = syncfs(dirFd);
        const int error = errno;
        close(dirFd);
        errno = error;
        return result;
    });
    step("utimensat", [&] {
        const struct timespec times[2] = {{1000000000, 0}, {1000000000, 0}};
        return utimensat(AT_FDCWD, file.c_str(), times, 0);
    });
    step("rename", [&] { return rename(file.c_str(), renamed.c_str()); });
    step("unlink", [&] { return unlink(victim.c_str()); });
    step("fopen", [&] {
        FILE* out = std::fopen(stream.c_str(), "we");
        if (out == nullptr) return -1L;
        std::fputs("stream\n", out);
        return succeeded(std::fclose(out) == 0);
    });
    step("remove", [&] { return std::remove(victim2.c_str()); });
    return 0;
}

int runLibrary(const fs::path& dir) {
    const fs::path lib = dir / "lib";
    libraryStep("create_directory", [&](std::error_code& error) { fs::create_directory(lib, error); });
    libraryStep("copy_file", [&](std::error_code& error) {
        fs::copy_file(dir / "source", lib / "copy", fs::copy_options::overwrite_existing, error);
    });
    libraryStep("last_write_time", [&](std::error_code& error) {
        fs::last_write_time(lib / "copy", fs::file_time_type(std::chrono::hours(24)), error);
    });
    libraryStep("resize_file", [&](std::error_code& error) { fs::resize_file(lib / "copy", 2, error); });
    libraryStep("rename", [&](std::error_code& error) { fs::rename(lib / "copy", lib / "moved", error); });
    libraryStep("remove", [&](std::error_code& error) { fs::remove(lib / "moved", error); });
    libraryStep("remove_all", [&](std::error_code& error) { fs::remove_all(lib, error); });
    return 0;
}

int runCoverageCounts(const std::string& dir) {
    const std::string counts = dir + "/probe.gcda";
    const std::string renamed = dir + "/renamed.gcda";
    step("create", [&] {
        const int fd = open(counts.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0666);
        if (fd < 0) return -1L;
        close(fd);
        return 0L;
    });
    step("fopen", [&] {
        FILE* stream = std::fopen(counts.c_str(), "r+e");
        if (stream == nullptr) return -1L;
        std::fputs("counts", stream);
        return succeeded(std::fclose(stream) == 0);
    });
    step("rename", [&] { return rename(counts.c_str(), renamed.c_str()); });
    step("unlink", [&] { return unlink(renamed.c_str()); });
    return 0;
}

int runReads(const std::string& dir) {
    const int fd = open((dir + "/source").c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return 1;
    char buffer[64];
    step("read", [&] { return static_cast<long>(read(fd, buffer, sizeof buffer)); });
    step("pread", [&] { return static_cast<long>(pread(fd, buffer, sizeof buffer, 1)); });
    close(fd);
    return 0;
}

int runSpawn(const char* self, const std::string& dir) {
    const std::string childDir = dir + "/child";
    std::string script = "script";
    std::string program = self;
    char* argv[] = {program.data(), script.data(), const_cast<char*>(childDir.c_str()), nullptr};
    pid_t child = 0;
    const int error = posix_spawn(&child, self, nullptr, nullptr, argv, environ);
    if (error != 0) {
        std::printf("spawn failed %d\n", error);
        return 1;
    }
    int status = 0;
    while (waitpid(child, &status, 0) < 0) {}
    std::printf("child exit %d\n", WIFEXITED(status) ? WEXITSTATUS(status) : -1);
    step("mkdir", [&] { return mkdir((dir + "/parent-made").c_str(), 0777); });
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    std::setvbuf(stdout, nullptr, _IONBF, 0);
    if (argc != 3) {
        std::fprintf(stderr, "usage: fault_probe script|library|spawn|record|gcda|read DIR\n");
        return 2;
    }
    const std::string mode = argv[1];
    if (mode == "script") return runScript(argv[2]);
    if (mode == "library") return runLibrary(argv[2]);
    if (mode == "spawn") return runSpawn(argv[0], argv[2]);
    if (mode == "record") return fault_probe::runRecord(argv[2]);
    if (mode == "gcda") return runCoverageCounts(argv[2]);
    if (mode == "read") return runReads(argv[2]);
    std::fprintf(stderr, "unknown mode %s\n", argv[1]);
    return 2;
}
