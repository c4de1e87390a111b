#include "lib/storage/slot_lock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <algorithm>
#include <cerrno>
#include <thread>

namespace Storage {
namespace {

// Short at first, for the common case of a commit that ends within
// milliseconds; never so long that a waiter oversleeps its deadline by much.
constexpr std::chrono::milliseconds kFirstPause{1};
constexpr std::chrono::milliseconds kLongestPause{25};

}  // namespace

SlotLock SlotLock::take(int directory, const char* name, LockMode mode, LockDeadline deadline, Outcome& outcome) {
    const int savedErrno = errno;
    SlotLock lock;
    // A description of its own: the lock must not be shared with, or
    // dropped by, the descriptors the operation opens and closes.
    // O_NONBLOCK: nothing but the lock is ever waited on.
    lock.fd_.reset(::openat(directory, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    outcome = Outcome::kUnreachable;
    const int operation = (mode == LockMode::kShared ? LOCK_SH : LOCK_EX) | LOCK_NB;
    auto pause = kFirstPause;
    while (lock.fd_) {
        if (::flock(lock.fd_.get(), operation) == 0) {
            outcome = Outcome::kHeld;
            break;
        }
        if (errno == EINTR) continue;
        if (errno != EWOULDBLOCK) {
            lock.release();
            break;
        }
        const auto now = std::chrono::steady_clock::now();
        if (now >= deadline) {
            outcome = Outcome::kBusy;
            lock.release();
            break;
        }
        std::this_thread::sleep_for(std::min<std::chrono::steady_clock::duration>(pause, deadline - now));
        pause = std::min(pause * 2, kLongestPause);
    }
    errno = savedErrno;
    return lock;
}

}  // namespace Storage
