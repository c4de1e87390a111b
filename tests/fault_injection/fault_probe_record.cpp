// "fault_probe record DIR": the calls behind every line kind of the shim's
// record, by absolute, cwd-relative and *at-relative names, then calls
// that fail and writes that reach no regular file.
#include <cerrno>
#include <cstdio>
#include <functional>
#include <string>

#include <fcntl.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include "fault_probe.h"

namespace fault_probe {
namespace {

// A step whose call returns a descriptor, kept in `fd`.
void openStep(const char* name, int& fd, const std::function<int()>& open) {
    step(name, [&] {
        fd = open();
        return succeeded(fd >= 0);
    });
}

void dataSteps(const std::string& dir, int dirFd) {
    int fd = -1;
    int subFd = -1;
    step("mkdir", [&] { return mkdir("sub", 0777); });
    openStep("open-sub", subFd, [&] { return open("sub", O_RDONLY | O_DIRECTORY | O_CLOEXEC); });
    openStep("openat-create", fd, [&] { return openat(subFd, "a.dat", O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0666); });
    step("write", [&] { return static_cast<long>(write(fd, "hello", 5)); });
    step("writev", [&] {
        char ab[] = "ab";
        char cd[] = "cd";
        const struct iovec parts[] = {{ab, 2}, {cd, 2}};
        return static_cast<long>(writev(fd, parts, 2));
    });
    step("pwrite", [&] { return static_cast<long>(pwrite(fd, "Z", 1, 1)); });
    step("pwritev", [&] {
        char xy[] = "XY";
        const struct iovec part = {xy, 2};
        return static_cast<long>(pwritev(fd, &part, 1, 20));
    });
    step("fdatasync", [&] { return fdatasync(fd); });
    step("ftruncate", [&] { return ftruncate(fd, 3); });
    step("fsync-dir", [&] { return fsync(dirFd); });
    close(fd);
    close(subFd);

    openStep("open-trunc", fd, [&] { return open("old", O_WRONLY | O_TRUNC | O_CLOEXEC); });
    close(fd);
    openStep("create-append", fd,
             [&] { return open((dir + "/odd %name\n").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666); });
    step("append", [&] { return static_cast<long>(write(fd, "one", 3)); });
    step("append-rewound", [&] {
        if (lseek(fd, 0, SEEK_SET) != 0) return -1L;
        return static_cast<long>(write(fd, "two", 3));
    });
    // Under O_APPEND Linux appends whatever offset pwrite names.
    step("append-pwrite", [&] { return static_cast<long>(pwrite(fd, "3", 1, 0)); });
    close(fd);
}

void metadataSteps(const std::string& dir, int dirFd) {
    int fd = -1;
    openStep("open-append", fd, [&] { return open("log", O_WRONLY | O_APPEND | O_CLOEXEC); });
    step("append-existing", [&] { return static_cast<long>(write(fd, "more", 4)); });
    step("truncate", [&] { return truncate("log", 2); });
    step("chmod", [&] { return chmod((dir + "/log").c_str(), 0600); });
    step("fchmod", [&] { return fchmod(fd, 0640); });
    step("fchmodat", [&] { return fchmodat(dirFd, "log", 0644, 0); });
    step("utimensat", [&] {
        const struct timespec times[2] = {{1000000000, 5}, {1000000000, 5}};
        return utimensat(dirFd, "log", times, 0);
    });
    step("futimens", [&] {
        const struct timespec times[2] = {{1500000000, 123456789}, {1500000000, 123456789}};
        return futimens(fd, times);
    });
    close(fd);
}

void copySteps() {
    int in = -1;
    int out = -1;
    int writeOnly = -1;
    openStep("open-source", in, [&] { return open("source", O_RDONLY | O_CLOEXEC); });
    openStep("create-copy", out, [&] { return open("copy.dat", O_RDWR | O_CREAT | O_CLOEXEC, 0666); });
    step("sendfile", [&] { return static_cast<long>(sendfile(out, in, nullptr, 6)); });
    step("copy_file_range", [&] {
        loff_t from = 7;
        loff_t to = 100;
        return static_cast<long>(copy_file_range(in, &from, out, &to, 4, 0));
    });
    openStep("create-write-only", writeOnly, [&] { return open("copy2.dat", O_WRONLY | O_CREAT | O_CLOEXEC, 0666); });
    step("sendfile-offset", [&] {
        off_t from = 2;
        return static_cast<long>(sendfile(writeOnly, in, &from, 5));
    });
    step("sendfile-position", [&] { return static_cast<long>(sendfile(writeOnly, in, nullptr, 5)); });
    close(writeOnly);
    close(out);
    close(in);
}

void nameSteps(const std::string& dir, int dirFd) {
    step("rename", [&] { return rename("sub/a.dat", (dir + "/moved.dat").c_str()); });
    step("renameat", [&] { return renameat(dirFd, "copy2.dat", AT_FDCWD, (dir + "/replaced").c_str()); });
    step("renameat2", [&] { return renameat2(AT_FDCWD, "moved.dat", dirFd, "moved2.dat", RENAME_NOREPLACE); });
    step("unlink", [&] { return unlink((dir + "/gone").c_str()); });
    step("mkdirat", [&] { return mkdirat(dirFd, "sub2", 0777); });
    step("unlinkat-dir", [&] { return unlinkat(AT_FDCWD, "sub2", AT_REMOVEDIR); });
    step("unlinkat", [&] { return unlinkat(dirFd, "gone2", 0); });
    step("rmdir", [&] { return rmdir((dir + "/sub").c_str()); });
    step("remove-dir", [&] { return std::remove((dir + "/emptydir").c_str()); });
    step("remove", [&] { return std::remove("gone3"); });
    int fd = -1;
    openStep("creat", fd, [&] { return creat("made.dat", 0666); });
    close(fd);
    openStep("creat-again", fd, [&] { return creat("made.dat", 0666); });
    close(fd);
    step("fopen", [&] {
        FILE* stream = std::fopen((dir + "/stream.txt").c_str(), "we");
        return succeeded(stream != nullptr && std::fclose(stream) == 0);
    });
    step("fopen-existing", [&] {
        FILE* stream = std::fopen("old", "we");
        return succeeded(stream != nullptr && std::fclose(stream) == 0);
    });
    step("syncfs", [&] { return syncfs(dirFd); });
}

// None of these may show in the record.
void unrecordedSteps(const std::string& dir) {
    step("unlink-missing", [&] { return unlink((dir + "/missing").c_str()); });
    step("create-in-missing", [&] { return open((dir + "/missing/x").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0666); });
    step("rename-missing", [&] { return rename((dir + "/missing").c_str(), (dir + "/other").c_str()); });
    step("mkdir-existing", [&] { return mkdir((dir + "/log").c_str(), 0777); });
    step("write-bad-fd", [&] { return static_cast<long>(write(-1, "x", 1)); });
    int fd = -1;
    openStep("open-read", fd, [&] { return open("source", O_RDONLY | O_CLOEXEC); });
    step("write-read-only", [&] { return static_cast<long>(write(fd, "x", 1)); });
    close(fd);
    int pipeFds[2] = {-1, -1};
    step("pipe", [&] { return pipe2(pipeFds, O_CLOEXEC); });
    step("write-pipe", [&] { return static_cast<long>(write(pipeFds[1], "x", 1)); });
    close(pipeFds[0]);
    close(pipeFds[1]);
    openStep("open-null", fd, [&] { return open("/dev/null", O_WRONLY | O_CLOEXEC); });
    step("write-null", [&] { return static_cast<long>(write(fd, "x", 1)); });
    close(fd);
}

}  // namespace

int runRecord(const std::string& dir) {
    if (chdir(dir.c_str()) != 0) {
        std::printf("chdir failed %d\n", errno);
        return 1;
    }
    const int dirFd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    dataSteps(dir, dirFd);
    metadataSteps(dir, dirFd);
    copySteps();
    nameSteps(dir, dirFd);
    unrecordedSteps(dir);
    close(dirFd);
    return 0;
}

}  // namespace fault_probe
