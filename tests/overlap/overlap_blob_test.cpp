// Blobs tell apart a whole blob from anything else a read may return.
#include "overlap_blob.h"

#include <algorithm>
#include <cstdint>

#include <gtest/gtest.h>

namespace {

using overlap::Bytes;
using overlap::kNotABlob;

TEST(OverlapBlob, OnlyAWholeBlobIsIdentified) {
    const Bytes blob = overlap::makeBlob(5, 1000);
    const Bytes other = overlap::makeBlob(6, 1000);
    EXPECT_EQ(overlap::identifyBlob(blob.data(), blob.size()), 5);
    EXPECT_EQ(overlap::identifyBlob(other.data(), other.size()), 6);
    EXPECT_EQ(overlap::identifyBlob(blob.data(), 0), kNotABlob);
    for (size_t length = 1; length < blob.size(); length += 37) {
        EXPECT_EQ(overlap::identifyBlob(blob.data(), length), kNotABlob) << length;
    }
    // Past the first byte in which the ids differ.
    for (size_t length = 5; length < blob.size(); length += 37) {
        Bytes mix = blob;
        std::copy(other.begin() + length, other.end(), mix.begin() + length);
        EXPECT_EQ(overlap::identifyBlob(mix.data(), mix.size()), kNotABlob) << length;
    }
    Bytes longer = blob;
    longer.push_back(0);
    EXPECT_EQ(overlap::identifyBlob(longer.data(), longer.size()), kNotABlob);
}

TEST(OverlapBlob, SizesStayWithinTheCampaignsRange) {
    size_t smallest = SIZE_MAX, largest = 0;
    for (overlap::BlobId id = 0; id < 1000; ++id) {
        const size_t size = overlap::blobSize(id, 4096);
        smallest = std::min(smallest, size);
        largest = std::max(largest, size);
        EXPECT_EQ(overlap::makeBlob(id, size).size(), size);
    }
    EXPECT_GE(smallest, 2048u);
    EXPECT_LE(largest, 4096u);
    EXPECT_LT(smallest + 1000, largest);  // sizes differ
}

TEST(OverlapBlob, DescribesWhatItCannotIdentify) {
    const Bytes blob = overlap::makeBlob(7, 100);
    EXPECT_EQ(overlap::describeBytes(blob.data(), 60), "60 bytes beginning like blob 7 of 100");
    EXPECT_EQ(overlap::describeBytes(blob.data() + 1, 60), "60 bytes");
    EXPECT_EQ(overlap::describeBytes(blob.data(), 0), "0 bytes");
}

}  // namespace
