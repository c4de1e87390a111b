#include "lib/util/crc32.h"

#include "lib/util/crc32_paths.h"

namespace {

Crc32Paths::Update fastestPath() {
    const Crc32Paths::Path* path = Crc32Paths::kPaths;
    while (!path->available()) ++path;  // the last one always is
    return path->update;
}

}  // namespace

uint32_t crc32Update(uint32_t state, const uint8_t* data, size_t length) {
    // Chosen on first use, not at start-up.
    static const Crc32Paths::Update update = fastestPath();
    return update(state, data, length);
}

uint32_t crc32(const uint8_t* data, size_t length) { return crc32Finish(crc32Update(kCrc32Initial, data, length)); }
