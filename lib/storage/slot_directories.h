// The directories of one dual-file slot, as one operation reaches them.
//
// The base directory is opened by its path and may be a link: where the
// stores live is the integrator's choice. Below it less trusted code can
// write, so the slot directory of a multi-slot target and the copy
// directories "1" and "2" are opened one component at a time without
// following a link, and every file in them is reached relative to its
// directory's descriptor (untrusted_tree.h). A link, or anything but a
// directory, where a directory should be fails with ENOTDIR.
//
// Each operation makes its own SlotDirectories: names are resolved afresh,
// once per operation, and every descriptor is closed when it returns.
#pragma once

#include <array>
#include <cstdint>
#include <filesystem>
#include <string>

#include "lib/storage/check_value.h"
#include "lib/storage/copy_check.h"
#include "lib/storage/store_names.h"
#include "lib/util/fd.h"
#include "lib/util/status.h"

namespace Storage {

// A copy's directory as far as an operation could reach it.
struct CopyDirectory {
    int fd = -1;           // borrowed from the SlotDirectories
    int error = 0;         // why fd is -1: the errno
    bool missing = false;  // fd is -1 because it, or one above it, does not exist

    // The check value of the data file (check_value.h), once the file is
    // on the medium (fsync); a missing file, or a missing directory, holds
    // an absent blob. STATUS_FAILED when it cannot be computed or synced;
    // `syncError` is then the fsync's errno, or 0 when the sync was not
    // what failed.
    [[nodiscard]] Status computeCheckAndSync(uint64_t& value, int& syncError) const;
    // The modification time of the check file; unknown unless it is a
    // regular file.
    CheckTime checkTime() const;
    // What the check file is now (copy_check.h); a directory that could not
    // be reached holds a missing one when it is missing, else another kind.
    CheckIdentity checkIdentity() const;
    // Removes the entry `name`: a file, a link (itself, never followed) or
    // an empty directory. 0 when done or when there is nothing to remove,
    // else the errno.
    int remove(const char* name) const;
    // openRegularAt for reading in this directory, with the file's fstat in
    // `status` when not null; errno is ENOENT when the directory is missing
    // and its own error when it is unusable.
    UniqueFd openToRead(const char* name, struct stat* status = nullptr) const;
    // The same for writing with `flags`, through openRegularToWriteAt: never
    // into a file that has another name.
    UniqueFd openToWrite(const char* name, int flags, mode_t mode) const;
    // An entry `name` of any kind is there.
    bool holds(const char* name) const;
};

class SlotDirectories {
public:
    // `slotName` is empty when the slot lives in the base directory itself.
    // `base`, when not negative, is an open descriptor of the base
    // directory, borrowed, used instead of opening it again.
    SlotDirectories(std::filesystem::path basePath, std::string slotName, int base = -1);
    SlotDirectories(SlotDirectories&&) = default;
    SlotDirectories& operator=(SlotDirectories&&) = delete;

    // The slot's own directory (the base directory for a one-slot target)
    // if it exists; with `create`, made first when missing.
    CopyDirectory slot(bool create);
    // The directory of copy 0 ("1") or copy 1 ("2") if it exists.
    CopyDirectory open(unsigned copy);
    // The same, first making whatever is missing (the base with its
    // parents, mode 0777 less the umask). A failure is logged at info
    // priority as "Failed to create <quoted copy directory> <message>".
    CopyDirectory ensure(unsigned copy);

    // Opens the regular file `name` of copy 0 or 1 for reading, with its
    // fstat in `status`. Where the kernel can (openRegularBeneath), in one
    // call from the base directory without opening the directories on the
    // way; elsewhere through them. errno on failure: ENOENT when the file or
    // a directory above it is missing; ELOOP or ENOTDIR for a link on the
    // way; EISDIR or ENXIO for something that is not a regular file.
    UniqueFd openForReading(unsigned copy, const char* name, struct stat& status);

    // The copy directory's path, for messages.
    std::filesystem::path copyPath(unsigned copy) const;

private:
    CopyDirectory reach(unsigned copy, bool create);
    CopyDirectory reachSlot(bool create);
    CopyDirectory reachBase(bool create);

    std::filesystem::path basePath_;
    std::string slotName_;
    int borrowedBase_;
    UniqueFd base_;
    UniqueFd slot_;
    std::array<UniqueFd, 2> copies_;
};

}  // namespace Storage
