// Directory helpers of the storage targets.
#pragma once

#include <filesystem>

#include "lib/util/status.h"

namespace Storage {

// Makes sure the directory that holds `dataPath` exists, creating missing
// parents. On failure logs "Failed to create <quoted dir> <message>" at info
// priority and returns the errno (STATUS_FAILED for a non-system error).
[[nodiscard]] Status ensureDataDirectory(const std::filesystem::path& dataPath);

}  // namespace Storage
