// Rounds of concurrent writers and readers on one store, each round judged
// (overlap_judge.h). A round starts a blob in every slot, then runs at once:
// migrate_settings processes writing one slot and neighbouring slots of
// another target, the driver's threads (overlap_driver.h), migrate_settings
// --query-present runs on untouched stores and inspect_store --dump runs of
// the written slots, the last two until the writers are done. Then every
// slot is read by a fresh target object and by inspect_store.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace overlap {

struct CampaignSettings {
    std::string label;  // begins every line the campaign prints
    size_t rounds = 0;
    size_t largestBlob = 0;
    // The programs and the driver run with every flock granted without
    // being held (the shim's FAULT_LOCKS=off); the driver in a process of
    // its own, this program started again with --driver.
    bool locksOff = false;
    // Ends the campaign after the first round that lost a write.
    bool untilLost = false;
};

struct CampaignTotals {
    size_t rounds = 0;
    size_t acknowledged = 0;
    size_t lost = 0;
    size_t staleReads = 0;
    size_t longWaits = 0;
    size_t answeredReads = 0;
    size_t failedWrites = 0;
    size_t failedReads = 0;
};

// Runs the campaign in a scratch base directory, printing the first
// findings, then a line of what was not judged, then the totals line.
CampaignTotals runCampaign(const CampaignSettings& settings);

// "LABEL: R rounds, A acknowledged, L lost, S stale reads, W waits beyond
// the bound".
std::string totalsLine(const std::string& label, const CampaignTotals& totals);

// The driver's side of a campaign with locksOff: `arguments` are those
// after --driver (a record file, then planArguments()). Runs the plan and
// writes the operations to the record file; the exit status.
int runDriverProcess(const std::vector<std::string>& arguments);

}  // namespace overlap
