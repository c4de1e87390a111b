// Records the crash scenarios' runs at the block level on a real kernel and
// checks every crash point of the log: the device's file system behind the
// kernel's log-writes target, the store driver's runs with a mark before
// each and after its acknowledgement; then, for every crash point, the
// device as the cut left it, mounted (the file system's own recovery, and
// the boot's repair when the mount refuses), and a fresh store opened on it
// twice. The tree each point shows is also checked against the crash model
// of tests/crash for the runs' recorded operations, but for the sectors of
// a torn write; a tree with a file that the file system refuses to read is
// outside it.
//
//   block_replay FS DATA LOG ORIGIN COWS WORK [options] [UPDATES...]
//     FS      ext4 | ext4-journal | ext4-writeback | f2fs
//     DATA    the block device the file system lives on (all of it is used)
//     LOG     the block device the log is written to
//     ORIGIN  a block device as large as DATA, for the device as the log started
//     COWS    two block devices as large as DATA, comma-separated, for the
//             points' changes in turn
//     WORK    a directory for mount points and the runs' inputs
//   options:
//     --slots=1,3                    store sizes
//     --clocks=forward,equal,backward
//     --subsets=N --torn=N --seed=S  crash points (see crash_points.h)
//     --broken                       the broken writer's scenario instead
//   UPDATES: scenarios of the store driver's updates W, B, A and E (see
//            scenario_runs.h), or TTT: three migrations by migrate_settings
//            into its settings target (one slot). Default: every sequence
//            of three of W, B, A, E, and TTT.
//
// Needs root, the log-writes and snapshot targets, and the file system's
// mkfs and fsck. Prints one line per scenario and the totals:
//   replay FS: S scenarios, E log entries, P crash points, D distinct states, V violations, M outside the model
// (or "broken writer FS: ..."), with a count of the points whose file
// system did not mount even after the repair, which no store can survive
// and which are not counted as violations. Exit status 0 without violations and, on
// ext4 with its defaults (the file system the model describes), without
// states outside the model; with --broken, 0 when there was a violation.
// 1 otherwise, 2 for a bad command line.
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <functional>
#include <map>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "child_process.h"
#include "crash_points.h"
#include "crash_states.h"
#include "fault_injection.h"
#include "files.h"
#include "fs_image.h"
#include "fs_record.h"
#include "lib/storage/dual_file_target.h"
#include "mapped_device.h"
#include "model_states.h"
#include "point_device.h"
#include "scenario_runs.h"
#include "write_log.h"

namespace {

namespace fs = std::filesystem;
using crash::Clock;
using store_test::SlotContent;
using testing_support::ProcessResult;

// The broken writer rewrites the current copy in place: a cut after its
// synced data and before its check file leaves only the older copy valid.
const crash::ScenarioPrograms kPrograms{DUAL_FILE_DRIVER, {BROKEN_ORDER_WRITER, "--in-place"}};
// Scenarios of the tool itself: each update a one-shot migration into its
// one-slot settings target, which lives in this directory of its base.
constexpr char kToolUpdate = 'T';
constexpr const char* kToolStore = "settings";
constexpr size_t kReportedProblems = 20;

struct FileSystem {
    std::string name;
    std::string type;
    std::string options;
    std::vector<std::string> mkfs;    // the device is appended
    std::vector<std::string> repair;  // what the boot runs when a mount refuses; the device is appended
    bool modelled;                    // the crash model describes it
};

// The device's data partition is large enough for mke2fs to give it 4 KiB
// blocks and 256-byte inodes; on the replay's small device it would choose
// 1 KiB blocks and 128-byte inodes, a file system the device never has.
// Its inode tables and journal are zeroed at once, as on a device past its
// first boot: else the kernel zeroes them in the background of the logged
// runs, megabytes of writes that no device in the field makes.
constexpr char kExt4Extended[] = "nodiscard,lazy_itable_init=0,lazy_journal_init=0";
const std::vector<std::string> kMakeExt4 = {"/sbin/mke2fs", "-q", "-F",  "-t", "ext4",       "-b",
                                            "4096",         "-I", "256", "-E", kExt4Extended};
const std::vector<std::string> kRepairExt4 = {"/sbin/e2fsck", "-p"};
const std::vector<FileSystem> kFileSystems = {
    {"ext4", "ext4", "", kMakeExt4, kRepairExt4, true},
    {"ext4-journal", "ext4", "data=journal", kMakeExt4, kRepairExt4, false},
    {"ext4-writeback", "ext4", "data=writeback", kMakeExt4, kRepairExt4, false},
    {"f2fs", "f2fs", "", {"/sbin/mkfs.f2fs", "-q", "-f"}, {"/sbin/fsck.f2fs", "-a"}, false},
};

struct Options {
    const FileSystem* fileSystem = nullptr;
    // The mapped devices' names: one replay per file system may run at once.
    std::string logTarget;
    std::string pointTarget;
    fs::path data;
    fs::path log;
    fs::path origin;
    std::array<fs::path, 2> cows;  // for the points' snapshots in turn
    fs::path work;
    std::vector<size_t> slotCounts = {1, 3};
    std::vector<Clock> clocks = {Clock::kForward, Clock::kEqual, Clock::kBackward};
    replay::CrashPointChoice choice;
    bool broken = false;
    std::vector<std::string> scenarios;
};

struct Totals {
    size_t scenarios = 0;
    size_t entries = 0;
    size_t points = 0;
    size_t violations = 0;
    size_t outsideModel = 0;
    size_t repaired = 0;
    size_t unmountable = 0;
    size_t unmountableTornFua = 0;  // of them, a forced-unit-access write torn
    std::set<std::string> states;
};

void run(const std::vector<std::string>& command, const std::map<std::string, std::string>& env = {}) {
    const ProcessResult result = testing_support::runProgram(command, env);
    if (result.exitStatus != 0) {
        std::string words;
        for (const std::string& word : command) words += word + " ";
        throw std::runtime_error(words + "failed:\n" + result.out + result.err);
    }
}

bool tryMount(const FileSystem& fileSystem, const fs::path& device, const fs::path& at) {
    return ::mount(device.c_str(), at.c_str(), fileSystem.type.c_str(), 0, fileSystem.options.c_str()) == 0;
}

void mountDevice(const FileSystem& fileSystem, const fs::path& device, const fs::path& at) {
    if (!tryMount(fileSystem, device, at)) {
        throw std::runtime_error("mount " + device.string() + ": " + std::strerror(errno));
    }
}

void unmount(const fs::path& at) {
    if (::umount(at.c_str()) != 0) throw std::runtime_error("umount " + at.string() + ": " + std::strerror(errno));
}

// One scenario's record: the device before the log, the log, what each
// run acknowledged, and the operations the runs made, for the model.
struct Recording {
    std::vector<uint8_t> base;
    replay::WriteLog log;
    std::vector<SlotContent> initial;
    std::vector<size_t> slots;              // per run
    std::vector<SlotContent> acknowledged;  // per run
    std::vector<size_t> runEnds;            // per run: the operations recorded when it ended
    fs::path storeDirectory;                // below the file system's "store"
    crash::FsImage durable;
    std::vector<crash::FsOp> ops;
};

// Where the store of a scenario lives below the file system's "store".
fs::path storeDirectory(const std::string& updates) {
    return updates.find(kToolUpdate) == std::string::npos ? "" : kToolStore;
}

std::vector<std::string> toolCommand(const fs::path& base, const std::vector<uint8_t>& blob, const fs::path& inputs) {
    const fs::path blobFile = inputs / "blob";
    testing_support::writeBytes(blobFile, blob);
    return {MIGRATE_SETTINGS_BIN, "--base", base.string(), "--target", kToolStore, "--type", "simple", "--data",
            blobFile.string()};
}

std::vector<SlotContent> openStore(const fs::path& root, size_t slotCount) {
    Storage::DualFileTarget target(root, slotCount);
    std::vector<SlotContent> slots;
    for (size_t i = 0; i < slotCount; ++i) slots.push_back(store_test::contentOf(*target.getSlot(i).get()));
    return slots;
}

// Runs the scenario's updates on the file system behind the log-writes
// target, a mark before each and after its acknowledgement; fills in what
// each acknowledged and returns the operations the runs recorded.
std::vector<crash::FsOp> runLogged(const Options& options, const std::string& updates, size_t slotCount, Clock clock,
                                   Recording& recording) {
    const fs::path mountPoint = options.work / "mnt";
    const fs::path inputs = options.work / "inputs";
    const fs::path root = mountPoint / "store";
    const size_t slot = slotCount == 1 ? 0 : crash::kUpdatedSlot;
    std::vector<crash::FsOp> raw;
    const replay::MappedDevice logged(options.logTarget, recording.base.size() / 512,
                                      "log-writes " + options.data.string() + " " + options.log.string());
    mountDevice(*options.fileSystem, logged.node(), mountPoint);
    for (size_t index = 0; index < updates.size(); ++index) {
        const char update = updates[index];
        const std::vector<uint8_t> blob = crash::blobFor(index + 1, slotCount);
        const std::vector<std::string> command =
            update == kToolUpdate ? toolCommand(root, blob, inputs)
                                  : crash::updateCommand(kPrograms, update, root, slotCount, slot, blob, inputs);
        const fs::path recordFile = inputs / ("record" + std::to_string(index));
        logged.message("mark begin:" + std::to_string(index));
        const ProcessResult outcome = testing_support::runProgram(
            command,
            testing_support::recordEnv(recordFile.string(), root.string() + "/", crash::clockOf(clock, index)));
        if (outcome.exitStatus != 0)
            throw std::runtime_error(std::string("update ") + update + " failed:\n" + outcome.err);
        logged.message("mark ack:" + std::to_string(index));
        const std::vector<crash::FsOp> ops = crash::readFsRecord(recordFile);
        raw.insert(raw.end(), ops.begin(), ops.end());
        recording.runEnds.push_back(raw.size());
        recording.slots.push_back(slot);
        // The broken writer and the tool do not report what they left.
        const bool reports = update != 'X' && update != kToolUpdate;
        recording.acknowledged.push_back(reports ? crash::reportedState(outcome.out)
                                                 : openStore(root / recording.storeDirectory, slotCount)[slot]);
    }
    unmount(mountPoint);
    return raw;
}

Recording record(const Options& options, const std::string& updates, size_t slotCount, Clock clock) {
    const FileSystem& fileSystem = *options.fileSystem;
    const fs::path mountPoint = options.work / "mnt";
    const fs::path inputs = options.work / "inputs";
    fs::create_directories(mountPoint);
    fs::remove_all(inputs);
    fs::create_directories(inputs);
    std::vector<std::string> mkfs = fileSystem.mkfs;
    mkfs.push_back(options.data.string());
    run(mkfs);

    Recording recording;
    recording.storeDirectory = storeDirectory(updates);
    const fs::path root = mountPoint / "store";
    mountDevice(fileSystem, options.data, mountPoint);
    fs::create_directories(root);
    recording.initial.assign(slotCount, store_test::nothingStored());
    if (slotCount > 1) {
        for (const auto& command : crash::populateCommands(kPrograms, root, slotCount, inputs, recording.initial)) {
            run(command, testing_support::recordEnv("", "", crash::kClockStart));
        }
    }
    recording.durable = crash::snapshotTree(root);
    unmount(mountPoint);
    recording.base = testing_support::readBytes(options.data);

    const std::vector<crash::FsOp> raw = runLogged(options, updates, slotCount, clock, recording);
    recording.log = replay::readWriteLog(options.log);
    recording.ops = crash::prepareRecord(raw, root, recording.durable);
    if (recording.ops.size() != raw.size()) throw std::runtime_error("a run's record reaches outside the store");
    return recording;
}

// What the marks before `reach` say: every slot's acknowledged content,
// the run in flight (or none), and the cuts of the runs' record the
// device can be at.
struct Expectation {
    std::vector<SlotContent> acknowledged;
    const SlotContent* inFlight = nullptr;
    size_t inFlightSlot = 0;
    size_t firstCut = 0;
    size_t lastCut = 0;
};

Expectation expectationAt(const Recording& recording, size_t reach) {
    Expectation expectation;
    expectation.acknowledged = recording.initial;
    for (size_t i = 0; i < reach; ++i) {
        const replay::LogEntry& entry = recording.log.entries[i];
        if (!entry.isMark()) continue;
        size_t run = 0;
        if (std::sscanf(entry.mark.c_str(), "begin:%zu", &run) == 1) {
            expectation.inFlight = &recording.acknowledged.at(run);
            expectation.inFlightSlot = recording.slots.at(run);
            expectation.lastCut = recording.runEnds.at(run);
        } else if (std::sscanf(entry.mark.c_str(), "ack:%zu", &run) == 1) {
            expectation.acknowledged[recording.slots.at(run)] = recording.acknowledged.at(run);
            expectation.inFlight = nullptr;
            expectation.firstCut = expectation.lastCut = recording.runEnds.at(run);
        }
    }
    return expectation;
}

// What a device showed: the store's tree as mounted, and what two
// openings of the store served. Points that leave the same bytes share it.
struct Observation {
    std::string problem;  // the mount or the store failed
    bool unmountable = false;
    bool repaired = false;
    // Why the tree could not be read (a file the file system itself
    // refuses, such as a torn inode); the store is still opened on it.
    std::string unreadableTree;
    crash::FsImage tree;
    std::vector<SlotContent> first;
    std::vector<SlotContent> second;
};

Observation observeDevice(const Options& options, const fs::path& device, const fs::path& storeDirectory,
                          size_t slotCount) {
    const FileSystem& fileSystem = *options.fileSystem;
    const fs::path mountPoint = options.work / "mnt";
    Observation observation;
    if (!tryMount(fileSystem, device, mountPoint)) {
        const std::string refusal = std::strerror(errno);
        std::vector<std::string> repair = fileSystem.repair;
        repair.push_back(device.string());
        const ProcessResult repaired = testing_support::runProgram(repair);
        // fsck: 1 and 2 mean errors corrected.
        if (repaired.exitStatus < 0 || repaired.exitStatus > 2 || !tryMount(fileSystem, device, mountPoint)) {
            observation.problem = "the file system does not mount (" + refusal + "), nor after " + repair[0] +
                                  " (exit " + std::to_string(repaired.exitStatus) + ")";
            observation.unmountable = true;
            return observation;
        }
        observation.repaired = true;
    }
    const fs::path root = mountPoint / "store";
    try {
        observation.tree = crash::snapshotTree(root);
    } catch (const std::exception& error) {
        observation.unreadableTree = error.what();
    }
    try {
        observation.first = openStore(root / storeDirectory, slotCount);
        observation.second = openStore(root / storeDirectory, slotCount);
    } catch (const std::exception& error) {
        observation.problem = std::string("reading the store failed: ") + error.what();
    }
    unmount(mountPoint);
    return observation;
}

Observation observe(const Options& options, replay::PointDevice& device, const Recording& recording,
                    const replay::SectorOverlay& overlay, size_t slotCount) {
    device.lay(overlay, recording.log.sectorSize);
    return observeDevice(options, device.node(), recording.storeDirectory, slotCount);
}

// The store's rules: every slot holds what was acknowledged or the run in
// flight, and a second opening agrees.
std::string violation(const Observation& seen, const Expectation& expected, size_t slotCount) {
    if (!seen.problem.empty()) return seen.problem;
    for (size_t slot = 0; slot < slotCount; ++slot) {
        const bool allowed =
            seen.first[slot] == expected.acknowledged[slot] ||
            (expected.inFlight != nullptr && expected.inFlightSlot == slot && seen.first[slot] == *expected.inFlight);
        if (!allowed) return "slot " + std::to_string(slot) + " shows " + crash::reportText(seen.first[slot]);
    }
    return seen.first == seen.second ? "" : "a second opening disagrees";
}

size_t hashOf(const replay::SectorOverlay& overlay) {
    std::string text;
    for (const auto& [sector, bytes] : overlay) {
        text.append(reinterpret_cast<const char*>(&sector), sizeof sector);
        text.append(bytes.begin(), bytes.end());
    }
    return std::hash<std::string>{}(text);
}

std::string scenarioName(const std::string& updates, size_t slotCount, Clock clock) {
    return updates + "_" + std::to_string(slotCount) + "slot_" + crash::clockName(clock);
}

struct Reports {
    std::vector<std::string> unmountable;
    std::vector<std::string> violations;
    std::vector<std::string> outsideModel;
};

void report(std::vector<std::string>& list, const std::string& text) {
    if (list.size() < kReportedProblems) list.push_back(text);
}

void explore(const Options& options, const std::string& updates, size_t slotCount, Clock clock, Totals& totals,
             Reports& reports) {
    const Recording recording = record(options, updates, slotCount, clock);
    replay::PointDevice device(options.pointTarget, options.origin, recording.base, options.cows);
    const std::vector<replay::CrashPoint> points = replay::crashPoints(recording.log, options.choice);
    replay::ModelStates model(recording.durable, recording.ops);
    const std::string name = options.fileSystem->name + " " + scenarioName(updates, slotCount, clock);
    std::map<size_t, Observation> seen;
    size_t violations = 0;
    size_t outside = 0;
    for (const replay::CrashPoint& point : points) {
        const replay::SectorOverlay overlay =
            replay::crashOverlay(recording.log, point, recording.base.size() / recording.log.sectorSize);
        const size_t key = hashOf(overlay);
        auto known = seen.find(key);
        if (known == seen.end()) {
            known = seen.emplace(key, observe(options, device, recording, overlay, slotCount)).first;
            if (known->second.repaired) ++totals.repaired;
            if (known->second.problem.empty() && known->second.unreadableTree.empty()) {
                totals.states.insert(std::to_string(slotCount) + "\n" + replay::visibleState(known->second.tree));
            }
        }
        const Observation& observation = known->second;
        // A file system torn in its own metadata is lost to every reader:
        // no rule of the store's can help, and it is reported apart.
        if (observation.unmountable) {
            ++totals.unmountable;
            // An eMMC with reliable write never tears these: the kernel
            // writes FUA requests that way.
            const bool torn = point.kind == replay::CrashKind::kTorn;
            const replay::LogEntry& tornEntry = recording.log.entries[point.torn];
            const bool tornFua = torn && (tornEntry.flags & replay::kFua) != 0;
            if (tornFua) ++totals.unmountableTornFua;
            // Where the torn write went tells which of the file system's
            // blocks it was.
            const std::string where = torn ? " at sector " + std::to_string(tornEntry.sector) : "";
            report(reports.unmountable,
                   name + ": " + point.describe() + where + (tornFua ? " (FUA)" : "") + ": " + observation.problem);
            continue;
        }
        const Expectation expected = expectationAt(recording, point.reach());
        const std::string problem = violation(observation, expected, slotCount);
        if (!problem.empty()) {
            ++violations;
            report(reports.violations, name + ": " + point.describe() + ": " + problem);
        }
        if (!observation.problem.empty()) continue;
        // The model has no file that cannot be read.
        if (!observation.unreadableTree.empty()) {
            ++outside;
            report(reports.outsideModel, name + ": " + point.describe() + ": " + observation.unreadableTree);
        } else if (!model.allows(observation.tree, expected.firstCut, expected.lastCut) &&
                   !(point.kind == replay::CrashKind::kTorn &&
                     model.allowsTornWrite(observation.tree, expected.firstCut, expected.lastCut,
                                           recording.log.entries[point.torn].sectorCount * recording.log.sectorSize))) {
            ++outside;
            report(reports.outsideModel,
                   name + ": " + point.describe() + ": operations " + std::to_string(expected.firstCut) + ".." +
                       std::to_string(expected.lastCut) + " do not give\n" + crash::fingerprint(observation.tree));
        }
    }
    ++totals.scenarios;
    totals.entries += recording.log.entries.size();
    totals.points += points.size();
    totals.violations += violations;
    totals.outsideModel += outside;
    std::printf("%s: %zu log entries, %zu crash points, %zu devices mounted, %zu violations, %zu outside the model\n",
                name.c_str(), recording.log.entries.size(), points.size(), seen.size(), violations, outside);
    std::fflush(stdout);
}

std::vector<std::string> split(const std::string& text) {
    std::vector<std::string> words;
    std::istringstream in(text);
    for (std::string word; std::getline(in, word, ',');) words.push_back(word);
    return words;
}

[[noreturn]] void usage(const std::string& problem) {
    std::fprintf(stderr, "block_replay: %s\nusage: block_replay FS DATA LOG ORIGIN COWS WORK [options] [UPDATES...]\n",
                 problem.c_str());
    std::exit(2);
}

Options parse(int argc, char** argv) {
    Options options;
    std::vector<std::string> positional;
    for (int i = 1; i < argc; ++i) {
        const std::string word = argv[i];
        const auto value = [&word](const char* name) -> const char* {
            const size_t length = std::strlen(name);
            return word.compare(0, length, name) == 0 ? word.c_str() + length : nullptr;
        };
        if (const char* slots = value("--slots=")) {
            options.slotCounts.clear();
            for (const std::string& count : split(slots)) options.slotCounts.push_back(std::stoul(count));
        } else if (const char* clocks = value("--clocks=")) {
            options.clocks.clear();
            for (const std::string& name : split(clocks)) {
                if (name == "forward")
                    options.clocks.push_back(Clock::kForward);
                else if (name == "equal")
                    options.clocks.push_back(Clock::kEqual);
                else if (name == "backward")
                    options.clocks.push_back(Clock::kBackward);
                else
                    usage("unknown clock " + name);
            }
        } else if (const char* subsets = value("--subsets=")) {
            options.choice.subsetsPerEpoch = std::stoul(subsets);
        } else if (const char* torn = value("--torn=")) {
            options.choice.tornPerWrite = std::stoul(torn);
        } else if (const char* seed = value("--seed=")) {
            options.choice.seed = std::stoull(seed);
        } else if (word == "--broken") {
            options.broken = true;
        } else if (word.compare(0, 2, "--") == 0) {
            usage("unknown option " + word);
        } else {
            positional.push_back(word);
        }
    }
    if (positional.size() < 6) usage("FS, DATA, LOG, ORIGIN, COWS and WORK are needed");
    for (const FileSystem& fileSystem : kFileSystems) {
        if (fileSystem.name == positional[0]) options.fileSystem = &fileSystem;
    }
    if (options.fileSystem == nullptr) usage("unknown file system " + positional[0]);
    options.logTarget = "replay-log-" + options.fileSystem->name;
    options.pointTarget = "replay-point-" + options.fileSystem->name;
    options.data = positional[1];
    options.log = positional[2];
    options.origin = positional[3];
    const std::vector<std::string> cows = split(positional[4]);
    if (cows.size() != options.cows.size()) usage("COWS must name two devices");
    std::copy(cows.begin(), cows.end(), options.cows.begin());
    options.work = positional[5];
    options.scenarios.assign(positional.begin() + 6, positional.end());
    if (options.broken) {
        options.scenarios = {"WXX"};
        options.slotCounts = {1};
        options.clocks = {Clock::kForward};
    } else if (options.scenarios.empty()) {
        const std::string kinds = "WBAE";
        for (const char first : kinds) {
            for (const char second : kinds) {
                for (const char third : kinds) options.scenarios.push_back({first, second, third});
            }
        }
        options.scenarios.push_back(std::string(3, kToolUpdate));
    }
    return options;
}

}  // namespace

int main(int argc, char** argv) {
    const Options options = parse(argc, argv);
    Totals totals;
    Reports reports;
    try {
        fs::create_directories(options.work);
        for (const size_t slotCount : options.slotCounts) {
            for (const Clock clock : options.clocks) {
                for (const std::string& updates : options.scenarios) {
                    // The tool's settings target has one slot.
                    if (!storeDirectory(updates).empty() && slotCount != 1) continue;
                    explore(options, updates, slotCount, clock, totals, reports);
                }
            }
        }
    } catch (const std::exception& error) {
        std::fprintf(stderr, "block_replay: %s\n", error.what());
        return 1;
    }
    for (const std::string& text : reports.unmountable) std::printf("unmountable: %s\n", text.c_str());
    for (const std::string& text : reports.violations) std::printf("violation: %s\n", text.c_str());
    for (const std::string& text : reports.outsideModel) std::printf("outside the model: %s\n", text.c_str());
    if (totals.unmountable > 0) {
        std::printf(
            "%s: %zu crash points left a file system that does not mount, even after %s (%zu of them a torn "
            "FUA write)\n",
            options.fileSystem->name.c_str(), totals.unmountable, options.fileSystem->repair[0].c_str(),
            totals.unmountableTornFua);
    }
    if (totals.repaired > 0) {
        std::printf("%s: %zu devices mounted only after %s\n", options.fileSystem->name.c_str(), totals.repaired,
                    options.fileSystem->repair[0].c_str());
    }
    std::printf(
        "%s %s: %zu scenarios, %zu log entries, %zu crash points, %zu distinct states, %zu violations, %zu "
        "outside the model\n",
        options.broken ? "broken writer" : "replay", options.fileSystem->name.c_str(), totals.scenarios, totals.entries,
        totals.points, totals.states.size(), totals.violations, totals.outsideModel);
    if (options.broken) return totals.violations > 0 ? 0 : 1;
    const bool modelHolds = !options.fileSystem->modelled || totals.outsideModel == 0;
    return totals.violations == 0 && modelHolds ? 0 : 1;
}
