// The check that a target with a fixed set of slots refuses to add or remove
// one, for the tests of every such target.
#pragma once

#include <cstddef>

#include <gtest/gtest.h>

#include "lib/storage/storage_target.h"

namespace store_test {

// addSlot(`name`) and removeSlot(0) both return STATUS_NOT_IMPLEMENTED, and
// the refused addSlot leaves its index and size as they were.
inline void expectSlotChangesRefused(Storage::Target& target, const char* name) {
    size_t index = 5;
    size_t size = 6;
    EXPECT_EQ(target.addSlot(name, index, size), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(index, 5u);
    EXPECT_EQ(size, 6u);
    EXPECT_EQ(target.removeSlot(0), STATUS_NOT_IMPLEMENTED);
}

}  // namespace store_test
