// Writes valid example migration data for trying migrate_settings:
//
//   make_example_data settings FILE [LENGTH]   settings block of LENGTH bytes
//                                              (default 4096) padded to a
//                                              multiple of 4 with 0xFF filler
//   make_example_data lut FILE                 19784-byte lookup table
//   make_example_data overlay FILE [PAYLOAD]   overlay header + PAYLOAD bytes
//                                              (default 1024)
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "lib/util/bsd_checksum.h"

namespace {

using Bytes = std::vector<uint8_t>;

void putLe16(Bytes& bytes, size_t offset, uint16_t value) {
    bytes[offset] = static_cast<uint8_t>(value);
    bytes[offset + 1] = static_cast<uint8_t>(value >> 8);
}

void putLe32(Bytes& bytes, size_t offset, uint32_t value) {
    for (size_t i = 0; i < 4; ++i) bytes[offset + i] = static_cast<uint8_t>(value >> (8 * i));
}

// Recognisable, non-constant contents.
void fillPattern(Bytes& bytes, size_t from, size_t to) {
    for (size_t i = from; i < to; ++i) bytes[i] = static_cast<uint8_t>(i * 31 + 7);
}

Bytes settingsBlock(unsigned long length) {
    Bytes bytes((length + 3) / 4 * 4, 0xFF);
    putLe16(bytes, 0, static_cast<uint16_t>(length));
    fillPattern(bytes, 2, length - 2);
    putLe16(bytes, length - 2, bsdChecksum16(0, bytes.data(), static_cast<uint32_t>(length - 2)));
    return bytes;
}

Bytes lutFile() {
    Bytes bytes(19784);
    fillPattern(bytes, 4, bytes.size());
    const uint8_t header[] = {0x80, 0x11, 0x02, 0x00};
    std::memcpy(bytes.data(), header, sizeof header);
    return bytes;
}

Bytes overlayFile(unsigned long payload) {
    Bytes bytes(284 + payload);
    fillPattern(bytes, 0, bytes.size());
    putLe32(bytes, 0, 0x089CC2CB);
    putLe16(bytes, 6, 5);
    putLe32(bytes, 8, 1);
    putLe32(bytes, 280, static_cast<uint32_t>(payload));
    return bytes;
}

int usage() {
    std::fputs("Usage: make_example_data settings|lut|overlay FILE [SIZE]\n", stderr);
    return 1;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 3 || argc > 4) return usage();
    const std::string kind = argv[1];
    char* end = nullptr;
    const unsigned long size = argc == 4 ? std::strtoul(argv[3], &end, 0) : 0;
    if (argc == 4 && (*end != '\0' || end == argv[3])) return usage();

    Bytes bytes;
    if (kind == "settings") {
        const unsigned long length = argc == 4 ? size : 4096;
        if (length < 4 || length > 0xFFFF) {
            std::fputs("settings length must be 4 to 65535\n", stderr);
            return 1;
        }
        bytes = settingsBlock(length);
    } else if (kind == "lut" && argc == 3) {
        bytes = lutFile();
    } else if (kind == "overlay") {
        const unsigned long payload = argc == 4 ? size : 1024;
        if (payload > 64ul * 1024 * 1024) {
            std::fputs("overlay payload must be at most 64 MiB\n", stderr);
            return 1;
        }
        bytes = overlayFile(payload);
    } else {
        return usage();
    }

    FILE* out = std::fopen(argv[2], "wbe");
    if (out == nullptr || std::fwrite(bytes.data(), 1, bytes.size(), out) != bytes.size() || std::fclose(out) != 0) {
        std::perror(argv[2]);
        return 1;
    }
    return 0;
}
