#include "migration.h"

#include <optional>
#include <string>

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

const Block kGood1{'G', '1', 'x'};
const Block kGood2{'G', '2', 'y', 'z'};
const Block kBad1{'B', '1'};
const Block kBad2{'B', '2', '2'};

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
};

// One migration of two blocks into a fresh one-slot store: its status, and
// what the slot holds after it (nothing at all where `stored` is empty).
struct MigrationRow {
    const char* name;
    MigrationType type;
    size_t slot;
    Block block1;
    Block block2;
    Status status;
    std::optional<Block> stored;
};

const MigrationRow kMigrationRows[] = {
    {"SimpleWritesBlockOneWholeWithoutChecking", MigrationType::simple, 0, kBad1, kGood2, STATUS_OK, kBad1},
    {"SimpleWritesAnEmptyBlock", MigrationType::simple, 0, Block{}, Block{}, STATUS_OK, Block{}},
    {"CheckedWritesTheReportedLength", MigrationType::checked, 0, kGood1, kBad2, STATUS_OK, Block{'G', '1'}},
    {"CheckedFailureWritesNothing", MigrationType::checked, 0, kBad1, kGood2, STATUS_NOT_FOUND + 2, std::nullopt},
    {"CheckedFailureIsReportedBeforeTheSlotIsAskedFor", MigrationType::checked, 5, kBad1, kGood2, STATUS_NOT_FOUND + 2,
     std::nullopt},
    {"RedundantPrefersBlockOne", MigrationType::redundant, 0, kGood1, kGood2, STATUS_OK, Block{'G', '1'}},
    {"RedundantFallsBackToBlockTwo", MigrationType::redundant, 0, kBad1, kGood2, STATUS_OK, Block{'G', '2'}},
    {"RedundantWithBothBadFailsWithBlockTwosStatus", MigrationType::redundant, 0, kBad1, kBad2, STATUS_NOT_FOUND + 3,
     std::nullopt},
    // A missing slot is an invalid parameter for every type.
    {"SimpleMissingSlot", MigrationType::simple, 1, kGood1, kGood2, STATUS_INVALID_PARAMETER, std::nullopt},
    {"CheckedMissingSlot", MigrationType::checked, 1, kGood1, kGood2, STATUS_INVALID_PARAMETER, std::nullopt},
    // Redundant asks for the slot before any check runs.
    {"RedundantMissingSlot", MigrationType::redundant, 1, kBad1, kBad2, STATUS_INVALID_PARAMETER, std::nullopt},
    {"UnknownTypeWritesNothingAndSucceeds", static_cast<MigrationType>(3), 0, kGood1, kGood2, STATUS_OK, std::nullopt},
};

class MigrationRows : public MigrationTest, public ::testing::WithParamInterface<MigrationRow> {};

TEST_P(MigrationRows, StatusAndWhatIsStored) {
    const MigrationRow& row = GetParam();
    EXPECT_EQ(runMigration(row.type, target, row.slot, check, row.block1, row.block2), row.status);
    if (row.stored) {
        EXPECT_EQ(stored(), *row.stored);
        EXPECT_TRUE(target.getSlot(0)->exists());
    } else {
        EXPECT_TRUE(nothingWritten());
    }
}

INSTANTIATE_TEST_SUITE_P(Migration, MigrationRows, ::testing::ValuesIn(kMigrationRows),
                         [](const ::testing::TestParamInfo<MigrationRow>& info) {
                             return std::string(info.param.name);
                         });

TEST_F(MigrationTest, WriteFailureIsTheResult) {
    // The copy's directory is a file: the data file cannot be created.
    std::filesystem::remove_all(dir / "store/2");
    testing_support::writeText(dir / "store/2", "in the way");
    EXPECT_NE(runMigration(MigrationType::simple, target, 0, check, kGood1, kGood2), STATUS_OK);
    EXPECT_FALSE(target.getSlot(0)->isValid());
}

}  // namespace
