// Blobs that name themselves, so that whatever a read returns is told
// apart: one written blob, whole, or anything else (a mix of two, a
// truncation, nothing).
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "files.h"

namespace overlap {

using testing_support::Bytes;
using BlobId = uint32_t;

// Bytes that are no whole blob.
constexpr int64_t kNotABlob = -1;
// An answer that the slot holds no blob at all.
constexpr int64_t kNoBlob = -2;
// "OVLP", the id and the size, little-endian.
constexpr size_t kBlobHeaderSize = 12;

// Blob `id` of `size` bytes (at least kBlobHeaderSize): its header, then
// bytes that depend on the id and on the offset, so that a shifted or
// truncated blob or a mix of two equals none.
Bytes makeBlob(BlobId id, size_t size);

// The size of blob `id` in a campaign whose largest blob has `largest`
// bytes: between largest / 2 and largest, different from blob to blob, so
// that the tail of a longer blob shows behind a shorter one.
size_t blobSize(BlobId id, size_t largest);

// The id of the blob that the bytes are, whole; else kNotABlob.
int64_t identifyBlob(const uint8_t* data, size_t size);

// For a report of bytes that are no blob: "N bytes", and which blob's
// header they begin with.
std::string describeBytes(const uint8_t* data, size_t size);

}  // namespace overlap
