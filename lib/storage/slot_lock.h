// The locks that serialise everyone who uses one dual-file slot: processes
// of the tool, the application through the library, and target objects in
// one process. The device updates take the same kind of lock on what they
// rewrite.
//
// Each is a flock on a directory (a slot's own directory, or a copy's),
// taken through a descriptor of its own. flock belongs to the open file
// description: the kernel drops it when its holder dies, an unrelated close
// in the holder does not, and two target objects of one process exclude
// each other as two processes do. Locking directories needs no lock file,
// so a store's files are exactly what they were without locks. Which
// operation takes which lock, and how, is in dual_file_target.h.
//
// Anyone who can open a directory can hold a conflicting lock for ever, so
// nobody waits without bound: a lock is tried without blocking until a
// deadline, with short sleeps between tries.
#pragma once

#include <chrono>

#include "lib/util/fd.h"

namespace Storage {

enum class LockMode { kShared, kExclusive };

// How long an operation of a slot (a read, a query, a change) waits for its
// lock before it fails with STATUS_TIMEOUT.
constexpr std::chrono::milliseconds kSlotLockWait{2000};
// How long opening a target waits, for all its slots together, before
// judging a slot without its lock: a run opens every store, most of which
// it never touches.
constexpr std::chrono::milliseconds kOpeningLockWait{100};

using LockDeadline = std::chrono::steady_clock::time_point;

class SlotLock {
public:
    enum class Outcome {
        kHeld,         // the lock is held until the SlotLock goes
        kBusy,         // someone else held a conflicting lock past the deadline
        kUnreachable,  // the directory could not be opened or locked: there is
                       // nothing to serialise on, and the operation fails on
                       // its own when it reaches the same directory
    };

    SlotLock() = default;
    SlotLock(SlotLock&&) = default;
    SlotLock& operator=(SlotLock&&) = default;

    // Locks `name` in the directory open as `directory` (a descriptor that
    // stays the caller's; AT_FDCWD for an absolute name), "." for the
    // directory itself, in `mode`, trying until `deadline`; a deadline
    // already past means one try. A link is not followed. errno is kept as
    // it was.
    static SlotLock take(int directory, const char* name, LockMode mode, LockDeadline deadline, Outcome& outcome);

    bool held() const { return static_cast<bool>(fd_); }
    // Gives the lock up; nothing when none is held.
    void release() { fd_.reset(); }

private:
    UniqueFd fd_;
};

}  // namespace Storage
