#include "lib/storage/untrusted_tree.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <cerrno>
#include <csignal>
#include <cstring>
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

// The number of names the file `path` has.
nlink_t linksOf(const fs::path& path) {
    struct stat status {};
    return ::lstat(path.c_str(), &status) == 0 ? status.st_nlink : 0;
}

// A hard link cannot be told from the file's own name by any open: the
// writer unlinks it, and the other name keeps its bytes.
TEST_F(UntrustedTree, AWriteWithTruncationReplacesAHardLinkWithAFreshFile) {
    for (const Plant plant : {Plant::kHardLinkToFile, Plant::kHardLinkToRootOnlyFile, Plant::kHardLinkToStoreFile}) {
        SCOPED_TRACE(testing_support::plantName(plant));
        if (!planted("entry", plant)) GTEST_SKIP() << skipReason;
        const std::string victimsBefore = testing_support::snapshotTree(dir / "victims");
        const UniqueFd fd =
            Storage::openRegularToWriteAt(directoryFd.get(), "entry", O_WRONLY | O_CREAT | O_TRUNC, 0640);
        ASSERT_TRUE(fd) << std::strerror(errno);
        ASSERT_EQ(::write(fd.get(), "new", 3), 3);
        EXPECT_EQ(testing_support::readText(dir / "entry"), "new");
        EXPECT_EQ(linksOf(dir / "entry"), 1U);
        EXPECT_EQ(testing_support::snapshotTree(dir / "victims"), victimsBefore);
        EXPECT_EQ(linksOf(victims.file()), 1U);
        EXPECT_EQ(linksOf(victims.rootOnlyFile()), 1U);
        EXPECT_EQ(linksOf(victims.storeFile()), 1U);
    }
}

// Without O_TRUNC the old bytes are wanted, and a hard link's are not
// ours: the name goes and the open fails as on a damaged file.
TEST_F(UntrustedTree, AWriteKeepingTheBytesRefusesAHardLink) {
    if (!planted("entry", Plant::kHardLinkToFile)) GTEST_SKIP() << skipReason;
    const std::string victimsBefore = testing_support::snapshotTree(dir / "victims");
    const UniqueFd fd = Storage::openRegularToWriteAt(directoryFd.get(), "entry", O_RDWR | O_CREAT, 0640);
    EXPECT_FALSE(fd);
    EXPECT_EQ(errno, EMLINK);
    EXPECT_FALSE(fs::exists(fs::symlink_status(dir / "entry")));
    EXPECT_EQ(testing_support::snapshotTree(dir / "victims"), victimsBefore);
    EXPECT_EQ(linksOf(victims.file()), 1U);
}

// A file with one name is opened as it is: truncated when asked, its bytes
// kept when not, and the same file either way.
TEST_F(UntrustedTree, AWriteOpensAFileOfOneNameInPlace) {
    testing_support::writeText(dir / "kept", "kept bytes");
    testing_support::writeText(dir / "cut", "cut bytes");
    struct stat keptBefore {};
    struct stat cutBefore {};
    ASSERT_EQ(::stat((dir / "kept").c_str(), &keptBefore), 0);
    ASSERT_EQ(::stat((dir / "cut").c_str(), &cutBefore), 0);

    const UniqueFd kept = Storage::openRegularToWriteAt(directoryFd.get(), "kept", O_RDWR, 0);
    ASSERT_TRUE(kept);
    const UniqueFd cut = Storage::openRegularToWriteAt(directoryFd.get(), "cut", O_WRONLY | O_TRUNC, 0);
    ASSERT_TRUE(cut);
    EXPECT_EQ(testing_support::readText(dir / "kept"), "kept bytes");
    EXPECT_EQ(testing_support::readText(dir / "cut"), "");
    struct stat keptAfter {};
    struct stat cutAfter {};
    ASSERT_EQ(::fstat(kept.get(), &keptAfter), 0);
    ASSERT_EQ(::fstat(cut.get(), &cutAfter), 0);
    EXPECT_EQ(keptAfter.st_ino, keptBefore.st_ino);
    EXPECT_EQ(cutAfter.st_ino, cutBefore.st_ino);
    EXPECT_NE(::fcntl(cut.get(), F_GETFD) & FD_CLOEXEC, 0);
}

// The write open refuses what is not a regular file as the read open does.
TEST_F(UntrustedTree, AWriteRefusesALinkWithoutTouchingItsTarget) {
    if (!planted("entry", Plant::kLinkToFile)) GTEST_SKIP() << skipReason;
    const std::string victimsBefore = testing_support::snapshotTree(dir / "victims");
    EXPECT_FALSE(Storage::openRegularToWriteAt(directoryFd.get(), "entry", O_WRONLY | O_CREAT | O_TRUNC, 0640));
    EXPECT_EQ(errno, ELOOP);
    EXPECT_EQ(testing_support::snapshotTree(dir / "victims"), victimsBefore);
}

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
