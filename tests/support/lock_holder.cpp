#include "lock_holder.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

namespace testing_support {
namespace {

constexpr uid_t kNobody = 65534;

// In the holder: the reason it failed, or "" once every lock is held.
std::string takeLocks(const std::vector<LockHolder::Lock>& locks) {
    if (::geteuid() == 0 && (::setgid(kNobody) != 0 || ::setuid(kNobody) != 0)) {
        return std::string("cannot become nobody: ") + std::strerror(errno);
    }
    for (const LockHolder::Lock& lock : locks) {
        // Left open on purpose: the lock lives as long as the holder.
        const int fd = ::open(lock.path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
        if (fd < 0) return "cannot open " + lock.path.string() + ": " + std::strerror(errno);
        if (::flock(fd, (lock.exclusive ? LOCK_EX : LOCK_SH) | LOCK_NB) != 0) {
            return "cannot lock " + lock.path.string() + ": " + std::strerror(errno);
        }
    }
    return "";
}

}  // namespace

LockHolder::LockHolder(const std::vector<Lock>& locks) {
    int ready[2];
    int release[2];
    if (::pipe2(ready, O_CLOEXEC) != 0 || ::pipe2(release, O_CLOEXEC) != 0) throw std::runtime_error("pipe");
    pid_ = ::fork();
    if (pid_ < 0) throw std::runtime_error("fork");
    if (pid_ == 0) {
        ::close(ready[0]);
        ::close(release[1]);
        const std::string problem = takeLocks(locks);
        const std::string answer = problem.empty() ? "held" : problem;
        (void)!::write(ready[1], answer.data(), answer.size());
        ::close(ready[1]);
        char byte;
        // Until the test closes its end, or dies.
        while (::read(release[0], &byte, 1) < 0 && errno == EINTR) {}
        ::_exit(0);
    }
    ::close(ready[1]);
    ::close(release[0]);
    release_ = release[1];
    std::string answer;
    char buffer[256];
    for (ssize_t count; (count = ::read(ready[0], buffer, sizeof buffer)) != 0;) {
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) break;
        answer.append(buffer, static_cast<size_t>(count));
    }
    ::close(ready[0]);
    if (answer != "held") {
        this->~LockHolder();
        throw std::runtime_error("lock holder: " + answer);
    }
}

LockHolder::~LockHolder() {
    if (release_ >= 0) ::close(release_);
    release_ = -1;
    if (pid_ > 0) {
        int status = 0;
        while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {}
    }
    pid_ = -1;
}

}  // namespace testing_support
