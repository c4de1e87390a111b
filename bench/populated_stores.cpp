#include "populated_stores.h"

#include "lib/storage/dual_file_target.h"
#include "target_registry.h"

namespace bench {

const std::vector<StoreFill>& registryStores() {
    static const std::vector<StoreFill> stores = {
        {"settings", 1, 4096},      {"app/overlays", 8, 284 + 1024},   {"app/luts", 26, 19784},
        {"app/calibSave", 1, 4096}, {"app/calibExtra", 1, 4096},       {"app/utilSave", 1, 4096},
        {"app/internal", 1, 4096},  {"app/rebootPersistent", 1, 4096},
    };
    return stores;
}

Status populateDualFileTarget(const std::filesystem::path& base, size_t slotCount, size_t blobSize) {
    std::vector<uint8_t> blob(blobSize);
    for (size_t i = 0; i < blob.size(); ++i) blob[i] = static_cast<uint8_t>(i * 31 + 7);
    Storage::DualFileTarget target(base, slotCount);
    for (size_t index = 0; index < slotCount; ++index) {
        const Storage::SlotHandle slot = target.getSlot(index);
        for (int copy = 0; copy < 2; ++copy) {
            if (const Status status = slot->write(blob.data(), blob.size())) return status;
        }
        if (!slot->exists() || !slot->isValid()) return STATUS_FAILED;
    }
    return STATUS_OK;
}

Status populateRegistryStores(const std::filesystem::path& base, size_t scale, uint64_t& storedBytes) {
    storedBytes = 0;
    for (const StoreFill& store : registryStores()) {
        const size_t blobSize = store.blobSize * scale;
        if (const Status status = populateDualFileTarget(base / store.location, store.slotCount, blobSize)) {
            return status;
        }
        storedBytes += 2 * store.slotCount * uint64_t{blobSize};
    }
    return STATUS_OK;
}

std::string checkRegistryPopulated(const std::filesystem::path& base) {
    TargetRegistry registry;
    registerTargets(base, registry);
    size_t dualFileTargets = 0;
    for (const auto& target : registry) {
        if (dynamic_cast<Storage::DualFileTarget*>(target.get()) == nullptr) continue;
        ++dualFileTargets;
        for (size_t index = 0; index < target->getSlotCount(); ++index) {
            const Storage::SlotHandle slot = target->getSlot(index);
            if (!slot->exists() || !slot->isValid()) {
                return target->getDescription() + " slot " + std::to_string(index) + " is not populated";
            }
        }
    }
    if (dualFileTargets != registryStores().size()) {
        return "the registry has " + std::to_string(dualFileTargets) + " dual-file stores, the benchmark fills " +
               std::to_string(registryStores().size());
    }
    return {};
}

}  // namespace bench
