#include "lib/storage/directories.h"

#include <iomanip>

#include "lib/util/log.h"

namespace Storage {

Status ensureDataDirectory(const std::filesystem::path& dataPath) {
    const std::filesystem::path directory = dataPath.parent_path();
    std::error_code error;
    if (std::filesystem::is_directory(directory, error)) return STATUS_OK;
    std::filesystem::create_directories(directory, error);
    if (!error) return STATUS_OK;
    LOGI << "Failed to create " << std::quoted(directory.string()) << " " << error.message();
    return statusFromError(error);
}

}  // namespace Storage
