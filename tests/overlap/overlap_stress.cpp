// Tool processes, threads with target objects of their own, queries and
// inspect_store runs on the same slots at once, round after round, every
// round judged (overlap_campaign.h); and the same campaign with the locks
// turned off, which must lose writes, so that the judge is known to see a
// loss. OVERLAP_ROUNDS and OVERLAP_LOCKS_OFF_ROUNDS lengthen or shorten the
// campaigns.
//
// Started as "overlap_stress --driver ..." it is the driver's process of
// the campaign without locks (runDriverProcess).

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "env_number.h"
#include "overlap_campaign.h"

namespace {

using overlap::CampaignSettings;
using overlap::CampaignTotals;
using overlap::runCampaign;

#ifndef OVERLAP_ROUNDS_DIVISOR
#define OVERLAP_ROUNDS_DIVISOR 1
#endif
constexpr size_t kRoundsDivisor = OVERLAP_ROUNDS_DIVISOR;

constexpr size_t kRounds = 80 / kRoundsDivisor;
constexpr size_t kLargestBlob = 64 * 1024;
// Without locks most rounds answer some read wrongly, but only about one
// in eight loses a write: the last writers of a slot must rewrite one copy
// at once. Longer blobs widen that window; the campaign ends at the first
// loss.
constexpr size_t kLocksOffRounds = 100 / kRoundsDivisor;
constexpr size_t kLargestLocksOffBlob = 256 * 1024;

TEST(OverlapStress, LockedStoresLoseNothingAndServeOnlyCommittedBlobs) {
    const CampaignTotals totals =
        runCampaign({"overlap", testing_support::envNumber("OVERLAP_ROUNDS", kRounds), kLargestBlob, false, false});
    EXPECT_GT(totals.acknowledged, 0u);
    EXPECT_GT(totals.answeredReads, 0u);
    EXPECT_EQ(totals.lost, 0u);
    EXPECT_EQ(totals.staleReads, 0u);
    EXPECT_EQ(totals.longWaits, 0u);
}

// Ends at the first round that lost a write, or after the last round.
TEST(OverlapStress, WithoutLocksWritesAreLost) {
    const CampaignSettings settings{"overlap (locks off)",
                                    testing_support::envNumber("OVERLAP_LOCKS_OFF_ROUNDS", kLocksOffRounds),
                                    kLargestLocksOffBlob, true, true};
    const CampaignTotals totals = runCampaign(settings);
    EXPECT_GT(totals.lost + totals.staleReads, 0u);
}

}  // namespace

int main(int argc, char** argv) {
    if (argc >= 2 && std::string(argv[1]) == "--driver") {
        return overlap::runDriverProcess(std::vector<std::string>(argv + 2, argv + argc));
    }
    testing::InitGoogleTest(&argc, argv);
    return RUN_ALL_TESTS();
}
