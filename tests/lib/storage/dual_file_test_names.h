// The names the dual-file store's tests share: each test file takes them with
// one using-directive instead of repeating the list.
#pragma once

#include <filesystem>
#include <string>

#include "files.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"
#include "source_lines.h"
#include "store_files.h"

namespace dual_file_test {

namespace fs = std::filesystem;
using Storage::DualFileTarget;
using Storage::TargetSlot;
using store_test::absentBlob;
using store_test::Bytes;
using store_test::bytesOf;
using store_test::contentOf;
using store_test::copyLines;
using store_test::describeTree;
using store_test::expectedCheckFile;
using store_test::hex;
using store_test::holding;
using store_test::kPast;
using store_test::kSecond;
using store_test::patternBytes;
using store_test::SlotContent;
using testing_support::ScratchDir;

// How an open failure reported by the descriptor helpers begins.
inline const std::string kOpenFailure = testing_support::openFailurePrefix();

}  // namespace dual_file_test
