// Every power cut during sequences of up to three updates of a dual-file
// store, under the ext4 crash model in its in-order and its per-file
// (pessimistic) metadata order, for one-slot and multi-slot stores and for
// clocks that move forward, stand still or go backwards. Totals are printed
// per case and for the whole run.
//
// CRASH_SEQUENCES=16 or 32 in the environment explores that many of the 64
// sequences in each case, chosen so that every kind of update still comes
// at every position equally often.
//
// CRASH_STATES_DIR=<directory> writes every distinct state a store is opened
// on into that directory, one target directory each (see Explorer), for a
// second reader of the format to judge.
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "crash_exploration.h"
#include "env_number.h"

namespace crash {
namespace {

Totals grandTotals;

class PrintGrandTotals : public ::testing::Environment {
public:
    void TearDown() override { std::printf("crash exploration totals: %s\n", describe(grandTotals).c_str()); }
};

const ::testing::Environment* const kPrintGrandTotals = ::testing::AddGlobalTestEnvironment(new PrintGrandTotals);

constexpr size_t kAllSequences = 64;

std::filesystem::path keptStatesDir() {
    const char* directory = std::getenv("CRASH_STATES_DIR");
    return directory == nullptr ? "" : directory;
}

// Sequences of three updates: each copy is rewritten at least once more
// after holding a blob, and shorter sequences are their prefixes. `count`
// of the 64 (64, 32 or 16): those whose kinds' positions in "WBAE" add up
// to a multiple of 64 / count, so that each kind comes at each position in
// a quarter of them.
std::vector<std::string> threeUpdateSequences(size_t count) {
    const std::string kinds = "WBAE";
    const size_t share = kAllSequences / count;
    std::vector<std::string> sequences;
    for (size_t first = 0; first < kinds.size(); ++first) {
        for (size_t second = 0; second < kinds.size(); ++second) {
            for (size_t third = 0; third < kinds.size(); ++third) {
                if ((first + second + third) % share == 0)
                    sequences.push_back({kinds[first], kinds[second], kinds[third]});
            }
        }
    }
    return sequences;
}

// "<slots>slot_<clock>_<order>"
std::string caseName(size_t slotCount, Clock clock, MetadataOrder order) {
    return Scenario{"", slotCount, clock, order}.name().substr(1);
}

// The runs are recorded by the preloaded shim, which cannot reach programs
// run under an emulator.
class NativeRuns : public ::testing::Test {
protected:
    void SetUp() override {
        if (!testing_support::programEmulator().empty()) {
            GTEST_SKIP() << "native builds only: under qemu-aarch64 the shim cannot be preloaded into the "
                            "emulated programs";
        }
    }
};

struct ExplorationCase {
    size_t slotCount;
    Clock clock;
};

class CrashExploration : public NativeRuns, public ::testing::WithParamInterface<ExplorationCase> {};

// Each scenario is recorded once and explored in both metadata orders.
TEST_P(CrashExploration, EveryPowerCutLeavesTheAcknowledgedOrTheInFlightBlob) {
    const size_t count = testing_support::envNumber("CRASH_SEQUENCES", kAllSequences);
    ASSERT_TRUE(count == kAllSequences || count == kAllSequences / 2 || count == kAllSequences / 4)
        << "CRASH_SEQUENCES must be 16, 32 or 64";
    const std::vector<std::string> sequences = threeUpdateSequences(count);
    Explorer explorer(keptStatesDir());
    for (const MetadataOrder order : {MetadataOrder::kInOrder, MetadataOrder::kPerFile}) {
        Totals totals;
        for (const std::string& updates : sequences) {
            totals += explorer.explore(Scenario{updates, GetParam().slotCount, GetParam().clock, order});
        }
        grandTotals += totals;
        std::printf("%s: %s\n", caseName(GetParam().slotCount, GetParam().clock, order).c_str(),
                    describe(totals).c_str());
        EXPECT_EQ(totals.scenarios, count);
    }
    for (const std::string& report : explorer.reports()) ADD_FAILURE() << report;
    EXPECT_TRUE(explorer.reports().empty());
}

INSTANTIATE_TEST_SUITE_P(AllCases, CrashExploration,
                         ::testing::Values(ExplorationCase{1, Clock::kForward}, ExplorationCase{1, Clock::kEqual},
                                           ExplorationCase{1, Clock::kBackward}, ExplorationCase{3, Clock::kForward},
                                           ExplorationCase{3, Clock::kEqual}, ExplorationCase{3, Clock::kBackward}),
                         [](const ::testing::TestParamInfo<ExplorationCase>& info) {
                             const std::string name =
                                 caseName(info.param.slotCount, info.param.clock, MetadataOrder::kInOrder);
                             return name.substr(0, name.rfind('_'));
                         });

// The same exploration catches a writer that puts the check file in place
// before the data: proof that it can fail.
class CrashExplorationOfABrokenWriter : public NativeRuns {};

TEST_F(CrashExplorationOfABrokenWriter, CatchesACheckFileCommittedBeforeItsData) {
    Explorer explorer(keptStatesDir());
    const Totals totals = explorer.explore(Scenario{"WXX", 1, Clock::kForward, MetadataOrder::kInOrder});
    std::printf("broken writer: %s\n", describe(totals).c_str());
    ASSERT_GT(totals.violations, 0u);
    ASSERT_FALSE(explorer.reports().empty());
    std::printf("first violation found: %s\n", explorer.reports().front().c_str());
    EXPECT_NE(explorer.reports().front().find("WXX"), std::string::npos);
}

}  // namespace
}  // namespace crash
