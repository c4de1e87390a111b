#include "crash_points.h"

#include <algorithm>
#include <random>
#include <set>
#include <stdexcept>

namespace replay {

namespace {

std::vector<size_t> writesIn(const WriteLog& log, size_t begin, size_t end) {
    std::vector<size_t> writes;
    for (size_t i = begin; i < end; ++i) {
        if (log.entries[i].writes()) writes.push_back(i);
    }
    return writes;
}

// An epoch runs from a flush (whose own data, if any, is cached like the
// rest) up to the next flush.
std::vector<std::pair<size_t, size_t>> epochs(const WriteLog& log) {
    std::vector<std::pair<size_t, size_t>> result;
    size_t start = 0;
    for (size_t i = 0; i < log.entries.size(); ++i) {
        if ((log.entries[i].flags & kFlush) == 0 || i == start) continue;
        result.emplace_back(start, i);
        start = i;
    }
    result.emplace_back(start, log.entries.size());
    return result;
}

// The epoch's writes that a cut keeping `members` leaves: those, and
// every forced-unit-access write that completed before the last of them
// (it was on the medium when it completed).
std::vector<size_t> keptWrites(const WriteLog& log, const std::vector<size_t>& writes,
                               const std::vector<bool>& members) {
    std::vector<size_t> kept;
    size_t last = 0;
    for (size_t bit = 0; bit < writes.size(); ++bit) {
        if (members[bit]) last = bit;
    }
    for (size_t bit = 0; bit < writes.size(); ++bit) {
        const bool durable = bit < last && (log.entries[writes[bit]].flags & kFua) != 0;
        if (members[bit] || durable) kept.push_back(writes[bit]);
    }
    return kept;
}

void addSubsets(const WriteLog& log, const std::vector<size_t>& writes, size_t prefix, const CrashPointChoice& choice,
                std::mt19937_64& random, std::vector<CrashPoint>& points) {
    if (writes.size() < 2 || choice.subsetsPerEpoch == 0) return;
    std::set<std::vector<size_t>> chosen;
    const auto choose = [&](const std::vector<bool>& members) {
        std::vector<size_t> kept = keptWrites(log, writes, members);
        // All of them is the cut after the epoch, a prefix.
        if (kept.size() < writes.size()) chosen.insert(std::move(kept));
    };
    const bool every = writes.size() < 63 && (uint64_t{1} << writes.size()) - 2 <= choice.subsetsPerEpoch;
    if (every) {
        for (uint64_t mask = 1; mask + 1 < (uint64_t{1} << writes.size()); ++mask) {
            std::vector<bool> members(writes.size());
            for (size_t bit = 0; bit < writes.size(); ++bit) members[bit] = (mask >> bit & 1) != 0;
            choose(members);
        }
    } else {
        // Forced writes make some draws alike: a bounded number of tries.
        for (size_t tries = 0; chosen.size() < choice.subsetsPerEpoch && tries < 64 * choice.subsetsPerEpoch; ++tries) {
            std::vector<bool> members(writes.size());
            for (size_t bit = 0; bit < writes.size(); ++bit) members[bit] = (random() & 1) != 0;
            if (std::find(members.begin(), members.end(), true) != members.end()) choose(members);
        }
    }
    for (const std::vector<size_t>& kept : chosen) {
        CrashPoint point;
        point.kind = CrashKind::kReordered;
        point.prefix = prefix;
        point.extra = kept;
        points.push_back(std::move(point));
    }
}

void addTorn(const WriteLog& log, size_t index, const CrashPointChoice& choice, std::mt19937_64& random,
             std::vector<CrashPoint>& points) {
    const size_t sectors = log.entries[index].sectorCount;
    for (size_t variant = 0; variant < choice.tornPerWrite; ++variant) {
        CrashPoint point;
        point.kind = CrashKind::kTorn;
        point.prefix = index;
        point.torn = index;
        // All old is the prefix before the write, all new the one after it.
        bool mixed = false;
        while (!mixed) {
            point.fates.clear();
            for (size_t sector = 0; sector < sectors; ++sector) {
                point.fates.push_back(static_cast<SectorFate>(random() % 4));
            }
            mixed = std::any_of(
                        point.fates.begin(), point.fates.end(),
                        [](SectorFate fate) { return fate == SectorFate::kZeros || fate == SectorFate::kErased; }) ||
                    (std::count(point.fates.begin(), point.fates.end(), SectorFate::kOld) > 0 &&
                     std::count(point.fates.begin(), point.fates.end(), SectorFate::kNew) > 0);
        }
        points.push_back(std::move(point));
    }
}

void checkWithin(const LogEntry& entry, uint64_t deviceSectors) {
    if (entry.sector > deviceSectors || entry.sectorCount > deviceSectors - entry.sector) {
        throw std::out_of_range("log entry at sector " + std::to_string(entry.sector) + " lies beyond the device");
    }
}

// The bytes `entry` leaves in each of its sectors (a discard leaves zeros).
void layEntry(const WriteLog& log, const LogEntry& entry, uint64_t deviceSectors, SectorOverlay& overlay) {
    if (entry.isMark() || entry.sectorCount == 0) return;
    checkWithin(entry, deviceSectors);
    for (uint64_t i = 0; i < entry.sectorCount; ++i) {
        std::vector<uint8_t>& bytes = overlay[entry.sector + i];
        if (entry.isDiscard()) {
            bytes.assign(log.sectorSize, 0);
        } else {
            const auto from = entry.data.begin() + static_cast<long>(i * log.sectorSize);
            bytes.assign(from, from + log.sectorSize);
        }
    }
}

}  // namespace

size_t CrashPoint::reach() const {
    switch (kind) {
        case CrashKind::kReordered:
            return extra.empty() ? prefix : extra.back() + 1;
        case CrashKind::kTorn:
            return torn + 1;
        default:
            return prefix;
    }
}

std::string CrashPoint::describe() const {
    switch (kind) {
        case CrashKind::kBarrier:
            return "after barrier entry " + std::to_string(prefix - 1);
        case CrashKind::kPrefix:
            return "after the first " + std::to_string(prefix) + " entries";
        case CrashKind::kReordered: {
            std::string text = "after entry " + std::to_string(prefix) + " plus entries";
            for (const size_t entry : extra) text += " " + std::to_string(entry);
            return text;
        }
        case CrashKind::kTorn: {
            std::string text = "entry " + std::to_string(torn) + " torn, sectors ";
            for (const SectorFate fate : fates) text += "ONZF"[static_cast<int>(fate)];
            return text;
        }
    }
    return "?";
}

std::vector<CrashPoint> crashPoints(const WriteLog& log, const CrashPointChoice& choice) {
    std::vector<CrashPoint> points;
    if (choice.barriers) {
        for (size_t i = 0; i < log.entries.size(); ++i) {
            if (log.entries[i].isBarrier()) points.push_back(CrashPoint{CrashKind::kBarrier, i + 1, {}, 0, {}});
        }
    }
    if (choice.prefixes) {
        for (size_t i = 0; i <= log.entries.size(); ++i) points.push_back(CrashPoint{CrashKind::kPrefix, i, {}, 0, {}});
    }
    std::mt19937_64 random(choice.seed);
    for (const auto& [begin, end] : epochs(log))
        addSubsets(log, writesIn(log, begin, end), begin, choice, random, points);
    for (const size_t index : writesIn(log, 0, log.entries.size())) addTorn(log, index, choice, random, points);
    return points;
}

SectorOverlay crashOverlay(const WriteLog& log, const CrashPoint& point, uint64_t deviceSectors) {
    SectorOverlay overlay;
    for (size_t i = 0; i < point.prefix; ++i) layEntry(log, log.entries[i], deviceSectors, overlay);
    for (const size_t i : point.extra) layEntry(log, log.entries[i], deviceSectors, overlay);
    if (point.kind != CrashKind::kTorn) return overlay;
    const LogEntry& entry = log.entries.at(point.torn);
    checkWithin(entry, deviceSectors);
    // An old sector keeps what the prefix left.
    for (size_t sector = 0; sector < point.fates.size(); ++sector) {
        const uint64_t at = entry.sector + sector;
        switch (point.fates[sector]) {
            case SectorFate::kOld:
                break;
            case SectorFate::kNew: {
                // A discard carries no data: its new bytes are zeros.
                if (entry.isDiscard()) {
                    overlay[at].assign(log.sectorSize, 0);
                    break;
                }
                const auto from = entry.data.begin() + static_cast<long>(sector * log.sectorSize);
                overlay[at].assign(from, from + log.sectorSize);
                break;
            }
            case SectorFate::kZeros:
                overlay[at].assign(log.sectorSize, 0);
                break;
            case SectorFate::kErased:
                overlay[at].assign(log.sectorSize, 0xff);
                break;
        }
    }
    return overlay;
}

void applyCrashPoint(const WriteLog& log, const CrashPoint& point, std::vector<uint8_t>& device) {
    for (const auto& [sector, bytes] : crashOverlay(log, point, device.size() / log.sectorSize)) {
        std::copy(bytes.begin(), bytes.end(), device.begin() + static_cast<long>(sector * log.sectorSize));
    }
}

}  // namespace replay
