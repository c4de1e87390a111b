#include "target_registry.h"

#include <gtest/gtest.h>

#include "child_process.h"
#include "lib/util/log.h"
#include "registration_log.h"
#include "scratch_dir.h"

namespace {

using testing_support::runInChild;
using testing_support::ScratchDir;

struct ExpectedTarget {
    StorageTarget id;
    const char* location;
    size_t slots;
};

constexpr ExpectedTarget kStores[] = {
    {kIpiStorageTargetSettings, "settings", 1},
    {kIpiStorageTargetOverlay, "app/overlays", 8},
    {kIpiStorageTargetLUT, "app/luts", 26},
    {kIpiStorageTargetCalibSave, "app/calibSave", 1},
    {kIpiStorageTargetCalibExtra, "app/calibExtra", 1},
    {kIpiStorageTargetUtilSave, "app/utilSave", 1},
    {kIpiStorageTargetApplicationInternal, "app/internal", 1},
    {kIpiStorageTargetRebootPersistent, "app/rebootPersistent", 1},
};

TEST(TargetRegistry, BuildsTheStoresBelowTheBase) {
    ScratchDir dir;
    TargetRegistry registry;
    registerTargets(dir.path(), registry);
    for (const auto& store : kStores) {
        SCOPED_TRACE(store.location);
        ASSERT_NE(registry[store.id], nullptr);
        EXPECT_EQ(registry[store.id]->getDescription(), "DualFileTarget " + (dir / store.location).string());
        EXPECT_EQ(registry[store.id]->getSlotCount(), store.slots);
        EXPECT_TRUE(std::filesystem::is_directory(dir / store.location));
    }
    EXPECT_TRUE(std::filesystem::is_directory(dir / "settings/1"));
    EXPECT_TRUE(std::filesystem::is_directory(dir / "app/luts/25/2"));
    EXPECT_FALSE(std::filesystem::exists(dir / "app/luts/26"));
    EXPECT_TRUE(std::filesystem::is_directory(dir / "app/overlays/7/1"));
    EXPECT_FALSE(std::filesystem::exists(dir / "app/overlays/8"));
}

TEST(TargetRegistry, DeviceTargetsFollowTheStores) {
    ScratchDir dir;
    TargetRegistry registry;
    registerTargets(dir.path(), registry);
    const std::pair<StorageTarget, const char*> devices[] = {
        {kIpiStorageTargetBootPartition, "FileReadTarget /media/boot"},
        {kIpiStorageTargetResourcePartition, "FileReadTarget /media/resources"},
        {kIpiStorageTargetResourceManufacturingPartition, "FileReadTarget /media/static"},
        {kIpiStorageTargetBootVector, "BootVectorTarget"},
        {kIpiStorageTargetFirmwareUpdateBootFile, "FirmwareUpdateBootTarget /media/boot"},
        {kIpiStorageTargetFirmwareUpdateResourcePartition, "FirmwareUpdatePartitionTarget"},
    };
    for (const auto& [id, description] : devices) {
        ASSERT_NE(registry[id], nullptr) << description;
        EXPECT_EQ(registry[id]->getDescription(), description);
    }
    for (const size_t unused : {11, 12, 13}) EXPECT_EQ(registry[unused], nullptr);
}

TEST(TargetRegistry, LutSlotsAreZeroToTwentyFive) {
    ScratchDir dir;
    TargetRegistry registry;
    registerTargets(dir.path(), registry);
    EXPECT_TRUE(registry[kIpiStorageTargetLUT]->getSlot(25));
    EXPECT_FALSE(registry[kIpiStorageTargetLUT]->getSlot(26));
    EXPECT_TRUE(registry[kIpiStorageTargetOverlay]->getSlot(7));
    EXPECT_FALSE(registry[kIpiStorageTargetOverlay]->getSlot(8));
}

// The lines of `text` that start with `prefix`.
std::string linesStartingWith(const std::string& text, const std::string& prefix) {
    std::string kept;
    size_t start = 0;
    while (start < text.size()) {
        size_t end = text.find('\n', start);
        end = end == std::string::npos ? text.size() : end + 1;
        if (text.compare(start, prefix.size(), prefix) == 0) kept += text.substr(start, end - start);
        start = end;
    }
    return kept;
}

TEST(TargetRegistry, RegisterLinesInTableOrder) {
    ScratchDir dir;
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_INFO);
        TargetRegistry registry;
        registerTargets(dir.path(), registry);
        return 0;
    });
    const std::string expected = testing_support::registerLines(dir.path());
    // Off the device the boot vector's own failure line is logged too.
    EXPECT_EQ(linesStartingWith(result.out, "Register "), expected);
}

TEST(TargetRegistry, RegisterLinesNeedInfoLevel) {
    ScratchDir dir;
    const auto result = runInChild([&] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        TargetRegistry registry;
        registerTargets(dir.path(), registry);
        return 0;
    });
    EXPECT_EQ(linesStartingWith(result.out, "Register "), "");
}

// Counts its own destruction.
class CountedTarget : public Storage::Target {
public:
    CountedTarget(std::vector<int>& destroyed, int tag) : destroyed_(destroyed), tag_(tag) {}
    ~CountedTarget() override { destroyed_.push_back(tag_); }
    Storage::SlotHandle getSlot(size_t) override { return {}; }
    size_t getSlotCount() const override { return 3; }
    std::string getDescription() const override { return "CountedTarget /x"; }

private:
    std::vector<int>& destroyed_;
    int tag_;
};

TEST(TargetRegistry, ReplacingAnEntryDestroysTheOldTarget) {
    std::vector<int> destroyed;
    {
        TargetRegistry registry;
        registerTarget(registry, kIpiStorageTargetUtilSave, std::make_unique<CountedTarget>(destroyed, 1));
        registerTarget(registry, kIpiStorageTargetUtilSave, std::make_unique<CountedTarget>(destroyed, 2));
        EXPECT_EQ(destroyed, std::vector<int>{1});
    }
    EXPECT_EQ(destroyed, (std::vector<int>{1, 2}));
}

TEST(TargetRegistry, EntriesAreDestroyedFromTheHighestValueDown) {
    std::vector<int> destroyed;
    {
        TargetRegistry registry;
        registerTarget(registry, kIpiStorageTargetSettings, std::make_unique<CountedTarget>(destroyed, 0));
        registerTarget(registry, kIpiStorageTargetBootVector, std::make_unique<CountedTarget>(destroyed, 14));
        registerTarget(registry, kIpiStorageTargetLUT, std::make_unique<CountedTarget>(destroyed, 1));
    }
    EXPECT_EQ(destroyed, (std::vector<int>{14, 1, 0}));
}

TEST(TargetRegistry, NamesOfValuesWithoutAnEnumeratorFallBackToTheFirst) {
    EXPECT_STREQ(storageTargetName(kIpiStorageTargetBootVector), "kIpiStorageTargetBootVector");
    EXPECT_STREQ(storageTargetName(kIpiStorageTargetFirmwareUpdateResourcePartition),
                 "kIpiStorageTargetFirmwareUpdateResourcePartition");
    EXPECT_STREQ(storageTargetName(static_cast<StorageTarget>(12)), "kIpiStorageTargetSettings");
    EXPECT_STREQ(storageTargetName(static_cast<StorageTarget>(99)), "kIpiStorageTargetSettings");
}

TEST(TargetRegistry, RegisterLineOfAnyTarget) {
    const auto result = runInChild([] {
        setLogOutput(LOG_OUTPUT_STDOUT);
        setLogLevel(LOG_PRIORITY_INFO);
        std::vector<int> destroyed;
        TargetRegistry registry;
        registerTarget(registry, kIpiStorageTargetBootVector, std::make_unique<CountedTarget>(destroyed, 0));
        registerTarget(registry, static_cast<StorageTarget>(12), std::make_unique<CountedTarget>(destroyed, 0));
        return 0;
    });
    EXPECT_EQ(result.out,
              "Register kIpiStorageTargetBootVector = CountedTarget /x [3]\n"
              "Register kIpiStorageTargetSettings = CountedTarget /x [3]\n");
}

}  // namespace
