// Another process that holds flocks on files or directories until it is
// told to let go: an application that holds a store's locks, or never
// lets them go.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <string>
#include <vector>

namespace testing_support {

class LockHolder {
public:
    struct Lock {
        std::filesystem::path path;
        bool exclusive = true;
    };

    // Starts the holder and returns once it holds every lock; as root it
    // first becomes the unprivileged user "nobody" (65534), as an
    // application would be. Throws std::runtime_error, with the holder's
    // reason, when it could not take them all.
    explicit LockHolder(const std::vector<Lock>& locks);
    // Lets go: the holder exits and its locks go with it.
    ~LockHolder();
    LockHolder(const LockHolder&) = delete;
    LockHolder& operator=(const LockHolder&) = delete;

private:
    pid_t pid_ = -1;
    int release_ = -1;  // closing it tells the holder to exit
};

}  // namespace testing_support
