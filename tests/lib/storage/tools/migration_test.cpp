#include "migration.h"

#include <gtest/gtest.h>

#include "files.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"

namespace {

using testing_support::readBytes;
using testing_support::ScratchDir;

// A check that passes blocks starting with 'G' and reports a length of 2.
Status passesG(const Block& block, size_t& length) {
    length = block.size();
    if (block.empty() || block[0] != 'G') return STATUS_NOT_FOUND + block.size();
    length = 2;
    return STATUS_OK;
}

class MigrationTest : public ::testing::Test {
protected:
    // One slot: the copies live directly under the base directory.
    std::vector<uint8_t> stored() { return readBytes(dir / "store/2/data"); }
    bool nothingWritten() {
        return !std::filesystem::exists(dir / "store/1/data") && !std::filesystem::exists(dir / "store/2/data");
    }

    ScratchDir dir;
    Storage::DualFileTarget target{dir / "store", 1};
    const MigrationCheck check = passesG;
    const Block good1{'G', '1', 'x'};
    const Block good2{'G', '2', 'y', 'z'};
    const Block bad1{'B', '1'};
    const Block bad2{'B', '2', '2'};
};

TEST_F(MigrationTest, SimpleWritesBlockOneWholeWithoutChecking) {
    EXPECT_EQ(runMigration(MigrationType::simple, target, 0, check, bad1, good2), STATUS_OK);
    EXPECT_EQ(stored(), bad1);
}

TEST_F(MigrationTest, SimpleWritesAnEmptyBlock) {
    EXPECT_EQ(runMigration(MigrationType::simple, target, 0, check, Block{}, Block{}), STATUS_OK);
    EXPECT_EQ(stored(), Block{});
    EXPECT_TRUE(target.getSlot(0)->exists());
}

TEST_F(MigrationTest, CheckedWritesTheReportedLength) {
    EXPECT_EQ(runMigration(MigrationType::checked, target, 0, check, good1, bad2), STATUS_OK);
    EXPECT_EQ(stored(), (Block{'G', '1'}));
}

TEST_F(MigrationTest, CheckedFailureWritesNothing) {
    EXPECT_EQ(runMigration(MigrationType::checked, target, 0, check, bad1, good2), STATUS_NOT_FOUND + 2);
    EXPECT_TRUE(nothingWritten());
}

TEST_F(MigrationTest, CheckedFailureIsReportedBeforeTheSlotIsAskedFor) {
    EXPECT_EQ(runMigration(MigrationType::checked, target, 5, check, bad1, good2), STATUS_NOT_FOUND + 2);
}

TEST_F(MigrationTest, RedundantPrefersBlockOne) {
    EXPECT_EQ(runMigration(MigrationType::redundant, target, 0, check, good1, good2), STATUS_OK);
    EXPECT_EQ(stored(), (Block{'G', '1'}));
}

TEST_F(MigrationTest, RedundantFallsBackToBlockTwo) {
    EXPECT_EQ(runMigration(MigrationType::redundant, target, 0, check, bad1, good2), STATUS_OK);
    EXPECT_EQ(stored(), (Block{'G', '2'}));
}

TEST_F(MigrationTest, RedundantWithBothBadFailsWithBlockTwosStatus) {
    EXPECT_EQ(runMigration(MigrationType::redundant, target, 0, check, bad1, bad2), STATUS_NOT_FOUND + 3);
    EXPECT_TRUE(nothingWritten());
}

TEST_F(MigrationTest, MissingSlotIsAnInvalidParameterForEveryType) {
    EXPECT_EQ(runMigration(MigrationType::simple, target, 1, check, good1, good2), STATUS_INVALID_PARAMETER);
    EXPECT_EQ(runMigration(MigrationType::checked, target, 1, check, good1, good2), STATUS_INVALID_PARAMETER);
    // Redundant asks for the slot before any check runs.
    EXPECT_EQ(runMigration(MigrationType::redundant, target, 1, check, bad1, bad2), STATUS_INVALID_PARAMETER);
    EXPECT_TRUE(nothingWritten());
}

TEST_F(MigrationTest, UnknownTypeWritesNothingAndSucceeds) {
    EXPECT_EQ(runMigration(static_cast<MigrationType>(3), target, 0, check, good1, good2), STATUS_OK);
    EXPECT_TRUE(nothingWritten());
}

TEST_F(MigrationTest, WriteFailureIsTheResult) {
    // The copy's directory is a file: the data file cannot be created.
    std::filesystem::remove_all(dir / "store/2");
    testing_support::writeText(dir / "store/2", "in the way");
    EXPECT_NE(runMigration(MigrationType::simple, target, 0, check, good1, good2), STATUS_OK);
    EXPECT_FALSE(target.getSlot(0)->isValid());
}

}  // namespace
