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

void addSubsets(const std::vector<size_t>& writes, size_t prefix, const CrashPointChoice& choice,
                std::mt19937_64& random, std::vector<CrashPoint>& points) {
    if (writes.size() < 2 || choice.subsetsPerEpoch == 0) return;
    std::set<std::vector<bool>> chosen;
    const bool every = writes.size() < 63 && (uint64_t{1} << writes.size()) - 2 <= choice.subsetsPerEpoch;
    if (every) {
        for (uint64_t mask = 1; mask + 1 < (uint64_t{1} << writes.size()); ++mask) {
            std::vector<bool> members(writes.size());
            for (size_t bit = 0; bit < writes.size(); ++bit) members[bit] = (mask >> bit & 1) != 0;
            chosen.insert(members);
        }
    } else {
        while (chosen.size() < choice.subsetsPerEpoch) {
            std::vector<bool> members(writes.size());
            size_t count = 0;
            for (size_t bit = 0; bit < writes.size(); ++bit) {
                members[bit] = (random() & 1) != 0;
                count += members[bit];
            }
            if (count > 0 && count < writes.size()) chosen.insert(members);
        }
    }
    for (const std::vector<bool>& members : chosen) {
        CrashPoint point;
        point.kind = CrashKind::kReordered;
        point.prefix = prefix;
        for (size_t bit = 0; bit < writes.size(); ++bit) {
            if (members[bit]) point.extra.push_back(writes[bit]);
        }
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

uint8_t* sectorsOf(const WriteLog& log, const LogEntry& entry, std::vector<uint8_t>& device) {
    const uint64_t begin = entry.sector * log.sectorSize;
    const uint64_t length = entry.sectorCount * log.sectorSize;
    if (begin > device.size() || length > device.size() - begin) {
        throw std::out_of_range("log entry at sector " + std::to_string(entry.sector) + " lies beyond the device");
    }
    return device.data() + begin;
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
    for (const auto& [begin, end] : epochs(log)) addSubsets(writesIn(log, begin, end), begin, choice, random, points);
    for (const size_t index : writesIn(log, 0, log.entries.size())) addTorn(log, index, choice, random, points);
    return points;
}

void applyEntry(const WriteLog& log, const LogEntry& entry, std::vector<uint8_t>& device) {
    if (entry.isMark() || entry.sectorCount == 0) return;
    uint8_t* target = sectorsOf(log, entry, device);
    if (entry.isDiscard()) {
        std::fill_n(target, entry.sectorCount * log.sectorSize, 0);
    } else {
        std::copy(entry.data.begin(), entry.data.end(), target);
    }
}

void applyCrashPoint(const WriteLog& log, const CrashPoint& point, std::vector<uint8_t>& device) {
    for (size_t i = 0; i < point.prefix; ++i) applyEntry(log, log.entries[i], device);
    for (const size_t i : point.extra) applyEntry(log, log.entries[i], device);
    if (point.kind != CrashKind::kTorn) return;
    const LogEntry& entry = log.entries.at(point.torn);
    uint8_t* target = sectorsOf(log, entry, device);
    for (size_t sector = 0; sector < point.fates.size(); ++sector) {
        uint8_t* bytes = target + sector * log.sectorSize;
        switch (point.fates[sector]) {
            case SectorFate::kOld:
                break;
            case SectorFate::kNew:
                std::copy_n(entry.data.begin() + static_cast<long>(sector * log.sectorSize), log.sectorSize, bytes);
                break;
            case SectorFate::kZeros:
                std::fill_n(bytes, log.sectorSize, 0);
                break;
            case SectorFate::kErased:
                std::fill_n(bytes, log.sectorSize, 0xff);
                break;
        }
    }
}

}  // namespace replay
