// Opening entries of a directory that less trusted code can write to.
//
// The tool runs as root beside data that applications write, so an entry
// may be a planted link, FIFO, socket, device node or directory. Nothing
// here follows a symbolic link in the name it is given, waits on a FIFO or
// a lease, or returns a descriptor of anything but what was asked for; the
// caller reaches the directory itself the same way, one component at a
// time. Every descriptor is close-on-exec.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include "lib/util/fd.h"
#include "lib/util/status.h"

namespace Storage {

// Opens the directory `name` in `parent`. Fails with ENOTDIR when `name` is
// a link or anything but a directory, ENOENT when it does not exist, else
// the errno of the open. errno is set on failure.
UniqueFd openDirectoryAt(int parent, const char* name);

// openDirectoryAt, first making the directory (mode 0777 less the umask)
// when it does not exist.
UniqueFd makeDirectoryAt(int parent, const char* name);

// Opens the regular file `name` in `directory` with `flags` (O_CREAT
// creates it with `mode`). Fails with ELOOP for a link, EISDIR for a
// directory and ENXIO for a FIFO, socket or device node, without waiting
// on any of them, else with the errno of the open. errno is set on failure.
// `status`, when not null, receives the file's fstat.
UniqueFd openRegularAt(int directory, const char* name, int flags, mode_t mode = 0, struct stat* status = nullptr);

// openRegularAt for writing (`flags` ask for it), sure that the file has no
// other name before a byte of it changes: a file of several links is
// someone else's file that a planted link made look like ours. Such a name
// is unlinked here, so the file's other names keep their bytes; then, with
// O_TRUNC (the old bytes are not wanted), the file is created afresh, and
// without it the open fails with EMLINK. O_TRUNC acts only once the file is
// known to be this name's alone.
UniqueFd openRegularToWriteAt(int directory, const char* name, int flags, mode_t mode);

// openRegularAt of an existing file (`flags` without O_CREAT) for a
// relative `path` of any number of components below `directory`, in one
// call that follows no link anywhere on the way:
// openat2 with RESOLVE_NO_SYMLINKS and RESOLVE_BENEATH, so a link as any
// component fails with ELOOP and a way out of `directory` with EXDEV.
// ENOSYS where the kernel, or an emulator, has no openat2; from then on
// every call fails that way at once, and the caller takes the directories
// one at a time instead.
UniqueFd openRegularBeneath(int directory, const char* path, int flags, struct stat* status = nullptr);

// Whether `fd` is open on a regular file, with its fstat in `status`; sets
// errno (EISDIR, ENXIO, or that of fstat) when not.
bool isRegularFile(int fd, struct stat& status);

// Whether an entry `name` exists in `directory`, of any kind; links are not
// followed.
bool entryExists(int directory, const char* name);

}  // namespace Storage
