#include "lib/storage/mount_commands.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <string>
#include <tuple>

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

// ---- mountPartition and unmountPartition ----

// The two commands on a partition behave alike; each runs under every
// behaviour of the stand-in below.
struct PartitionCommand {
    const char* name;
    Status (*call)(const std::string& mountPoint);
    // The notice at warning priority, and the command's record.
    const char* notice;
    const char* calls;
};

const PartitionCommand kPartitionCommands[] = {
    {"Mount", Storage::mountPartition, "Mounting \"/media/resources\"\n", "mount [/media/resources]\n"},
    {"Unmount", Storage::unmountPartition, "Unmounting \"/media/resources\"\n", "umount [/media/resources]\n"},
};

// What the stand-in does and what the log shows after the notice, when the
// threshold lets the notice through.
struct StandIn {
    const char* name;
    int threshold;
    std::map<std::string, std::string> env;
    bool noticeShown;
    const char* afterNotice;
    const char* err = "";
};

const StandIn kStandIns[] = {
    {"RunsWithTheMountPointOnly", LOG_PRIORITY_WARNING, kSucceeds, true, "status 0\n"},
    {"NoNoticeBelowWarningPriority", LOG_PRIORITY_ERROR, kSucceeds, false, "status 0\n"},
    {"FailingCommandIsReported", LOG_PRIORITY_WARNING, kExits32, true,
     "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n"},
    {"FailureStillReportedAtErrorPriority", LOG_PRIORITY_ERROR, kExits1, false,
     "[lib/storage/storage_target:N] err_code = 52 (STATUS_FAILED)\nstatus 52\n"},
    {"NoReportAtCriticalPriority", LOG_PRIORITY_CRITICAL, kExits1, false, "status 52\n"},
    {"KilledCommandIsNotFound", LOG_PRIORITY_WARNING, kKilled, true,
     "[lib/storage/storage_target:N] err_code = 2 (STATUS_NOT_FOUND)\nstatus 2\n"},
    // The command's standard output is captured and dropped; its standard
    // error is left alone.
    {"CommandOutputIsDiscarded",
     LOG_PRIORITY_WARNING,
     {{"FAKE_MOUNT_STDOUT", "said on stdout"}, {"FAKE_MOUNT_STDERR", "said on stderr"}},
     true,
     "status 0\n",
     "said on stderr\n"},
};

class PartitionCommands : public ::testing::TestWithParam<std::tuple<PartitionCommand, StandIn>> {};

TEST_P(PartitionCommands, LogAndCommandsRun) {
    const PartitionCommand& command = std::get<0>(GetParam());
    const StandIn& standIn = std::get<1>(GetParam());
    FakeMountCommands fake;
    const auto result = fake.run(
        standIn.threshold, [&] { return printStatus(command.call("/media/resources")); }, standIn.env);
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(withoutStorageLineNumbers(result.out),
              std::string(standIn.noticeShown ? command.notice : "") + standIn.afterNotice);
    EXPECT_EQ(result.err, standIn.err);
    EXPECT_EQ(fake.calls(), command.calls);
}

INSTANTIATE_TEST_SUITE_P(StandInCommands, PartitionCommands,
                         ::testing::Combine(::testing::ValuesIn(kPartitionCommands), ::testing::ValuesIn(kStandIns)),
                         [](const ::testing::TestParamInfo<std::tuple<PartitionCommand, StandIn>>& info) {
                             return std::string(std::get<0>(info.param).name) + std::get<1>(info.param).name;
                         });

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
