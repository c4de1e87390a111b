#include "lib/storage/copy_check.h"

#include <gtest/gtest.h>

#include <cerrno>

namespace {

using Storage::CopyCheck;
using Storage::CopyFault;
using Storage::failedToRead;

CopyCheck checkOf(CopyFault fault, int error = 0) {
    CopyCheck check;
    check.fault = fault;
    check.error = error;
    return check;
}

// A failing card or file system is worth a log line; what the tree holds
// (links, directories, FIFOs) and damaged contents are not.
TEST(FailedToRead, OnlyOpensAndReadsThatFailBelowTheTree) {
    for (const CopyFault fault :
         {CopyFault::kCheckUnopenable, CopyFault::kCheckUnreadable, CopyFault::kDataUnreadable}) {
        for (const int error : {EIO, EACCES, ENOMEM, EUCLEAN}) {
            EXPECT_TRUE(failedToRead(checkOf(fault, error))) << static_cast<int>(fault) << " " << error;
        }
        for (const int error : {ELOOP, ENOTDIR, EISDIR, ENXIO}) {
            EXPECT_FALSE(failedToRead(checkOf(fault, error))) << static_cast<int>(fault) << " " << error;
        }
    }
    for (const CopyFault fault : {CopyFault::kNone, CopyFault::kNoCheckFile, CopyFault::kCheckSize,
                                  CopyFault::kNoDataFile, CopyFault::kSizeDiffers, CopyFault::kCrcDiffers}) {
        EXPECT_FALSE(failedToRead(checkOf(fault, EIO))) << static_cast<int>(fault);
    }
}

}  // namespace
