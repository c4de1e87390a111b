// Which states a power cut can leave on an ext4 file system mounted with
// data=ordered and delayed allocation, given the operations a program made
// since everything was last on disk.
//
// The model: metadata operations (create, unlink, rename, truncate, mkdir,
// time changes, including the time a write sets) persist as an in-order
// prefix, each one whole. Written data persists per 4 KiB block, in any of
// the versions the block had between the writes to it, and appears with
// the size that covers it; a block's data can only land once the file's
// earlier metadata (its creation, a truncation) has. fsync forces one
// file's metadata and data, syncfs everything. A file created and renamed
// into place whose data never reached the disk is therefore empty: a legal
// state. A block that a write allocates (the file did not reach it) may
// also read as zeros with the size that covers it: where a block is a page,
// ext4 allocates delayed blocks as unwritten extents, and the journal
// commits the allocation and the size without waiting for the data. The pessimistic order lets the metadata of
// different files persist in any interleaving, each file's own still in order.
#pragma once

#include <cstddef>
#include <filesystem>
#include <functional>
#include <vector>

#include "fs_image.h"
#include "fs_record.h"

namespace crash {

constexpr size_t kBlockSize = 4096;

enum class MetadataOrder {
    kInOrder,  // one prefix of all metadata operations
    kPerFile,  // a prefix per file; different files reorder freely
};

// The recorded operations below `root` with paths relative to it (others
// and `root` itself dropped; syncfs kept), and with every inode a file
// identity of its own: a number the file system reuses after an unlink
// names a new file. `durable` holds the files the record starts from.
std::vector<FsOp> prepareRecord(const std::vector<FsOp>& ops, const std::filesystem::path& root,
                                const FsImage& durable);

// `image` after `op` took full effect.
void applyOp(FsImage& image, const FsOp& op);

// Calls `visit` for every state the model allows after a power cut that
// follows the first `crashPoint` of the prepared `ops`, when `durable` was
// entirely on disk before them. Returns the number of states visited; the
// same state may come more than once. Throws when the states would number
// more than a million.
size_t forEachCrashState(const FsImage& durable, const std::vector<FsOp>& ops, size_t crashPoint, MetadataOrder order,
                         const std::function<void(const FsImage&)>& visit);

}  // namespace crash
