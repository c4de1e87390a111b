// migrate_settings: carries one block of settings data (or the first valid
// of two) from a file into a slot of a storage target. The outcome is the
// exit status; the reasons go to the log.
#include <unistd.h>
#include <cerrno>
#include <filesystem>
#include <string>

#include "lib/util/fd.h"
#include "lib/util/log.h"
#include "migration.h"
#include "migration_checks.h"
#include "options.h"
#include "target_registry.h"

namespace {

constexpr int kExitSuccess = 0;
constexpr int kExitFailure = 1;
constexpr int kExitAbsent = 10;  // --query-present: the slot holds no valid data

// Scripts match the data file's error line by this number.
constexpr int kFailedToOpenLine = 494;

// Reads the whole of `fileName` into `out`. Logs only when the file cannot
// be sized; returns that errno, or STATUS_FAILED when the file cannot be
// opened or yields fewer bytes than its size.
Status readMigrationData(const std::string& fileName, Block& out) {
    std::error_code error;
    const std::uintmax_t size = std::filesystem::file_size(fileName, error);
    if (error) {
        LOGE_AT(kFailedToOpenLine) << "Failed to open '" << fileName << "'";
        return statusFromError(error);
    }
    out.resize(size);
    // A FIFO put there since the size query reads as an error, never waits.
    const UniqueFd fd(::open(fileName.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd) return STATUS_FAILED;
    for (size_t done = 0; done < out.size();) {
        const ssize_t count = ::read(fd.get(), out.data() + done, out.size() - done);
        if (count < 0 && errno == EINTR) continue;
        if (count <= 0) return STATUS_FAILED;
        done += static_cast<size_t>(count);
    }
    return STATUS_OK;
}

// Present: the slot exists and holds consistent data.
bool slotPresent(Storage::Target& target, size_t index) {
    const Storage::SlotHandle slot = target.getSlot(index);
    return slot && slot->exists() && slot->isValid();
}

MigrationCheck chooseCheck(const Options& options) {
    switch (options.checkType) {
        case CheckType::settings:
            return checkSettingsBlock;
        case CheckType::lut:
            return [&options](const Block& block, size_t& length) {
                return checkLutHeader(block, length, options.slotIndex);
            };
        case CheckType::overlay:
            return [&options](const Block& block, size_t& length) {
                return checkOverlayHeader(block, length, options.slotIndex);
            };
    }
    return acceptAll;
}

// Everything after the command line; the locals die in the order the
// targets expect: the check and the blocks, then the registry.
int run(const Options& options) {
    TargetRegistry registry;
    registerTargets(std::filesystem::path(options.basePath), registry);

    Storage::Target* const target = registry[options.target].get();
    if (target == nullptr) {
        LOGI << "Target not available";
        return kExitFailure;
    }
    // An index equal to the count passes on purpose: getSlot then finds no slot.
    const size_t slotCount = target->getSlotCount();
    if (options.slotIndex > slotCount) {
        LOGI << "index is out of range of available slots " << slotCount;
        return kExitFailure;
    }

    if (options.queryPresent || options.ifNotPresent) {
        const bool present = slotPresent(*target, options.slotIndex);
        if (options.queryPresent) return present ? kExitSuccess : kExitAbsent;
        if (present) {
            LOGW << "No update required";
            return kExitSuccess;
        }
    }

    Block block1;
    Block block2;
    if (readMigrationData(options.dataPath, block1) != STATUS_OK) return kExitFailure;
    if (!options.data2Path.empty() && readMigrationData(options.data2Path, block2) != STATUS_OK) return kExitFailure;

    const MigrationCheck check = chooseCheck(options);
    const Status result = runMigration(options.migrationType, *target, options.slotIndex, check, block1, block2);
    return result == STATUS_OK ? kExitSuccess : kExitFailure;
}

}  // namespace

int main(int argc, char** argv) {
    setLogOutput(LOG_OUTPUT_STDOUT);
    const Options options(argc, argv);
    if (options.debug) {
        setLogLevel(LOG_PRIORITY_DEBUG);
    } else if (options.verbose) {
        setLogLevel(LOG_PRIORITY_INFO);
    }
    return run(options);
}
