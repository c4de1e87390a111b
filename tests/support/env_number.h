#pragma once

#include <cstdint>

namespace testing_support {

// The number in environment variable `name` (decimal, 0x hex or 0 octal),
// or `fallback` when it is unset or empty: how a long test is shortened or
// replayed from the shell.
uint64_t envNumber(const char* name, uint64_t fallback);

}  // namespace testing_support
