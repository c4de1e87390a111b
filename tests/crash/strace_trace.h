// What strace saw a program do to a directory tree, as the operations the
// fault-injection shim records (fs_record.h): an account of the same run
// that owes nothing to the shim, to check its record against.
#pragma once

#include <set>
#include <string>
#include <vector>

#include "fs_record.h"

namespace crash {

// The -e trace= list: every call that changes files, and the opens, reads
// and seeks that move the file positions writes go to. sendfile and
// copy_file_range are left out, since strace does not show the bytes they
// copy; a program that uses them shows those writes in the shim's record
// only.
extern const char* const kStraceCalls;

// The options that parseStraceTrace expects before -e trace=kStraceCalls:
// children followed, descriptors shown with their paths, every string byte
// as \xNN, strings of up to 64 KiB whole (longer writes cannot be
// followed), no exit or signal lines.
extern const std::vector<std::string> kStraceOptions;

// The successful calls in `trace` (strace's -o file written with
// kStraceOptions) that changed something below `root` (absolute, without a
// final '/'), in order, plus every syncfs. `existing` holds the absolute
// paths below `root` that existed when the program started: an open with
// O_CREAT is a create when its name did not exist, and with O_TRUNC a
// truncate when it did. Paths are the arguments joined to the *at or the
// working directory (descriptors: the path strace shows for them). Inodes
// stay 0 and times are filled only for utimens.
//
// Throws std::runtime_error naming the line (its first 200 bytes) for a
// line it cannot read, and
// for what it cannot follow below `root`: strings strace cut short, a
// write through a descriptor whose position is unknown (a duplicate or an
// inherited one) or opened with O_APPEND, a utimensat to the current time.
std::vector<FsOp> parseStraceTrace(const std::string& trace, const std::string& root, std::set<std::string> existing);

// The calls in `trace` (failed ones included) that name an entry below
// `root` (absolute, without a final '/') in a way that could follow a link
// planted there, one line each: anything named by its path (from the
// working directory or absolute) but the making and opening of
// directories whose names below `root` are not decimal numbers (slot and
// copy directories are), a relative name of more than one component (but
// for openat2 with RESOLVE_NO_SYMLINKS, which follows no link on the way),
// an open without O_NOFOLLOW, an openat2 without RESOLVE_NO_SYMLINKS, a
// utimensat of a name without AT_SYMLINK_NOFOLLOW. Throws as
// parseStraceTrace.
std::vector<std::string> linkFollowingCalls(const std::string& trace, const std::string& root);

}  // namespace crash
