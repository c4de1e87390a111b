#include "overlap_judge.h"

#include <sstream>

namespace overlap {
namespace {

std::string describe(const Operation& op, const Round& round) {
    std::ostringstream text;
    text << op.who << " " << (op.startNs - round.startNs) / 1000 << ".." << (op.endNs - round.startNs) / 1000 << " us";
    return text.str();
}

std::string blobName(int64_t blob, const std::string& detail = "") {
    if (blob == kNotABlob) return detail.empty() ? "bytes that are no whole blob" : detail + ", no whole blob";
    if (blob == kNoBlob) return "no blob at all";
    return "blob " + std::to_string(blob);
}

const Operation* writeOf(const Round& round, size_t slot, int64_t blob) {
    for (const Operation& op : round.operations) {
        if (op.kind == OperationKind::kWrite && op.slot == slot && op.blob == blob) return &op;
    }
    return nullptr;
}

// Why a read of `slot` that began at `startNs` and ended at `endNs` must
// not have answered `blob`; empty when it may have.
std::string readProblem(const Round& round, size_t slot, int64_t blob, const std::string& detail, int64_t startNs,
                        int64_t endNs) {
    if (blob < 0) return "answered with " + blobName(blob, detail);
    int64_t writtenBy = round.startNs;
    const Operation* source = nullptr;
    if (blob != round.starting[slot]) {
        source = writeOf(round, slot, blob);
        if (source == nullptr)
            return "answered with blob " + std::to_string(blob) + ", which no write of the round made";
        if (source->startNs >= endNs) return "answered with " + blobName(blob) + ", whose write began after it ended";
        writtenBy = source->endNs;
    }
    for (const Operation& later : round.operations) {
        if (later.kind != OperationKind::kWrite || later.slot != slot || !later.ok || &later == source) continue;
        if (later.startNs > writtenBy && later.endNs < startNs) {
            return "answered with " + blobName(blob) + ", which acknowledged blob " + std::to_string(later.blob) +
                   " (" + describe(later, round) + ") had superseded";
        }
    }
    return "";
}

// Why `slot` must not serve `blob` after the round; empty when it may.
std::string servedProblem(const Round& round, size_t slot, int64_t blob, const std::string& detail) {
    std::vector<const Operation*> acknowledged;
    for (const Operation& op : round.operations) {
        if (op.kind == OperationKind::kWrite && op.slot == slot && op.ok) acknowledged.push_back(&op);
    }
    if (acknowledged.empty()) {
        if (blob == round.starting[slot]) return "";
        return "serves " + blobName(blob, detail) + ", not its starting blob " + std::to_string(round.starting[slot]) +
               ", though no write was acknowledged";
    }
    const Operation* source = nullptr;
    for (const Operation* op : acknowledged) {
        if (op->blob == blob) source = op;
    }
    if (source == nullptr) {
        return "serves " + blobName(blob, detail) + ", which no acknowledged write of the round made";
    }
    for (const Operation* later : acknowledged) {
        if (later->startNs > source->endNs) {
            return "serves blob " + std::to_string(blob) + " although acknowledged blob " +
                   std::to_string(later->blob) + " (" + describe(*later, round) + ") began after its write (" +
                   describe(*source, round) + ") had returned";
        }
    }
    return "";
}

}  // namespace

int64_t nowNs() {
    return std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

Operation beginOperation(OperationKind kind, size_t slot, int64_t blob, const std::string& who) {
    Operation op;
    op.kind = kind;
    op.slot = slot;
    op.startNs = nowNs();
    op.blob = blob;
    op.who = who;
    return op;
}

Verdict judgeRound(const Round& round, std::chrono::nanoseconds longestWait) {
    Verdict verdict;
    for (const Operation& op : round.operations) {
        if (op.endNs - op.startNs > longestWait.count()) {
            ++verdict.longWaits;
            verdict.findings.push_back(describe(op, round) + " took longer than the longest wait allowed");
        }
        if (op.kind == OperationKind::kWrite) {
            ++(op.ok ? verdict.acknowledged : verdict.failedWrites);
            continue;
        }
        if (!op.ok) {
            ++verdict.failedReads;
            continue;
        }
        std::string problem;
        if (op.kind == OperationKind::kQuery) {
            if (!op.rightAnswer) problem = "answered a query of an untouched store wrongly";
        } else {
            problem = readProblem(round, op.slot, op.blob, op.detail, op.startNs, op.endNs);
        }
        if (!problem.empty()) {
            ++verdict.staleReads;
            verdict.findings.push_back("slot " + std::to_string(op.slot) + ": " + describe(op, round) + " " + problem);
        }
    }
    for (size_t slot = 0; slot < round.served.size(); ++slot) {
        bool lost = false;
        for (const ServedBlob& served : round.served[slot]) {
            const std::string problem = servedProblem(round, slot, served.blob, served.detail);
            if (problem.empty()) continue;
            lost = true;
            verdict.findings.push_back("slot " + std::to_string(slot) + " read by " + served.who + " " + problem);
        }
        if (lost) ++verdict.lost;
    }
    return verdict;
}

}  // namespace overlap
