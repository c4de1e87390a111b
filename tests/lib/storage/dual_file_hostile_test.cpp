// The dual-file store in a tree that a less trusted program has written
// to: at every place the store touches, every kind of planted entry, every
// operation. Each runs in a child under a time limit (a wait on a FIFO ends
// it with SIGALRM), must leave everything outside the store as it was, and
// must either do what it says or fail with a clear status.
#include <unistd.h>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <iterator>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "dual_file_test_names.h"
#include "hostile_tree.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"
#include "store_files.h"
#include "without_openat2.h"

namespace {

using namespace dual_file_test;
using testing_support::Plant;

// Long enough for a sanitized or emulated run; a wait never ends by itself.
constexpr unsigned kTimeLimitSeconds = 20;

// Where the store reaches: a path below the base, in a target of `slots`
// slots whose slot `slot` is used.
struct Place {
    const char* name;
    size_t slots;
    size_t slot;
    const char* relative;
};

const Place kPlaces[] = {
    {"copy0_data", 1, 0, "1/data"},        {"copy0_check", 1, 0, "1/data.chk"}, {"copy0_tmp", 1, 0, "1/data.chk.tmp"},
    {"copy0_directory", 1, 0, "1"},        {"copy1_data", 1, 0, "2/data"},      {"copy1_check", 1, 0, "2/data.chk"},
    {"copy1_tmp", 1, 0, "2/data.chk.tmp"}, {"copy1_directory", 1, 0, "2"},      {"slot_directory", 3, 1, "1"},
};

// Failures an operation may report for a planted entry.
bool clearFailure(Status status) {
    switch (status) {
        case ENOTDIR:
        case ELOOP:
        case EISDIR:
        case ENXIO:
        case ENOTEMPTY:
        case STATUS_FAILED:
            return true;
        default:
            return false;
    }
}

// One operation, done twice so that both copies take a write.
struct Operation {
    const char* name;
    // Runs round 0 or 1 on the slot; returns its status and sets what a
    // successful round leaves the slot holding, given what it held. The
    // queries of every round (contentOf before and after) are the query.
    std::function<Status(TargetSlot&, int round, const SlotContent& before, SlotContent& promised)> run;
};

Status writeBlob(TargetSlot& slot, const Bytes& blob) { return slot.write(blob.data(), blob.size()); }

const Bytes kBlock = patternBytes(64, 90);  // longer than anything stored before

const std::vector<Operation>& operations() {
    static const std::vector<Operation> all = {
        {"opening",
         [](TargetSlot&, int, const SlotContent& before, SlotContent& promised) {
             promised = before;
             return STATUS_OK;
         }},
        {"query",
         [](TargetSlot& slot, int, const SlotContent& before, SlotContent& promised) {
             promised = before;
             uint8_t buffer[16];
             size_t count = 0;
             // At an offset, beside the reads from 0 of every round.
             const Status status = slot.readSome(buffer, sizeof buffer, 3, count);
             return status == before.status ? STATUS_OK : STATUS_FAILED;
         }},
        {"write",
         [](TargetSlot& slot, int round, const SlotContent&, SlotContent& promised) {
             const Bytes blob = patternBytes(100 + round, 91 + round);
             promised = holding(blob);
             return writeBlob(slot, blob);
         }},
        {"writeAt-inside",
         [](TargetSlot& slot, int, const SlotContent&, SlotContent& promised) {
             promised = holding(Bytes(kBlock.begin(), kBlock.end()));
             Status status = slot.beginWrite();
             if (status == STATUS_OK) status = slot.writeAt(0, kBlock.data(), 32);
             if (status == STATUS_OK) status = slot.writeAt(32, kBlock.data() + 32, kBlock.size() - 32);
             const Status finalised = slot.finalise();
             return status != STATUS_OK ? status : finalised;
         }},
        {"writeAt-outside",
         [](TargetSlot& slot, int, const SlotContent&, SlotContent& promised) {
             promised = holding(kBlock);
             return slot.writeAt(0, kBlock.data(), kBlock.size());
         }},
        {"begin-finalise",
         [](TargetSlot& slot, int, const SlotContent&, SlotContent& promised) {
             promised = absentBlob();
             const Status begun = slot.beginWrite();
             const Status finalised = slot.finalise();
             return begun != STATUS_OK ? begun : finalised;
         }},
        {"erase",
         [](TargetSlot& slot, int, const SlotContent&, SlotContent& promised) {
             promised = absentBlob();
             return slot.erase();
         }},
    };
    return all;
}

std::string describe(const SlotContent& content) {
    std::ostringstream text;
    text << content;
    return text.str();
}

// Where the kernel has openat2 the store reads in one call through it;
// elsewhere (and under an emulator without it) it opens the directories one
// at a time. Both ways meet every plant.
enum class Reads { kOpenat2, kDirectories };

class HostileTree : public ::testing::TestWithParam<std::tuple<size_t, Plant, Reads>> {
protected:
    const Place& place() const { return kPlaces[std::get<0>(GetParam())]; }
    Plant plant() const { return std::get<1>(GetParam()); }
    Reads reads() const { return std::get<2>(GetParam()); }
    fs::path base() const { return dir / "store"; }
    fs::path slotDirectory() const { return place().slots == 1 ? base() : base() / std::to_string(place().slot); }

    // Two committed blobs in the slot used (copy "1" current), one in each
    // other slot, then the plant.
    void prepare(const testing_support::Victims& victims) {
        fs::remove_all(base());
        {
            DualFileTarget target(base(), place().slots);
            for (size_t slot = 0; slot < place().slots; ++slot) {
                ASSERT_EQ(writeBlob(*target.getSlot(slot).get(), older()), STATUS_OK);
                ASSERT_EQ(writeBlob(*target.getSlot(slot).get(), old(slot)), STATUS_OK);
            }
        }
        std::string reason;
        if (!testing_support::plantAt(base() / place().relative, plant(), victims, reason)) GTEST_SKIP() << reason;
    }

    static Bytes older() { return bytesOf("the older blob"); }
    static Bytes old(size_t slot) { return bytesOf("the old blob of slot " + std::to_string(slot)); }

    // The operation in a child: every problem is printed, one per line.
    testing_support::ProcessResult run(const Operation& operation) {
        return testing_support::runInChild([&] {
            ::alarm(kTimeLimitSeconds);
            if (reads() == Reads::kDirectories && !testing_support::withoutOpenat2()) {
                std::puts("openat2 cannot be turned off here");
                return 1;
            }
            std::string problems;
            const auto note = [&](const std::string& problem) { problems += problem + "\n"; };
            {
                DualFileTarget target(base(), place().slots);
                TargetSlot& slot = *target.getSlot(place().slot).get();
                for (int round = 0; round < 2; ++round) {
                    const SlotContent before = contentOf(slot);
                    SlotContent promised;
                    const Status status = operation.run(slot, round, before, promised);
                    const SlotContent after = contentOf(slot);
                    const std::string which = "round " + std::to_string(round) + ": ";
                    if (status == STATUS_OK && after != promised) {
                        note(which + "succeeded, but the slot shows " + describe(after) + " instead of " +
                             describe(promised));
                    }
                    if (status != STATUS_OK && !clearFailure(status)) {
                        note(which + "failed with status " + std::to_string(status));
                    }
                }
                const SlotContent last = contentOf(slot);
                // A second opening agrees with what the first one shows now.
                DualFileTarget again(base(), place().slots);
                const SlotContent reopened = contentOf(*again.getSlot(place().slot).get());
                if (reopened != last) note("reopened: " + describe(reopened) + ", was " + describe(last));
                for (size_t other = 0; other < place().slots; ++other) {
                    if (other == place().slot) continue;
                    const SlotContent content = contentOf(*again.getSlot(other).get());
                    if (content != holding(old(other)))
                        note("slot " + std::to_string(other) + ": " + describe(content));
                }
            }
            std::fputs(problems.c_str(), stdout);
            return problems.empty() ? 0 : 1;
        });
    }

    testing_support::ScratchDir dir;
};

TEST_P(HostileTree, EveryOperationStaysInsideTheStoreAndNeverWaits) {
    const testing_support::Victims victims(dir / "victims");
    for (const Operation& operation : operations()) {
        SCOPED_TRACE(operation.name);
        prepare(victims);
        if (IsSkipped() || HasFatalFailure()) return;
        const std::string outside = testing_support::snapshotTree(dir.path(), {"store"});
        const testing_support::ProcessResult result = run(operation);
        EXPECT_NE(result.signal, SIGALRM) << "still waiting after " << kTimeLimitSeconds << " s";
        EXPECT_EQ(result.signal, 0);
        EXPECT_EQ(result.exitStatus, 0) << result.out;
        EXPECT_EQ(testing_support::snapshotTree(dir.path(), {"store"}), outside);
    }
}

std::string caseName(const ::testing::TestParamInfo<HostileTree::ParamType>& info) {
    return std::string(kPlaces[std::get<0>(info.param)].name) + "_" +
           testing_support::plantName(std::get<1>(info.param)) +
           (std::get<2>(info.param) == Reads::kOpenat2 ? "" : "_through_directories");
}

INSTANTIATE_TEST_SUITE_P(Planted, HostileTree,
                         ::testing::Combine(::testing::Range<size_t>(0, std::size(kPlaces)),
                                            ::testing::ValuesIn(testing_support::allPlants()),
                                            ::testing::Values(Reads::kOpenat2, Reads::kDirectories)),
                         caseName);

}  // namespace
