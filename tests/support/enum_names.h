// Names of enumerators for test output, kept as tables.
#pragma once

#include <cstddef>
#include <utility>

namespace testing_support {

template <typename Enum>
using EnumName = std::pair<Enum, const char*>;

// The name beside `value` in `names`, or "?" for a value the table leaves out.
template <typename Enum, size_t N>
const char* nameIn(const EnumName<Enum> (&names)[N], Enum value) {
    for (const auto& [entry, name] : names) {
        if (entry == value) return name;
    }
    return "?";
}

}  // namespace testing_support
