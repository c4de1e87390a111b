// Running programs under the LD_PRELOAD fault-injection shim. The variables
// and what they do are described at the top of fault_injection_shim.c.
#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <optional>
#include <string>

namespace testing_support {

using Environment = std::map<std::string, std::string>;

// Path of the built shim.
const char* faultInjectionLibrary();

// Environment for runProgram that preloads the shim and nothing else: the
// shim only forwards. ASAN_OPTIONS carries the inherited options plus
// verify_asan_link_order=0, which a sanitized program needs to start with a
// library preloaded ahead of its runtime.
Environment preloadEnv();

// preloadEnv() under which flock takes no lock and always succeeds
// (FAULT_LOCKS=off): the program runs as if it had no locks.
Environment locksOffEnv();

// Fails or ends the program at the `nth` call matching `call` ("rename",
// "open", "mutating", ...). `action` is "errno:EIO" (any errno name or
// number), "crash" or "short:BYTES". An empty `pathSubstr` counts calls on
// every path; a non-empty `countFile` (absolute) receives the number of
// matching calls seen.
Environment faultEnv(const std::string& call, unsigned long nth, const std::string& action,
                     const std::string& pathSubstr = "", const std::string& countFile = "");

// faultEnv acting on the `nth` matching call and on every later one.
Environment faultFromEnv(const std::string& call, unsigned long nth, const std::string& action,
                         const std::string& pathSubstr = "", const std::string& countFile = "");

// Only counts the calls matching `call` into `countFile` (absolute).
Environment faultCountEnv(const std::string& call, const std::string& countFile, const std::string& pathSubstr = "");

// Adds recording to `base` (preloadEnv(), faultEnv(...), ...): every
// successful mutating call on a path containing `pathSubstr` (any path when
// empty) is appended to `recordFile` (absolute; none when empty), and with
// `fakeTime` files the calls create, truncate or write get that time.
// Throws std::invalid_argument when `base` already filters on another
// path, since the shim has one filter for counting and recording.
Environment recordEnv(const std::string& recordFile, const std::string& pathSubstr = "",
                      std::optional<int64_t> fakeTime = std::nullopt, Environment base = preloadEnv());

// The number the shim wrote to a count file. Throws std::runtime_error when
// the file is missing or does not hold one decimal number and a newline.
unsigned long readFaultCount(const std::filesystem::path& countFile);

}  // namespace testing_support
