// Dual-file stores filled through the store itself: every slot written
// twice, so that both copies are valid and opening checksums both, as on a
// device that has been written more than once.
#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "lib/util/status.h"

namespace bench {

// One dual-file store of the registry as it is typically filled.
struct StoreFill {
    const char* location;  // below the base directory, as the registry places it
    size_t slotCount;
    size_t blobSize;  // bytes per slot at scale 1
};

// The registry's eight dual-file stores with the sizes their data has:
// a settings block of 4 KiB (make_example_data's default, also used for the
// single-slot stores whose blobs have no fixed format), lookup tables of
// 19,784 bytes (the least the check accepts), overlays of a 284-byte header
// and 1 KiB of payload.
const std::vector<StoreFill>& registryStores();

// Writes `blobSize` bytes into every slot of a `slotCount`-slot dual-file
// target at `base`, twice per slot. Returns the first failing write's
// status; STATUS_OK when every slot's current copy then exists and is valid.
[[nodiscard]] Status populateDualFileTarget(const std::filesystem::path& base, size_t slotCount, size_t blobSize);

// Populates every store of registryStores() below `base` with blobs
// `scale` times their typical size. `storedBytes` receives the bytes in the
// data files of both copies.
[[nodiscard]] Status populateRegistryStores(const std::filesystem::path& base, size_t scale, uint64_t& storedBytes);

// Builds the registry over `base` and checks that every slot of every
// dual-file target in it is present; a store of the registry that
// registryStores() does not fill makes this fail. An empty string, or what
// is wrong.
std::string checkRegistryPopulated(const std::filesystem::path& base);

}  // namespace bench
