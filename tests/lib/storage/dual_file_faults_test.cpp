// The dual-file store's failure paths and power cuts, reached by running
// dual_file_driver under the fault-injection shim: a chosen call fails with
// an errno, or the process is killed at it.
#include <algorithm>
#include <csignal>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "dual_file_test_names.h"
#include "fault_injection.h"
#include "files.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"
#include "source_lines.h"
#include "store_files.h"
#include "without_openat2.h"

namespace {

using namespace dual_file_test;
using testing_support::Environment;
using testing_support::faultCountEnv;
using testing_support::faultEnv;
using testing_support::faultFromEnv;
using testing_support::ProcessResult;
using testing_support::readFaultCount;

// Without openat2 (qemu-user), the first read of a store tries it once, fails
// with ENOSYS and goes through the directories from then on: the open of
// the first check file read is counted twice, and the directories on the
// way are opened.
unsigned long firstReadTries() { return testing_support::openat2Available() ? 1 : 2; }

std::string stateLine(const SlotContent& content) {
    return "state: exists=" + std::to_string(content.exists ? 1 : 0) +
           " valid=" + std::to_string(content.valid ? 1 : 0) + " read=" + std::to_string(content.status) +
           " data=" + hex(content.data) + "\n";
}

std::string shortWriteLine(const std::string& path, size_t written, size_t size) {
    return testing_support::errorPrefixOf("lib/storage/storage_target.cpp", "\"Short write to \" <<") +
           "Short write to \"" + path + "\": " + std::to_string(written) + " of " + std::to_string(size) + " bytes\n";
}

class DualFileFaults : public ::testing::Test {
protected:
    fs::path base() const { return dir / "store"; }
    // Directory of one slot of a target with `slots` slots.
    fs::path slotDir(size_t slots, size_t slot) const { return slots == 1 ? base() : base() / std::to_string(slot); }
    std::string path(const std::string& relative) const { return (base() / relative).string(); }

    // An input file for the driver, outside the store.
    std::string input(const Bytes& bytes) {
        const fs::path file = dir / ("input-" + std::to_string(inputs++));
        testing_support::writeBytes(file, bytes);
        return file.string();
    }

    ProcessResult drive(const std::vector<std::string>& steps, const Environment& env = {}, size_t slots = 1,
                        size_t slot = 0) {
        std::vector<std::string> argv = {DUAL_FILE_DRIVER, base().string(), std::to_string(slots),
                                         std::to_string(slot)};
        argv.insert(argv.end(), steps.begin(), steps.end());
        return testing_support::runProgram(argv, env);
    }
    ProcessResult driveAtLevel(int level, const std::vector<std::string>& steps, const Environment& env) {
        std::vector<std::string> argv = {DUAL_FILE_DRIVER, "-l", std::to_string(level), base().string(), "1", "0"};
        argv.insert(argv.end(), steps.begin(), steps.end());
        return testing_support::runProgram(argv, env);
    }

    // How many calls matching `call` on paths containing `substr` the steps
    // make, opening included.
    unsigned long countCalls(const std::string& call, const std::string& substr,
                             const std::vector<std::string>& steps) {
        const fs::path countFile = dir / "count";
        const ProcessResult result = drive(steps, faultCountEnv(call, countFile.string(), substr));
        EXPECT_EQ(result.exitStatus, 0) << result.out << result.err;
        return readFaultCount(countFile);
    }

    SlotContent reopened(size_t slots = 1, size_t slot = 0) {
        Storage::DualFileTarget target(base(), slots);
        return contentOf(*target.getSlot(slot).get());
    }

    // Opened afresh, without the shim, by a new driver and by this process.
    void expectReopenedAs(const SlotContent& content) {
        const ProcessResult result = drive({});
        EXPECT_EQ(result.out, stateLine(content));
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(reopened(), content);
    }

    // An update that failed and kept `old_`: exit status 1, the driver's
    // output `out` then the state it still saw, copy 0 left holding `copy0`
    // beside copy 1's `old_`, and a fresh open reading `old_`.
    void expectUpdateFailedKeepingOld(const ProcessResult& result, const std::string& out, const Bytes& copy0) {
        EXPECT_EQ(result.exitStatus, 1);
        EXPECT_EQ(result.out, out + stateLine(holding(old_)));
        EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(copy0) + "\n" + copyLines("2", old_));
        expectReopenedAs(holding(old_));
    }

    // Copy 0 holds `older_`, copy 1 the current `old_` (its check file is
    // newer): every update goes to copy 0, "1/data".
    void prepare(int64_t currentCheckTime = kPast + kSecond) {
        store_test::writeCopy(base() / "1", older_, kPast);
        store_test::writeCopy(base() / "2", old_, currentCheckTime);
    }

    ScratchDir dir;
    int inputs = 0;
    const Bytes older_ = bytesOf("the older blob");
    const Bytes old_ = patternBytes(300, 21);
    const Bytes new_ = patternBytes(700, 22);
};

// ---- the check value's transient file ----

TEST_F(DualFileFaults, TransientFileCannotBeOpened) {
    prepare();
    const ProcessResult result =
        drive({"write", input(new_)}, faultEnv("open", 1, "errno:EIO", path("1/data.chk.tmp")));
    expectUpdateFailedKeepingOld(result,
                                 kOpenFailure + path("1/data.chk.tmp") +
                                     ": Input/output error\n"
                                     "lib/storage/storage_target:461 finalise: write failed: 9: Bad file descriptor\n"
                                     "write: 52\n",
                                 new_);
}

class CheckValueWriteFails : public DualFileFaults,
                             public ::testing::WithParamInterface<std::pair<const char*, const char*>> {};

TEST_P(CheckValueWriteFails, TransientFileIsRemoved) {
    prepare();
    const std::string errorName = GetParam().first;
    const ProcessResult result =
        drive({"write", input(new_)}, faultEnv("write", 1, "errno:" + errorName, path("1/data.chk.tmp")));
    expectUpdateFailedKeepingOld(
        result,
        std::string("lib/storage/storage_target:461 finalise: write failed: ") + GetParam().second + "\nwrite: 52\n",
        new_);
}

INSTANTIATE_TEST_SUITE_P(Errors, CheckValueWriteFails,
                         ::testing::Values(std::make_pair("EIO", "5: Input/output error"),
                                           std::make_pair("ENOSPC", "28: No space left on device"),
                                           std::make_pair("EDQUOT", "122: Disk quota exceeded")),
                         [](const auto& info) { return std::string(info.param.first); });

// Error lines follow the threshold; the result does not.
TEST_F(DualFileFaults, BelowTheErrorThresholdNothingIsLogged) {
    prepare();
    const ProcessResult result =
        driveAtLevel(2, {"write", input(new_)}, faultEnv("write", 1, "errno:EIO", path("1/data.chk.tmp")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "write: 52\n" + stateLine(holding(old_)));
    expectReopenedAs(holding(old_));
}

TEST_F(DualFileFaults, ShortCheckValueWrite) {
    prepare();
    const ProcessResult result = drive({"write", input(new_)}, faultEnv("write", 1, "short:3", path("1/data.chk.tmp")));
    expectUpdateFailedKeepingOld(result, "lib/storage/storage_target:465 Failed to write expected data: 3\nwrite: 52\n",
                                 new_);
}

// ---- installing the check file ----

class RenameFails : public DualFileFaults, public ::testing::WithParamInterface<std::pair<const char*, int>> {};

TEST_P(RenameFails, ReturnsItsErrnoAndKeepsTheOldCopy) {
    prepare();
    const ProcessResult result =
        drive({"write", input(new_)}, faultEnv("rename", 1, std::string("errno:") + GetParam().first, path("1/data")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "write: " + std::to_string(GetParam().second) + "\n" + stateLine(holding(old_)));
    // The check value never reached its real name.
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(new_) + "\nf 1/data.chk.tmp " +
                                        hex(expectedCheckFile(new_)) + "\n" + copyLines("2", old_));
    expectReopenedAs(holding(old_));
}

INSTANTIATE_TEST_SUITE_P(Errors, RenameFails,
                         ::testing::Values(std::make_pair("EIO", 5), std::make_pair("EXDEV", 18),
                                           std::make_pair("ENOSPC", 28)),
                         [](const auto& info) { return std::string(info.param.first); });

TEST_F(DualFileFaults, RenameFailsInFinalise) {
    prepare();
    const Bytes block = bytesOf("incremental");
    const ProcessResult result = drive({"beginWrite", "writeAt", "0", input(block), "finalise", "finalise"},
                                       faultEnv("rename", 1, "errno:EIO", path("1/data")));
    EXPECT_EQ(result.exitStatus, 1);
    // The failed finalise still ends the begun write.
    EXPECT_EQ(result.out, "beginWrite: 0\nwriteAt: 0\nfinalise: 5\nfinalise: 95\n" + stateLine(holding(old_)));
    expectReopenedAs(holding(old_));
}

// A card that fails its writes shows first at the data file's sync: the
// commit stops there, says why, and the old copy is served.
TEST_F(DualFileFaults, DataFileSyncFails) {
    prepare();
    const ProcessResult result = drive({"write", input(new_)}, faultEnv("sync", 1, "errno:EIO", path("1/data")));
    expectUpdateFailedKeepingOld(
        result,
        testing_support::errorPrefixOf("lib/storage/storage_target.cpp", "\"Failed to \" << verb") +
            "Failed to sync \"" + path("1/data") + "\": Input/output error (5)\nwrite: 52\n",
        new_);
}

// The sync comes after the rename: the new copy is on disk and wins at the
// next opening, while this process keeps serving the old one.
TEST_F(DualFileFaults, SyncfsFails) {
    prepare();
    const ProcessResult result = drive({"write", input(new_)}, faultEnv("syncfs", 1, "errno:EIO", path("1/data.chk")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "lib/storage/storage_target:510 Failed to sync fs: Input/output error (5)\nwrite: 5\n" +
                              stateLine(holding(old_)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", new_) + copyLines("2", old_));
    expectReopenedAs(holding(new_));
}

TEST_F(DualFileFaults, SyncfsFailsOnErase) {
    prepare();
    const ProcessResult result = drive({"erase"}, faultEnv("sync", 1, "errno:ENOSPC", path("1/data.chk")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out,
              "lib/storage/storage_target:510 Failed to sync fs: No space left on device (28)\nerase: 28\n" +
                  stateLine(holding(old_)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data.chk ffffffffffffffff\n" + copyLines("2", old_));
    expectReopenedAs(absentBlob());
}

// After a failed sync the slot still sees the old copy as current, so the
// next write goes to the same copy again and then wins.
TEST_F(DualFileFaults, WriteAfterAFailedSync) {
    prepare();
    const Bytes newer = bytesOf("newer still");
    const ProcessResult result =
        drive({"write", input(new_), "write", input(newer)}, faultEnv("syncfs", 1, "errno:EIO", path("1/data.chk")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out,
              "lib/storage/storage_target:510 Failed to sync fs: Input/output error (5)\nwrite: 5\n"
              "write: 0\n" +
                  stateLine(holding(newer)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", newer) + copyLines("2", old_));
    expectReopenedAs(holding(newer));
}

TEST_F(DualFileFaults, CheckFileCannotBeOpenedForTheSync) {
    prepare();
    const std::vector<std::string> steps = {"write", input(new_)};
    // The last open of the check path is the one for the sync.
    const unsigned long opens = countCalls("open", path("1/data.chk"), steps);
    // Reading the check value at opening, the transient file, the sync.
    ASSERT_EQ(opens, firstReadTries() + 2);
    expectReopenedAs(holding(new_));

    fs::remove_all(base());
    prepare();
    const ProcessResult result = drive(steps, faultEnv("open", opens, "errno:EIO", path("1/data.chk")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, kOpenFailure + path("1/data.chk") +
                              ": Input/output error\n"
                              "lib/storage/storage_target:516 Failed to open path \"" +
                              path("1/data.chk") + "\" for  fs sync\nwrite: 0\n" + stateLine(holding(new_)));
    expectReopenedAs(holding(new_));
}

// Dating the new check file can fail; the commit goes on with the time the
// file got, which here is older than the current copy's future date.
TEST_F(DualFileFaults, UtimensatFails) {
    const int64_t future = store_test::nowNs() + 3600 * kSecond;
    prepare(future);
    const ProcessResult result =
        drive({"write", input(new_)}, faultEnv("utimens", 1, "errno:EIO", path("1/data.chk.tmp")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "lib/storage/storage_target:490 generic:5\nwrite: 0\n" + stateLine(holding(new_)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", new_) + copyLines("2", old_));
    EXPECT_LT(store_test::mtimeNs(base() / "1" / "data.chk"), future);
    expectReopenedAs(holding(old_));
}

TEST_F(DualFileFaults, UtimensatSucceedsWithoutTheShimFailingIt) {
    const int64_t future = store_test::nowNs() + 3600 * kSecond;
    prepare(future);
    const ProcessResult result = drive({"write", input(new_)}, testing_support::preloadEnv());
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "write: 0\n" + stateLine(holding(new_)));
    EXPECT_EQ(store_test::mtimeNs(base() / "1" / "data.chk"), future + 2 * kSecond);
    expectReopenedAs(holding(new_));
}

// ---- removing check files ----

// The first removal of the other copy's check file fails and is logged; the
// removal before opening its data file then succeeds.
TEST_F(DualFileFaults, InvalidatingRemovalFails) {
    prepare();
    const ProcessResult result = drive({"write", input(new_)}, faultEnv("unlink", 1, "errno:EIO", path("1/data.chk")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "lib/storage/storage_target:378 generic:5\nwrite: 0\n" + stateLine(holding(new_)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", new_) + copyLines("2", old_));
    expectReopenedAs(holding(new_));
}

TEST_F(DualFileFaults, RemovalBeforeOpeningTheDataFails) {
    prepare();
    const ProcessResult result = drive({"write", input(new_)}, faultEnv("unlink", 2, "errno:EIO", path("1/data.chk")));
    expectUpdateFailedKeepingOld(result, "write: 5\n", older_);
}

TEST_F(DualFileFaults, InvalidatingRemovalFailsOnErase) {
    prepare();
    const ProcessResult result = drive({"erase"}, faultEnv("unlinkat", 1, "errno:EBUSY", path("1/data.chk")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "lib/storage/storage_target:378 generic:16\nerase: 0\n" + stateLine(absentBlob()));
    expectReopenedAs(absentBlob());
}

TEST_F(DualFileFaults, EraseCannotRemoveTheData) {
    prepare();
    // The first removal on "1/data" is the check file's.
    const ProcessResult result = drive({"erase"}, faultEnv("unlink", 2, "errno:EIO", path("1/data")));
    expectUpdateFailedKeepingOld(result, "erase: 5\n", older_);
}

// The copy's directory is gone and cannot be made again (at opening, nor
// by erase): nothing to remove, and the commit cannot happen.
TEST_F(DualFileFaults, EraseCannotMakeTheCopyDirectory) {
    prepare();
    fs::remove_all(base() / "1");
    const ProcessResult result = drive({"erase"}, testing_support::faultFromEnv("mkdir", 1, "errno:EROFS", path("1")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out,
              "[lib/storage/storage_target:427] err_code = 30 (<unknown>)\nerase: 30\n" + stateLine(holding(old_)));
    EXPECT_EQ(describeTree(base()), "d 2\n" + copyLines("2", old_));
    expectReopenedAs(holding(old_));
}

TEST_F(DualFileFaults, BeginWriteCannotRemoveTheData) {
    prepare();
    const ProcessResult result = drive({"beginWrite", "finalise"}, faultEnv("unlink", 1, "errno:EIO", path("1/data")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "beginWrite: 5\nfinalise: 95\n" + stateLine(holding(old_)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", older_) + copyLines("2", old_));
}

// Opening cannot delete the check file of a damaged copy: it says so, and
// the copy is still not used.
TEST_F(DualFileFaults, OpeningCannotRemoveADamagedCopysCheckFile) {
    store_test::writeCopy(base() / "1", older_, kPast + 10 * kSecond);
    store_test::writeCopy(base() / "2", old_, kPast);
    testing_support::writeBytes(base() / "1" / "data", bytesOf("the OLDER blob"));
    const ProcessResult result = drive({}, faultEnv("unlink", 1, "errno:EIO", path("1/data.chk")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "lib/storage/storage_target:334 Failure cleaning up checkfile \"" + path("1/data.chk") +
                              "\"\n" + stateLine(holding(old_)));
    EXPECT_EQ(testing_support::readBytes(base() / "1" / "data.chk"), expectedCheckFile(older_));
    expectReopenedAs(holding(old_));
    EXPECT_FALSE(fs::exists(base() / "1" / "data.chk"));
}

// A card that cannot read the current copy's check file: opening says so,
// and the copy is judged as any whose check file does not vouch for its
// data (its check file removed), so the older copy is served.
TEST_F(DualFileFaults, CheckFileReadFailsAtOpening) {
    prepare();
    const ProcessResult result = drive({}, faultFromEnv("read", 1, "errno:EIO", path("2/data.chk")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, testing_support::errorPrefixOf("lib/storage/storage_target.cpp", "\"Failed to \" << verb") +
                              "Failed to read \"" + path("2/data.chk") + "\": Input/output error (5)\n" +
                              stateLine(holding(older_)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", older_) + "f 2/data " + hex(old_) + "\n");
    expectReopenedAs(holding(older_));
}

// A planted check file of any size but 8 costs opening no read, and a
// data file whose size the check file does not claim is not read either.
TEST_F(DualFileFaults, OpeningReadsNoCheckFileOfAnotherSizeAndNoDataOfAnotherSize) {
    prepare();
    testing_support::writeBytes(base() / "2" / "data.chk", Bytes(1 << 20, 0xa5));
    EXPECT_EQ(countCalls("read", path("2/data.chk"), {}), 0u);
    // "2/data" names the check file too: all its reads are the check file's.
    const auto readsOf = [&](const std::string& substr) {
        prepare();
        testing_support::writeBytes(base() / "2" / "data", Bytes(1 << 20, 0x5a));
        return countCalls("read", path(substr), {});
    };
    const unsigned long checkReads = readsOf("2/data.chk");
    EXPECT_GT(checkReads, 0u);
    EXPECT_EQ(readsOf("2/data"), checkReads);
}

// A read that fails once is read again under the copy's lock before
// anything is removed: the copy stays, and nothing is logged.
TEST_F(DualFileFaults, DataReadThatFailsOnceKeepsTheCopy) {
    prepare();
    // The current copy's check file is read first, then its data.
    const ProcessResult result = drive({}, faultEnv("read", 2, "errno:EIO", path("2/data")));
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, stateLine(holding(old_)));
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n" + copyLines("1", older_) + copyLines("2", old_));
    expectReopenedAs(holding(old_));
}

// Opening opens each file of a copy once (and each directory on the way to
// them once) and removes only check files that are there and wrong.
TEST_F(DualFileFaults, OpeningOpensEachFileOnce) {
    prepare();
    // The driver's closing read of the current copy is the fifth.
    EXPECT_EQ(countCalls("open", "/data", {}), firstReadTries() + 4);
    EXPECT_EQ(countCalls("open", ".chk", {}), firstReadTries() + 1);
    // With openat2 no directory below the base is opened at opening, only
    // the base. Then the closing exists, isValid and read each open the base,
    // "1" and "2" to see whether the check files are still those judged,
    // and exists and the read lock the current copy's directory through a
    // descriptor of their own. Without openat2, "1" and "2" at opening too.
    EXPECT_EQ(countCalls("open", base().string(), {}) - countCalls("open", "/data", {}),
              testing_support::openat2Available() ? 12u : 14u);
    EXPECT_EQ(countCalls("mutating", base().string(), {}), 0u);
}

// Without a check file there is nothing to compare the data with: only the
// check files are looked for (without openat2, after the first try, the
// missing copy directories show that there is none to open).
TEST_F(DualFileFaults, OpeningAFreshStoreRemovesNothing) {
    EXPECT_EQ(countCalls("open", "/data", {}), testing_support::openat2Available() ? 2u : 1u);
    EXPECT_EQ(countCalls("unlink", base().string(), {}), 0u);
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\n");
    EXPECT_EQ(countCalls("mutating", base().string(), {}), 0u);
}

TEST_F(DualFileFaults, OpeningRemovesOnlyCheckFilesThatAreThere) {
    store_test::writeCopy(base() / "1", older_, kPast);
    fs::remove(base() / "1" / "data.chk");  // data without a check file
    store_test::writeCopy(base() / "2", old_, kPast);
    testing_support::writeBytes(base() / "2" / "data", bytesOf("changed"));
    EXPECT_EQ(countCalls("unlink", base().string(), {}), 1u);
    EXPECT_EQ(describeTree(base()),
              "d 1\nd 2\nf 1/data " + hex(older_) + "\nf 2/data " + hex(bytesOf("changed")) + "\n");
}

// ---- writing the data ----

class DataWriteFails : public DualFileFaults,
                       public ::testing::WithParamInterface<std::pair<const char*, const char*>> {};

TEST_P(DataWriteFails, ReturnsTheErrno) {
    prepare();
    const std::string errorName = GetParam().first;
    const std::string text = GetParam().second;
    const ProcessResult result =
        drive({"write", input(new_)}, faultEnv("write", 1, "errno:" + errorName, path("1/data")));
    expectUpdateFailedKeepingOld(
        result,
        "lib/storage/storage_target:144 write failed: " + text + "\nwrite: " + text.substr(0, text.find(':')) + "\n",
        Bytes{});
}

INSTANTIATE_TEST_SUITE_P(Errors, DataWriteFails,
                         ::testing::Values(std::make_pair("EIO", "5: Input/output error"),
                                           std::make_pair("ENOSPC", "28: No space left on device"),
                                           std::make_pair("EFBIG", "27: File too large")),
                         [](const auto& info) { return std::string(info.param.first); });

TEST_F(DualFileFaults, ShortDataWrite) {
    prepare();
    const ProcessResult result = drive({"write", input(new_)}, faultEnv("write", 1, "short:4", path("1/data")));
    expectUpdateFailedKeepingOld(result, shortWriteLine(path("1/data"), 4, new_.size()) + "write: 52\n",
                                 Bytes(new_.begin(), new_.begin() + 4));
}

TEST_F(DualFileFaults, DataFileCannotBeOpened) {
    prepare();
    // Opening the store reads copy 0's check and data files first.
    const unsigned long atOpening = countCalls("open", path("1/data"), {});
    ASSERT_EQ(atOpening, firstReadTries() + 1);
    const ProcessResult result =
        drive({"write", input(new_)}, faultEnv("open", atOpening + 1, "errno:EIO", path("1/data")));
    expectUpdateFailedKeepingOld(result, kOpenFailure + path("1/data") + ": Input/output error\nwrite: 52\n", older_);
}

TEST_F(DualFileFaults, BlockWriteFailsOutsideABegunWrite) {
    prepare();
    const ProcessResult result =
        drive({"writeAt", "10", input(bytesOf("block"))}, faultEnv("pwrite", 1, "errno:EIO", path("1/data")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "writeAt: 5\n" + stateLine(holding(old_)));
    // The old blob was copied; the block never landed and nothing committed.
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(old_) + "\n" + copyLines("2", old_));
    expectReopenedAs(holding(old_));
}

TEST_F(DualFileFaults, ShortBlockWrite) {
    prepare();
    const ProcessResult result =
        drive({"writeAt", "10", input(bytesOf("block"))}, faultEnv("pwrite", 1, "short:2", path("1/data")));
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, shortWriteLine(path("1/data"), 2, 5) + "writeAt: 52\n" + stateLine(holding(old_)));
    expectReopenedAs(holding(old_));
}

TEST_F(DualFileFaults, BlockWriteFailsInsideABegunWrite) {
    prepare();
    const ProcessResult result = drive({"beginWrite", "writeAt", "0", input(bytesOf("block")), "finalise"},
                                       faultEnv("pwrite", 1, "errno:ENOSPC", path("1/data")));
    EXPECT_EQ(result.exitStatus, 1);
    // finalise commits whatever the pending copy holds: here an empty file.
    EXPECT_EQ(result.out, "beginWrite: 0\nwriteAt: 28\nfinalise: 0\n" + stateLine(holding({})));
    expectReopenedAs(holding({}));
}

TEST_F(DualFileFaults, CopyingTheOldBlobFails) {
    prepare();
    const ProcessResult result =
        drive({"writeAt", "10", input(bytesOf("block"))}, faultEnv("write", 1, "errno:EIO", path("1/data")));
    expectUpdateFailedKeepingOld(result, "lib/storage/storage_target:199 Failed to copy old data\nwriteAt: 52\n",
                                 Bytes{});
}

// A power cut right after the data write: the commit never started.
TEST_F(DualFileFaults, CrashAfterTheDataWrite) {
    prepare();
    const ProcessResult result = drive({"write", input(new_)}, faultEnv("open", 1, "crash", path("1/data.chk.tmp")));
    EXPECT_EQ(result.signal, SIGKILL);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(describeTree(base()), "d 1\nd 2\nf 1/data " + hex(new_) + "\n" + copyLines("2", old_));
    expectReopenedAs(holding(old_));
}

// ---- power cuts at every mutating call ----

struct CrashScenario {
    const char* name;
    size_t slots;
    size_t slot;
};

void PrintTo(const CrashScenario& scenario, std::ostream* out) { *out << scenario.name; }

// One run of the driver and what a reopened store may show after it was
// killed: outcomes[k] or outcomes[k + 1], where k is the number of commit
// steps it reported finished.
struct CrashPlan {
    std::vector<std::string> steps;
    std::string commitStep;
    std::vector<SlotContent> outcomes;
};

class PowerCut : public DualFileFaults, public ::testing::WithParamInterface<CrashScenario> {
protected:
    // Every slot gets two valid copies, so that opening changes nothing. In
    // the slot under test the current copy's check file is dated ahead of
    // the clock, so every commit redates its check file: the calls made are
    // then the same in every run, whatever the clock does.
    void resetStore() {
        fs::remove_all(base());
        const CrashScenario& scenario = GetParam();
        for (size_t slot = 0; slot < scenario.slots; ++slot) {
            const fs::path directory = slotDir(scenario.slots, slot);
            if (slot == scenario.slot) {
                store_test::writeCopy(directory / "1", older_, future_ - 10 * kSecond);
                store_test::writeCopy(directory / "2", old_, future_);
            } else {
                store_test::writeCopy(directory / "1", bytesOf("slot " + std::to_string(slot) + " a"), kPast);
                store_test::writeCopy(directory / "2", bytesOf("slot " + std::to_string(slot) + " b"), kPast + 1);
            }
        }
    }

    std::string otherSlots() const {
        const CrashScenario& scenario = GetParam();
        std::string text;
        for (size_t slot = 0; slot < scenario.slots; ++slot) {
            if (slot != scenario.slot) text += describeTree(slotDir(scenario.slots, slot), true);
        }
        return text;
    }

    size_t finishedCommits(const std::string& out, const std::string& step) const {
        const std::string line = step + ": 0\n";
        size_t count = 0;
        for (size_t at = out.find(line); at != std::string::npos; at = out.find(line, at + line.size())) {
            if (at == 0 || out[at - 1] == '\n') ++count;
        }
        return count;
    }

    void runPlan(const CrashPlan& plan) {
        const CrashScenario& scenario = GetParam();
        const std::string substr = base().string();

        resetStore();
        const fs::path countFile = dir / "count";
        const ProcessResult counted =
            drive(plan.steps, faultCountEnv("mutating", countFile.string(), substr), scenario.slots, scenario.slot);
        ASSERT_EQ(counted.exitStatus, 0) << counted.out << counted.err;
        ASSERT_EQ(counted.out.substr(counted.out.rfind("state: ")), stateLine(plan.outcomes.back()));
        const unsigned long total = readFaultCount(countFile);
        ASSERT_GE(total, 5u);

        for (unsigned long nth = 1; nth <= total + 1; ++nth) {
            SCOPED_TRACE("killed at mutating call " + std::to_string(nth) + " of " + std::to_string(total));
            resetStore();
            const std::string othersBefore = otherSlots();
            const ProcessResult run =
                drive(plan.steps, faultEnv("mutating", nth, "crash", substr), scenario.slots, scenario.slot);
            if (nth <= total) {
                ASSERT_EQ(run.signal, SIGKILL) << run.out << run.err;
            } else {
                ASSERT_EQ(run.exitStatus, 0) << run.out << run.err;
            }

            const size_t finished = finishedCommits(run.out, plan.commitStep);
            ASSERT_LT(finished, plan.outcomes.size());
            const SlotContent after = reopened(scenario.slots, scenario.slot);
            const bool before = after == plan.outcomes[finished];
            const bool next = finished + 1 < plan.outcomes.size() && after == plan.outcomes[finished + 1];
            EXPECT_TRUE(before || next) << "reopened as " << after << " after " << finished << " commits";
            if (nth == 1) {
                EXPECT_EQ(after, plan.outcomes.front());
            }
            if (nth >= total) {
                EXPECT_EQ(after, plan.outcomes.back());
            }
            EXPECT_EQ(otherSlots(), othersBefore);

            // The store takes the next write as usual.
            {
                Storage::DualFileTarget target(base(), scenario.slots);
                const Bytes next = bytesOf("after the power cut");
                EXPECT_EQ(target.getSlot(scenario.slot)->write(next.data(), next.size()), STATUS_OK);
            }
            EXPECT_EQ(reopened(scenario.slots, scenario.slot), holding(bytesOf("after the power cut")));
        }
    }

    const int64_t future_ = store_test::nowNs() + 3600 * kSecond;
};

TEST_P(PowerCut, OneShotWrite) { runPlan({{"write", input(new_)}, "write", {holding(old_), holding(new_)}}); }

TEST_P(PowerCut, Erase) { runPlan({{"erase"}, "erase", {holding(old_), absentBlob()}}); }

TEST_P(PowerCut, WriteAtOutsideABegunWrite) {
    const Bytes block = patternBytes(50, 23);
    Bytes patched = old_;
    std::copy(block.begin(), block.end(), patched.begin() + 100);
    runPlan({{"writeAt", "100", input(block)}, "writeAt", {holding(old_), holding(patched)}});
}

TEST_P(PowerCut, BeginWriteAtFinalise) {
    const Bytes tail = bytesOf("tail");
    Bytes composed = new_;
    composed.resize(800, 0);
    composed.insert(composed.end(), tail.begin(), tail.end());
    runPlan({{"beginWrite", "writeAt", "0", input(new_), "writeAt", "800", input(tail), "finalise"},
             "finalise",
             {holding(old_), holding(composed)}});
}

TEST_P(PowerCut, ThreeSuccessiveWrites) {
    const Bytes first = patternBytes(500, 24);
    const Bytes second = bytesOf("second");
    const Bytes third = patternBytes(5000, 25);
    runPlan({{"write", input(first), "write", input(second), "write", input(third)},
             "write",
             {holding(old_), holding(first), holding(second), holding(third)}});
}

INSTANTIATE_TEST_SUITE_P(Targets, PowerCut,
                         ::testing::Values(CrashScenario{"OneSlot", 1, 0}, CrashScenario{"ThreeSlots", 3, 1}),
                         [](const auto& info) { return std::string(info.param.name); });

}  // namespace
