// The migration types: how the data blocks reach the slot.
#pragma once

#include <cstddef>

#include "lib/storage/storage_target.h"
#include "migration_checks.h"
#include "options.h"

// Runs one migration into slot `slotIndex` of `target` with one call of the
// slot's write, straight from the blocks:
//   simple     block 1 whole, unchecked;
//   checked    the checked length of block 1; the slot is not asked for
//              when the check fails;
//   redundant  block 1 if it passes, else block 2 if it passes, else
//              block 2's check result.
// STATUS_INVALID_PARAMETER when the target has no such slot; otherwise the
// failing check's status or the write's status. Any other type writes
// nothing and succeeds.
Status runMigration(MigrationType type, Storage::Target& target, size_t slotIndex, const MigrationCheck& check,
                    const Block& block1, const Block& block2);
