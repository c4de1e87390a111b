// Runs a sequence of operations on one slot of a dual-file store and
// reports them on standard output, so that tests can run the store in a
// child process under the fault-injection shim or end it part-way.
//
//   dual_file_driver [-l LEVEL] [-s] BASE SLOTS SLOT [STEP...]
//
//   STEP: write FILE | writeAt OFFSET FILE | beginWrite | finalise | erase
//
// Every input file is read before the store is opened. Log lines go to
// standard output, line-buffered, with threshold LEVEL (default 4). Each
// step prints "<step>: <status>" as soon as it returns, and a failing step
// does not stop the run. At the end the driver prints what the slot then
// shows:
//
//   state: exists=E valid=V read=STATUS data=HEX
//
// from readSome of the whole blob (up to 1 MiB) at offset 0 (HEX empty when
// it failed); with -s the size and CRC-32 of those bytes instead of them:
//
//   state: exists=E valid=V read=STATUS size=N crc32=XXXXXXXX
//
// Exit status: 0 when every step returned STATUS_OK, 1 when one failed, 2
// for a usage error.
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "lib/storage/dual_file_target.h"
#include "lib/util/crc32.h"
#include "lib/util/log.h"

namespace {

using Bytes = std::vector<uint8_t>;

struct Step {
    std::string name;
    int64_t offset = 0;
    Bytes data;
};

int usage(const std::string& message) {
    std::fprintf(stderr, "dual_file_driver: %s\n", message.c_str());
    return 2;
}

bool parseNumber(const char* text, int64_t& value) {
    char* end = nullptr;
    errno = 0;
    const long long parsed = std::strtoll(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0') return false;
    value = parsed;
    return true;
}

bool readFile(const char* path, Bytes& data) {
    std::ifstream in(path, std::ios::binary);
    if (!in) return false;
    data.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    return !in.bad();
}

void printState(Storage::TargetSlot& slot, bool summary) {
    Bytes buffer(1 << 20);
    size_t count = 0;
    const bool exists = slot.exists();
    const bool valid = slot.isValid();
    const Status status = slot.readSome(buffer.data(), buffer.size(), 0, count);
    std::printf("state: exists=%d valid=%d read=%u", exists ? 1 : 0, valid ? 1 : 0, status);
    if (status != STATUS_OK) count = 0;
    if (summary) {
        std::printf(" size=%zu crc32=%08x\n", count, crc32Finish(crc32Update(kCrc32Initial, buffer.data(), count)));
        return;
    }
    std::printf(" data=");
    for (size_t i = 0; i < count; ++i) std::printf("%02x", buffer[i]);
    std::printf("\n");
}

// Parses the steps from argv[first] on; an empty string on success.
std::string parseSteps(int argc, char** argv, int first, std::vector<Step>& steps) {
    for (int i = first; i < argc;) {
        Step step;
        step.name = argv[i++];
        if (step.name == "write" || step.name == "writeAt") {
            if (step.name == "writeAt") {
                if (i >= argc || !parseNumber(argv[i], step.offset)) return "writeAt needs OFFSET FILE";
                ++i;
            }
            if (i >= argc || !readFile(argv[i], step.data)) return step.name + " needs a readable FILE";
            ++i;
        } else if (step.name != "beginWrite" && step.name != "finalise" && step.name != "erase") {
            return "unknown step " + step.name;
        }
        steps.push_back(std::move(step));
    }
    return "";
}

Status runStep(Storage::TargetSlot& slot, const Step& step) {
    if (step.name == "write") return slot.write(step.data.data(), step.data.size());
    if (step.name == "writeAt") return slot.writeAt(step.offset, step.data.data(), step.data.size());
    if (step.name == "beginWrite") return slot.beginWrite();
    if (step.name == "finalise") return slot.finalise();
    return slot.erase();
}

}  // namespace

int main(int argc, char** argv) {
    setLogOutput(LOG_OUTPUT_STDOUT);
    int first = 1;
    if (argc > 2 && std::string(argv[1]) == "-l") {
        int64_t level = 0;
        if (!parseNumber(argv[2], level)) return usage("bad log level");
        setLogLevel(static_cast<int>(level));
        first = 3;
    }
    const bool summary = argc > first && std::string(argv[first]) == "-s";
    if (summary) ++first;
    if (argc - first < 3) return usage("expected BASE SLOTS SLOT [STEP...]");
    int64_t slotCount = 0;
    int64_t slotIndex = 0;
    if (!parseNumber(argv[first + 1], slotCount) || slotCount < 0) return usage("bad slot count");
    if (!parseNumber(argv[first + 2], slotIndex) || slotIndex < 0) return usage("bad slot");
    std::vector<Step> steps;
    if (const std::string problem = parseSteps(argc, argv, first + 3, steps); !problem.empty()) {
        return usage(problem);
    }

    Storage::DualFileTarget target(argv[first], static_cast<size_t>(slotCount));
    Storage::SlotHandle slot = target.getSlot(static_cast<size_t>(slotIndex));
    if (!slot) return usage("no such slot");

    bool ok = true;
    for (const Step& step : steps) {
        const Status status = runStep(*slot.get(), step);
        std::printf("%s: %u\n", step.name.c_str(), status);
        ok = ok && status == STATUS_OK;
    }
    printState(*slot.get(), summary);
    return ok ? 0 : 1;
}
