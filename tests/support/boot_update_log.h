// The log lines of an update of a boot file ("BOOT.BIN", "BOOT0010.BIN"),
// as normalisedStorageLog leaves them, and the remount calls the stand-in
// mount commands record for it. Shared by the host tests and the tests on
// the simulated device, so that each transcript is written once.
#pragma once

#include <cstddef>
#include <string>

namespace testing_support {

// "mount [-o] [remount,rw] [/media/boot]\n" and its read-only twin.
extern const char kBootRemountRwCall[];
extern const char kBootRemountRoCall[];

// A begun update, its temporary file named #`temporary`.
std::string begunLines(const std::string& file, int temporary = 1);

// The start of a finalise that received `bytes`.
std::string finalisingLines(const std::string& file, size_t bytes);

// The file differs: the read-write remount.
std::string needsUpdatingLines(const std::string& file);

// The five attempts to write `file`, each failing to open it with the
// message `error` ("No such file or directory"). The last line names
// BOOT.BIN for either file.
std::string failedOpenLines(const std::string& file, const std::string& error);

}  // namespace testing_support
