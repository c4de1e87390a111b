#include "inspect_run.h"

#include <fcntl.h>
#include <unistd.h>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <iomanip>
#include <iostream>

#include "boot_vector_report.h"
#include "lib/storage/boot_vector_target.h"
#include "lib/util/fd.h"
#include "store_report.h"

namespace {

std::filesystem::path targetPath(const InspectOptions& options, const DualFileRow& row) {
    return std::filesystem::path(options.basePath) / row.location;
}

TargetReport inspectTarget(const InspectOptions& options, const DualFileRow& row) {
    TargetReport target;
    target.name = commandLineName(row.id);
    target.path = targetPath(options, row);
    target.slotCount = row.slotCount;
    const size_t first = options.indexSet ? options.slotIndex : 0;
    const size_t end = options.indexSet ? first + 1 : row.slotCount;
    for (size_t index = first; index < end && target.error == 0; ++index) {
        SlotReport slot;
        slot.index = index;
        target.error = Storage::inspectSlot(target.path, row.slotCount, index, slot.inspection);
        if (target.error == 0) target.slots.push_back(slot);
    }
    return target;
}

void printError(const std::filesystem::path& path, int error) {
    std::cerr << std::quoted(path.string()) << ": " << std::strerror(error) << "\n";
}

}  // namespace

int reportStores(const InspectOptions& options) {
    StoreReport report;
    report.base = options.basePath;
    if (options.target != nullptr) {
        report.targets.push_back(inspectTarget(options, *options.target));
    } else {
        for (const DualFileRow& row : dualFileRows()) report.targets.push_back(inspectTarget(options, row));
    }
    std::cout << (options.json ? jsonReport(report) : plainReport(report)) << std::flush;
    return showsDamage(report) ? kInspectDamage : kInspectClean;
}

int dumpSlot(const InspectOptions& options) {
    const DualFileRow& row = *options.target;
    const std::filesystem::path path = targetPath(options, row);
    Storage::SlotInspection slot;
    // Held to the last byte: no change rewrites the copy while it is dumped.
    Storage::InspectionLocks locks;
    if (const int error = Storage::inspectSlot(path, row.slotCount, options.slotIndex, slot, &locks)) {
        printError(path, error);
        return kInspectDamage;
    }
    if (slot.state != Storage::SlotState::kPresent) {
        std::cerr << std::quoted(path.string()) << ": slot " << options.slotIndex << " is "
                  << Storage::slotStateName(slot.state) << ", nothing to dump\n";
        return kInspectNotPresent;
    }
    const bool toStandardOutput = options.dumpPath == "-";
    // The dump file is the caller's, outside the store: an ordinary open.
    UniqueFd file(toStandardOutput ? -1
                                   : ::open(options.dumpPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666));
    if (!toStandardOutput && !file) {
        printError(options.dumpPath, errno);
        return kInspectDamage;
    }
    const int out = toStandardOutput ? STDOUT_FILENO : file.get();
    if (const int error = Storage::copySlotData(path, row.slotCount, options.slotIndex, slot.current, out)) {
        printError(toStandardOutput ? path : std::filesystem::path(options.dumpPath), error);
        return kInspectDamage;
    }
    if (!toStandardOutput && ::close(file.release()) != 0) {
        printError(options.dumpPath, errno);
        return kInspectDamage;
    }
    return kInspectClean;
}

int reportBootVector(bool json) {
    uint64_t sector = 0;
    uint8_t record[Storage::kBootVectorRecordSize] = {};
    if (Storage::locateBootVector(sector) != STATUS_OK) {
        std::cerr << "/dev/mmcblk0: the boot-vector record could not be located\n";
        return kInspectDamage;
    }
    if (Storage::readBootVectorRecord(sector, record) != STATUS_OK) {
        std::cerr << "/dev/mmcblk0: the boot-vector record at sector " << sector << " could not be read\n";
        return kInspectDamage;
    }
    std::cout << (json ? jsonBootVector(sector, record) : plainBootVector(sector, record)) << std::flush;
    return Storage::isValidBootVectorRecord(record) ? kInspectClean : kInspectDamage;
}
