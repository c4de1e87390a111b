#include "overlap_driver.h"

#include <map>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <thread>

#include "enum_names.h"
#include "lib/storage/dual_file_target.h"
#include "overlap_slots.h"

namespace overlap {
namespace {

void driveThread(const DriverPlan& plan, size_t thread, std::vector<Operation>& operations) {
    std::map<std::string, std::unique_ptr<Storage::DualFileTarget>> targets;
    for (const SlotPlace& place : kSlots) {
        auto& target = targets[place.directory];
        if (!target) target = std::make_unique<Storage::DualFileTarget>(plan.base / place.directory, place.slotCount);
    }
    const std::string who = "driver-" + std::to_string(thread);
    Bytes buffer(plan.largestBlob + 1);  // room for a longer answer, which is no blob either
    for (const DriverStep& step : plan.threads[thread]) {
        const Bytes blob = makeBlob(step.blob, blobSize(step.blob, plan.largestBlob));
        Operation write = beginOperation(OperationKind::kWrite, step.slot, step.blob, who);
        {
            const SlotPlace& place = kSlots[step.slot];
            const Status status = targets[place.directory]->getSlot(place.index)->write(blob.data(), blob.size());
            write.endNs = nowNs();
            write.ok = status == STATUS_OK;
        }
        operations.push_back(write);
        for (size_t slot = 0; slot < kSlotCount; ++slot) {
            const SlotPlace& place = kSlots[slot];
            Operation read = beginOperation(OperationKind::kRead, slot, kNotABlob, who);
            size_t got = 0;
            const Status status =
                targets[place.directory]->getSlot(place.index)->readSome(buffer.data(), buffer.size(), 0, got);
            read.endNs = nowNs();
            // "Nothing there" is an answer, a wrong one; a timeout is none.
            read.ok = status == STATUS_OK || status == STATUS_NOT_FOUND || status == STATUS_FAILED;
            read.blob = status == STATUS_OK ? identifyBlob(buffer.data(), got) : kNoBlob;
            if (read.blob == kNotABlob) read.detail = describeBytes(buffer.data(), got);
            operations.push_back(read);
        }
    }
}

const char* kindWord(OperationKind kind) {
    static constexpr testing_support::EnumName<OperationKind> kWords[] = {
        {OperationKind::kWrite, "write"}, {OperationKind::kRead, "read"}, {OperationKind::kQuery, "query"}};
    return testing_support::nameIn(kWords, kind);
}

}  // namespace

std::vector<Operation> runDriver(const DriverPlan& plan) {
    std::vector<std::vector<Operation>> recorded(plan.threads.size());
    std::vector<std::thread> threads;
    for (size_t i = 0; i < plan.threads.size(); ++i) {
        threads.emplace_back([&plan, &recorded, i] { driveThread(plan, i, recorded[i]); });
    }
    for (std::thread& thread : threads) thread.join();
    std::vector<Operation> operations;
    for (const auto& some : recorded) operations.insert(operations.end(), some.begin(), some.end());
    return operations;
}

// BASE LARGEST, then one "SLOT:BLOB,SLOT:BLOB,..." per thread.
std::vector<std::string> planArguments(const DriverPlan& plan) {
    std::vector<std::string> arguments = {plan.base.string(), std::to_string(plan.largestBlob)};
    for (const auto& steps : plan.threads) {
        std::string text;
        for (const DriverStep& step : steps) {
            if (!text.empty()) text += ',';
            text += std::to_string(step.slot) + ':' + std::to_string(step.blob);
        }
        arguments.push_back(text);
    }
    return arguments;
}

DriverPlan parsePlan(const std::vector<std::string>& arguments) {
    if (arguments.size() < 2) throw std::invalid_argument("driver plan: expected BASE LARGEST THREAD...");
    DriverPlan plan;
    plan.base = arguments[0];
    plan.largestBlob = std::stoul(arguments[1]);
    for (size_t i = 2; i < arguments.size(); ++i) {
        std::vector<DriverStep> steps;
        std::istringstream text(arguments[i]);
        for (std::string item; std::getline(text, item, ',');) {
            const size_t colon = item.find(':');
            if (colon == std::string::npos) throw std::invalid_argument("driver plan: bad step " + item);
            DriverStep step{std::stoul(item.substr(0, colon)), static_cast<BlobId>(std::stoul(item.substr(colon + 1)))};
            if (step.slot >= kSlotCount) throw std::invalid_argument("driver plan: no slot " + item);
            steps.push_back(step);
        }
        plan.threads.push_back(steps);
    }
    return plan;
}

// KIND SLOT START END OK BLOB RIGHT WHO, then the detail to the end of
// the line.
std::string operationsText(const std::vector<Operation>& operations) {
    std::ostringstream text;
    for (const Operation& op : operations) {
        text << kindWord(op.kind) << ' ' << op.slot << ' ' << op.startNs << ' ' << op.endNs << ' ' << op.ok << ' '
             << op.blob << ' ' << op.rightAnswer << ' ' << op.who << ' ' << op.detail << '\n';
    }
    return text.str();
}

std::vector<Operation> parseOperations(const std::string& text) {
    std::vector<Operation> operations;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        std::istringstream fields(line);
        std::string kind;
        Operation op;
        if (!(fields >> kind >> op.slot >> op.startNs >> op.endNs >> op.ok >> op.blob >> op.rightAnswer >> op.who)) {
            throw std::invalid_argument("operation record: " + line);
        }
        fields.get();  // the blank after WHO
        std::getline(fields, op.detail);
        if (kind == "write") {
            op.kind = OperationKind::kWrite;
        } else if (kind == "read") {
            op.kind = OperationKind::kRead;
        } else if (kind == "query") {
            op.kind = OperationKind::kQuery;
        } else {
            throw std::invalid_argument("operation record: " + line);
        }
        operations.push_back(op);
    }
    return operations;
}

}  // namespace overlap
