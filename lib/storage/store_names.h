// The names of a dual-file store's entries, the only place they are
// spelled (docs/STORE_FORMAT.md describes the layout). A slot directory
// holds one directory per copy; each copy directory holds the data file,
// its check file and, while a commit is under way, the transient check
// file.
#pragma once

#include <cstddef>
#include <string>

namespace Storage {

// Copy 0 lives in "1", copy 1 in "2".
constexpr const char* kCopyDirectoryNames[2] = {"1", "2"};

// The names inside a copy directory.
constexpr const char* kDataName = "data";
constexpr const char* kCheckName = "data.chk";
constexpr const char* kTransientName = "data.chk.tmp";

// The directory of slot `index` below the target's directory: none (empty)
// when the target has one slot, else the index in decimal.
inline std::string slotDirectoryName(size_t slotCount, size_t index) {
    return slotCount == 1 ? std::string() : std::to_string(index);
}

}  // namespace Storage
