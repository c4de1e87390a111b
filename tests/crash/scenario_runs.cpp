#include "scenario_runs.h"

#include <algorithm>
#include <cstdio>
#include <sstream>
#include <stdexcept>

#include "crash_states.h"
#include "enum_names.h"
#include "files.h"

namespace crash {

namespace fs = std::filesystem;
using store_test::SlotContent;

namespace {

// A writeAt outside a begun write that crosses a block boundary.
constexpr int64_t kPatchOffset = 4000;
constexpr size_t kPatchSize = 300;

}  // namespace

const char* clockName(Clock clock) {
    static constexpr testing_support::EnumName<Clock> kNames[] = {
        {Clock::kForward, "forward"}, {Clock::kEqual, "equal"}, {Clock::kBackward, "backward"}};
    return testing_support::nameIn(kNames, clock);
}

int64_t clockOf(Clock clock, size_t run) {
    const int64_t step = static_cast<int64_t>(run);
    switch (clock) {
        case Clock::kForward:
            return kClockStart + 10 * step;
        case Clock::kEqual:
            return kClockStart;
        case Clock::kBackward:
            return kClockStart - 100 * step;
    }
    return kClockStart;
}

std::vector<uint8_t> blobFor(size_t run, size_t salt) {
    return store_test::patternBytes(kBlockSize + 1000 + 211 * run, static_cast<uint32_t>(run * 7919 + salt));
}

std::vector<std::string> updateCommand(const ScenarioPrograms& programs, char update, const fs::path& root,
                                       size_t slotCount, size_t slot, const std::vector<uint8_t>& blob,
                                       const fs::path& inputs) {
    const fs::path blobFile = inputs / "blob";
    testing_support::writeBytes(blobFile, blob);
    if (update == 'X') {
        std::vector<std::string> command = programs.brokenWriter;
        command.insert(command.end(), {root.string(), blobFile.string()});
        return command;
    }
    std::vector<std::string> command = {programs.driver, root.string(), std::to_string(slotCount),
                                        std::to_string(slot)};
    switch (update) {
        case 'W':
            command.insert(command.end(), {"write", blobFile.string()});
            break;
        case 'B': {
            const size_t half = blob.size() / 2;
            const fs::path head = inputs / "head";
            const fs::path tail = inputs / "tail";
            testing_support::writeBytes(head, std::vector<uint8_t>(blob.begin(), blob.begin() + half));
            testing_support::writeBytes(tail, std::vector<uint8_t>(blob.begin() + half, blob.end()));
            command.insert(command.end(), {"beginWrite", "writeAt", "0", head.string(), "writeAt", std::to_string(half),
                                           tail.string(), "finalise"});
            break;
        }
        case 'A': {
            const fs::path patch = inputs / "patch";
            testing_support::writeBytes(patch, std::vector<uint8_t>(blob.begin(), blob.begin() + kPatchSize));
            command.insert(command.end(), {"writeAt", std::to_string(kPatchOffset), patch.string()});
            break;
        }
        case 'E':
            command.push_back("erase");
            break;
        default:
            throw std::invalid_argument(std::string("unknown update ") + update);
    }
    return command;
}

std::vector<std::vector<std::string>> populateCommands(const ScenarioPrograms& programs, const fs::path& root,
                                                       size_t slotCount, const fs::path& inputs,
                                                       std::vector<SlotContent>& initial) {
    const fs::path blobFile = inputs / "other";
    const std::vector<uint8_t> other = blobFor(0, 99);
    testing_support::writeBytes(blobFile, other);
    const std::string slots = std::to_string(slotCount);
    initial.assign(slotCount, store_test::nothingStored());
    initial.at(0) = store_test::holding(other);
    initial.at(2) = store_test::absentBlob();
    return {{programs.driver, root.string(), slots, "0", "write", blobFile.string()},
            {programs.driver, root.string(), slots, "2", "write", blobFile.string(), "erase"}};
}

SlotContent reportedState(const std::string& out) {
    const size_t line = out.rfind("state: ");
    if (line == std::string::npos) throw std::runtime_error("no state line in:\n" + out);
    int exists = 0;
    int valid = 0;
    unsigned status = 0;
    if (std::sscanf(out.c_str() + line, "state: exists=%d valid=%d read=%u", &exists, &valid, &status) != 3) {
        throw std::runtime_error("bad state line in:\n" + out);
    }
    SlotContent content;
    content.exists = exists != 0;
    content.valid = valid != 0;
    content.status = static_cast<Status>(status);
    const size_t data = out.find("data=", line) + 5;
    content.data = testing_support::fromHex(out.substr(data, out.find('\n', data) - data));
    return content;
}

std::string reportText(const SlotContent& content) {
    std::ostringstream out;
    out << content;
    const std::string shown = out.str();
    return shown.size() > 120 ? shown.substr(0, 120) + "..." : shown;
}

bool expectedAfter(char update, const SlotContent& before, const std::vector<uint8_t>& blob, SlotContent& expected) {
    switch (update) {
        case 'W':
        case 'B':
        case 'X':
            expected = store_test::holding(blob);
            return true;
        case 'E':
            expected = store_test::absentBlob();
            return true;
        case 'A': {
            if (!before.exists) return false;
            std::vector<uint8_t> patched = before.data;
            const size_t end = static_cast<size_t>(kPatchOffset) + kPatchSize;
            if (patched.size() < end) patched.resize(end);
            std::copy(blob.begin(), blob.begin() + kPatchSize, patched.begin() + kPatchOffset);
            expected = store_test::holding(patched);
            return true;
        }
        default:
            throw std::invalid_argument(std::string("unknown update ") + update);
    }
}

}  // namespace crash
