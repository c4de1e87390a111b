#include "page_runs.h"

#include <algorithm>
#include <stdexcept>

namespace replay {

std::vector<PageRun> pageRuns(const SectorOverlay& overlay, uint32_t sectorSize, const std::vector<uint8_t>& base,
                              size_t pageSize) {
    if (sectorSize == 0 || pageSize % sectorSize != 0 || base.size() % pageSize != 0) {
        throw std::invalid_argument("pages of " + std::to_string(pageSize) + " bytes do not fit sectors of " +
                                    std::to_string(sectorSize) + " on a device of " + std::to_string(base.size()));
    }
    std::vector<PageRun> runs;
    for (const auto& [sector, bytes] : overlay) {
        const uint64_t at = sector * sectorSize;
        if (at >= base.size() || bytes.size() != sectorSize) {
            throw std::invalid_argument("overlay sector " + std::to_string(sector) + " does not fit the device");
        }
        const uint64_t page = at - at % pageSize;
        // The overlay is in ascending order: a sector's page is the last
        // run's last page, the one right after it, or the start of a new run.
        if (runs.empty() || page > runs.back().offset + runs.back().bytes.size()) runs.push_back(PageRun{page, {}});
        PageRun& run = runs.back();
        if (page == run.offset + run.bytes.size()) {
            const auto from = base.begin() + static_cast<long>(page);
            run.bytes.insert(run.bytes.end(), from, from + static_cast<long>(pageSize));
        }
        std::copy(bytes.begin(), bytes.end(), run.bytes.begin() + static_cast<long>(at - run.offset));
    }
    return runs;
}

}  // namespace replay
