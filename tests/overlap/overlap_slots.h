// The slots that a round writes and reads: the one slot of one store and
// three of the eight of another, so that writers of one slot meet and
// writers of neighbouring slots of one target do too.
#pragma once

#include <cstddef>

namespace overlap {

struct SlotPlace {
    const char* target;     // the store's name for migrate_settings and inspect_store
    const char* directory;  // the target's directory below the base directory
    size_t slotCount;       // of the target
    size_t index;
};

inline constexpr SlotPlace kSlots[] = {
    {"util_save", "app/utilSave", 1, 0},
    {"overlay", "app/overlays", 8, 0},
    {"overlay", "app/overlays", 8, 1},
    {"overlay", "app/overlays", 8, 2},
};
inline constexpr size_t kSlotCount = sizeof kSlots / sizeof kSlots[0];

}  // namespace overlap
