#include "boot_update_log.h"

namespace testing_support {
namespace {

std::string quoted(const std::string& file) { return "\"/media/boot/" + file + "\""; }

}  // namespace

const char kBootRemountRwCall[] = "mount [-o] [remount,rw] [/media/boot]\n";
const char kBootRemountRoCall[] = "mount [-o] [remount,ro] [/media/boot]\n";

std::string begunLines(const std::string& file, int temporary) {
    return "Beginning update of /boot file " + quoted(file) + "\nOpened #" + std::to_string(temporary) +
           " for receiving firmware\n";
}

std::string finalisingLines(const std::string& file, size_t bytes) {
    return "lib/storage/storage_target:N TODO: Sanity-check the file\n" + quoted(file) + " update with " +
           std::to_string(bytes) + " bytes written\n";
}

std::string needsUpdatingLines(const std::string& file) {
    return quoted(file) + " needs updating\nRemounting \"/media/boot\" as rw\n";
}

std::string failedOpenLines(const std::string& file, const std::string& error) {
    const std::string opening = "Opening " + quoted(file) + " for write\n";
    const std::string failed = "libcommon/lib/util/fd:N Failed to open /media/boot/" + file + ": " + error + "\n";
    const std::string refused = "lib/storage/storage_target:N Failed to open BOOT.BIN for writing\n";
    std::string lines;
    for (int attempt = 0; attempt < 5; ++attempt) lines += opening + failed + refused;
    return lines;
}

}  // namespace testing_support
