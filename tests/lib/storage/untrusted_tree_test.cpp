#include "lib/storage/untrusted_tree.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <string>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "hostile_tree.h"
#include "scratch_dir.h"

namespace {

namespace fs = std::filesystem;
using testing_support::Plant;

class UntrustedTree : public ::testing::Test {
protected:
    UntrustedTree() : directoryFd(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)) {}

    // `plant` at `name`; false (and the test skipped) when it cannot be made here.
    bool planted(const char* name, Plant plant) {
        std::string reason;
        if (testing_support::plantAt(dir / name, plant, victims, reason)) return true;
        skipReason = reason;
        return false;
    }

    testing_support::ScratchDir dir;
    const testing_support::Victims victims{dir / "victims"};
    UniqueFd directoryFd;
    std::string skipReason;
};

struct Refusal {
    Plant plant;
    int error;  // of openRegularAt for reading
};

class RegularFilesOnly : public UntrustedTree, public ::testing::WithParamInterface<Refusal> {};

// Whatever is planted, an open for reading or writing returns at once (a
// wait would end the child with SIGALRM) and refuses it; a write open with
// O_CREAT neither creates nor truncates anything through a link.
TEST_P(RegularFilesOnly, AnythingElseIsRefusedAtOnce) {
    if (!planted("entry", GetParam().plant)) GTEST_SKIP() << skipReason;
    const std::string victimsBefore = testing_support::snapshotTree(dir / "victims");
    const auto result = testing_support::runInChild([&] {
        ::alarm(20);
        const UniqueFd reading = Storage::openRegularAt(directoryFd.get(), "entry", O_RDONLY);
        const int readError = errno;
        const UniqueFd writing = Storage::openRegularAt(directoryFd.get(), "entry", O_RDWR | O_CREAT | O_TRUNC, 0666);
        if (reading || writing) return 1;
        return readError == GetParam().error ? 0 : 2;
    });
    EXPECT_EQ(result.signal, 0);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(testing_support::snapshotTree(dir / "victims"), victimsBefore);
}

INSTANTIATE_TEST_SUITE_P(Planted, RegularFilesOnly,
                         ::testing::Values(Refusal{Plant::kLinkToFile, ELOOP}, Refusal{Plant::kLinkToDirectory, ELOOP},
                                           Refusal{Plant::kDanglingLink, ELOOP}, Refusal{Plant::kLinkLoop, ELOOP},
                                           Refusal{Plant::kFifo, ENXIO}, Refusal{Plant::kSocket, ENXIO},
                                           Refusal{Plant::kDirectory, EISDIR}, Refusal{Plant::kDeviceNode, ENXIO}),
                         [](const ::testing::TestParamInfo<Refusal>& info) {
                             return testing_support::plantName(info.param.plant);
                         });

TEST_F(UntrustedTree, RegularFileOpensWithItsStatus) {
    testing_support::writeText(dir / "file", "twelve bytes");
    struct stat status {};
    const UniqueFd fd = Storage::openRegularAt(directoryFd.get(), "file", O_RDONLY, 0, &status);
    ASSERT_TRUE(fd);
    EXPECT_EQ(status.st_size, 12);
    EXPECT_NE(::fcntl(fd.get(), F_GETFD) & FD_CLOEXEC, 0);
}

TEST_F(UntrustedTree, MissingFileIsCreatedOnlyWhenAsked) {
    EXPECT_FALSE(Storage::openRegularAt(directoryFd.get(), "new", O_RDONLY));
    EXPECT_EQ(errno, ENOENT);
    EXPECT_TRUE(Storage::openRegularAt(directoryFd.get(), "new", O_WRONLY | O_CREAT, 0600));
    EXPECT_TRUE(fs::is_regular_file(dir / "new"));
}

// Another program's lease makes an open for writing fail at once instead
// of waiting for the lease to be broken.
TEST_F(UntrustedTree, LeasedFileFailsInsteadOfWaiting) {
    testing_support::writeText(dir / "leased", "leased");
    int ready[2];
    ASSERT_EQ(::pipe(ready), 0);
    const pid_t holder = ::fork();
    ASSERT_GE(holder, 0);
    if (holder == 0) {
        const int fd = ::open((dir / "leased").c_str(), O_RDONLY);
        const char answer = fd >= 0 && ::fcntl(fd, F_SETLEASE, F_RDLCK) == 0 ? 'y' : 'n';
        (void)::write(ready[1], &answer, 1);
        ::pause();
        _exit(0);
    }
    ::close(ready[1]);
    char answer = 'n';
    (void)::read(ready[0], &answer, 1);
    ::close(ready[0]);
    if (answer == 'y') {
        const auto result = testing_support::runInChild([&] {
            ::alarm(20);
            const UniqueFd fd = Storage::openRegularAt(directoryFd.get(), "leased", O_WRONLY | O_TRUNC);
            return !fd && errno == EWOULDBLOCK ? 0 : 1;
        });
        EXPECT_EQ(result.signal, 0) << "waited for the lease";
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(testing_support::readText(dir / "leased"), "leased");
    }
    ::kill(holder, SIGKILL);
    ::waitpid(holder, nullptr, 0);
    if (answer != 'y') GTEST_SKIP() << "no lease could be taken here (fs.leases-enable, CAP_LEASE)";
}

TEST_F(UntrustedTree, DirectoryOpensOnlyWhenItIsOne) {
    fs::create_directory(dir / "real");
    EXPECT_TRUE(Storage::openDirectoryAt(directoryFd.get(), "real"));
    fs::create_directory_symlink(dir / "real", dir / "link");
    EXPECT_FALSE(Storage::openDirectoryAt(directoryFd.get(), "link"));
    EXPECT_EQ(errno, ENOTDIR);
    testing_support::writeText(dir / "file", "");
    EXPECT_FALSE(Storage::openDirectoryAt(directoryFd.get(), "file"));
    EXPECT_EQ(errno, ENOTDIR);
    EXPECT_FALSE(Storage::openDirectoryAt(directoryFd.get(), "missing"));
    EXPECT_EQ(errno, ENOENT);
}

TEST_F(UntrustedTree, MakingADirectoryNeverGoesThroughALink) {
    EXPECT_TRUE(Storage::makeDirectoryAt(directoryFd.get(), "made"));
    EXPECT_TRUE(fs::is_directory(dir / "made"));
    EXPECT_TRUE(Storage::makeDirectoryAt(directoryFd.get(), "made"));  // already there
    fs::create_directory_symlink(victims.missing(), dir / "dangling");
    EXPECT_FALSE(Storage::makeDirectoryAt(directoryFd.get(), "dangling"));
    EXPECT_EQ(errno, ENOTDIR);
    EXPECT_FALSE(fs::exists(victims.missing()));
}

TEST_F(UntrustedTree, EntriesExistWithoutFollowingLinks) {
    fs::create_symlink(victims.missing(), dir / "dangling");
    EXPECT_TRUE(Storage::entryExists(directoryFd.get(), "dangling"));
    EXPECT_FALSE(Storage::entryExists(directoryFd.get(), "nothing"));
}

}  // namespace
