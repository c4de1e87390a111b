#include "overlap_campaign.h"

#include <atomic>
#include <chrono>
#include <filesystem>
#include <iostream>
#include <iterator>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "fault_injection.h"
#include "files.h"
#include "lib/storage/dual_file_target.h"
#include "lib/storage/slot_lock.h"
#include "overlap_driver.h"
#include "overlap_slots.h"
#include "scratch_dir.h"

namespace overlap {
namespace {

namespace fs = std::filesystem;
using testing_support::Environment;
using testing_support::ProcessResult;

// The tool processes of a round, by slot: four meet on the one-slot store.
constexpr size_t kToolWrites[] = {0, 0, 0, 0, 1, 2, 3};
constexpr size_t kDriverThreads = 3;
constexpr size_t kDriverSteps = 4;
constexpr size_t kInspectLoops = 2;

// Stores nobody writes during the campaign, and whether they hold a blob.
struct QueryPlace {
    const char* target;
    const char* directory;
    bool present;
};
constexpr QueryPlace kQueries[] = {{"settings", "settings", false}, {"calib_save", "app/calibSave", true}};

// An operation may wait for its lock this long, and take this much more
// for everything else, a program's start and end too: on the emulated
// device a run of the tool alone takes up to a second or more beside the
// others.
#ifndef OVERLAP_WAIT_MARGIN_SECONDS
#define OVERLAP_WAIT_MARGIN_SECONDS 1
#endif
constexpr std::chrono::nanoseconds kLongestWait =
    Storage::kSlotLockWait + std::chrono::seconds(OVERLAP_WAIT_MARGIN_SECONDS);
// A program that hangs ends the round instead of the test's time limit.
constexpr unsigned kProgramTimeLimitSeconds = 60;
constexpr size_t kReportedFindings = 10;

std::vector<std::string> slotArguments(const SlotPlace& place, const char* indexOption) {
    std::vector<std::string> arguments = {std::string("--target=") + place.target};
    if (place.slotCount > 1) arguments.insert(arguments.end(), {indexOption, std::to_string(place.index)});
    return arguments;
}

ProcessResult runTool(const std::vector<std::string>& arguments, const Environment& environment) {
    std::vector<std::string> argv = {MIGRATE_SETTINGS_BIN};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return testing_support::runProgram(argv, environment, kProgramTimeLimitSeconds);
}

// The slot's blob whole, through a target object opened for this read.
ServedBlob freshRead(const fs::path& base, const SlotPlace& place, size_t largestBlob) {
    ServedBlob served{"a fresh target object", kNoBlob, ""};
    Storage::DualFileTarget target(base / place.directory, place.slotCount);
    Bytes buffer(largestBlob + 1);
    size_t got = 0;
    if (target.getSlot(place.index)->readSome(buffer.data(), buffer.size(), 0, got) != STATUS_OK) return served;
    served.blob = identifyBlob(buffer.data(), got);
    if (served.blob == kNotABlob) served.detail = describeBytes(buffer.data(), got);
    return served;
}

class Campaign {
public:
    explicit Campaign(const CampaignSettings& settings)
        : settings_(settings),
          base_(scratch_ / "base"),
          blobs_(scratch_ / "blobs"),
          environment_(settings.locksOff ? testing_support::locksOffEnv() : Environment{}) {
        fs::create_directories(blobs_);
        for (const QueryPlace& query : kQueries) {
            if (!query.present) continue;
            const BlobId id = nextBlob_++;
            const Bytes blob = makeBlob(id, blobSize(id, settings_.largestBlob));
            Storage::DualFileTarget target(base_ / query.directory, 1);
            EXPECT_EQ(target.getSlot(0)->write(blob.data(), blob.size()), STATUS_OK) << query.target;
        }
    }

    Round run() {
        Round round;
        startBlobs(round);
        const std::vector<std::pair<size_t, BlobId>> toolWrites = planToolWrites();
        const DriverPlan driverPlan = planDriver();

        // Every thread records into a list of its own.
        std::vector<std::vector<Operation>> written(toolWrites.size() + 1);
        std::vector<std::vector<Operation>> answered(1 + kInspectLoops);
        std::atomic<bool> writing{true};
        round.startNs = nowNs();
        std::vector<std::thread> writers;
        for (size_t i = 0; i < toolWrites.size(); ++i) {
            writers.emplace_back(
                [&, i] { written[i].push_back(toolWrite(toolWrites[i].first, toolWrites[i].second)); });
        }
        writers.emplace_back([&] { written.back() = drive(driverPlan); });
        std::vector<std::thread> readers;
        readers.emplace_back([&] { queryLoop(writing, answered[0]); });
        for (size_t i = 0; i < kInspectLoops; ++i) {
            readers.emplace_back([&, i] { inspectLoop(writing, i, answered[1 + i]); });
        }
        for (std::thread& thread : writers) thread.join();
        writing = false;
        for (std::thread& thread : readers) thread.join();
        for (const auto* lists : {&written, &answered}) {
            for (const auto& list : *lists) round.operations.insert(round.operations.end(), list.begin(), list.end());
        }

        for (size_t slot = 0; slot < kSlotCount; ++slot) {
            const Operation dump = inspect(slot, {});
            round.served.push_back(
                {freshRead(base_, kSlots[slot], settings_.largestBlob), {dump.who, dump.blob, dump.detail}});
        }
        for (const auto& [slot, id] : toolWrites) fs::remove(blobPath(id));
        return round;
    }

private:
    fs::path blobPath(BlobId id) const { return blobs_ / std::to_string(id); }

    // Written one after the other, before anything else runs: nothing can
    // keep them out, locks or not.
    void startBlobs(Round& round) {
        std::map<std::string, std::unique_ptr<Storage::DualFileTarget>> targets;
        for (const SlotPlace& place : kSlots) {
            auto& target = targets[place.directory];
            if (!target) target = std::make_unique<Storage::DualFileTarget>(base_ / place.directory, place.slotCount);
            const BlobId id = nextBlob_++;
            const Bytes blob = makeBlob(id, blobSize(id, settings_.largestBlob));
            EXPECT_EQ(target->getSlot(place.index)->write(blob.data(), blob.size()), STATUS_OK) << place.directory;
            round.starting.push_back(id);
        }
    }

    std::vector<std::pair<size_t, BlobId>> planToolWrites() {
        std::vector<std::pair<size_t, BlobId>> writes;
        for (const size_t slot : kToolWrites) {
            const BlobId id = nextBlob_++;
            testing_support::writeBytes(blobPath(id), makeBlob(id, blobSize(id, settings_.largestBlob)));
            writes.emplace_back(slot, id);
        }
        return writes;
    }

    // Each thread starts at another slot and moves on by one.
    DriverPlan planDriver() {
        DriverPlan plan{base_, settings_.largestBlob, {}};
        for (size_t thread = 0; thread < kDriverThreads; ++thread) {
            std::vector<DriverStep> steps;
            for (size_t step = 0; step < kDriverSteps; ++step) {
                steps.push_back({(thread + step) % kSlotCount, nextBlob_++});
            }
            plan.threads.push_back(steps);
        }
        return plan;
    }

    Operation toolWrite(size_t slot, BlobId id) const {
        Operation op = beginOperation(OperationKind::kWrite, slot, id, "migrate_settings");
        std::vector<std::string> arguments = {"--base", base_.string()};
        for (const std::string& word : slotArguments(kSlots[slot], "--index")) arguments.push_back(word);
        arguments.insert(arguments.end(), {"--type", "simple", "--data", blobPath(id).string()});
        const ProcessResult result = runTool(arguments, environment_);
        op.endNs = nowNs();
        op.ok = result.exitStatus == 0;
        return op;
    }

    std::vector<Operation> drive(const DriverPlan& plan) const {
        if (!settings_.locksOff) return runDriver(plan);
        const testing_support::ScratchDir records;
        const fs::path recordFile = records / "operations";
        std::vector<std::string> argv = {OVERLAP_STRESS_BIN, "--driver", recordFile.string()};
        for (const std::string& word : planArguments(plan)) argv.push_back(word);
        const ProcessResult result = testing_support::runProgram(argv, environment_, kProgramTimeLimitSeconds);
        if (result.exitStatus != 0) {
            ADD_FAILURE() << "the driver's process ended with status " << result.exitStatus << ", signal "
                          << result.signal << ":\n"
                          << result.out << result.err;
            return {};
        }
        return parseOperations(testing_support::readText(recordFile));
    }

    void queryLoop(const std::atomic<bool>& writing, std::vector<Operation>& operations) const {
        for (size_t i = 0; writing; ++i) {
            const QueryPlace& query = kQueries[i % std::size(kQueries)];
            Operation op = beginOperation(OperationKind::kQuery, 0, kNotABlob, "migrate_settings");
            const ProcessResult result =
                runTool({"--base", base_.string(), "--target", query.target, "--query-present"}, environment_);
            op.endNs = nowNs();
            op.ok = result.exitStatus == 0 || result.exitStatus == 10;
            op.rightAnswer = (result.exitStatus == 0) == query.present;
            operations.push_back(op);
        }
    }

    // inspect_store --dump=- of one slot after another, each loop starting
    // at a slot of its own.
    void inspectLoop(const std::atomic<bool>& writing, size_t loop, std::vector<Operation>& operations) const {
        for (size_t i = loop; writing; ++i) operations.push_back(inspect(i % kSlotCount, environment_));
    }

    Operation inspect(size_t slot, const Environment& environment) const {
        Operation op = beginOperation(OperationKind::kRead, slot, kNotABlob, "inspect_store");
        std::vector<std::string> argv = {INSPECT_STORE_BIN, "--base=" + base_.string()};
        for (const std::string& word : slotArguments(kSlots[slot], "-i")) argv.push_back(word);
        argv.push_back("--dump=-");
        const ProcessResult result = testing_support::runProgram(argv, environment, kProgramTimeLimitSeconds);
        op.endNs = nowNs();
        // 10: "not present", a wrong answer about a slot that holds a blob.
        op.ok = result.exitStatus == 0 || result.exitStatus == 10;
        if (result.exitStatus == 0) {
            const auto* bytes = reinterpret_cast<const uint8_t*>(result.out.data());
            op.blob = identifyBlob(bytes, result.out.size());
            if (op.blob == kNotABlob) op.detail = describeBytes(bytes, result.out.size());
        } else {
            op.blob = kNoBlob;
        }
        return op;
    }

    const CampaignSettings settings_;
    const testing_support::ScratchDir scratch_;
    const fs::path base_;
    const fs::path blobs_;
    const Environment environment_;
    BlobId nextBlob_ = 1;
};

}  // namespace

CampaignTotals runCampaign(const CampaignSettings& settings) {
    Campaign campaign(settings);
    CampaignTotals totals;
    size_t reported = 0;
    while (totals.rounds < settings.rounds) {
        const Round round = campaign.run();
        const Verdict verdict = judgeRound(round, kLongestWait);
        ++totals.rounds;
        totals.acknowledged += verdict.acknowledged;
        totals.lost += verdict.lost;
        totals.staleReads += verdict.staleReads;
        totals.longWaits += verdict.longWaits;
        totals.failedWrites += verdict.failedWrites;
        totals.failedReads += verdict.failedReads;
        for (const Operation& op : round.operations) {
            if (op.kind != OperationKind::kWrite && op.ok) ++totals.answeredReads;
        }
        for (const std::string& finding : verdict.findings) {
            if (reported++ < kReportedFindings) {
                std::cout << settings.label << ": round " << totals.rounds << ": " << finding << "\n";
            }
        }
        if (settings.untilLost && verdict.lost > 0) break;
    }
    std::cout << settings.label << ": " << totals.answeredReads << " reads and queries answered; gave up, which "
              << "says nothing about the store: " << totals.failedWrites << " writes, " << totals.failedReads
              << " reads and queries\n";
    std::cout << totalsLine(settings.label, totals) << std::endl;
    return totals;
}

std::string totalsLine(const std::string& label, const CampaignTotals& totals) {
    return label + ": " + std::to_string(totals.rounds) + " rounds, " + std::to_string(totals.acknowledged) +
           " acknowledged, " + std::to_string(totals.lost) + " lost, " + std::to_string(totals.staleReads) +
           " stale reads, " + std::to_string(totals.longWaits) + " waits beyond the bound";
}

int runDriverProcess(const std::vector<std::string>& arguments) {
    if (arguments.empty()) {
        std::cerr << "--driver: expected RECORD_FILE BASE LARGEST THREAD...\n";
        return 2;
    }
    try {
        const DriverPlan plan = parsePlan(std::vector<std::string>(arguments.begin() + 1, arguments.end()));
        testing_support::writeText(arguments[0], operationsText(runDriver(plan)));
    } catch (const std::exception& error) {
        std::cerr << "--driver: " << error.what() << "\n";
        return 2;
    }
    return 0;
}

}  // namespace overlap
