// Crash points of logs made by hand: which points each kind yields, and
// the device bytes each one leaves.
#include "crash_points.h"

#include <algorithm>
#include <set>

#include <gtest/gtest.h>

#include "log_entries.h"

namespace replay {
namespace {

constexpr uint32_t kSector = 512;

// 0 w, 1 w, 2 mark, 3 flush, 4 w(FUA), 5 w, 6 w, 7 w, 8 flush
WriteLog sample() {
    WriteLog log;
    log.entries = {writeEntry(0, 1, 0x11), writeEntry(1, 2, 0x22),       markEntry("ack 1"),
                   flushEntry(),           writeEntry(3, 1, 0x33, kFua), writeEntry(4, 1, 0x44),
                   writeEntry(5, 1, 0x55), writeEntry(0, 1, 0x66),       flushEntry()};
    return log;
}

CrashPointChoice none() {
    CrashPointChoice choice;
    choice.barriers = false;
    choice.prefixes = false;
    choice.subsetsPerEpoch = 0;
    choice.tornPerWrite = 0;
    return choice;
}

TEST(CrashPoints, BarriersFollowEveryFlushAndFuaEntry) {
    CrashPointChoice choice = none();
    choice.barriers = true;
    std::vector<size_t> prefixes;
    for (const CrashPoint& point : crashPoints(sample(), choice)) prefixes.push_back(point.prefix);
    EXPECT_EQ(prefixes, (std::vector<size_t>{4, 5, 9}));
}

TEST(CrashPoints, PrefixesCoverEveryEntryFromNoneToAll) {
    CrashPointChoice choice = none();
    choice.prefixes = true;
    const std::vector<CrashPoint> points = crashPoints(sample(), choice);
    ASSERT_EQ(points.size(), 10u);
    for (size_t i = 0; i < points.size(); ++i) {
        EXPECT_EQ(points[i].prefix, i);
        EXPECT_EQ(points[i].reach(), i);
    }
}

TEST(CrashPoints, ASmallEpochGivesEverySubsetButNoneAndAll) {
    CrashPointChoice choice = none();
    choice.subsetsPerEpoch = 20;
    const std::vector<CrashPoint> points = crashPoints(sample(), choice);
    // Epoch 0..3 holds writes 0 and 1: {0}, {1}. Epoch 3..8 holds 4..7,
    // 4 a FUA write that every subset with a later write keeps: 4 with any
    // of the 7 subsets of 5..7 but all of them.
    ASSERT_EQ(points.size(), 2u + 7u);
    std::set<std::vector<size_t>> first;
    std::set<std::vector<size_t>> second;
    for (const CrashPoint& point : points) {
        ASSERT_EQ(point.kind, CrashKind::kReordered);
        ASSERT_FALSE(point.extra.empty());
        (point.prefix == 0 ? first : second).insert(point.extra);
        EXPECT_EQ(point.reach(), point.extra.back() + 1);
    }
    EXPECT_EQ(first, (std::set<std::vector<size_t>>{{0}, {1}}));
    EXPECT_EQ(second.size(), 7u);
    EXPECT_EQ(second.count({4, 5, 6, 7}), 0u);
    EXPECT_EQ(second.count({4, 7}), 1u);
    EXPECT_EQ(second.count({4}), 1u);
    for (const std::vector<size_t>& kept : second) EXPECT_EQ(kept.front(), 4u) << "a subset without the FUA write";
}

TEST(CrashPoints, ALargeEpochGivesTheChosenNumberOfDistinctSeededSubsets) {
    WriteLog log;
    for (uint8_t i = 0; i < 12; ++i) log.entries.push_back(writeEntry(i, 1, i));
    log.entries.push_back(flushEntry());
    CrashPointChoice choice = none();
    choice.subsetsPerEpoch = 20;
    const std::vector<CrashPoint> points = crashPoints(log, choice);
    ASSERT_EQ(points.size(), 20u);
    std::set<std::vector<size_t>> distinct;
    for (const CrashPoint& point : points) {
        EXPECT_EQ(point.prefix, 0u);
        EXPECT_GT(point.extra.size(), 0u);
        EXPECT_LT(point.extra.size(), 12u);
        EXPECT_TRUE(std::is_sorted(point.extra.begin(), point.extra.end()));
        distinct.insert(point.extra);
    }
    EXPECT_EQ(distinct.size(), 20u);

    std::set<std::vector<size_t>> again;
    for (const CrashPoint& point : crashPoints(log, choice)) again.insert(point.extra);
    EXPECT_EQ(again, distinct);
    choice.seed = 2;
    std::set<std::vector<size_t>> otherSeed;
    for (const CrashPoint& point : crashPoints(log, choice)) otherSeed.insert(point.extra);
    EXPECT_NE(otherSeed, distinct);
}

TEST(CrashPoints, TornWritesAreNeverWhollyOldOrWhollyNew) {
    CrashPointChoice choice = none();
    choice.tornPerWrite = 6;
    const std::vector<CrashPoint> points = crashPoints(sample(), choice);
    // Six writes (entries 0, 1, 4, 5, 6, 7), six variants each.
    ASSERT_EQ(points.size(), 36u);
    for (const CrashPoint& point : points) {
        ASSERT_EQ(point.kind, CrashKind::kTorn);
        EXPECT_EQ(point.prefix, point.torn);
        EXPECT_EQ(point.reach(), point.torn + 1);
        ASSERT_EQ(point.fates.size(), sample().entries[point.torn].sectorCount);
        const auto count = [&point](SectorFate fate) {
            return std::count(point.fates.begin(), point.fates.end(), fate);
        };
        EXPECT_NE(static_cast<size_t>(count(SectorFate::kOld)), point.fates.size());
        EXPECT_NE(static_cast<size_t>(count(SectorFate::kNew)), point.fates.size());
    }
}

TEST(CrashPoints, TheDefaultChoiceGivesEveryKindInTurn) {
    const std::vector<CrashPoint> points = crashPoints(sample(), CrashPointChoice{});
    std::vector<std::pair<CrashKind, size_t>> runs;
    for (const CrashPoint& point : points) {
        if (runs.empty() || runs.back().first != point.kind) runs.emplace_back(point.kind, 0);
        ++runs.back().second;
    }
    EXPECT_EQ(
        runs,
        (std::vector<std::pair<CrashKind, size_t>>{
            {CrashKind::kBarrier, 3}, {CrashKind::kPrefix, 10}, {CrashKind::kReordered, 9}, {CrashKind::kTorn, 24}}));
}

TEST(CrashPoints, APrefixLeavesTheWritesInOrderAndADiscardLeavesZeros) {
    WriteLog log = sample();
    log.entries.push_back(discardEntry(4, 2));
    std::vector<uint8_t> device(8 * kSector, 0xcc);
    applyCrashPoint(log, CrashPoint{CrashKind::kPrefix, log.entries.size(), {}, 0, {}}, device);
    const auto sectorByte = [&device](size_t sector) { return device[sector * kSector + 7]; };
    EXPECT_EQ(sectorByte(0), 0x66);  // written twice: the later write wins
    EXPECT_EQ(sectorByte(1), 0x22);
    EXPECT_EQ(sectorByte(2), 0x22);
    EXPECT_EQ(sectorByte(3), 0x33);
    EXPECT_EQ(sectorByte(4), 0x00);
    EXPECT_EQ(sectorByte(5), 0x00);
    EXPECT_EQ(sectorByte(6), 0xcc);
}

TEST(CrashPoints, AReorderedPointLeavesOnlyItsChosenWrites) {
    std::vector<uint8_t> device(8 * kSector, 0xcc);
    applyCrashPoint(sample(), CrashPoint{CrashKind::kReordered, 3, {5, 7}, 0, {}}, device);
    EXPECT_EQ(device[0], 0x66);
    EXPECT_EQ(device[kSector], 0x22);
    EXPECT_EQ(device[3 * kSector], 0xcc);
    EXPECT_EQ(device[4 * kSector], 0x44);
    EXPECT_EQ(device[5 * kSector], 0xcc);
}

TEST(CrashPoints, ATornWriteLeavesEachSectorToItsFate) {
    WriteLog log;
    log.entries = {writeEntry(0, 4, 0x11), writeEntry(0, 4, 0x22)};
    std::vector<uint8_t> device(4 * kSector, 0xcc);
    const CrashPoint point{
        CrashKind::kTorn, 1, {}, 1, {SectorFate::kOld, SectorFate::kNew, SectorFate::kZeros, SectorFate::kErased}};
    applyCrashPoint(log, point, device);
    EXPECT_EQ(device[0], 0x11);
    EXPECT_EQ(device[kSector], 0x22);
    EXPECT_EQ(device[2 * kSector + kSector - 1], 0x00);
    EXPECT_EQ(device[3 * kSector], 0xff);
    EXPECT_EQ(point.describe(), "entry 1 torn, sectors ONZF");
}

// A discard carries no data: its new sectors are zeros, as when it lands whole.
TEST(CrashPoints, ATornDiscardLeavesZerosForItsNewSectors) {
    WriteLog log;
    log.entries = {writeEntry(0, 3, 0x11), discardEntry(0, 3)};
    std::vector<uint8_t> device(4 * kSector, 0xcc);
    const CrashPoint point{CrashKind::kTorn, 1, {}, 1, {SectorFate::kNew, SectorFate::kOld, SectorFate::kErased}};
    applyCrashPoint(log, point, device);
    EXPECT_EQ(device[kSector - 1], 0x00);
    EXPECT_EQ(device[kSector], 0x11);
    EXPECT_EQ(device[2 * kSector], 0xff);
    EXPECT_EQ(device[3 * kSector], 0xcc);
}

TEST(CrashPoints, AnEntryBeyondTheDeviceIsAnError) {
    WriteLog log;
    log.entries = {writeEntry(3, 2, 0x11)};
    std::vector<uint8_t> device(4 * kSector, 0);
    EXPECT_THROW(applyCrashPoint(log, CrashPoint{CrashKind::kPrefix, 1, {}, 0, {}}, device), std::out_of_range);
}

}  // namespace
}  // namespace replay
