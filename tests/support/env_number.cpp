#include "env_number.h"

#include <cstdlib>

namespace testing_support {

uint64_t envNumber(const char* name, uint64_t fallback) {
    const char* text = std::getenv(name);
    return text != nullptr && *text != '\0' ? std::strtoull(text, nullptr, 0) : fallback;
}

}  // namespace testing_support
