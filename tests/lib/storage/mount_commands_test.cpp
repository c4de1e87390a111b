#include "lib/storage/mount_commands.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>

#include <gtest/gtest.h>

#include "child_process.h"
#include "fake_mount_commands.h"
#include "lib/util/log.h"
#include "scratch_dir.h"
#include "storage_log.h"

namespace {

namespace fs = std::filesystem;
using testing_support::FakeMountCommands;
using testing_support::runInChild;
using testing_support::ScratchDir;
using testing_support::withoutStorageLineNumbers;

int printStatus(Status status) {
    std::printf("status %u\n", status);
    return 0;
}

// ---- remountBootPartition ----

TEST(RemountBootPartition, WritableRunsRemountRw) {
    FakeMountCommands fake;
    const auto result = fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::remountBootPartition(true)); });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "Remounting \"/media/boot\" as rw\nstatus 0\n");
    EXPECT_EQ(fake.calls(), "mount [-o] [remount,rw] [/media/boot]\n");
}

TEST(RemountBootPartition, ReadOnlyRunsRemountRo) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::remountBootPartition(false)); });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "Remounting \"/media/boot\" as ro\nstatus 0\n");
    EXPECT_EQ(fake.calls(), "mount [-o] [remount,ro] [/media/boot]\n");
}

TEST(RemountBootPartition, NoNoticeBelowWarningPriority) {
    FakeMountCommands fake;
    const auto result = fake.run(LOG_PRIORITY_ERROR, [] {
        printStatus(Storage::remountBootPartition(true));
        return printStatus(Storage::remountBootPartition(false));
    });
    EXPECT_EQ(result.out, "status 0\nstatus 0\n");
    EXPECT_EQ(fake.calls(), "mount [-o] [remount,rw] [/media/boot]\nmount [-o] [remount,ro] [/media/boot]\n");
}

TEST(RemountBootPartition, FailingMountIsFailed) {
    FakeMountCommands fake;
    const auto result = fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::remountBootPartition(true)); },
                                 {{"FAKE_MOUNT_EXIT", "32"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "Remounting \"/media/boot\" as rw\n"
              "lib/storage/storage_target:N Failed to execute mount\n"
              "status 52\n");
    EXPECT_EQ(fake.calls(), "mount [-o] [remount,rw] [/media/boot]\n");
}

TEST(RemountBootPartition, FailureStillLoggedAtErrorPriority) {
    FakeMountCommands fake;
    const auto result = fake.run(LOG_PRIORITY_ERROR, [] { return printStatus(Storage::remountBootPartition(false)); },
                                 {{"FAKE_MOUNT_EXIT", "1"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "lib/storage/storage_target:N Failed to execute mount\nstatus 52\n");
}

TEST(RemountBootPartition, NothingLoggedAtCriticalPriority) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_CRITICAL, [] { return printStatus(Storage::remountBootPartition(false)); },
                 {{"FAKE_MOUNT_EXIT", "1"}});
    EXPECT_EQ(result.out, "status 52\n");
}

// Any failure of the command is STATUS_FAILED, a signal too.
TEST(RemountBootPartition, KilledMountIsFailed) {
    FakeMountCommands fake;
    const auto result = fake.run(LOG_PRIORITY_ERROR, [] { return printStatus(Storage::remountBootPartition(true)); },
                                 {{"FAKE_MOUNT_KILL", "1"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "lib/storage/storage_target:N Failed to execute mount\nstatus 52\n");
    EXPECT_EQ(fake.calls(), "mount [-o] [remount,rw] [/media/boot]\n");
}

TEST(RemountBootPartition, MissingMountCommandIsFailed) {
    ScratchDir empty;
    const auto result = runInChild([&] {
        setenv("PATH", empty.path().c_str(), 1);
        setLogOutput(LOG_OUTPUT_STDOUT);
        return printStatus(Storage::remountBootPartition(true));
    });
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "Remounting \"/media/boot\" as rw\nlib/storage/storage_target:N Failed to execute mount\nstatus 52\n");
}

TEST(RemountBootPartition, MountPointConstant) { EXPECT_STREQ(Storage::kBootMountPoint, "/media/boot"); }

// ---- mountPartition and unmountPartition ----

TEST(MountPartition, RunsMountWithTheMountPointOnly) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::mountPartition("/media/resources")); });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "Mounting \"/media/resources\"\nstatus 0\n");
    EXPECT_EQ(fake.calls(), "mount [/media/resources]\n");
}

TEST(MountPartition, NoNoticeBelowWarningPriority) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_ERROR, [] { return printStatus(Storage::mountPartition("/media/resources")); });
    EXPECT_EQ(result.out, "status 0\n");
    EXPECT_EQ(fake.calls(), "mount [/media/resources]\n");
}

TEST(MountPartition, FailingMountIsReported) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::mountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_EXIT", "32"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "Mounting \"/media/resources\"\n"
              "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
              "status 52\n");
}

TEST(MountPartition, FailureStillReportedAtErrorPriority) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_ERROR, [] { return printStatus(Storage::mountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_EXIT", "1"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n");
}

TEST(MountPartition, NoReportAtCriticalPriority) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_CRITICAL, [] { return printStatus(Storage::mountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_EXIT", "1"}});
    EXPECT_EQ(result.out, "status 52\n");
}

TEST(MountPartition, KilledMountIsNotFound) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::mountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_KILL", "1"}});
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "Mounting \"/media/resources\"\n"
              "[lib/storage/storage_target:N] err_code = 2 (STATUS_NOT_FOUND)\n"
              "status 2\n");
    EXPECT_EQ(fake.calls(), "mount [/media/resources]\n");
}

TEST(MountPartition, MissingMountCommandIsFailed) {
    ScratchDir empty;
    const auto result = runInChild([&] {
        setenv("PATH", empty.path().c_str(), 1);
        setLogOutput(LOG_OUTPUT_STDOUT);
        return printStatus(Storage::mountPartition("/media/resources"));
    });
    EXPECT_EQ(
        withoutStorageLineNumbers(result.out),
        "Mounting \"/media/resources\"\n[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n");
}

// The command's standard output is captured and dropped; its standard
// error is left alone.
TEST(MountPartition, CommandOutputIsDiscarded) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::mountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_STDOUT", "said on stdout"}, {"FAKE_MOUNT_STDERR", "said on stderr"}});
    EXPECT_EQ(result.out, "Mounting \"/media/resources\"\nstatus 0\n");
    EXPECT_EQ(result.err, "said on stderr\n");
}

// The notice quotes the mount point; the command line carries it as it
// stands, so the shell splits it.
TEST(MountPartition, MountPointIsNotQuotedForTheShell) {
    FakeMountCommands fake;
    const auto result = fake.run(LOG_PRIORITY_WARNING, [] {
        printStatus(Storage::mountPartition("/media/two words"));
        return printStatus(Storage::mountPartition("/media/\"q\""));
    });
    EXPECT_EQ(result.out,
              "Mounting \"/media/two words\"\nstatus 0\n"
              "Mounting \"/media/\\\"q\\\"\"\nstatus 0\n");
    EXPECT_EQ(fake.calls(), "mount [/media/two] [words]\nmount [/media/q]\n");
}

TEST(UnmountPartition, RunsUmountWithTheMountPointOnly) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::unmountPartition("/media/resources")); });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "Unmounting \"/media/resources\"\nstatus 0\n");
    EXPECT_EQ(fake.calls(), "umount [/media/resources]\n");
}

TEST(UnmountPartition, NoNoticeBelowWarningPriority) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_ERROR, [] { return printStatus(Storage::unmountPartition("/media/resources")); });
    EXPECT_EQ(result.out, "status 0\n");
    EXPECT_EQ(fake.calls(), "umount [/media/resources]\n");
}

TEST(UnmountPartition, FailingUmountIsReported) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::unmountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_EXIT", "32"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "Unmounting \"/media/resources\"\n"
              "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
              "status 52\n");
    EXPECT_EQ(fake.calls(), "umount [/media/resources]\n");
}

TEST(UnmountPartition, FailureStillReportedAtErrorPriority) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_ERROR, [] { return printStatus(Storage::unmountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_EXIT", "1"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n");
}

TEST(UnmountPartition, KilledUmountIsNotFound) {
    FakeMountCommands fake;
    const auto result =
        fake.run(LOG_PRIORITY_WARNING, [] { return printStatus(Storage::unmountPartition("/media/resources")); },
                 {{"FAKE_MOUNT_KILL", "1"}});
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              "Unmounting \"/media/resources\"\n"
              "[lib/storage/storage_target:N] err_code = 2 (STATUS_NOT_FOUND)\n"
              "status 2\n");
}

}  // namespace
