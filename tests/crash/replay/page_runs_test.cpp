// Overlays turned into whole pages: what each page holds and where the
// runs of adjacent pages break.
#include "page_runs.h"

#include <gtest/gtest.h>

namespace replay {
namespace {

constexpr uint32_t kSector = 512;
constexpr size_t kPage = 4096;

// A device of `pages` pages whose every byte tells its page (1, 2, ...).
std::vector<uint8_t> baseOf(size_t pages) {
    std::vector<uint8_t> base;
    for (size_t page = 0; page < pages; ++page) base.insert(base.end(), kPage, static_cast<uint8_t>(page + 1));
    return base;
}

std::vector<uint8_t> sectorOf(uint8_t fill) { return std::vector<uint8_t>(kSector, fill); }

TEST(PageRuns, NoOverlayWritesNothing) { EXPECT_TRUE(pageRuns({}, kSector, baseOf(4), kPage).empty()); }

TEST(PageRuns, ASectorGetsTheRestOfItsPageFromTheBase) {
    const std::vector<PageRun> runs = pageRuns({{10, sectorOf(0xaa)}}, kSector, baseOf(4), kPage);
    ASSERT_EQ(runs.size(), 1u);
    EXPECT_EQ(runs[0].offset, kPage);
    ASSERT_EQ(runs[0].bytes.size(), kPage);
    // Sector 10 is the third of page 1.
    for (size_t i = 0; i < kPage; ++i) {
        const bool overlaid = i >= 2 * kSector && i < 3 * kSector;
        ASSERT_EQ(runs[0].bytes[i], overlaid ? 0xaa : 2) << "byte " << i;
    }
}

TEST(PageRuns, AdjacentPagesJoinAndAGapStartsANewRun) {
    // Pages 0 and 1 (sectors 7 and 8 straddle their border), then page 3.
    const SectorOverlay overlay = {{7, sectorOf(0x11)}, {8, sectorOf(0x22)}, {24, sectorOf(0x33)}};
    const std::vector<PageRun> runs = pageRuns(overlay, kSector, baseOf(4), kPage);
    ASSERT_EQ(runs.size(), 2u);
    EXPECT_EQ(runs[0].offset, 0u);
    ASSERT_EQ(runs[0].bytes.size(), 2 * kPage);
    EXPECT_EQ(runs[0].bytes[7 * kSector - 1], 1);
    EXPECT_EQ(runs[0].bytes[7 * kSector], 0x11);
    EXPECT_EQ(runs[0].bytes[8 * kSector], 0x22);
    EXPECT_EQ(runs[0].bytes[9 * kSector], 2);
    EXPECT_EQ(runs[1].offset, 3 * kPage);
    ASSERT_EQ(runs[1].bytes.size(), kPage);
    EXPECT_EQ(runs[1].bytes[0], 0x33);
    EXPECT_EQ(runs[1].bytes[kSector], 4);
}

TEST(PageRuns, ManySectorsOfOnePageMakeOnePage) {
    SectorOverlay overlay;
    for (uint64_t sector = 16; sector < 24; ++sector) overlay[sector] = sectorOf(static_cast<uint8_t>(sector));
    const std::vector<PageRun> runs = pageRuns(overlay, kSector, baseOf(4), kPage);
    ASSERT_EQ(runs.size(), 1u);
    ASSERT_EQ(runs[0].bytes.size(), kPage);
    for (uint64_t sector = 16; sector < 24; ++sector) EXPECT_EQ(runs[0].bytes[(sector - 16) * kSector], sector);
}

TEST(PageRuns, SizesThatDoNotFitAreRefused) {
    EXPECT_THROW(pageRuns({}, 3000, baseOf(4), kPage), std::invalid_argument);
    EXPECT_THROW(pageRuns({}, kSector, std::vector<uint8_t>(kPage + kSector), kPage), std::invalid_argument);
    EXPECT_THROW(pageRuns({{32, sectorOf(1)}}, kSector, baseOf(4), kPage), std::invalid_argument);
    EXPECT_THROW(pageRuns({{0, std::vector<uint8_t>(10)}}, kSector, baseOf(4), kPage), std::invalid_argument);
}

}  // namespace
}  // namespace replay
