#include "lib/storage/mount_commands.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <string>

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

// One call through the stand-in commands: what the log shows at a
// threshold, and which commands ran, with the stand-ins told to succeed,
// fail, be killed or talk.
struct MountCase {
    const char* name;
    // Calls the function under test and prints each status.
    void (*act)();
    int threshold;
    std::map<std::string, std::string> env;
    // The child's standard output, storage line numbers as N.
    const char* out;
    const char* calls;
    const char* err = "";
};

void remountRw() { printStatus(Storage::remountBootPartition(true)); }
void remountRo() { printStatus(Storage::remountBootPartition(false)); }
void mountResources() { printStatus(Storage::mountPartition("/media/resources")); }
void unmountResources() { printStatus(Storage::unmountPartition("/media/resources")); }

const std::map<std::string, std::string> kSucceeds;
const std::map<std::string, std::string> kExits32 = {{"FAKE_MOUNT_EXIT", "32"}};
const std::map<std::string, std::string> kExits1 = {{"FAKE_MOUNT_EXIT", "1"}};
const std::map<std::string, std::string> kKilled = {{"FAKE_MOUNT_KILL", "1"}};

const MountCase kMountCases[] = {
    // ---- remountBootPartition ----
    {"RemountWritableRunsRemountRw", remountRw, LOG_PRIORITY_WARNING, kSucceeds,
     "Remounting \"/media/boot\" as rw\nstatus 0\n", "mount [-o] [remount,rw] [/media/boot]\n"},
    {"RemountReadOnlyRunsRemountRo", remountRo, LOG_PRIORITY_WARNING, kSucceeds,
     "Remounting \"/media/boot\" as ro\nstatus 0\n", "mount [-o] [remount,ro] [/media/boot]\n"},
    {"RemountNoNoticeBelowWarningPriority",
     [] {
         remountRw();
         remountRo();
     },
     LOG_PRIORITY_ERROR, kSucceeds, "status 0\nstatus 0\n",
     "mount [-o] [remount,rw] [/media/boot]\n"
     "mount [-o] [remount,ro] [/media/boot]\n"},
    {"RemountFailingMountIsFailed", remountRw, LOG_PRIORITY_WARNING, kExits32,
     "Remounting \"/media/boot\" as rw\n"
     "lib/storage/storage_target:N Failed to execute mount\n"
     "status 52\n",
     "mount [-o] [remount,rw] [/media/boot]\n"},
    {"RemountFailureStillLoggedAtErrorPriority", remountRo, LOG_PRIORITY_ERROR, kExits1,
     "lib/storage/storage_target:N Failed to execute mount\nstatus 52\n", "mount [-o] [remount,ro] [/media/boot]\n"},
    {"RemountNothingLoggedAtCriticalPriority", remountRo, LOG_PRIORITY_CRITICAL, kExits1, "status 52\n",
     "mount [-o] [remount,ro] [/media/boot]\n"},
    // Any failure of the command is STATUS_FAILED, a signal too.
    {"RemountKilledMountIsFailed", remountRw, LOG_PRIORITY_ERROR, kKilled,
     "lib/storage/storage_target:N Failed to execute mount\nstatus 52\n", "mount [-o] [remount,rw] [/media/boot]\n"},
    // ---- mountPartition ----
    {"MountRunsMountWithTheMountPointOnly", mountResources, LOG_PRIORITY_WARNING, kSucceeds,
     "Mounting \"/media/resources\"\nstatus 0\n", "mount [/media/resources]\n"},
    {"MountNoNoticeBelowWarningPriority", mountResources, LOG_PRIORITY_ERROR, kSucceeds, "status 0\n",
     "mount [/media/resources]\n"},
    {"MountFailingMountIsReported", mountResources, LOG_PRIORITY_WARNING, kExits32,
     "Mounting \"/media/resources\"\n"
     "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
     "status 52\n",
     "mount [/media/resources]\n"},
    {"MountFailureStillReportedAtErrorPriority", mountResources, LOG_PRIORITY_ERROR, kExits1,
     "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n", "mount [/media/resources]\n"},
    {"MountNoReportAtCriticalPriority", mountResources, LOG_PRIORITY_CRITICAL, kExits1, "status 52\n",
     "mount [/media/resources]\n"},
    {"MountKilledMountIsNotFound", mountResources, LOG_PRIORITY_WARNING, kKilled,
     "Mounting \"/media/resources\"\n"
     "[lib/storage/storage_target:N] err_code = 2 (STATUS_NOT_FOUND)\n"
     "status 2\n",
     "mount [/media/resources]\n"},
    // The command's standard output is captured and dropped; its standard
    // error is left alone.
    {"MountCommandOutputIsDiscarded",
     mountResources,
     LOG_PRIORITY_WARNING,
     {{"FAKE_MOUNT_STDOUT", "said on stdout"}, {"FAKE_MOUNT_STDERR", "said on stderr"}},
     "Mounting \"/media/resources\"\nstatus 0\n",
     "mount [/media/resources]\n",
     "said on stderr\n"},
    // The notice quotes the mount point; the command line carries it as it
    // stands, so the shell splits it.
    {"MountPointIsNotQuotedForTheShell",
     [] {
         printStatus(Storage::mountPartition("/media/two words"));
         printStatus(Storage::mountPartition("/media/\"q\""));
     },
     LOG_PRIORITY_WARNING, kSucceeds,
     "Mounting \"/media/two words\"\nstatus 0\n"
     "Mounting \"/media/\\\"q\\\"\"\nstatus 0\n",
     "mount [/media/two] [words]\nmount [/media/q]\n"},
    // ---- unmountPartition ----
    {"UnmountRunsUmountWithTheMountPointOnly", unmountResources, LOG_PRIORITY_WARNING, kSucceeds,
     "Unmounting \"/media/resources\"\nstatus 0\n", "umount [/media/resources]\n"},
    {"UnmountNoNoticeBelowWarningPriority", unmountResources, LOG_PRIORITY_ERROR, kSucceeds, "status 0\n",
     "umount [/media/resources]\n"},
    {"UnmountFailingUmountIsReported", unmountResources, LOG_PRIORITY_WARNING, kExits32,
     "Unmounting \"/media/resources\"\n"
     "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\n"
     "status 52\n",
     "umount [/media/resources]\n"},
    {"UnmountFailureStillReportedAtErrorPriority", unmountResources, LOG_PRIORITY_ERROR, kExits1,
     "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n", "umount [/media/resources]\n"},
    {"UnmountKilledUmountIsNotFound", unmountResources, LOG_PRIORITY_WARNING, kKilled,
     "Unmounting \"/media/resources\"\n"
     "[lib/storage/storage_target:N] err_code = 2 (STATUS_NOT_FOUND)\n"
     "status 2\n",
     "umount [/media/resources]\n"},
};

class MountCommands : public ::testing::TestWithParam<MountCase> {};

TEST_P(MountCommands, LogAndCommandsRun) {
    const MountCase& row = GetParam();
    FakeMountCommands fake;
    const auto result = fake.run(
        row.threshold,
        [&] {
            row.act();
            return 0;
        },
        row.env);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(withoutStorageLineNumbers(result.out), row.out);
    EXPECT_EQ(result.err, row.err);
    EXPECT_EQ(fake.calls(), row.calls);
}

INSTANTIATE_TEST_SUITE_P(StandInCommands, MountCommands, ::testing::ValuesIn(kMountCases),
                         [](const ::testing::TestParamInfo<MountCase>& info) { return std::string(info.param.name); });

// ---- without a mount command ----

// Runs `act` in a child whose PATH finds no mount command, the log on
// standard output.
testing_support::ProcessResult withoutMountCommand(void (*act)()) {
    ScratchDir empty;
    return runInChild([&] {
        setenv("PATH", empty.path().c_str(), 1);
        setLogOutput(LOG_OUTPUT_STDOUT);
        act();
        return 0;
    });
}

TEST(RemountBootPartition, MissingMountCommandIsFailed) {
    EXPECT_EQ(withoutStorageLineNumbers(withoutMountCommand(remountRw).out),
              "Remounting \"/media/boot\" as rw\nlib/storage/storage_target:N Failed to execute mount\nstatus 52\n");
}

TEST(MountPartition, MissingMountCommandIsFailed) {
    EXPECT_EQ(
        withoutStorageLineNumbers(withoutMountCommand(mountResources).out),
        "Mounting \"/media/resources\"\n[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n");
}

TEST(RemountBootPartition, MountPointConstant) { EXPECT_STREQ(Storage::kBootMountPoint, "/media/boot"); }

}  // namespace
