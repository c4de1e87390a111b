// Stores a blob in slot 1 of a two-slot store below the given directory,
// reads it back through a second target over the same directory, and prints
// what it saw.
#include <cstdio>
#include <string>
#include <vector>

#include "lib/storage/dual_file_target.h"
#include "lib/util/crc32.h"
#include "lib/util/status.h"

namespace {

int fail(const char* what, Status status) {
    std::printf("%s: %s\n", what, statusName(status));
    return 1;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::printf("usage: %s DIRECTORY\n", argv[0]);
        return 2;
    }
    const std::string blob = "settings for another program";
    {
        Storage::DualFileTarget target(argv[1], 2);
        Storage::SlotHandle slot = target.getSlot(1);
        const Status status = slot->write(reinterpret_cast<const uint8_t*>(blob.data()), blob.size());
        if (status != STATUS_OK) return fail("write", status);
    }

    Storage::DualFileTarget reopened(argv[1], 2);
    std::printf("%s with %zu slots\n", reopened.getDescription().c_str(), reopened.getSlotCount());
    for (size_t index = 0; index < reopened.getSlotCount(); ++index) {
        Storage::SlotHandle slot = reopened.getSlot(index);
        if (!slot->exists()) {
            std::printf("slot %zu: empty\n", index);
            continue;
        }
        std::vector<uint8_t> buffer(64);
        size_t count = 0;
        const Status status = slot->readSome(buffer.data(), buffer.size(), 0, count);
        if (status != STATUS_OK) return fail("read", status);
        std::printf("slot %zu: \"%.*s\" crc32 %08x\n", index, static_cast<int>(count),
                    reinterpret_cast<const char*>(buffer.data()), crc32(buffer.data(), count));
    }
    return 0;
}
