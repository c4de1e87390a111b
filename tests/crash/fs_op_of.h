// Record operations made by hand, for the tests of what reads a record.
#pragma once

#include <cstdint>
#include <string>

#include "fs_record.h"

namespace crash {

// An operation of `kind` on `path` and `inode`, stamped `seconds` after the
// epoch; the kind's other fields are the caller's to fill in.
inline FsOp opOf(FsOpKind kind, const std::string& path, uint64_t inode, int64_t seconds = 0) {
    FsOp op;
    op.kind = kind;
    op.path = path;
    op.inode = inode;
    op.mtime.tv_sec = seconds;
    return op;
}

}  // namespace crash
