// Inspecting dual-file stores made through the store itself and damaged by
// hand: every state and every reason a copy is not valid, in one-slot and
// 26-slot targets, with the tree unchanged by each inspection and the
// verdict equal to what a DualFileTarget opened on a copy of the tree
// serves.
#include "lib/storage/store_inspection.h"

#include <sys/stat.h>
#include <unistd.h>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "files.h"
#include "hostile_tree.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"
#include "store_files.h"

namespace {

namespace fs = std::filesystem;
using Storage::CopyFault;
using Storage::EntryKind;
using Storage::SlotInspection;
using Storage::SlotState;
using store_test::Bytes;
using store_test::kPast;
using store_test::kSecond;
using store_test::patternBytes;
using testing_support::readBytes;
using testing_support::ScratchDir;
using testing_support::snapshotTree;
using testing_support::writeBytes;

// Two blobs of different sizes, so that a read tells which copy served it.
const Bytes kFirst = patternBytes(300, 1);
const Bytes kSecond_ = patternBytes(200, 2);

fs::path slotDirectory(const fs::path& base, size_t slots, size_t index) {
    return slots == 1 ? base : base / std::to_string(index);
}

// Inspects and checks that nothing below `base` changed.
SlotInspection inspected(const fs::path& base, size_t slots, size_t index) {
    const std::string before = fs::exists(base) ? snapshotTree(base) : "";
    SlotInspection slot;
    EXPECT_EQ(Storage::inspectSlot(base, slots, index, slot), 0);
    EXPECT_EQ(fs::exists(base) ? snapshotTree(base) : "", before) << "inspection changed the tree";
    return slot;
}

// The inspection agrees with a DualFileTarget opened on a copy of the tree:
// the same validity and existence, and reads serve the data of the copy the
// inspection calls current.
void expectAgreement(const fs::path& base, size_t slots, size_t index, const SlotInspection& slot,
                     const fs::path& scratch) {
    const fs::path copy = scratch / "agreement";
    fs::remove_all(copy);
    store_test::copyTree(base, copy);
    const Bytes currentData =
        slot.copies[slot.current].data.kind == EntryKind::kFile
            ? readBytes(slotDirectory(copy, slots, index) / (slot.current == 0 ? "1/data" : "2/data"))
            : Bytes();
    Storage::DualFileTarget target(copy, slots);
    Storage::SlotHandle handle = target.getSlot(index);
    Storage::TargetSlot& opened = *handle.get();
    EXPECT_EQ(opened.isValid(), slot.copies[slot.current].check.valid());
    EXPECT_EQ(opened.exists() && opened.isValid(), slot.state == SlotState::kPresent);
    if (slot.state == SlotState::kPresent) {
        EXPECT_EQ(store_test::contentOf(opened), store_test::holding(currentData));
    }
}

struct Row {
    const char* name;
    // Writes through the store and damages the slot directory by hand.
    std::function<void(Storage::TargetSlot&, const fs::path& slotDir)> make;
    SlotState state;
    unsigned current;
    CopyFault faults[2];
};

void twoWrites(Storage::TargetSlot& slot) {
    ASSERT_EQ(slot.write(kFirst.data(), kFirst.size()), STATUS_OK);      // copy 1 ("2")
    ASSERT_EQ(slot.write(kSecond_.data(), kSecond_.size()), STATUS_OK);  // copy 0 ("1"), later
}

const Row kRows[] = {
    {"never_written",
     [](Storage::TargetSlot&, const fs::path&) {},
     SlotState::kEmpty,
     0,
     {CopyFault::kNoCheckFile, CopyFault::kNoCheckFile}},
    {"one_write",
     [](Storage::TargetSlot& s, const fs::path&) { ASSERT_EQ(s.write(kFirst.data(), kFirst.size()), 0u); },
     SlotState::kPresent,
     1,
     {CopyFault::kNoCheckFile, CopyFault::kNone}},
    {"two_writes",
     [](Storage::TargetSlot& s, const fs::path&) { twoWrites(s); },
     SlotState::kPresent,
     0,
     {CopyFault::kNone, CopyFault::kNone}},
    {"erased",
     [](Storage::TargetSlot& s, const fs::path&) {
         twoWrites(s);
         ASSERT_EQ(s.erase(), STATUS_OK);
     },
     SlotState::kAbsentBlob,
     1,
     {CopyFault::kNone, CopyFault::kNone}},
    {"crc_differs",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         store_test::flipByte(d / "1/data", 17);
     },
     SlotState::kPresent,
     1,
     {CopyFault::kCrcDiffers, CopyFault::kNone}},
    {"size_differs",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         fs::resize_file(d / "1/data", 150);
     },
     SlotState::kPresent,
     1,
     {CopyFault::kSizeDiffers, CopyFault::kNone}},
    {"check_file_of_7_bytes",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         fs::resize_file(d / "1/data.chk", 7);
     },
     SlotState::kPresent,
     1,
     {CopyFault::kCheckSize, CopyFault::kNone}},
    {"no_check_file",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         fs::remove(d / "1/data.chk");
     },
     SlotState::kPresent,
     1,
     {CopyFault::kNoCheckFile, CopyFault::kNone}},
    {"no_data_file",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         fs::remove(d / "1/data");
     },
     SlotState::kPresent,
     1,
     {CopyFault::kNoDataFile, CopyFault::kNone}},
    {"data_is_a_directory",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         fs::remove(d / "1/data");
         fs::create_directories(d / "1/data/inside");
     },
     SlotState::kPresent,
     1,
     {CopyFault::kDataUnreadable, CopyFault::kNone}},
    {"check_file_is_a_link",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         fs::rename(d / "1/data.chk", d / "1/elsewhere");
         fs::create_symlink("elsewhere", d / "1/data.chk");
     },
     SlotState::kPresent,
     1,
     {CopyFault::kCheckUnopenable, CopyFault::kNone}},
    {"retimed",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         store_test::setMtimeNs(d / "1/data.chk", kPast);
         store_test::setMtimeNs(d / "2/data.chk", kPast + kSecond);
     },
     SlotState::kPresent,
     1,
     {CopyFault::kNone, CopyFault::kNone}},
    {"equal_times",
     [](Storage::TargetSlot& s, const fs::path& d) {
         twoWrites(s);
         store_test::setMtimeNs(d / "1/data.chk", kPast);
         store_test::setMtimeNs(d / "2/data.chk", kPast);
     },
     SlotState::kPresent,
     0,
     {CopyFault::kNone, CopyFault::kNone}},
    {"lost",
     [](Storage::TargetSlot& s, const fs::path& d) {
         ASSERT_EQ(s.write(kFirst.data(), kFirst.size()), STATUS_OK);
         store_test::flipByte(d / "2/data", 0);
     },
     SlotState::kLost,
     0,
     {CopyFault::kNoCheckFile, CopyFault::kCrcDiffers}},
    {"first_commit_interrupted",
     [](Storage::TargetSlot&, const fs::path& d) {
         writeBytes(d / "2/data", kFirst);
         writeBytes(d / "2/data.chk.tmp", store_test::expectedCheckFile(kFirst));
     },
     SlotState::kLost,
     0,
     {CopyFault::kNoCheckFile, CopyFault::kNoCheckFile}},
};

class StoreInspection : public testing::TestWithParam<std::tuple<Row, size_t>> {};

TEST_P(StoreInspection, ReportsTheStateTheStoreServes) {
    const Row& row = std::get<0>(GetParam());
    const size_t slots = std::get<1>(GetParam());
    const size_t index = slots - 1;
    ScratchDir scratch;
    const fs::path base = scratch / "base";
    {
        Storage::DualFileTarget target(base, slots);
        Storage::SlotHandle handle = target.getSlot(index);
        row.make(*handle.get(), slotDirectory(base, slots, index));
    }
    const SlotInspection slot = inspected(base, slots, index);
    EXPECT_EQ(Storage::slotStateName(slot.state), std::string(Storage::slotStateName(row.state)));
    EXPECT_EQ(slot.current, row.current);
    EXPECT_EQ(slot.copies[0].check.fault, row.faults[0]);
    EXPECT_EQ(slot.copies[1].check.fault, row.faults[1]);
    expectAgreement(base, slots, index, slot, scratch.path());
    // The other slots of a many-slot target stay empty.
    if (slots > 1) {
        EXPECT_EQ(inspected(base, slots, 0).state, SlotState::kEmpty);
    }
}

INSTANTIATE_TEST_SUITE_P(Rows, StoreInspection, testing::Combine(testing::ValuesIn(kRows), testing::Values(1, 26)),
                         [](const testing::TestParamInfo<std::tuple<Row, size_t>>& info) {
                             return std::string(std::get<0>(info.param).name) + "_" +
                                    std::to_string(std::get<1>(info.param)) + "_slots";
                         });

TEST(StoreInspectionDetails, DescribesEachCopy) {
    ScratchDir scratch;
    const fs::path base = scratch / "base";
    {
        Storage::DualFileTarget target(base, 1);
        Storage::SlotHandle handle = target.getSlot(0);
        twoWrites(*handle.get());
    }
    store_test::setMtimeNs(base / "1/data.chk", kPast + 123456789);
    fs::resize_file(base / "2/data.chk", 9);
    writeBytes(base / "2/data.chk.tmp", {1, 2});
    const SlotInspection slot = inspected(base, 1, 0);
    const Storage::CopyInspection& first = slot.copies[0];
    EXPECT_EQ(first.data.kind, EntryKind::kFile);
    EXPECT_EQ(first.data.size, 200);
    ASSERT_TRUE(first.crcKnown);
    EXPECT_EQ(first.crc32, store_test::referenceCrc32(kSecond_));
    EXPECT_EQ(first.checkFile.kind, EntryKind::kFile);
    EXPECT_EQ(first.checkFile.modified.tv_sec, kPast / kSecond);
    EXPECT_EQ(first.checkFile.modified.tv_nsec, kPast % kSecond + 123456789);
    EXPECT_EQ(first.transient.kind, EntryKind::kMissing);
    const Storage::CopyInspection& second = slot.copies[1];
    EXPECT_EQ(second.check.fault, CopyFault::kCheckSize);
    EXPECT_EQ(second.check.checkSize, 9);
    EXPECT_EQ(second.transient.kind, EntryKind::kFile);
    EXPECT_EQ(second.transient.size, 2);
    EXPECT_EQ(slot.current, 0u);
}

TEST(StoreInspectionDetails, AMissingTargetDirectoryHoldsEmptySlots) {
    ScratchDir scratch;
    SlotInspection slot;
    slot.state = SlotState::kLost;
    ASSERT_EQ(Storage::inspectSlot(scratch / "none", 26, 3, slot), 0);
    EXPECT_EQ(slot.state, SlotState::kEmpty);
    EXPECT_FALSE(fs::exists(scratch / "none"));
}

TEST(StoreInspectionDetails, ATargetThatIsNotADirectoryIsAnError) {
    ScratchDir scratch;
    writeBytes(scratch / "file", {1});
    SlotInspection slot;
    EXPECT_EQ(Storage::inspectSlot(scratch / "file", 1, 0, slot), ENOTDIR);
}

TEST(StoreInspectionDetails, APlantedSlotDirectoryIsNamed) {
    ScratchDir scratch;
    const fs::path base = scratch / "base";
    fs::create_directories(base);
    fs::create_symlink(scratch.path(), base / "4");
    const SlotInspection slot = inspected(base, 8, 4);
    EXPECT_EQ(slot.state, SlotState::kLost);
    for (const auto& copy : slot.copies) {
        EXPECT_EQ(copy.blockedAt, "4");
        EXPECT_EQ(copy.blockedKind, EntryKind::kLink);
        EXPECT_EQ(copy.check.fault, CopyFault::kCheckUnopenable);
    }
}

// Every planted kind, at every store file and directory of a written slot:
// named, never followed, the tree left as it was.
TEST(StoreInspectionDetails, PlantedEntriesAreReportedByKind) {
    const std::pair<const char*, EntryKind> plants[] = {
        {"link", EntryKind::kLink}, {"fifo", EntryKind::kFifo}, {"directory", EntryKind::kDirectory}};
    for (const char* place : {"1/data", "1/data.chk", "1/data.chk.tmp", "1"}) {
        for (const auto& [plantName, kind] : plants) {
            SCOPED_TRACE(std::string(place) + " " + plantName);
            ScratchDir scratch;
            const fs::path base = scratch / "base";
            {
                Storage::DualFileTarget target(base, 1);
                Storage::SlotHandle handle = target.getSlot(0);
                twoWrites(*handle.get());
            }
            fs::remove_all(base / place);
            if (kind == EntryKind::kLink) fs::create_symlink("/dev/zero", base / place);
            if (kind == EntryKind::kFifo) {
                ASSERT_EQ(::mkfifo((base / place).c_str(), 0600), 0);
            }
            if (kind == EntryKind::kDirectory) fs::create_directories(base / place / "inside");
            const SlotInspection slot = inspected(base, 1, 0);
            const Storage::CopyInspection& copy = slot.copies[0];
            const std::string where = place;
            const EntryKind seen = where == "1" ? (copy.blockedAt == "1" ? copy.blockedKind : EntryKind::kDirectory)
                                   : where == "1/data"     ? copy.data.kind
                                   : where == "1/data.chk" ? copy.checkFile.kind
                                                           : copy.transient.kind;
            EXPECT_EQ(Storage::entryKindName(seen), std::string(Storage::entryKindName(kind)));
            // A planted ".tmp" file takes nothing from the copy.
            const bool judged = where != "1/data.chk.tmp";
            EXPECT_EQ(copy.check.valid(), !judged);
            EXPECT_EQ(slot.state, SlotState::kPresent);
            EXPECT_EQ(slot.current, judged ? 1u : 0u);
        }
    }
}

// Random damage of a slot written twice: truncated, flipped, deleted and
// retimed files. Whatever results, the inspection and a freshly opened
// store agree.
TEST(StoreInspectionAgreement, RandomlyDamagedTrees) {
    std::mt19937 random(20261125);
    for (int round = 0; round < 150; ++round) {
        SCOPED_TRACE("round " + std::to_string(round));
        ScratchDir scratch;
        const fs::path base = scratch / "base";
        const size_t slots = round % 2 == 0 ? 1 : 26;
        const size_t index = random() % slots;
        {
            Storage::DualFileTarget target(base, slots);
            Storage::SlotHandle handle = target.getSlot(index);
            twoWrites(*handle.get());
            if (random() % 4 == 0) {
                ASSERT_EQ(handle->erase(), STATUS_OK);
            }
        }
        const fs::path dir = slotDirectory(base, slots, index);
        store_test::damageAtRandom(dir, random);
        const SlotInspection slot = inspected(base, slots, index);
        expectAgreement(base, slots, index, slot, scratch.path());
    }
}

}  // namespace
