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

}  // namespace testing_support
