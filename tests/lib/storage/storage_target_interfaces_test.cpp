#include "lib/storage/storage_target.h"

#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"
#include "slot_changes_refused.h"
#include "store_files.h"

namespace {

using Storage::SlotHandle;
using Storage::Target;
using Storage::TargetSlot;
using Storage::TargetSlotAdaptor;
using Storage::TargetSlotObserver;
using Calls = std::vector<std::string>;

// A slot that writes every call into `calls` and answers with `result`.
class RecordingSlot : public TargetSlot {
public:
    RecordingSlot(Calls& calls, int& destroyed) : calls_(calls), destroyed_(destroyed) {}
    ~RecordingSlot() override { ++destroyed_; }

    bool exists() const override {
        calls_.push_back("exists");
        return existsAnswer;
    }
    bool isValid() const override {
        calls_.push_back("isValid");
        return validAnswer;
    }
    Status beginWrite() override { return record("beginWrite"); }
    Status finalise() override { return record("finalise"); }
    Status write(const uint8_t* data, size_t size) override {
        return record("write " + std::string(data, data + size));
    }
    Status writeAt(int64_t offset, const uint8_t* data, size_t size) override {
        return record("writeAt " + std::to_string(offset) + " " + std::string(data, data + size));
    }
    Status read(uint8_t* buffer, size_t size, int64_t offset) override {
        if (size > 0) buffer[0] = 'r';
        return record("read " + std::to_string(size) + " " + std::to_string(offset));
    }
    Status readSome(uint8_t* buffer, size_t size, int64_t offset, size_t& bytesRead) override {
        if (size > 0) buffer[0] = 's';
        bytesRead = 1;
        return record("readSome " + std::to_string(size) + " " + std::to_string(offset));
    }
    Status erase() override { return record("erase"); }

    bool existsAnswer = true;
    bool validAnswer = true;
    Status result = STATUS_OK;

private:
    Status record(const std::string& call) {
        calls_.push_back(call);
        return result;
    }

    Calls& calls_;
    int& destroyed_;
};

class RecordingObserver : public TargetSlotObserver {
public:
    explicit RecordingObserver(Calls& calls) : calls_(calls) {}

    void onBeginWrite(size_t index, bool skip) override { record("onBeginWrite", index, skip); }
    void onFinalised(size_t index, bool skip) override { record("onFinalised", index, skip); }
    void onRemoveAllSlots() override { calls_.push_back("onRemoveAllSlots"); }
    void beforeModify(size_t index) override { record("beforeModify", index); }
    void afterModify(size_t index) override { record("afterModify", index); }
    void beforeRead(size_t index) override { record("beforeRead", index); }
    void afterRead(size_t index) override { record("afterRead", index); }

private:
    void record(const std::string& name, size_t index) { calls_.push_back(name + " " + std::to_string(index)); }
    void record(const std::string& name, size_t index, bool skip) {
        calls_.push_back(name + " " + std::to_string(index) + (skip ? " skip" : " act"));
    }

    Calls& calls_;
};

// Nothing but the required operations: the optional ones keep their
// defaults.
class BareSlot : public TargetSlot {
public:
    bool exists() const override { return false; }
    bool isValid() const override { return false; }
};

class BareTarget : public Target {
public:
    SlotHandle getSlot(size_t) override { return SlotHandle(); }
    size_t getSlotCount() const override { return 0; }
    std::string getDescription() const override { return "BareTarget"; }
};

const uint8_t kText[] = {'a', 'b', 'c'};

// ---- SlotHandle ----

TEST(SlotHandle, DefaultIsNull) {
    SlotHandle handle;
    EXPECT_FALSE(handle);
    EXPECT_EQ(handle.get(), nullptr);
    EXPECT_FALSE(handle.ownsSlot());
}

TEST(SlotHandle, BorrowedSlotSurvivesTheHandle) {
    Calls calls;
    int destroyed = 0;
    RecordingSlot slot(calls, destroyed);
    {
        SlotHandle handle = SlotHandle::borrow(&slot);
        EXPECT_TRUE(handle);
        EXPECT_EQ(handle.get(), &slot);
        EXPECT_FALSE(handle.ownsSlot());
        handle.reset();
        EXPECT_FALSE(handle);
        EXPECT_FALSE(handle.ownsSlot());
    }
    EXPECT_EQ(destroyed, 0);
}

TEST(SlotHandle, OwnedSlotDiesWithTheHandle) {
    Calls calls;
    int destroyed = 0;
    {
        SlotHandle handle = SlotHandle::own(std::make_unique<RecordingSlot>(calls, destroyed));
        EXPECT_TRUE(handle);
        EXPECT_TRUE(handle.ownsSlot());
        EXPECT_EQ(destroyed, 0);
    }
    EXPECT_EQ(destroyed, 1);
}

TEST(SlotHandle, OwningNothingIsANullHandle) {
    SlotHandle handle = SlotHandle::own(nullptr);
    EXPECT_FALSE(handle);
    EXPECT_EQ(handle.get(), nullptr);
    handle.reset();
    EXPECT_FALSE(handle);
    EXPECT_FALSE(handle.ownsSlot());
}

TEST(SlotHandle, ResetDestroysAnOwnedSlotOnce) {
    Calls calls;
    int destroyed = 0;
    SlotHandle handle = SlotHandle::own(std::make_unique<RecordingSlot>(calls, destroyed));
    handle.reset();
    EXPECT_EQ(destroyed, 1);
    EXPECT_FALSE(handle);
    EXPECT_FALSE(handle.ownsSlot());
    handle.reset();
    EXPECT_EQ(destroyed, 1);
}

TEST(SlotHandle, MoveTransfersOwnership) {
    Calls calls;
    int destroyed = 0;
    SlotHandle first = SlotHandle::own(std::make_unique<RecordingSlot>(calls, destroyed));
    TargetSlot* const slot = first.get();
    SlotHandle second(std::move(first));
    EXPECT_FALSE(first);  // NOLINT(bugprone-use-after-move): a moved-from handle is null
    EXPECT_FALSE(first.ownsSlot());
    EXPECT_EQ(second.get(), slot);
    EXPECT_TRUE(second.ownsSlot());
    first.reset();
    EXPECT_EQ(destroyed, 0);
    second.reset();
    EXPECT_EQ(destroyed, 1);
}

TEST(SlotHandle, MoveAssignmentReleasesTheOldSlot) {
    Calls calls;
    int destroyedOld = 0;
    int destroyedNew = 0;
    SlotHandle target = SlotHandle::own(std::make_unique<RecordingSlot>(calls, destroyedOld));
    SlotHandle source = SlotHandle::own(std::make_unique<RecordingSlot>(calls, destroyedNew));
    TargetSlot* const slot = source.get();
    target = std::move(source);
    EXPECT_EQ(destroyedOld, 1);
    EXPECT_EQ(destroyedNew, 0);
    EXPECT_EQ(target.get(), slot);
    EXPECT_TRUE(target.ownsSlot());
    EXPECT_FALSE(source);  // NOLINT(bugprone-use-after-move)
    target = SlotHandle();
    EXPECT_EQ(destroyedNew, 1);
    EXPECT_FALSE(target);
}

TEST(SlotHandle, SelfMoveAssignmentKeepsTheSlot) {
    Calls calls;
    int destroyed = 0;
    SlotHandle handle = SlotHandle::own(std::make_unique<RecordingSlot>(calls, destroyed));
    SlotHandle& alias = handle;
    handle = std::move(alias);
    EXPECT_TRUE(handle);
    EXPECT_TRUE(handle.ownsSlot());
    EXPECT_EQ(destroyed, 0);
}

// ---- defaults of the optional operations ----

TEST(TargetDefaults, OptionalOperationsAreNotImplemented) {
    BareTarget target;
    store_test::expectSlotChangesRefused(target, "x");
    EXPECT_EQ(target.removeAllSlots(), STATUS_NOT_IMPLEMENTED);
}

TEST(TargetSlotDefaults, OptionalOperationsAreNotImplemented) {
    BareSlot slot;
    uint8_t buffer[4] = {9, 9, 9, 9};
    size_t count = 77;
    EXPECT_EQ(slot.beginWrite(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.finalise(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.write(kText, sizeof kText), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.writeAt(0, kText, sizeof kText), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.read(buffer, sizeof buffer, 0), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.readSome(buffer, sizeof buffer, 0, count), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(slot.erase(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(count, 77u);
    EXPECT_EQ(buffer[0], 9);
}

// ---- TargetSlotAdaptor ----

class AdaptorTest : public ::testing::Test {
protected:
    AdaptorTest() {
        auto slot = std::make_unique<RecordingSlot>(calls, destroyed);
        inner = slot.get();
        adaptor = std::make_unique<TargetSlotAdaptor>(SlotHandle::own(std::move(slot)), 3, observer);
    }

    Calls calls;
    int destroyed = 0;
    RecordingObserver observer{calls};
    RecordingSlot* inner = nullptr;
    std::unique_ptr<TargetSlotAdaptor> adaptor;
};

TEST_F(AdaptorTest, QueriesForwardWithoutNotification) {
    inner->existsAnswer = true;
    inner->validAnswer = false;
    EXPECT_TRUE(adaptor->exists());
    EXPECT_FALSE(adaptor->isValid());
    inner->existsAnswer = false;
    inner->validAnswer = true;
    EXPECT_FALSE(adaptor->exists());
    EXPECT_TRUE(adaptor->isValid());
    EXPECT_EQ(calls, (Calls{"exists", "isValid", "exists", "isValid"}));
}

TEST_F(AdaptorTest, BeginWriteNotifiesFirst) {
    EXPECT_EQ(adaptor->beginWrite(), STATUS_OK);
    EXPECT_EQ(calls, (Calls{"onBeginWrite 3 act", "beginWrite"}));
}

TEST_F(AdaptorTest, FinaliseNotifiesAfterwards) {
    EXPECT_EQ(adaptor->finalise(), STATUS_OK);
    EXPECT_EQ(calls, (Calls{"finalise", "onFinalised 3 act"}));
}

TEST_F(AdaptorTest, ModificationsAreBracketed) {
    EXPECT_EQ(adaptor->write(kText, sizeof kText), STATUS_OK);
    EXPECT_EQ(adaptor->writeAt(17, kText, 2), STATUS_OK);
    EXPECT_EQ(adaptor->erase(), STATUS_OK);
    EXPECT_EQ(calls, (Calls{"beforeModify 3", "write abc", "afterModify 3", "beforeModify 3", "writeAt 17 ab",
                            "afterModify 3", "beforeModify 3", "erase", "afterModify 3"}));
}

TEST_F(AdaptorTest, ReadsAreBracketedAndPassResultsThrough) {
    uint8_t buffer[8] = {};
    size_t count = 0;
    EXPECT_EQ(adaptor->read(buffer, sizeof buffer, 5), STATUS_OK);
    EXPECT_EQ(buffer[0], 'r');
    EXPECT_EQ(adaptor->readSome(buffer, 4, 6, count), STATUS_OK);
    EXPECT_EQ(buffer[0], 's');
    EXPECT_EQ(count, 1u);
    EXPECT_EQ(calls, (Calls{"beforeRead 3", "read 8 5", "afterRead 3", "beforeRead 3", "readSome 4 6", "afterRead 3"}));
}

class AdaptorFailureTest : public AdaptorTest, public ::testing::WithParamInterface<Status> {};

// The after-calls come even when the inner operation failed, and its
// status is passed on unchanged.
TEST_P(AdaptorFailureTest, FailuresPassThroughWithAfterCalls) {
    const Status failure = GetParam();
    inner->result = failure;
    uint8_t buffer[4] = {};
    size_t count = 0;
    EXPECT_EQ(adaptor->beginWrite(), failure);
    EXPECT_EQ(adaptor->finalise(), failure);
    EXPECT_EQ(adaptor->write(kText, 1), failure);
    EXPECT_EQ(adaptor->writeAt(2, kText, 1), failure);
    EXPECT_EQ(adaptor->erase(), failure);
    EXPECT_EQ(adaptor->read(buffer, 4, 0), failure);
    EXPECT_EQ(adaptor->readSome(buffer, 4, 0, count), failure);
    EXPECT_EQ(calls, (Calls{"onBeginWrite 3 act", "beginWrite", "finalise", "onFinalised 3 act", "beforeModify 3",
                            "write a", "afterModify 3", "beforeModify 3", "writeAt 2 a", "afterModify 3",
                            "beforeModify 3", "erase", "afterModify 3", "beforeRead 3", "read 4 0", "afterRead 3",
                            "beforeRead 3", "readSome 4 0", "afterRead 3"}));
}

INSTANTIATE_TEST_SUITE_P(Statuses, AdaptorFailureTest,
                         ::testing::Values(STATUS_FAILED, STATUS_INVALID_OPERATION, STATUS_NOT_IMPLEMENTED, Status{5}));

TEST_F(AdaptorTest, DestroyingTheAdaptorDestroysAnOwnedInnerSlot) {
    EXPECT_EQ(destroyed, 0);
    adaptor.reset();
    EXPECT_EQ(destroyed, 1);
    EXPECT_TRUE(calls.empty());
}

TEST(Adaptor, BorrowedInnerSlotSurvivesTheAdaptor) {
    Calls calls;
    int destroyed = 0;
    RecordingSlot slot(calls, destroyed);
    RecordingObserver observer(calls);
    {
        SlotHandle handle =
            SlotHandle::own(std::make_unique<TargetSlotAdaptor>(SlotHandle::borrow(&slot), 0, observer));
        EXPECT_TRUE(handle.ownsSlot());
        EXPECT_EQ(handle->erase(), STATUS_OK);
    }
    EXPECT_EQ(destroyed, 0);
    EXPECT_EQ(slot.erase(), STATUS_OK);
    EXPECT_EQ(calls, (Calls{"beforeModify 0", "erase", "afterModify 0", "erase"}));
}

// Releasing an owning handle to an adaptor over a target's own slot leaves
// that slot alive and working.
TEST(Adaptor, ReleasingAnAdaptorOverATargetSlotKeepsTheSlot) {
    testing_support::ScratchDir dir;
    Storage::DualFileTarget target(dir / "store", 2);
    Calls calls;
    RecordingObserver observer(calls);
    const store_test::Bytes blob = store_test::bytesOf("kept");
    {
        SlotHandle handle = SlotHandle::own(std::make_unique<TargetSlotAdaptor>(target.getSlot(1), 1, observer));
        ASSERT_TRUE(handle);
        EXPECT_EQ(handle->write(blob.data(), blob.size()), STATUS_OK);
    }
    EXPECT_EQ(calls, (Calls{"beforeModify 1", "afterModify 1"}));
    SlotHandle again = target.getSlot(1);
    ASSERT_TRUE(again);
    EXPECT_EQ(store_test::contentOf(*again.get()), store_test::holding(blob));
}

TEST(Adaptor, MissingInnerSlot) {
    Calls calls;
    RecordingObserver observer(calls);
    TargetSlotAdaptor adaptor(SlotHandle(), 4, observer);
    uint8_t buffer[4] = {7, 7, 7, 7};
    size_t count = 9;
    EXPECT_FALSE(adaptor.exists());
    EXPECT_FALSE(adaptor.isValid());
    EXPECT_EQ(adaptor.beginWrite(), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(adaptor.finalise(), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(adaptor.write(kText, 3), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(adaptor.writeAt(0, kText, 3), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(adaptor.erase(), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(adaptor.read(buffer, 4, 0), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(adaptor.readSome(buffer, 4, 0, count), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(count, 9u);
    EXPECT_EQ(buffer[0], 7);
    EXPECT_EQ(calls, (Calls{"onBeginWrite 4 act", "onFinalised 4 act", "beforeModify 4", "afterModify 4",
                            "beforeModify 4", "afterModify 4", "beforeModify 4", "afterModify 4", "beforeRead 4",
                            "afterRead 4", "beforeRead 4", "afterRead 4"}));
}

}  // namespace
