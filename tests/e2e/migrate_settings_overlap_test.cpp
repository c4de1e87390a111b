// The real migrate_settings beside other runs of itself and beside a less
// trusted process that holds a store's locks: acknowledged writes are never
// lost, and no run waits on a lock without bound.
#include <sys/stat.h>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "lock_holder.h"
#include "scratch_dir.h"
#include "store_files.h"
#include "tool_run.h"

namespace {

namespace fs = std::filesystem;
using e2e::Bytes;
using e2e::concat;
using e2e::ProcessResult;
using testing_support::LockHolder;

// The tool's wait for a slot's lock, and what a run may take beyond it:
// on the emulated device a run alone can take seconds beside the others.
#ifndef OVERLAP_WAIT_MARGIN_SECONDS
#define OVERLAP_WAIT_MARGIN_SECONDS 3
#endif
constexpr auto kLockWait = std::chrono::seconds(2);
constexpr auto kMargin = std::chrono::seconds(OVERLAP_WAIT_MARGIN_SECONDS);
#ifndef OVERLAP_ROUNDS_DIVISOR
#define OVERLAP_ROUNDS_DIVISOR 1
#endif
constexpr int kRoundsDivisor = OVERLAP_ROUNDS_DIVISOR;

class OverlappingRuns : public ::testing::Test {
protected:
    OverlappingRuns() {
        // The holder runs as nobody, who must reach the stores.
        fs::permissions(scratch.path(), fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                            fs::perms::others_read | fs::perms::others_exec);
        fs::create_directory(inputs);
    }

    testing_support::ScratchDir scratch;
    const fs::path base = scratch / "base";
    const fs::path inputs = scratch / "inputs";
    const fs::path utilSave = base / "app" / "utilSave";

    std::string dataFile(const std::string& name, const Bytes& bytes) const {
        testing_support::writeBytes(inputs / name, bytes);
        return (inputs / name).string();
    }

    ProcessResult run(const std::vector<std::string>& args) const {
        return e2e::runTool(concat({"--base", base.string()}, args), e2e::kRunTimeLimitSeconds);
    }

    ProcessResult migrate(const char* target, const std::string& data) const {
        return run({"--target", target, "--type", "simple", "--data", data});
    }

    int query(const char* target) const { return run({"--target", target, "--query-present"}).exitStatus; }

    // What inspect_store says the slot serves, in hexadecimal; empty when it
    // serves nothing.
    std::string served(const char* target) const {
        const ProcessResult result =
            testing_support::runProgram({e2e::kInspectStore, "--base", base.string(), "--target", target, "--dump=-"},
                                        {}, e2e::kRunTimeLimitSeconds);
        return result.exitStatus == 0 ? testing_support::hex(Bytes(result.out.begin(), result.out.end())) : "";
    }
};

// A run that only opens a store judges its copies and removes check files
// that do not match their data. Beside a writer it used to judge a copy in
// the middle of its commit and remove the check file the commit had just
// put in place: an acknowledged write gone.
TEST_F(OverlappingRuns, QueriesOfOtherStoresNeverUndoACommit) {
    constexpr int kWrites = 300 / kRoundsDivisor;
    ASSERT_EQ(migrate("util_save", dataFile("first", e2e::pattern(1000, 0))).exitStatus, 0);
    std::atomic<bool> writing{true};
    const auto queryLoop = [&](const char* target) {
        while (writing) (void)query(target);
    };
    std::thread settings(queryLoop, "settings");
    std::thread lut(queryLoop, "lut");
    std::thread overlay(queryLoop, "overlay");
    int lost = 0;
    for (int i = 1; i <= kWrites; ++i) {
        // Large enough that judging a copy takes a while; sizes that differ,
        // so that a half-written copy never matches its check file.
        const Bytes blob = e2e::pattern(400000 + 4000 * (i % 7), static_cast<uint8_t>(i));
        const ProcessResult result = migrate("util_save", dataFile("blob", blob));
        ASSERT_EQ(result.exitStatus, 0) << result.out;
        if (served("util_save") != testing_support::hex(blob)) ++lost;
    }
    writing = false;
    settings.join();
    lut.join();
    overlay.join();
    EXPECT_EQ(lost, 0) << "of " << kWrites << " acknowledged writes";
}

// Two runs started together into one slot: the slot serves one of the blobs
// whose run succeeded, and never loses the earlier ones.
TEST_F(OverlappingRuns, TwoWritersOfOneSlotKeepAnAcknowledgedBlob) {
    constexpr int kRounds = 200 / kRoundsDivisor;
    std::string previous = testing_support::hex(e2e::pattern(3000, 0));
    ASSERT_EQ(migrate("util_save", dataFile("start", e2e::pattern(3000, 0))).exitStatus, 0);
    int wrong = 0;
    for (int round = 1; round <= kRounds; ++round) {
        const Bytes a = e2e::pattern(30000, static_cast<uint8_t>(2 * round));
        const Bytes b = e2e::pattern(40000, static_cast<uint8_t>(2 * round + 1));
        const std::string fileA = dataFile("a", a);
        const std::string fileB = dataFile("b", b);
        ProcessResult resultA;
        std::thread other([&] { resultA = migrate("util_save", fileA); });
        const ProcessResult resultB = migrate("util_save", fileB);
        other.join();
        const std::string now = served("util_save");
        const bool fine = (resultA.exitStatus == 0 && now == testing_support::hex(a)) ||
                          (resultB.exitStatus == 0 && now == testing_support::hex(b)) ||
                          (resultA.exitStatus != 0 && resultB.exitStatus != 0 && now == previous);
        if (!fine) {
            ++wrong;
            ADD_FAILURE() << "round " << round << ": exits " << resultA.exitStatus << " and " << resultB.exitStatus
                          << ", served " << now.size() / 2 << " bytes\n"
                          << resultA.out << resultB.out;
        }
        previous = now;
        EXPECT_EQ(query("util_save"), 0) << "round " << round;
    }
    EXPECT_EQ(wrong, 0) << "of " << kRounds << " rounds";
}

using Clock = std::chrono::steady_clock;

// An application that takes a store's locks and never lets go delays a run
// by the lock's bound at most; the held slot fails clearly, every other one
// works, and nothing is removed.
class HeldStore : public OverlappingRuns {
protected:
    HeldStore() {
        EXPECT_EQ(migrate("util_save", dataFile("old", kOld)).exitStatus, 0);
        EXPECT_EQ(migrate("util_save", dataFile("current", kCurrent)).exitStatus, 0);
    }

    // Runs the tool and checks that it ended within the bound and a margin.
    ProcessResult timedRun(const std::vector<std::string>& args) const {
        const auto start = Clock::now();
        ProcessResult result = run(args);
        EXPECT_LT(Clock::now() - start, kLockWait + kMargin) << e2e::describe(args);
        EXPECT_EQ(result.signal, 0) << e2e::describe(args);
        return result;
    }

    const Bytes kOld = e2e::pattern(500, 1);
    const Bytes kCurrent = e2e::pattern(700, 2);
};

// The slot's own directory, and each copy's, held exclusive or shared.
struct HeldLock {
    const char* name;
    const char* directory;  // below the slot's directory
    bool exclusive;
    bool migrationWaits;  // a migration into the slot cannot have it
};

class HeldLocks : public HeldStore, public ::testing::WithParamInterface<HeldLock> {};

TEST_P(HeldLocks, EveryRunEndsWithinTheBound) {
    const HeldLock held = GetParam();
    const std::string before = store_test::describeTree(base, true);
    {
        const LockHolder holder({{utilSave / held.directory, held.exclusive}});
        EXPECT_EQ(timedRun({"--target", "settings", "--query-present"}).exitStatus, 10);
        EXPECT_EQ(timedRun({"--target", "util_save", "--query-present"}).exitStatus, 0);
        EXPECT_EQ(store_test::describeTree(base, true), before) << "a run that changed nothing removed something";

        const std::string fresh = dataFile("fresh", e2e::pattern(900, 3));
        const ProcessResult migration = timedRun({"--target", "util_save", "--type", "simple", "--data", fresh});
        if (held.migrationWaits) {
            EXPECT_EQ(migration.exitStatus, 1);
            EXPECT_NE(migration.out.find("Store \"" + utilSave.string() + "\" is busy: not locked within 2000 ms\n"),
                      std::string::npos)
                << migration.out;
            EXPECT_EQ(store_test::describeTree(base, true), before);
        } else {
            EXPECT_EQ(migration.exitStatus, 0) << migration.out;
        }
        EXPECT_EQ(timedRun({"--target", "calib_save", "--type", "simple", "--data", fresh}).exitStatus, 0);
        EXPECT_EQ(timedRun({"--target", "settings", "--query-present"}).exitStatus, 10);
    }
    EXPECT_EQ(served("util_save"), testing_support::hex(held.migrationWaits ? kCurrent : e2e::pattern(900, 3)));
    EXPECT_EQ(served("calib_save"), testing_support::hex(e2e::pattern(900, 3)));
}

// Copy 0 ("1") is current after the two writes; a migration rewrites copy 1 ("2").
INSTANTIATE_TEST_SUITE_P(, HeldLocks,
                         ::testing::Values(HeldLock{"SlotExclusive", ".", true, true},
                                           HeldLock{"SlotShared", ".", false, true},
                                           HeldLock{"OtherCopyShared", "2", false, true},
                                           HeldLock{"OtherCopyExclusive", "2", true, true},
                                           HeldLock{"CurrentCopyExclusive", "1", true, false}),
                         [](const ::testing::TestParamInfo<HeldLock>& info) { return info.param.name; });

TEST_F(HeldStore, EveryLockHeldAtOnce) {
    const std::string before = store_test::describeTree(utilSave, true);
    {
        const LockHolder holder({{utilSave, true}, {utilSave / "1", true}, {utilSave / "2", true}});
        const std::string fresh = dataFile("fresh", e2e::pattern(900, 3));
        EXPECT_EQ(timedRun({"--target", "util_save", "--type", "simple", "--data", fresh}).exitStatus, 1);
        // Judged without the lock: a change rewrites the other copy, never the current one.
        EXPECT_EQ(timedRun({"--target", "util_save", "--query-present"}).exitStatus, 0);
        const ProcessResult unneeded =
            timedRun({"--target", "util_save", "--if-not-present", "--type", "simple", "--data", fresh});
        EXPECT_EQ(unneeded.exitStatus, 0);
        EXPECT_NE(unneeded.out.find("No update required\n"), std::string::npos) << unneeded.out;
        EXPECT_EQ(timedRun({"--target", "calib_save", "--type", "simple", "--data", fresh}).exitStatus, 0);
        EXPECT_EQ(store_test::describeTree(utilSave, true), before);
    }
    EXPECT_EQ(store_test::describeTree(utilSave, true), before);
    EXPECT_EQ(served("util_save"), testing_support::hex(kCurrent));
}

// A copy whose check file does not match while a change holds it may be that
// change's commit: opening leaves it alone, and removes it once free.
TEST_F(HeldStore, OpeningRemovesADamagedCheckFileOnlyWhenItsCopyIsFree) {
    // The copy that is not current no longer holds what its check file says.
    testing_support::writeBytes(utilSave / "2" / "data", e2e::pattern(500, 9));
    const auto checkFile = utilSave / "2" / "data.chk";
    {
        const LockHolder holder({{utilSave / "2", true}});
        const auto start = Clock::now();
        EXPECT_EQ(run({"--target", "settings", "--query-present"}).exitStatus, 10);
        EXPECT_LT(Clock::now() - start, std::chrono::milliseconds(100) + kMargin);
        EXPECT_TRUE(fs::exists(checkFile));
    }
    EXPECT_EQ(query("settings"), 10);
    EXPECT_FALSE(fs::exists(checkFile));
    EXPECT_EQ(served("util_save"), testing_support::hex(kCurrent));
}

}  // namespace
