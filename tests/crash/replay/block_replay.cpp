// Records the crash scenarios' runs at the block level on a real kernel and
// checks every crash point of the log: the device's file system behind the
// kernel's log-writes target, the store driver's runs with a mark before
// each and after its acknowledgement; then, for every crash point, the
// device as the cut left it, mounted (the file system's own recovery), and
// a fresh store opened on it twice.
//
//   block_replay FS DATA LOG WORK [options] [UPDATES...]
//     FS      ext4 | ext4-journal | ext4-writeback | f2fs
//     DATA    the block device the file system lives on (all of it is used)
//     LOG     the block device the log is written to
//     WORK    a directory for the device images (best in memory)
//   options:
//     --slots=1,3                    store sizes
//     --clocks=forward,equal,backward
//     --subsets=N --torn=N --seed=S  crash points (see crash_points.h)
//     --broken                       the broken writer's scenario instead
//   UPDATES: scenarios (default: every sequence of three of W, B, A, E).
//
// Needs root, the log-writes target, dmsetup, mount and the file system's
// mkfs. Prints one line per scenario and the totals:
//   replay FS: S scenarios, E log entries, P crash points, D distinct states, V violations
// (or "broken writer FS: ..."). Exit status 0 without violations (with
// --broken: with at least one), 1 otherwise, 2 for a bad command line.
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

#include "child_process.h"
#include "crash_points.h"
#include "fault_injection.h"
#include "files.h"
#include "fs_image.h"
#include "lib/storage/dual_file_target.h"
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
constexpr const char* kTargetName = "block-replay";
constexpr size_t kReportedViolations = 20;

struct FileSystem {
    std::string name;
    std::string type;
    std::string options;
    std::vector<std::string> mkfs;  // the device is appended
};

const std::vector<FileSystem> kFileSystems = {
    {"ext4", "ext4", "", {"/sbin/mke2fs", "-q", "-F", "-t", "ext4", "-E", "nodiscard"}},
    {"ext4-journal", "ext4", "data=journal", {"/sbin/mke2fs", "-q", "-F", "-t", "ext4", "-E", "nodiscard"}},
    {"ext4-writeback", "ext4", "data=writeback", {"/sbin/mke2fs", "-q", "-F", "-t", "ext4", "-E", "nodiscard"}},
    {"f2fs", "f2fs", "", {"/sbin/mkfs.f2fs", "-q", "-f"}},
};

struct Options {
    const FileSystem* fileSystem = nullptr;
    fs::path data;
    fs::path log;
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

void mountDevice(const FileSystem& fileSystem, const fs::path& device, const fs::path& at) {
    if (::mount(device.c_str(), at.c_str(), fileSystem.type.c_str(), 0, fileSystem.options.c_str()) != 0) {
        throw std::runtime_error("mount " + device.string() + ": " + std::strerror(errno));
    }
}

void unmount(const fs::path& at) {
    if (::umount(at.c_str()) != 0) throw std::runtime_error("umount " + at.string() + ": " + std::strerror(errno));
}

// The mapped device of the log-writes target, as a node of our own: without
// udev nothing appears under /dev/mapper.
fs::path createLogTarget(const Options& options, uint64_t sectors) {
    run({"/sbin/dmsetup", "create", kTargetName, "--table",
         "0 " + std::to_string(sectors) + " log-writes " + options.data.string() + " " + options.log.string()});
    const ProcessResult numbers =
        testing_support::runProgram({"/sbin/dmsetup", "info", "-c", "--noheadings", "-o", "major,minor", kTargetName});
    unsigned major = 0;
    unsigned minor = 0;
    if (numbers.exitStatus != 0 || std::sscanf(numbers.out.c_str(), "%u:%u", &major, &minor) != 2) {
        throw std::runtime_error("dmsetup info: " + numbers.out + numbers.err);
    }
    const fs::path node = options.work / "log-writes-device";
    fs::remove(node);
    if (::mknod(node.c_str(), S_IFBLK | 0600, makedev(major, minor)) != 0) {
        throw std::runtime_error("mknod " + node.string() + ": " + std::strerror(errno));
    }
    return node;
}

void mark(const std::string& text) { run({"/sbin/dmsetup", "message", kTargetName, "0", "mark", text}); }

// One scenario's record: the device before the log, the log, and what
// each run acknowledged.
struct Recording {
    std::vector<uint8_t> base;
    replay::WriteLog log;
    std::vector<SlotContent> initial;
    std::vector<size_t> slots;              // per run
    std::vector<SlotContent> acknowledged;  // per run
};

std::vector<SlotContent> openStore(const fs::path& root, size_t slotCount) {
    Storage::DualFileTarget target(root, slotCount);
    std::vector<SlotContent> slots;
    for (size_t i = 0; i < slotCount; ++i) slots.push_back(store_test::contentOf(*target.getSlot(i).get()));
    return slots;
}

Recording record(const Options& options, const std::string& updates, size_t slotCount, Clock clock) {
    const FileSystem& fileSystem = *options.fileSystem;
    const fs::path mountPoint = options.work / "mnt";
    const fs::path inputs = options.work / "inputs";
    fs::create_directories(mountPoint);
    fs::create_directories(inputs);
    std::vector<std::string> mkfs = fileSystem.mkfs;
    mkfs.push_back(options.data.string());
    run(mkfs);

    Recording recording;
    const fs::path root = mountPoint / "store";
    const size_t slot = slotCount == 1 ? 0 : crash::kUpdatedSlot;
    mountDevice(fileSystem, options.data, mountPoint);
    fs::create_directories(root);
    recording.initial.assign(slotCount, store_test::nothingStored());
    if (slotCount > 1) {
        for (const auto& command : crash::populateCommands(kPrograms, root, slotCount, inputs, recording.initial)) {
            run(command, testing_support::recordEnv("", "", crash::kClockStart));
        }
    }
    unmount(mountPoint);
    recording.base = testing_support::readBytes(options.data);

    const fs::path node = createLogTarget(options, recording.base.size() / 512);
    mountDevice(fileSystem, node, mountPoint);
    for (size_t index = 0; index < updates.size(); ++index) {
        const char update = updates[index];
        const std::vector<uint8_t> blob = crash::blobFor(index + 1, slotCount);
        const std::vector<std::string> command =
            crash::updateCommand(kPrograms, update, root, slotCount, slot, blob, inputs);
        mark("begin:" + std::to_string(index));
        const ProcessResult outcome =
            testing_support::runProgram(command, testing_support::recordEnv("", "", crash::clockOf(clock, index)));
        if (outcome.exitStatus != 0)
            throw std::runtime_error(std::string("update ") + update + " failed:\n" + outcome.err);
        mark("ack:" + std::to_string(index));
        recording.slots.push_back(slot);
        recording.acknowledged.push_back(update == 'X' ? openStore(root, slotCount)[slot]
                                                       : crash::reportedState(outcome.out));
    }
    unmount(mountPoint);
    run({"/sbin/dmsetup", "remove", kTargetName});
    recording.log = replay::readWriteLog(options.log);
    return recording;
}

// What the marks before `reach` say: every slot's acknowledged content,
// and the run in flight (or none).
struct Expectation {
    std::vector<SlotContent> acknowledged;
    const SlotContent* inFlight = nullptr;
    size_t inFlightSlot = 0;
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
        } else if (std::sscanf(entry.mark.c_str(), "ack:%zu", &run) == 1) {
            expectation.acknowledged[recording.slots.at(run)] = recording.acknowledged.at(run);
            expectation.inFlight = nullptr;
        }
    }
    return expectation;
}

// The problem with the device as the cut at `point` left it, or "".
std::string check(const Options& options, const Recording& recording, const replay::CrashPoint& point, size_t slotCount,
                  Totals& totals) {
    std::vector<uint8_t> image = recording.base;
    replay::applyCrashPoint(recording.log, point, image);
    const fs::path imageFile = options.work / "crash.img";
    testing_support::writeBytes(imageFile, image);
    const fs::path mountPoint = options.work / "mnt";
    const ProcessResult mounted = testing_support::runProgram(
        {"/bin/mount", "-t", options.fileSystem->type, "-o",
         "loop" + (options.fileSystem->options.empty() ? "" : "," + options.fileSystem->options), imageFile.string(),
         mountPoint.string()});
    if (mounted.exitStatus != 0) return "the file system does not mount: " + mounted.err;
    std::string problem;
    try {
        const fs::path root = mountPoint / "store";
        totals.states.insert(std::to_string(slotCount) + "\n" +
                             (fs::exists(root) ? crash::fingerprint(crash::snapshotTree(root)) : "no store"));
        const std::vector<SlotContent> first = openStore(root, slotCount);
        const std::vector<SlotContent> second = openStore(root, slotCount);
        const Expectation expected = expectationAt(recording, point.reach());
        for (size_t slot = 0; slot < slotCount && problem.empty(); ++slot) {
            const bool allowed =
                first[slot] == expected.acknowledged[slot] ||
                (expected.inFlight != nullptr && expected.inFlightSlot == slot && first[slot] == *expected.inFlight);
            if (!allowed) problem = "slot " + std::to_string(slot) + " shows " + crash::reportText(first[slot]);
        }
        if (problem.empty() && first != second) problem = "a second opening disagrees";
    } catch (const std::exception& error) {
        problem = std::string("reading the store failed: ") + error.what();
    }
    run({"/bin/umount", mountPoint.string()});
    return problem;
}

std::string scenarioName(const std::string& updates, size_t slotCount, Clock clock) {
    return updates + "_" + std::to_string(slotCount) + "slot_" + crash::clockName(clock);
}

void explore(const Options& options, const std::string& updates, size_t slotCount, Clock clock, Totals& totals,
             std::vector<std::string>& reports) {
    const Recording recording = record(options, updates, slotCount, clock);
    const std::vector<replay::CrashPoint> points = replay::crashPoints(recording.log, options.choice);
    size_t violations = 0;
    for (const replay::CrashPoint& point : points) {
        const std::string problem = check(options, recording, point, slotCount, totals);
        if (problem.empty()) continue;
        ++violations;
        if (reports.size() < kReportedViolations) {
            reports.push_back(options.fileSystem->name + " " + scenarioName(updates, slotCount, clock) + ": " +
                              point.describe() + ": " + problem);
        }
    }
    ++totals.scenarios;
    totals.entries += recording.log.entries.size();
    totals.points += points.size();
    totals.violations += violations;
    std::printf("%s %s: %zu log entries, %zu crash points, %zu violations\n", options.fileSystem->name.c_str(),
                scenarioName(updates, slotCount, clock).c_str(), recording.log.entries.size(), points.size(),
                violations);
    std::fflush(stdout);
}

std::vector<std::string> split(const std::string& text) {
    std::vector<std::string> words;
    std::istringstream in(text);
    for (std::string word; std::getline(in, word, ',');) words.push_back(word);
    return words;
}

[[noreturn]] void usage(const std::string& problem) {
    std::fprintf(stderr, "block_replay: %s\nusage: block_replay FS DATA LOG WORK [options] [UPDATES...]\n",
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
    if (positional.size() < 4) usage("FS, DATA, LOG and WORK are needed");
    for (const FileSystem& fileSystem : kFileSystems) {
        if (fileSystem.name == positional[0]) options.fileSystem = &fileSystem;
    }
    if (options.fileSystem == nullptr) usage("unknown file system " + positional[0]);
    options.data = positional[1];
    options.log = positional[2];
    options.work = positional[3];
    options.scenarios.assign(positional.begin() + 4, positional.end());
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
    }
    return options;
}

}  // namespace

int main(int argc, char** argv) {
    const Options options = parse(argc, argv);
    Totals totals;
    std::vector<std::string> reports;
    try {
        fs::create_directories(options.work);
        for (const size_t slotCount : options.slotCounts) {
            for (const Clock clock : options.clocks) {
                for (const std::string& updates : options.scenarios) {
                    explore(options, updates, slotCount, clock, totals, reports);
                }
            }
        }
    } catch (const std::exception& error) {
        std::fprintf(stderr, "block_replay: %s\n", error.what());
        return 1;
    }
    for (const std::string& report : reports) std::printf("violation: %s\n", report.c_str());
    std::printf("%s %s: %zu scenarios, %zu log entries, %zu crash points, %zu distinct states, %zu violations\n",
                options.broken ? "broken writer" : "replay", options.fileSystem->name.c_str(), totals.scenarios,
                totals.entries, totals.points, totals.states.size(), totals.violations);
    return options.broken == (totals.violations > 0) ? 0 : 1;
}
