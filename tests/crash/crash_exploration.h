// Power-cut exploration of the dual-file store. A scenario is a sequence of
// updates of one slot, each made by a separate run of a small program under
// the fault-injection shim in recording mode. At every point of the joint
// record, every state the crash model allows is written out and a fresh
// store opened on it; each slot must show the blob acknowledged last or the
// one in flight, whole, and a second opening after a power cut during the
// first one's clean-up must show the same.
#pragma once

#include <cstddef>
#include <filesystem>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "crash_states.h"
#include "scenario_runs.h"
#include "scratch_dir.h"
#include "store_files.h"

namespace crash {

// Updates, one letter and one program run each:
//   W  write
//   B  beginWrite, two writeAt inside it, finalise
//   A  writeAt outside a begun write
//   E  erase
//   X  a test-only writer that commits the new copy's check file before
//      it writes the data, then commits again: a broken commit order
struct Scenario {
    std::string updates;
    size_t slotCount = 1;
    Clock clock = Clock::kForward;
    MetadataOrder order = MetadataOrder::kInOrder;

    std::string name() const;
};

struct Totals {
    size_t scenarios = 0;
    size_t crashPoints = 0;
    size_t states = 0;        // enumerated, repeats included
    size_t openedStates = 0;  // distinct states a store was opened on
    size_t cleanUps = 0;      // of those, where opening deleted check files
    size_t violations = 0;

    Totals& operator+=(const Totals& other);
};

std::string describe(const Totals& totals);

struct ScenarioRecord;

class Explorer {
public:
    // With `keepStatesIn`, every distinct state a store is opened on is
    // also written there once, as a store's target directory named after
    // the first cut that left it: "<scenario>-cut<crash point>-<state>",
    // and "-cleanup<subset>" after it for a clean-up a second cut stopped.
    // The scenario's name gives the slot count.
    explicit Explorer(std::filesystem::path keepStatesIn = {});
    ~Explorer();

    // Records `scenario` (once for all metadata orders) and checks every
    // crash state of it.
    Totals explore(const Scenario& scenario);

    // The first violations found, one line each.
    const std::vector<std::string>& reports() const { return reports_; }

private:
    struct Observation {
        std::vector<store_test::SlotContent> slots;
        std::string cleanupProblem;  // empty when a second opening agreed
    };

    const Observation& observe(const FsImage& image, size_t slotCount, const std::string& name, Totals& totals);
    void keep(const FsImage& image, size_t slotCount, const std::string& name);
    std::vector<store_test::SlotContent> open(const FsImage& image, size_t slotCount, FsImage* afterOpening);

    // In memory when the machine has a memory file system: the exploration
    // checks records against a model, not the disk, and the runs' syncfs
    // calls are then cheap.
    testing_support::ScratchDir scratch_;
    std::map<std::string, Observation> observations_;
    std::map<std::string, std::unique_ptr<ScenarioRecord>> records_;
    std::filesystem::path keptStates_;
    std::set<std::string> kept_;  // keys, as observations_ has them
    std::vector<std::string> reports_;
};

}  // namespace crash
