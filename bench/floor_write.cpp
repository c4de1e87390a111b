// floor_write DATA DIRECTORY
//
// Reads the file DATA whole and stores it as DIRECTORY/1/data with
// floorCommit: the least a process can do to store a blob the way the
// dual-file store does, and the floor that bench/compare.sh measures the
// tool and its peers against. Exit status 0, or 1 with the reason on
// standard error.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include "floor_commit.h"

namespace {

int fail(const char* what, int error) {
    std::fprintf(stderr, "floor_write: %s: %s\n", what, std::strerror(error));
    return 1;
}

// Open, size and read, as the tool does with its data file.
int readWhole(const char* path, std::vector<uint8_t>& bytes) {
    const int fd = ::open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) return errno;
    struct stat status {};
    int error = ::fstat(fd, &status) == 0 ? 0 : errno;
    if (error == 0) {
        bytes.resize(static_cast<size_t>(status.st_size));
        const ssize_t count = ::read(fd, bytes.data(), bytes.size());
        if (count < 0)
            error = errno;
        else if (static_cast<size_t>(count) != bytes.size())
            error = EIO;
    }
    ::close(fd);
    return error;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 3) {
        std::fputs("Usage: floor_write DATA DIRECTORY\n", stderr);
        return 1;
    }
    std::vector<uint8_t> bytes;
    if (const int error = readWhole(argv[1], bytes)) return fail(argv[1], error);
    const std::filesystem::path copyDirectory = std::filesystem::path(argv[2]) / "1";
    if (::mkdir(copyDirectory.c_str(), 0777) != 0 && errno != EEXIST) return fail(copyDirectory.c_str(), errno);
    if (const int error = bench::floorCommit(bench::FloorCopy(copyDirectory), bytes.data(), bytes.size())) {
        return fail("commit", error);
    }
    return 0;
}
