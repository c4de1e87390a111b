#include "lib/storage/slot_lock.h"

#include <fcntl.h>
#include <unistd.h>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <thread>
#include <utility>

#include <gtest/gtest.h>

#include "scratch_dir.h"

namespace {

using Storage::LockDeadline;
using Storage::LockMode;
using Storage::SlotLock;
using Outcome = SlotLock::Outcome;
using Clock = std::chrono::steady_clock;

class SlotLockTest : public ::testing::Test {
protected:
    SlotLockTest() { std::filesystem::create_directory(dir / "slot"); }

    // `mode` on the directory "slot", trying until `deadline`.
    SlotLock take(LockMode mode, LockDeadline deadline, Outcome& outcome) {
        return SlotLock::take(parent(), "slot", mode, deadline, outcome);
    }
    SlotLock tryOnce(LockMode mode, Outcome& outcome) { return take(mode, LockDeadline(), outcome); }

    int parent() {
        if (!parentFd) parentFd.reset(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        return parentFd.get();
    }

    testing_support::ScratchDir dir;
    UniqueFd parentFd;
};

TEST_F(SlotLockTest, SharedLocksAreHeldBesideEachOther) {
    Outcome first = Outcome::kUnreachable;
    Outcome second = Outcome::kUnreachable;
    const SlotLock a = tryOnce(LockMode::kShared, first);
    const SlotLock b = tryOnce(LockMode::kShared, second);
    EXPECT_EQ(first, Outcome::kHeld);
    EXPECT_EQ(second, Outcome::kHeld);
    EXPECT_TRUE(a.held());
    EXPECT_TRUE(b.held());
}

TEST_F(SlotLockTest, AnExclusiveLockExcludesEveryOtherTakerUntilTheDeadline) {
    Outcome outcome = Outcome::kUnreachable;
    const SlotLock holder = tryOnce(LockMode::kExclusive, outcome);
    ASSERT_EQ(outcome, Outcome::kHeld);

    for (const LockMode mode : {LockMode::kShared, LockMode::kExclusive}) {
        const LockDeadline deadline = Clock::now() + std::chrono::milliseconds(30);
        const SlotLock waiter = take(mode, deadline, outcome);
        EXPECT_EQ(outcome, Outcome::kBusy);
        EXPECT_FALSE(waiter.held());
        EXPECT_GE(Clock::now(), deadline) << "gave up before its deadline";
    }
}

TEST_F(SlotLockTest, ASharedLockExcludesAnExclusiveOne) {
    Outcome outcome = Outcome::kUnreachable;
    const SlotLock reader = tryOnce(LockMode::kShared, outcome);
    ASSERT_EQ(outcome, Outcome::kHeld);
    const SlotLock writer = tryOnce(LockMode::kExclusive, outcome);
    EXPECT_EQ(outcome, Outcome::kBusy);
    EXPECT_FALSE(writer.held());
}

TEST_F(SlotLockTest, AWaiterGetsTheLockWhenItsHolderLetsGoBeforeTheDeadline) {
    Outcome outcome = Outcome::kUnreachable;
    SlotLock holder = tryOnce(LockMode::kExclusive, outcome);
    ASSERT_EQ(outcome, Outcome::kHeld);
    std::thread letGo([&holder] {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        holder.release();
    });
    Outcome waited = Outcome::kUnreachable;
    const SlotLock waiter = take(LockMode::kExclusive, Clock::now() + std::chrono::seconds(30), waited);
    letGo.join();
    EXPECT_EQ(waited, Outcome::kHeld);
    EXPECT_TRUE(waiter.held());
    EXPECT_FALSE(holder.held());
}

TEST_F(SlotLockTest, AMovedLockStaysHeldByItsNewOwner) {
    Outcome outcome = Outcome::kUnreachable;
    SlotLock first = tryOnce(LockMode::kExclusive, outcome);
    ASSERT_EQ(outcome, Outcome::kHeld);

    SlotLock moved(std::move(first));
    EXPECT_TRUE(moved.held());
    EXPECT_FALSE(first.held());  // a moved-from lock holds nothing
    first.release();             // and giving it up changes nothing
    EXPECT_FALSE(tryOnce(LockMode::kShared, outcome).held());
    EXPECT_EQ(outcome, Outcome::kBusy);

    SlotLock assigned;
    assigned = std::move(moved);
    EXPECT_TRUE(assigned.held());
    EXPECT_FALSE(tryOnce(LockMode::kShared, outcome).held());

    assigned.release();
    EXPECT_FALSE(assigned.held());
    EXPECT_TRUE(tryOnce(LockMode::kExclusive, outcome).held());
    EXPECT_EQ(outcome, Outcome::kHeld);
}

TEST_F(SlotLockTest, ALinkToADirectoryIsNotFollowed) {
    std::filesystem::create_directory_symlink(dir / "slot", dir / "link");
    Outcome outcome = Outcome::kHeld;
    errno = 1234;
    const SlotLock lock = SlotLock::take(parent(), "link", LockMode::kExclusive, LockDeadline(), outcome);
    EXPECT_EQ(errno, 1234) << "errno is the caller's";
    EXPECT_EQ(outcome, Outcome::kUnreachable);
    EXPECT_FALSE(lock.held());
    // Nothing was locked through the link.
    EXPECT_TRUE(tryOnce(LockMode::kExclusive, outcome).held());
}

TEST_F(SlotLockTest, AMissingDirectoryIsUnreachableAtOnce) {
    Outcome outcome = Outcome::kHeld;
    errno = 1234;
    const SlotLock lock =
        SlotLock::take(parent(), "missing", LockMode::kShared, Clock::now() + std::chrono::seconds(30), outcome);
    EXPECT_EQ(errno, 1234);
    EXPECT_EQ(outcome, Outcome::kUnreachable);
    EXPECT_FALSE(lock.held());
}

TEST_F(SlotLockTest, AnAbsoluteNameAndTheDirectoryItselfNameTheSameLock) {
    Outcome outcome = Outcome::kUnreachable;
    const SlotLock byPath =
        SlotLock::take(AT_FDCWD, (dir / "slot").c_str(), LockMode::kExclusive, LockDeadline(), outcome);
    ASSERT_EQ(outcome, Outcome::kHeld);
    const UniqueFd slot(::open((dir / "slot").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const SlotLock itself = SlotLock::take(slot.get(), ".", LockMode::kShared, LockDeadline(), outcome);
    EXPECT_EQ(outcome, Outcome::kBusy);
    EXPECT_FALSE(itself.held());
}

}  // namespace
