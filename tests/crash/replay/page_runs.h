// A crash point's overlay as a device takes it fastest: whole pages, the
// bytes the device held when the log started filled in around the
// overlay's sectors, adjacent pages joined into one write. A snapshot
// device given a whole chunk stores it without first copying the chunk
// from its origin, and a whole page needs no read before the write.
#pragma once

#include <cstdint>
#include <vector>

#include "crash_points.h"

namespace replay {

struct PageRun {
    uint64_t offset = 0;         // of the first byte on the device
    std::vector<uint8_t> bytes;  // whole pages
};

// The pages of `pageSize` bytes (a multiple of `sectorSize`) that
// `overlay` touches on a device that held `base`, in ascending runs.
// Throws std::invalid_argument when the sizes do not fit together or an
// overlay sector lies beyond `base`.
std::vector<PageRun> pageRuns(const SectorOverlay& overlay, uint32_t sectorSize, const std::vector<uint8_t>& base,
                              size_t pageSize);

}  // namespace replay
