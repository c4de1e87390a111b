#include "store_report.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "json_text.h"
#include "lib/storage/slot_directories.h"

namespace {

using Storage::CopyFault;
using Storage::CopyInspection;
using Storage::EntryKind;
using Storage::SlotInspection;
using Storage::SlotState;

bool isFileOrMissing(EntryKind kind) { return kind == EntryKind::kFile || kind == EntryKind::kMissing; }

std::string kindText(EntryKind kind) { return std::string("is a ") + Storage::entryKindName(kind); }

std::string crcText(uint32_t crc) {
    char text[11];
    std::snprintf(text, sizeof text, "0x%08x", static_cast<unsigned>(crc));
    return text;
}

std::filesystem::path slotPath(const TargetReport& target, size_t index) {
    const std::string name = Storage::slotDirectoryName(target.slotCount, index);
    return name.empty() ? target.path : target.path / name;
}

// The damage to report for one copy, each line naming its path.
std::vector<std::string> damageLines(const TargetReport& target, size_t index, unsigned copy,
                                     const CopyInspection& inspected) {
    std::vector<std::string> lines;
    // What looks damaged is the half-made copy of a change in progress.
    if (inspected.beingRewritten) return lines;
    const auto add = [&](const std::filesystem::path& path, const std::string& text) {
        lines.push_back(path.string() + ": " + text);
    };
    if (!inspected.blockedAt.empty()) {
        add(target.path / inspected.blockedAt, kindText(inspected.blockedKind) + ", not a directory");
    }
    const std::pair<const char*, const Storage::EntryInfo*> entries[] = {
        {Storage::kDataName, &inspected.data},
        {Storage::kCheckName, &inspected.checkFile},
        {Storage::kTransientName, &inspected.transient}};
    for (const auto& [name, entry] : entries) {
        if (!isFileOrMissing(entry->kind))
            add(copyPath(target, index, copy, name), kindText(entry->kind) + ", not a file");
    }
    if (inspected.data.kind == EntryKind::kFile && !inspected.crcKnown) {
        add(copyPath(target, index, copy, Storage::kDataName), std::strerror(inspected.dataError));
    }
    // An open that fails for a plain file (EIO, EACCES) is damage too; a
    // wrong kind or a blocked way was named above.
    const bool unopenable = inspected.check.fault == CopyFault::kCheckUnopenable && inspected.blockedAt.empty() &&
                            isFileOrMissing(inspected.checkFile.kind);
    if (inspected.check.fault == CopyFault::kCheckUnreadable || unopenable) {
        add(copyPath(target, index, copy, Storage::kCheckName), std::strerror(inspected.check.error));
    }
    return lines;
}

// The slot is served, so an invalid other copy without damage is an update
// that a power cut interrupted.
bool interrupted(const TargetReport& target, const SlotReport& slot, unsigned copy) {
    const SlotInspection& inspection = slot.inspection;
    const CopyInspection& inspected = inspection.copies[copy];
    return (inspection.state == SlotState::kPresent || inspection.state == SlotState::kAbsentBlob) &&
           copy != inspection.current && !inspected.check.valid() && inspected.hasEntries() &&
           !inspected.beingRewritten && damageLines(target, slot.index, copy, inspected).empty();
}

// What a copy holds, for the slot's line: "-" when it has no entries.
std::string copySummary(const CopyInspection& copy) {
    if (!copy.hasEntries()) return "-";
    std::string text = copy.check.valid() ? "valid" : copyReason(copy);
    if (copy.data.kind == EntryKind::kFile) {
        text += ", " + std::to_string(copy.data.size) + " bytes";
        if (copy.crcKnown) text += " crc " + crcText(copy.crc32);
    }
    if (copy.checkFile.kind == EntryKind::kFile) text += ", checked " + isoTime(copy.checkFile.modified);
    if (copy.transient.kind != EntryKind::kMissing) text += ", leftover .tmp";
    return text;
}

std::string currentText(const SlotInspection& slot) {
    return slot.copies[slot.current].check.valid() ? Storage::kCopyDirectoryNames[slot.current] : "-";
}

std::string padded(const std::string& text, size_t width) {
    return text + std::string(width > text.size() ? width - text.size() : 0, ' ');
}

std::string jsonOrNull(bool known, const std::string& json) { return known ? json : "null"; }

std::string jsonCopy(const TargetReport& target, const SlotReport& slot, unsigned copy) {
    const CopyInspection& inspected = slot.inspection.copies[copy];
    const bool valid = inspected.check.valid();
    std::string json = "{\"copy\":" + std::to_string(copy + 1) + ",\"valid\":" + (valid ? "true" : "false");
    json += ",\"reason\":" + jsonOrNull(!valid, jsonQuoted(copyReason(inspected)));
    json += ",\"size\":" + jsonOrNull(inspected.data.kind == EntryKind::kFile, std::to_string(inspected.data.size));
    json += ",\"crc32\":" + jsonOrNull(inspected.crcKnown, jsonQuoted(crcText(inspected.crc32)));
    json += ",\"check_time\":" +
            jsonOrNull(inspected.checkFile.kind == EntryKind::kFile, jsonQuoted(isoTime(inspected.checkFile.modified)));
    json += std::string(",\"interrupted_update\":") + (interrupted(target, slot, copy) ? "true" : "false");
    json += std::string(",\"being_rewritten\":") + (inspected.beingRewritten ? "true" : "false");
    return json + "}";
}

}  // namespace

std::string copyReason(const CopyInspection& copy) {
    const Storage::CopyCheck& check = copy.check;
    switch (check.fault) {
        case CopyFault::kNone:
            return "";
        case CopyFault::kNoCheckFile:
            return "no check file";
        case CopyFault::kCheckUnopenable:
            if (!copy.blockedAt.empty()) return "directory " + copy.blockedAt + " " + kindText(copy.blockedKind);
            if (!isFileOrMissing(copy.checkFile.kind)) return "check file " + kindText(copy.checkFile.kind);
            return std::string("check file unreadable: ") + std::strerror(check.error);
        case CopyFault::kCheckSize:
            return "check file of " + std::to_string(check.checkSize) + " bytes";
        case CopyFault::kCheckUnreadable:
            return std::string("check file unreadable: ") + std::strerror(check.error);
        case CopyFault::kNoDataFile:
            return "no data file";
        case CopyFault::kDataUnreadable:
            if (!isFileOrMissing(copy.data.kind)) return "data " + kindText(copy.data.kind);
            return std::string("data unreadable: ") + std::strerror(check.error);
        case CopyFault::kSizeDiffers:
            return "size differs";
        case CopyFault::kCrcDiffers:
            return "CRC differs";
    }
    return "";
}

std::filesystem::path copyPath(const TargetReport& target, size_t index, unsigned copy, const char* name) {
    std::filesystem::path path = slotPath(target, index) / Storage::kCopyDirectoryNames[copy];
    if (*name != '\0') path /= name;
    return path;
}

std::string isoTime(const struct timespec& time) {
    struct tm utc {};
    const time_t seconds = time.tv_sec;
    if (::gmtime_r(&seconds, &utc) == nullptr) return std::to_string(time.tv_sec) + "s";
    char text[64];
    const size_t length = std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S", &utc);
    std::snprintf(text + length, sizeof text - length, ".%09ldZ", static_cast<long>(time.tv_nsec));
    return text;
}

std::string plainReport(const StoreReport& report) {
    std::vector<std::array<std::string, 6>> rows;
    std::vector<std::string> lines;
    for (const TargetReport& target : report.targets) {
        if (target.error != 0) lines.push_back(target.path.string() + ": " + std::strerror(target.error));
        for (const SlotReport& slot : target.slots) {
            const SlotInspection& inspection = slot.inspection;
            rows.push_back({target.name, std::to_string(slot.index), Storage::slotStateName(inspection.state),
                            "current " + currentText(inspection), "copy 1: " + copySummary(inspection.copies[0]),
                            "copy 2: " + copySummary(inspection.copies[1])});
            if (inspection.state == SlotState::kLost) {
                lines.push_back(slotPath(target, slot.index).string() + ": lost: copy 1: " +
                                copyReason(inspection.copies[0]) + "; copy 2: " + copyReason(inspection.copies[1]));
            }
            if (inspection.changeInProgress)
                lines.push_back(slotPath(target, slot.index).string() + ": change in progress");
            for (unsigned copy = 0; copy < 2; ++copy) {
                const CopyInspection& inspected = inspection.copies[copy];
                if (inspected.beingRewritten) {
                    lines.push_back(copyPath(target, slot.index, copy).string() +
                                    ": being rewritten by a change in progress");
                    continue;
                }
                if (interrupted(target, slot, copy)) {
                    lines.push_back(copyPath(target, slot.index, copy).string() + ": interrupted update (" +
                                    copyReason(inspected) + "), normal after a power cut");
                }
                for (std::string& line : damageLines(target, slot.index, copy, inspected)) lines.push_back(line);
                if (inspected.transient.kind == EntryKind::kFile) {
                    lines.push_back(copyPath(target, slot.index, copy, Storage::kTransientName).string() +
                                    ": leftover of an interrupted commit");
                }
            }
        }
    }
    std::array<size_t, 6> widths{};
    for (const auto& row : rows) {
        for (size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
    }
    std::string text;
    for (const auto& row : rows) {
        std::string line;
        for (size_t i = 0; i + 1 < row.size(); ++i) line += padded(row[i], widths[i]) + "  ";
        text += line + row.back() + "\n";
    }
    for (const std::string& line : lines) text += line + "\n";
    return text;
}

std::string jsonReport(const StoreReport& report) {
    std::string json = "{\"base\":" + jsonQuoted(report.base.string()) + ",\"targets\":[";
    for (size_t t = 0; t < report.targets.size(); ++t) {
        const TargetReport& target = report.targets[t];
        if (t > 0) json += ",";
        json += "{\"name\":" + jsonQuoted(target.name) + ",\"path\":" + jsonQuoted(target.path.string());
        json += ",\"error\":" + jsonOrNull(target.error != 0, jsonQuoted(std::strerror(target.error)));
        json += ",\"slots\":[";
        for (size_t s = 0; s < target.slots.size(); ++s) {
            const SlotReport& slot = target.slots[s];
            const SlotInspection& inspection = slot.inspection;
            if (s > 0) json += ",";
            json += "{\"index\":" + std::to_string(slot.index) +
                    ",\"state\":" + jsonQuoted(Storage::slotStateName(inspection.state)) + ",\"current\":" +
                    jsonOrNull(inspection.copies[inspection.current].check.valid(),
                               std::to_string(inspection.current + 1)) +
                    ",\"change_in_progress\":" + (inspection.changeInProgress ? "true" : "false") + ",\"copies\":[" +
                    jsonCopy(target, slot, 0) + "," + jsonCopy(target, slot, 1) + "]";
            json += ",\"leftover_tmp\":[";
            bool first = true;
            for (unsigned copy = 0; copy < 2; ++copy) {
                if (inspection.copies[copy].transient.kind == EntryKind::kMissing) continue;
                if (!first) json += ",";
                first = false;
                json += jsonQuoted(copyPath(target, slot.index, copy, Storage::kTransientName).string());
            }
            json += "]}";
        }
        json += "]}";
    }
    return json + "]}\n";
}

bool showsDamage(const StoreReport& report) {
    for (const TargetReport& target : report.targets) {
        if (target.error != 0) return true;
        for (const SlotReport& slot : target.slots) {
            if (slot.inspection.state == SlotState::kLost) return true;
            for (unsigned copy = 0; copy < 2; ++copy) {
                if (!damageLines(target, slot.index, copy, slot.inspection.copies[copy]).empty()) return true;
            }
        }
    }
    return false;
}
