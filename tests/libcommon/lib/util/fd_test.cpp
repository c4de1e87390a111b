#include "lib/util/fd.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <cerrno>
#include <cstdio>
#include <functional>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "lib/util/log.h"
#include "scratch_dir.h"
#include "source_lines.h"

namespace {

using testing_support::ProcessResult;
using testing_support::readText;
using testing_support::runInChild;
using testing_support::ScratchDir;
using testing_support::writeText;

// Line of the LOGE statement in libcommon/lib/util/fd.cpp; scripts match on it.
const std::string kOpenFailurePrefix = testing_support::openFailurePrefix();

static_assert(!std::is_copy_constructible_v<UniqueFd>);
static_assert(!std::is_copy_assignable_v<UniqueFd>);
static_assert(std::is_nothrow_move_constructible_v<UniqueFd>);
static_assert(std::is_nothrow_move_assignable_v<UniqueFd>);

int openDevNull() { return ::open("/dev/null", O_RDONLY | O_CLOEXEC); }

bool isOpen(int fd) { return fcntl(fd, F_GETFD) != -1; }

// True when `fd` is closed: fcntl reports EBADF.
bool isClosed(int fd) {
    errno = 0;
    return fcntl(fd, F_GETFD) == -1 && errno == EBADF;
}

TEST(UniqueFd, DefaultHoldsNothing) {
    const UniqueFd fd;
    EXPECT_EQ(fd.get(), -1);
    EXPECT_FALSE(fd.valid());
    EXPECT_FALSE(static_cast<bool>(fd));
}

TEST(UniqueFd, DestructionCloses) {
    const int raw = openDevNull();
    ASSERT_GE(raw, 0);
    {
        const UniqueFd fd(raw);
        EXPECT_EQ(fd.get(), raw);
        EXPECT_TRUE(fd.valid());
        EXPECT_TRUE(static_cast<bool>(fd));
        EXPECT_TRUE(isOpen(raw));
    }
    EXPECT_TRUE(isClosed(raw));
}

TEST(UniqueFd, DescriptorZeroIsClosedToo) {
    const ProcessResult result = runInChild([] {
        if (!isOpen(0)) return 2;
        { const UniqueFd fd(0); }
        return isClosed(0) ? 0 : 1;
    });
    EXPECT_EQ(result.exitStatus, 0);
}

TEST(UniqueFd, MoveConstructionTransfersOwnership) {
    const int raw = openDevNull();
    ASSERT_GE(raw, 0);
    {
        UniqueFd source(raw);
        {
            const UniqueFd target(std::move(source));
            EXPECT_EQ(target.get(), raw);
            EXPECT_EQ(source.get(), -1);  // NOLINT(bugprone-use-after-move)
            EXPECT_FALSE(source.valid());
        }
        EXPECT_TRUE(isClosed(raw));
    }
}

TEST(UniqueFd, MovedFromDoesNotCloseOnDestruction) {
    const int raw = openDevNull();
    ASSERT_GE(raw, 0);
    UniqueFd target;
    {
        UniqueFd source(raw);
        target = std::move(source);
    }
    EXPECT_TRUE(isOpen(raw));
    EXPECT_EQ(target.get(), raw);
}

// Two descriptors of /dev/null, open when a test starts.
class UniqueFdOfTwo : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_GE(first, 0);
        ASSERT_GE(second, 0);
    }

    const int first = openDevNull();
    const int second = openDevNull();
};

TEST_F(UniqueFdOfTwo, MoveAssignmentClosesThePreviousDescriptor) {
    UniqueFd target(first);
    UniqueFd source(second);
    target = std::move(source);
    EXPECT_TRUE(isClosed(first));
    EXPECT_TRUE(isOpen(second));
    EXPECT_EQ(target.get(), second);
    EXPECT_EQ(source.get(), -1);  // NOLINT(bugprone-use-after-move)
}

TEST(UniqueFd, SelfMoveAssignmentKeepsTheDescriptor) {
    const int raw = openDevNull();
    ASSERT_GE(raw, 0);
    UniqueFd fd(raw);
    UniqueFd& alias = fd;
    fd = std::move(alias);
    EXPECT_EQ(fd.get(), raw);
    EXPECT_TRUE(isOpen(raw));
}

TEST(UniqueFd, ReleaseGivesUpOwnershipWithoutClosing) {
    const int raw = openDevNull();
    ASSERT_GE(raw, 0);
    {
        UniqueFd fd(raw);
        EXPECT_EQ(fd.release(), raw);
        EXPECT_EQ(fd.get(), -1);
        EXPECT_EQ(fd.release(), -1);
    }
    EXPECT_TRUE(isOpen(raw));
    EXPECT_EQ(::close(raw), 0);
}

TEST_F(UniqueFdOfTwo, ResetClosesAndTakesTheNewDescriptor) {
    UniqueFd fd(first);
    fd.reset(second);
    EXPECT_TRUE(isClosed(first));
    EXPECT_EQ(fd.get(), second);
    EXPECT_TRUE(isOpen(second));
    fd.reset();
    EXPECT_TRUE(isClosed(second));
    EXPECT_EQ(fd.get(), -1);
    fd.reset();
    EXPECT_EQ(fd.get(), -1);
}

// ---------------------------------------------------------------------------
// openFd

// Runs `body` in a child logging to standard output with `threshold`.
ProcessResult inLoggingChild(int threshold, const std::function<int()>& body) {
    return runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(threshold);
        return body();
    });
}

TEST(OpenFd, MissingFileLogsAndReturnsEmptyWithEnoent) {
    const ScratchDir dir;
    const std::string path = (dir / "missing").string();
    const ProcessResult result = inLoggingChild(4, [&] {
        errno = 0;
        const UniqueFd fd = openFd(path.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd.valid() || fd.get() != -1) return 1;
        return errno == ENOENT ? 0 : 2;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, kOpenFailurePrefix + path + ": No such file or directory\n");
    EXPECT_EQ(result.err, "");
}

TEST(OpenFd, FailureIsLoggedAtErrorPriority) {
    const ScratchDir dir;
    const std::string path = (dir / "missing").string();
    for (const int threshold : {2, 3}) {
        const ProcessResult result = inLoggingChild(threshold, [&] {
            const UniqueFd fd = openFd(path.c_str(), O_RDONLY | O_CLOEXEC);
            return fd.valid() ? 1 : 0;
        });
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.out, threshold >= 3 ? kOpenFailurePrefix + path + ": No such file or directory\n" : "")
            << "threshold " << threshold;
    }
}

struct FailureRow {
    std::string path;
    int flags;
    int expectedErrno;
    std::string text;
};

TEST(OpenFd, EachFailureNamesItsError) {
    const ScratchDir dir;
    writeText(dir / "file", "x");
    const std::vector<FailureRow> rows = {
        {(dir / "missing").string(), O_RDONLY | O_CLOEXEC, ENOENT, "No such file or directory"},
        {(dir / "file" / "below").string(), O_RDONLY | O_CLOEXEC, ENOTDIR, "Not a directory"},
        {dir.path().string(), O_WRONLY | O_CLOEXEC, EISDIR, "Is a directory"},
        {(dir / "file").string(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, EEXIST, "File exists"},
    };
    for (const FailureRow& row : rows) {
        const ProcessResult result = inLoggingChild(4, [&] {
            errno = 0;
            const UniqueFd fd = openFd(row.path.c_str(), row.flags, 0666);
            if (fd.valid()) return 1;
            return errno == row.expectedErrno ? 0 : 2;
        });
        EXPECT_EQ(result.exitStatus, 0) << row.path;
        EXPECT_EQ(result.out, kOpenFailurePrefix + row.path + ": " + row.text + "\n");
    }
}

TEST(OpenFd, ErrnoSurvivesAFailingLogWrite) {
    const ScratchDir dir;
    writeText(dir / "file", "x");
    const std::string path = (dir / "file" / "below").string();
    const ProcessResult result = runInChild([&] {
        // The log line's write fails with EBADF; errno must still be open's.
        setLogOutput(LOG_OUTPUT_STDERR);
        ::close(2);
        errno = 0;
        const UniqueFd fd = openFd(path.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd.valid()) return 1;
        return errno == ENOTDIR ? 0 : 2;
    });
    EXPECT_EQ(result.exitStatus, 0);
}

TEST(OpenFd, LogOpenFailureWritesTheGivenError) {
    const ProcessResult result = inLoggingChild(4, [] {
        logOpenFailure("/some/path", EACCES);
        logOpenFailure("relative", EROFS);
        return 0;
    });
    EXPECT_EQ(result.out, kOpenFailurePrefix + "/some/path: Permission denied\n" + kOpenFailurePrefix +
                              "relative: Read-only file system\n");
}

TEST(OpenFd, SuccessKeepsCloseOnExecAndLogsNothing) {
    const ScratchDir dir;
    writeText(dir / "data", "content");
    const std::string path = (dir / "data").string();
    const ProcessResult result = inLoggingChild(7, [&] {
        const UniqueFd withCloexec = openFd(path.c_str(), O_RDONLY | O_CLOEXEC);
        if (!withCloexec) return 1;
        if ((fcntl(withCloexec.get(), F_GETFD) & FD_CLOEXEC) == 0) return 2;
        char buffer[16];
        if (::read(withCloexec.get(), buffer, sizeof buffer) != 7 || std::string(buffer, 7) != "content") return 3;
        const UniqueFd synced = openFd(path.c_str(), O_RDONLY | O_CLOEXEC | O_SYNC);
        if (!synced) return 4;
        if ((fcntl(synced.get(), F_GETFL) & O_SYNC) != O_SYNC) return 5;
        if ((fcntl(withCloexec.get(), F_GETFL) & O_SYNC) == O_SYNC) return 6;
        return 0;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
}

TEST(OpenFd, CreatePassesFlagsAndMode) {
    const ScratchDir dir;
    writeText(dir / "existing", "old content");
    const std::string created = (dir / "created").string();
    const std::string existing = (dir / "existing").string();
    const ProcessResult result = inLoggingChild(4, [&] {
        umask(0);
        {
            const UniqueFd fd = openFd(created.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
            if (!fd || ::write(fd.get(), "new", 3) != 3) return 1;
            const int accessMode = fcntl(fd.get(), F_GETFL) & O_ACCMODE;
            if (accessMode != O_WRONLY) return 2;
        }
        {
            const UniqueFd fd = openFd(existing.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0640);
            if (!fd) return 3;
        }
        umask(022);
        const UniqueFd masked = openFd((created + ".masked").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0666);
        return masked ? 0 : 4;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(readText(created), "new");
    EXPECT_EQ(readText(existing), "");  // truncated
    struct stat info {};
    ASSERT_EQ(::stat(created.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0666u);
    ASSERT_EQ(::stat((created + ".masked").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0644u);
}

}  // namespace
