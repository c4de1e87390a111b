// What the operations of one round of concurrent writers and readers
// recorded, and the judge of it: a set check of every acknowledged write
// and of every answer, against the times the operations began and ended.
//
// Every operation takes effect at some instant between its start and its
// end, so an order is known only between operations that did not overlap.
// The judge rejects what no such order explains:
// - a slot that serves, at the end of the round, anything but a blob whose
//   write was acknowledged in the round and that no acknowledged write
//   began after it had returned; or, when the round acknowledged no write
//   of the slot, anything but the blob it started with;
// - a read that answered with anything but the starting blob or the whole
//   blob of a write of the round that had begun before the read ended,
//   and that no acknowledged write superseded before the read began (one
//   that began after the blob's write, or the round's start, had ended and
//   returned before the read began);
// - a query of an untouched store answered wrongly;
// - any operation that took longer than the longest wait allowed.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "overlap_blob.h"

namespace overlap {

enum class OperationKind {
    kWrite,  // a blob written to a slot
    kRead,   // a slot's blob read whole
    kQuery,  // an untouched store asked whether it holds a blob
};

struct Operation {
    OperationKind kind = OperationKind::kRead;
    size_t slot = 0;  // the round's slot, for writes and reads
    // Steady clock, which every process of the machine shares.
    int64_t startNs = 0;
    int64_t endNs = 0;
    // Write: acknowledged. Read or query: answered; false when it gave up
    // (a lock not granted in time, a program that failed), which says
    // nothing about the store.
    bool ok = false;
    // Write: its blob. Read: the blob it answered with, kNotABlob for
    // bytes that are none, kNoBlob for "nothing there".
    int64_t blob = kNotABlob;
    bool rightAnswer = true;  // query: the store answered as it must
    std::string who;          // the program or thread, one word
    std::string detail;       // read of kNotABlob: what it got (describeBytes)
};

// Nanoseconds on the steady clock.
int64_t nowNs();

// An operation that begins now; the rest is filled in when it ends.
Operation beginOperation(OperationKind kind, size_t slot, int64_t blob, const std::string& who);

// What a slot served after the round, by one way of reading it.
struct ServedBlob {
    std::string who;
    int64_t blob = kNotABlob;
    std::string detail;  // for kNotABlob: what it got (describeBytes)
};

struct Round {
    int64_t startNs = 0;           // every slot held its starting blob
    std::vector<BlobId> starting;  // by slot
    std::vector<Operation> operations;
    std::vector<std::vector<ServedBlob>> served;  // by slot
};

struct Verdict {
    size_t acknowledged = 0;
    size_t lost = 0;        // slots whose served blob breaks the rule
    size_t staleReads = 0;  // reads and queries whose answer breaks it
    size_t longWaits = 0;   // operations that took longer than allowed
    size_t failedWrites = 0;
    size_t failedReads = 0;
    std::vector<std::string> findings;  // one line per violation
};

Verdict judgeRound(const Round& round, std::chrono::nanoseconds longestWait);

}  // namespace overlap
