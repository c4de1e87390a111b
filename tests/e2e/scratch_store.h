// The fixture of runs against a store of the test's own.
#pragma once

#include <filesystem>
#include <string>

#include <gtest/gtest.h>

#include "files.h"
#include "scratch_dir.h"

namespace e2e {

// One scratch directory per test: data files at its top, the store in "base".
class ScratchStore : public ::testing::Test {
protected:
    testing_support::ScratchDir scratch;
    const std::filesystem::path base = scratch / "base";

    // Writes `bytes` to `name` at the scratch directory's top; its path.
    std::string dataFile(const std::string& name, const testing_support::Bytes& bytes) const {
        testing_support::writeBytes(scratch / name, bytes);
        return (scratch / name).string();
    }
};

}  // namespace e2e
