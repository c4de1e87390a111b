#include "migration.h"

namespace {

Status writeBlock(Storage::SlotHandle slot, const Block& block, size_t length) {
    if (!slot) return STATUS_INVALID_PARAMETER;
    return slot->write(block.data(), length);
}

Status checkedLength(const MigrationCheck& check, const Block& block, size_t& length) {
    length = block.size();
    return check(block, length);
}

}  // namespace

Status runMigration(MigrationType type, Storage::Target& target, size_t slotIndex, const MigrationCheck& check,
                    const Block& block1, const Block& block2) {
    size_t length = 0;
    switch (type) {
        case MigrationType::simple:
            return writeBlock(target.getSlot(slotIndex), block1, block1.size());
        case MigrationType::checked:
            if (const Status status = checkedLength(check, block1, length)) return status;
            return writeBlock(target.getSlot(slotIndex), block1, length);
        case MigrationType::redundant: {
            Storage::SlotHandle slot = target.getSlot(slotIndex);
            if (!slot) return STATUS_INVALID_PARAMETER;
            if (checkedLength(check, block1, length) == STATUS_OK) return writeBlock(std::move(slot), block1, length);
            if (const Status status = checkedLength(check, block2, length)) return status;
            return writeBlock(std::move(slot), block2, length);
        }
    }
    return STATUS_OK;
}
