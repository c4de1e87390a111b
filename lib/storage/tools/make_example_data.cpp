// Writes valid example migration data for trying migrate_settings; see
// kHelp below for the kinds and what SIZE means for each.
#include <cctype>
#include <cerrno>
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

constexpr const char* kUsage = "Usage: make_example_data settings|lut|overlay FILE [SIZE]\n";
constexpr const char* kHelp =
    "Writes a valid example migration data file for migrate_settings.\n"
    "\n"
    "  settings FILE [SIZE]  settings block declaring SIZE bytes (4 to 65535, default\n"
    "                        4096), padded with 0xFF to a multiple of 4 bytes\n"
    "  lut FILE              lookup table of 19784 bytes; takes no SIZE\n"
    "  overlay FILE [SIZE]   overlay: 284-byte header, then SIZE payload bytes\n"
    "                        (0 to 67108864, default 1024)\n"
    "\n"
    "SIZE is decimal, 0x-prefixed hex or 0-prefixed octal.\n";

struct Kind {
    const char* name;
    unsigned long defaultSize;  // 0: the kind takes no SIZE
    unsigned long minSize;
    unsigned long maxSize;
    const char* sizeName;
    Bytes (*make)(unsigned long size);
};

constexpr Kind kKinds[] = {
    {"settings", 4096, 4, 0xFFFF, "settings length", settingsBlock},
    {"lut", 0, 0, 0, nullptr, [](unsigned long) { return lutFile(); }},
    {"overlay", 1024, 0, 64ul * 1024 * 1024, "overlay payload", overlayFile},
};

int refuse(const std::string& reason) {
    std::fprintf(stderr, "make_example_data: %s\n%s", reason.c_str(), kUsage);
    return 1;
}

int cannotWrite(const char* path, int error) {
    std::fprintf(stderr, "make_example_data: cannot write '%s': %s\n", path, std::strerror(error));
    return 1;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc == 2 && (std::strcmp(argv[1], "--help") == 0 || std::strcmp(argv[1], "-h") == 0)) {
        std::printf("%s\n%s", kUsage, kHelp);
        return 0;
    }
    if (argc < 3) return refuse("expected a kind and a file name");
    if (argc > 4) return refuse("too many arguments");
    const std::string name = argv[1];
    const Kind* kind = nullptr;
    for (const Kind& candidate : kKinds) {
        if (name == candidate.name) kind = &candidate;
    }
    if (kind == nullptr) return refuse("unknown kind '" + name + "' (settings, lut or overlay)");

    unsigned long size = kind->defaultSize;
    if (argc == 4) {
        if (kind->defaultSize == 0) return refuse(name + " takes no SIZE: a lookup table is always 19784 bytes");
        const std::string text = argv[3];
        char* end = nullptr;
        errno = 0;
        size = std::strtoul(text.c_str(), &end, 0);
        // strtoul would skip blanks and wrap a minus sign around.
        if (!std::isdigit(static_cast<unsigned char>(text[0])) || *end != '\0') {
            return refuse("SIZE '" + text + "' is not a number");
        }
        if (errno == ERANGE || size < kind->minSize || size > kind->maxSize) {
            return refuse(std::string(kind->sizeName) + " must be " + std::to_string(kind->minSize) + " to " +
                          std::to_string(kind->maxSize) + ", not " + text);
        }
    }

    const Bytes bytes = kind->make(size);
    FILE* out = std::fopen(argv[2], "wbe");
    if (out == nullptr) return cannotWrite(argv[2], errno);
    const bool written = std::fwrite(bytes.data(), 1, bytes.size(), out) == bytes.size();
    const int writeError = errno;
    if (std::fclose(out) != 0) return cannotWrite(argv[2], errno);
    if (!written) return cannotWrite(argv[2], writeError);
    return 0;
}
