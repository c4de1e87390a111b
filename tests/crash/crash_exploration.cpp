#include "crash_exploration.h"

#include <algorithm>
#include <cstdio>
#include <stdexcept>
#include <utility>

#include <unistd.h>

#include "child_process.h"
#include "fault_injection.h"
#include "files.h"
#include "lib/storage/dual_file_target.h"

namespace crash {

namespace {

namespace fs = std::filesystem;
using store_test::SlotContent;
using testing_support::ProcessResult;

constexpr size_t kReportedViolations = 20;

const ScenarioPrograms kPrograms{DUAL_FILE_DRIVER, {BROKEN_ORDER_WRITER}};

}  // namespace

// One run of a scenario: where its record ends, and what it acknowledged.
struct Segment {
    size_t end;  // the record's length when the run ended
    size_t slot;
    SlotContent acknowledged;
};

// A scenario's runs: the files they started from, what each slot held
// then, and the joint record.
struct ScenarioRecord {
    FsImage durable;
    std::vector<SlotContent> initial;
    std::vector<FsOp> ops;
    std::vector<FsOp> recorded;  // as the shim wrote them, for reports
    std::vector<Segment> segments;
};

namespace {

class Recorder {
public:
    Recorder(const fs::path& scratch, const Scenario& scenario)
        : scenario_(scenario), root_(scratch / "store"), inputs_(scratch / "inputs") {
        fs::create_directories(inputs_);
    }

    ScenarioRecord record() {
        ScenarioRecord result;
        result.initial.assign(scenario_.slotCount, store_test::nothingStored());
        const size_t slot = scenario_.slotCount == 1 ? 0 : kUpdatedSlot;
        if (scenario_.slotCount > 1) populateOtherSlots(result.initial);
        fs::create_directories(root_);
        result.durable = snapshotTree(root_);

        std::vector<SlotContent> current = result.initial;
        std::vector<FsOp> raw;
        for (size_t run = 0; run < scenario_.updates.size(); ++run) {
            const char update = scenario_.updates[run];
            const Bytes blob = blobFor(run + 1, scenario_.slotCount);
            const fs::path recordFile = inputs_ / ("record" + std::to_string(run));
            const ProcessResult outcome = testing_support::runProgram(
                updateCommand(kPrograms, update, root_, scenario_.slotCount, slot, blob, inputs_),
                testing_support::recordEnv(recordFile.string(), root_.string() + "/", clockOf(scenario_.clock, run)));
            if (outcome.exitStatus != 0) {
                throw std::runtime_error(std::string("update ") + update + " failed:\n" + outcome.out + outcome.err);
            }
            const std::vector<FsOp> ops = readFsRecord(recordFile);
            checkOneCommit(ops, update);
            raw.insert(raw.end(), ops.begin(), ops.end());

            // The broken writer only writes; a fresh opening tells what it left.
            const SlotContent reported = update == 'X' ? openedState(slot) : reportedState(outcome.out);
            SlotContent expected;
            if (expectedAfter(update, current[slot], blob, expected) && reported != expected) {
                throw std::runtime_error(std::string("update ") + update + " left " + reportText(reported) + ", not " +
                                         reportText(expected));
            }
            current[slot] = reported;
            result.segments.push_back(Segment{raw.size(), slot, reported});
        }
        result.ops = prepareRecord(raw, root_, result.durable);
        result.recorded = std::move(raw);
        // prepareRecord drops nothing below the root, so the run ends stay.
        if (result.ops.size() != result.recorded.size()) throw std::runtime_error("record outside the store");
        return result;
    }

private:
    SlotContent openedState(size_t slot) const {
        Storage::DualFileTarget target(root_, scenario_.slotCount);
        return store_test::contentOf(*target.getSlot(slot).get());
    }

    // Slot 0 holds a blob, slot 2 an erased one; written before the record
    // starts, so they are on disk.
    void populateOtherSlots(std::vector<SlotContent>& initial) {
        for (const std::vector<std::string>& command :
             populateCommands(kPrograms, root_, scenario_.slotCount, inputs_, initial)) {
            // At a fixed time, so that every scenario starts from the same files.
            const ProcessResult result =
                testing_support::runProgram(command, testing_support::recordEnv("", "", kClockStart));
            if (result.exitStatus != 0) throw std::runtime_error("populating failed:\n" + result.out + result.err);
        }
    }

    // Every acknowledged update ends with the one syncfs of its commit.
    static void checkOneCommit(const std::vector<FsOp>& ops, char update) {
        const size_t syncs = static_cast<size_t>(
            std::count_if(ops.begin(), ops.end(), [](const FsOp& op) { return op.kind == FsOpKind::kSyncfs; }));
        if (ops.empty() || ops.back().kind != FsOpKind::kSyncfs || syncs != 1) {
            throw std::runtime_error(std::string("update ") + update + " did not end with its one commit's syncfs");
        }
    }

    const Scenario& scenario_;
    fs::path root_;
    fs::path inputs_;
};

fs::path scratchParent() {
    const fs::path memory = "/dev/shm";
    std::error_code ignored;
    return fs::is_directory(memory, ignored) && ::access(memory.c_str(), W_OK) == 0 ? memory
                                                                                    : fs::temp_directory_path();
}

std::string stateKey(const FsImage& image, size_t slotCount) {
    return std::to_string(slotCount) + "\n" + fingerprint(image);
}

}  // namespace

Explorer::Explorer(fs::path keepStatesIn) : scratch_(scratchParent()), keptStates_(std::move(keepStatesIn)) {
    if (!keptStates_.empty()) fs::create_directories(keptStates_);
}

Explorer::~Explorer() = default;

std::string Scenario::name() const {
    return updates + "_" + std::to_string(slotCount) + "slot_" + clockName(clock) + "_" +
           (order == MetadataOrder::kInOrder ? "inorder" : "perfile");
}

Totals& Totals::operator+=(const Totals& other) {
    scenarios += other.scenarios;
    crashPoints += other.crashPoints;
    states += other.states;
    openedStates += other.openedStates;
    cleanUps += other.cleanUps;
    violations += other.violations;
    return *this;
}

std::string describe(const Totals& totals) {
    return std::to_string(totals.scenarios) + " scenarios, " + std::to_string(totals.crashPoints) + " crash points, " +
           std::to_string(totals.states) + " crash states (" + std::to_string(totals.openedStates) +
           " distinct, each opened; " + std::to_string(totals.cleanUps) +
           " with a clean-up cut short and opened again), " + std::to_string(totals.violations) + " violations";
}

std::vector<SlotContent> Explorer::open(const FsImage& image, size_t slotCount, FsImage* afterOpening) {
    const fs::path root = scratch_ / "state";
    fs::remove_all(root);
    materialise(image, root);
    std::vector<SlotContent> slots;
    {
        Storage::DualFileTarget target(root, slotCount);
        for (size_t i = 0; i < slotCount; ++i) slots.push_back(store_test::contentOf(*target.getSlot(i).get()));
    }
    if (afterOpening != nullptr) *afterOpening = snapshotTree(root);
    return slots;
}

void Explorer::keep(const FsImage& image, size_t slotCount, const std::string& name) {
    if (keptStates_.empty() || !kept_.insert(stateKey(image, slotCount)).second) return;
    materialise(image, keptStates_ / name);
}

const Explorer::Observation& Explorer::observe(const FsImage& image, size_t slotCount, const std::string& name,
                                               Totals& totals) {
    const std::string key = stateKey(image, slotCount);
    const auto known = observations_.find(key);
    if (known != observations_.end()) return known->second;
    keep(image, slotCount, name);

    Observation observation;
    FsImage cleaned;
    observation.slots = open(image, slotCount, &cleaned);
    std::vector<std::string> removed;
    for (const auto& [name, inode] : image.names) {
        if (cleaned.names.count(name) == 0) removed.push_back(name);
    }
    // A power cut during the clean-up leaves any part of it done.
    if (!removed.empty()) ++totals.cleanUps;
    const size_t subsets = size_t{1} << std::min<size_t>(removed.size(), 10);
    for (size_t mask = 1; mask < subsets && observation.cleanupProblem.empty(); ++mask) {
        FsImage partial = image;
        for (size_t i = 0; i < removed.size(); ++i) {
            if (mask & (size_t{1} << i)) partial.dropName(removed[i]);
        }
        keep(partial, slotCount, name + "-cleanup" + std::to_string(mask));
        if (open(partial, slotCount, nullptr) != observation.slots) {
            observation.cleanupProblem = "a second opening after a cut clean-up disagrees";
        }
    }
    return observations_.emplace(key, std::move(observation)).first->second;
}

Totals Explorer::explore(const Scenario& scenario) {
    // The runs do not depend on the metadata order.
    Scenario recorded = scenario;
    recorded.order = MetadataOrder::kInOrder;
    std::unique_ptr<ScenarioRecord>& known = records_[recorded.name()];
    if (!known) {
        const fs::path scenarioDir = scratch_ / "scenario";
        fs::remove_all(scenarioDir);
        known = std::make_unique<ScenarioRecord>(Recorder(scenarioDir, scenario).record());
    }
    const ScenarioRecord& record = *known;

    Totals totals;
    totals.scenarios = 1;
    const size_t openedBefore = observations_.size();
    for (size_t crashPoint = 0; crashPoint <= record.ops.size(); ++crashPoint) {
        // Runs that ended before the cut are acknowledged; the blob of the
        // one it interrupted is in flight.
        std::vector<SlotContent> acknowledged = record.initial;
        const Segment* inFlight = nullptr;
        size_t previousEnd = 0;
        for (const Segment& run : record.segments) {
            if (run.end <= crashPoint) {
                acknowledged[run.slot] = run.acknowledged;
                previousEnd = run.end;
                continue;
            }
            if (crashPoint > previousEnd) inFlight = &run;
            break;
        }
        ++totals.crashPoints;
        size_t stateAtPoint = 0;
        totals.states +=
            forEachCrashState(record.durable, record.ops, crashPoint, scenario.order, [&](const FsImage& image) {
                const std::string name =
                    scenario.name() + "-cut" + std::to_string(crashPoint) + "-" + std::to_string(stateAtPoint++);
                const Observation& seen = observe(image, scenario.slotCount, name, totals);
                std::string problem = seen.cleanupProblem;
                for (size_t slot = 0; slot < scenario.slotCount && problem.empty(); ++slot) {
                    const SlotContent& shown = seen.slots[slot];
                    const bool inFlightHere = inFlight != nullptr && inFlight->slot == slot;
                    const bool allowed =
                        shown == acknowledged[slot] || (inFlightHere && shown == inFlight->acknowledged);
                    if (!allowed) problem = "slot " + std::to_string(slot) + " shows " + reportText(shown);
                }
                if (problem.empty()) return;
                ++totals.violations;
                if (reports_.size() < kReportedViolations) {
                    const std::string after =
                        crashPoint == 0 ? "at the start" : "after " + describe(record.recorded[crashPoint - 1]);
                    reports_.push_back(scenario.name() + ": power cut " + after + ": " + problem);
                }
            });
    }
    totals.openedStates = observations_.size() - openedBefore;
    return totals;
}

}  // namespace crash
