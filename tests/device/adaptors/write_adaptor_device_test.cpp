#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <regex>
#include <string>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "lib/storage/dual_file_target.h"
#include "lib/storage/write_adaptors.h"
#include "lib/util/log.h"
#include "simulated_device.h"
#include "store_files.h"

namespace {

namespace fs = std::filesystem;
using simulated_device::kBootMount;
using Storage::DualFileTarget;
using Storage::PartitionWriteAdaptor;
using Storage::SlotHandle;
using store_test::Bytes;
using testing_support::ProcessResult;
using testing_support::runShell;

const fs::path kStore = "/media/boot/store";

std::string bootState() { return simulated_device::toString(simulated_device::mountState(kBootMount)); }

// "<source>:N " where the line number is not a fixed one.
std::string withoutLineNumbers(const std::string& text) {
    static const std::regex prefix("^(lib/storage/write_adaptors|libcommon/lib/util/fd):[0-9]+ ",
                                   std::regex::multiline);
    return std::regex_replace(text, prefix, "$1:N ");
}

// The status of a step and the boot partition's mode right after it.
void report(const char* step, Status status) {
    const std::string state = bootState();
    std::printf("%s -> %u, %s\n", step, status, state.c_str());
}

// A one-slot store in a directory of the read-only boot partition.
class WriteAdaptorOnDevice : public ::testing::Test {
protected:
    void SetUp() override {
        SKIP_UNLESS_ON_SIMULATED_DEVICE();
        ASSERT_EQ(bootState(), "read-only");
        const ProcessResult made = runShell(
            "mount -o remount,rw /media/boot && rm -rf /media/boot/store && "
            "mkdir /media/boot/store && mount -o remount,ro /media/boot");
        ASSERT_EQ(made.exitStatus, 0) << made.err;
        ASSERT_EQ(bootState(), "read-only");
    }

    // Runs `body` in a child with log lines on its standard output; the
    // child's exit status is body's Status.
    static ProcessResult run(const std::function<Status()>& body) {
        return testing_support::runInChild([&] {
            setLogOutput(LOG_OUTPUT_STDOUT);
            return static_cast<int>(body());
        });
    }

    // Commits `older`, then `blob` through the adaptor: copy 1 holds
    // `older`, copy 0 `blob`, which is current.
    void commitBothCopies() {
        const ProcessResult result = run([&] {
            PartitionWriteAdaptor<DualFileTarget> store(kBootMount, kStore, 1);
            const Status first = store.getSlot(0)->write(older.data(), older.size());
            return first != STATUS_OK ? first : store.getSlot(0)->write(blob.data(), blob.size());
        });
        ASSERT_EQ(result.exitStatus, 0) << result.out;
        ASSERT_EQ(result.out, "");
        ASSERT_EQ(bootState(), "read-only");
        ASSERT_EQ(describeStore(), expectedBothCopies());
    }

    std::string expectedBothCopies() const {
        return "d 1\nd 2\n" + store_test::copyLines("1", blob) + store_test::copyLines("2", older);
    }

    void expectBothCopiesUnchanged() const {
        EXPECT_EQ(describeStore(), expectedBothCopies());
        DualFileTarget reopened(kStore, 1);
        EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), store_test::holding(blob));
    }

    static std::string describeStore() { return store_test::describeTree(kStore); }

    const Bytes older = store_test::bytesOf("older settings");
    const Bytes blob = store_test::bytesOf("settings on the boot partition");
    const Bytes third = store_test::bytesOf("never stored");
};

TEST_F(WriteAdaptorOnDevice, WriteSucceedsAndThePartitionIsReadOnlyAgain) {
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store(kBootMount, kStore, 1);
        return store.getSlot(0)->write(blob.data(), blob.size());
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.signal, 0);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(bootState(), "read-only");
    // A fresh store writes copy 1; copy 0's directory could not be made
    // while the store was opened on the read-only partition.
    EXPECT_EQ(describeStore(), "d 2\n" + store_test::copyLines("2", blob));
    DualFileTarget reopened(kStore, 1);
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), store_test::holding(blob));
}

// The partition is writable from beginWrite to finalise, and only then.
TEST_F(WriteAdaptorOnDevice, IncrementalWriteHoldsThePartitionWritable) {
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store(kBootMount, kStore, 1);
        SlotHandle slot = store.getSlot(0);
        report("before", STATUS_OK);
        report("beginWrite", slot->beginWrite());
        report("writeAt", slot->writeAt(0, blob.data(), blob.size()));
        report("finalise", slot->finalise());
        return STATUS_OK;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.signal, 0);
    EXPECT_EQ(result.out,
              "before -> 0, read-only\n"
              "beginWrite -> 0, read-write\n"
              "writeAt -> 0, read-write\n"
              "finalise -> 0, read-only\n");
    EXPECT_EQ(result.err, "");
    DualFileTarget reopened(kStore, 1);
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), store_test::holding(blob));
}

TEST_F(WriteAdaptorOnDevice, AdaptorLeftWritableIsReadOnlyAfterDestruction) {
    const ProcessResult result = run([&] {
        {
            PartitionWriteAdaptor<DualFileTarget> store(kBootMount, kStore, 1);
            report("beginWrite", store.getSlot(0)->beginWrite());
        }
        report("destroyed", STATUS_OK);
        return STATUS_OK;
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "beginWrite -> 0, read-write\ndestroyed -> 0, read-only\n");
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(bootState(), "read-only");
}

// With both copies committed, the bare store's first change, removing the
// pending copy's check file, meets the read-only file system.
TEST_F(WriteAdaptorOnDevice, BareStoreOnTheReadOnlyPartitionFailsWithEROFS) {
    ASSERT_NO_FATAL_FAILURE(commitBothCopies());
    const ProcessResult result = run([&] {
        DualFileTarget store(kStore, 1);
        return store.getSlot(0)->write(third.data(), third.size());
    });
    EXPECT_EQ(result.exitStatus, EROFS);
    EXPECT_EQ(result.signal, 0);
    EXPECT_EQ(result.out, "lib/storage/storage_target:378 generic:30\n");
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(bootState(), "read-only");
    expectBothCopiesUnchanged();
}

// In a fresh store the directory of the pending copy cannot be made, and
// the store reports the failed open of its data file as STATUS_FAILED.
TEST_F(WriteAdaptorOnDevice, BareFreshStoreOnTheReadOnlyPartitionFails) {
    const ProcessResult result = run([&] {
        DualFileTarget store(kStore, 1);
        return store.getSlot(0)->write(blob.data(), blob.size());
    });
    EXPECT_EQ(result.exitStatus, STATUS_FAILED);
    EXPECT_EQ(result.signal, 0);
    EXPECT_EQ(withoutLineNumbers(result.out),
              "lib/storage/storage_target:410 30\n"
              "libcommon/lib/util/fd:N Failed to open /media/boot/store/2/data: No such file or directory\n");
    EXPECT_EQ(bootState(), "read-only");
    EXPECT_EQ(describeStore(), "");
}

// A mount point that is not one: both remounts fail and are logged, and
// the write fails with the file system's own error in between.
TEST_F(WriteAdaptorOnDevice, FailedRemountLeavesTheWriteToFailWithEROFS) {
    ASSERT_NO_FATAL_FAILURE(commitBothCopies());
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store("/media/static", kStore, 1);
        return store.getSlot(0)->write(third.data(), third.size());
    });
    EXPECT_EQ(result.exitStatus, EROFS);
    EXPECT_EQ(result.signal, 0);
    EXPECT_EQ(withoutLineNumbers(result.out),
              "lib/storage/write_adaptors:N Failed to set \"/media/static\" to writable\n"
              "lib/storage/storage_target:378 generic:30\n"
              "lib/storage/write_adaptors:N Failed to set \"/media/static\" to not writable\n");
    EXPECT_EQ(bootState(), "read-only");
    expectBothCopiesUnchanged();
}

}  // namespace
