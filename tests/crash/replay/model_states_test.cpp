// The store-visible key and the model's states of a window, on trees and
// records made by hand.
#include "model_states.h"

#include <algorithm>
#include <stdexcept>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "fs_op_of.h"

namespace replay {
namespace {

using crash::FsImage;
using crash::FsOp;
using crash::FsOpKind;
using crash::opOf;

void putFile(FsImage& image, const std::string& path, uint64_t inode, const std::string& bytes, timespec mtime) {
    image.names[path] = inode;
    image.files[inode] = crash::FileNode{crash::Bytes(bytes.begin(), bytes.end()), mtime};
}

FsOp write(const std::string& path, uint64_t inode, const std::string& bytes, int64_t seconds) {
    FsOp op = opOf(FsOpKind::kWrite, path, inode, seconds);
    op.data.assign(bytes.begin(), bytes.end());
    return op;
}

FsOp rename(const std::string& from, const std::string& to, uint64_t inode) {
    FsOp op = opOf(FsOpKind::kRename, from, inode);
    op.toPath = to;
    return op;
}

// Two copies as the store keeps them: a data file and its check file each.
FsImage twoCopies(timespec first, timespec second) {
    FsImage image;
    image.directories = {"1", "2"};
    putFile(image, "1/data", 1, "one", {5, 0});
    putFile(image, "1/data.chk", 2, "check one", first);
    putFile(image, "2/data", 3, "two", {6, 0});
    putFile(image, "2/data.chk", 4, "check two", second);
    return image;
}

TEST(VisibleState, IgnoresTheTimesThemselves) {
    FsImage later = twoCopies({1100, 7}, {1200, 0});
    later.files.at(1).mtime = {99, 0};
    EXPECT_EQ(visibleState(twoCopies({100, 0}, {200, 3})), visibleState(later));
}

TEST(VisibleState, ChainsTheCheckFilesInTimeOrderTiesByName) {
    FsImage image = twoCopies({100, 0}, {100, 0});
    putFile(image, "0/data.chk", 5, "check zero", {100, 1});
    image.directories.insert("0");
    EXPECT_NE(visibleState(image).find("\norder 1/data.chk=2/data.chk<0/data.chk\n"), std::string::npos)
        << visibleState(image);
}

TEST(VisibleState, TellsTheOrderOfCheckFilesApart) {
    const std::string older = visibleState(twoCopies({100, 0}, {200, 0}));
    const std::string equal = visibleState(twoCopies({100, 0}, {100, 0}));
    const std::string newer = visibleState(twoCopies({200, 0}, {100, 0}));
    const std::string byNanoseconds = visibleState(twoCopies({100, 0}, {100, 1}));
    EXPECT_NE(older, equal);
    EXPECT_NE(older, newer);
    EXPECT_NE(equal, newer);
    EXPECT_EQ(older, byNanoseconds);
}

TEST(VisibleState, SeesEveryOtherDifference) {
    const FsImage base = twoCopies({100, 0}, {200, 0});
    struct Change {
        const char* what;
        void (*apply)(FsImage&);
    };
    const Change changes[] = {
        {"size", [](FsImage& image) { image.files.at(1).data.push_back('!'); }},
        {"bytes", [](FsImage& image) { image.files.at(1).data[0] = 'O'; }},
        {"name",
         [](FsImage& image) {
             image.names = {{"1/data", 1}, {"1/data.chk", 2}, {"2/Data", 3}, {"2/data.chk", 4}};
         }},
        {"extra directory", [](FsImage& image) { image.directories.insert("3"); }},
        {"missing file", [](FsImage& image) { image.dropName("2/data"); }},
        {"empty file",
         [](FsImage& image) {
             putFile(image, "2/data.chk.tmp", 6, "", {0, 0});
         }},
    };
    for (const Change& change : changes) {
        FsImage changed = base;
        change.apply(changed);
        EXPECT_NE(visibleState(base), visibleState(changed)) << change.what;
    }
}

// A commit: a temporary file written and renamed into place, then synced.
const std::vector<FsOp> kCommit = {opOf(FsOpKind::kCreate, "c.tmp", 10, 1), write("c.tmp", 10, "12345678", 2),
                                   rename("c.tmp", "c", 10), opOf(FsOpKind::kSyncfs, "", 0)};

FsImage committed(const std::string& bytes) {
    FsImage image;
    putFile(image, "c", 77, bytes, {1234, 0});
    return image;
}

TEST(ModelStates, AllowsTheDurableStateBeforeTheFirstOperation) {
    FsImage durable;
    putFile(durable, "old", 3, "kept", {1, 0});
    ModelStates model(durable, kCommit);
    EXPECT_TRUE(model.allows(durable, 0, 0));
    EXPECT_EQ(model.stateCount(0, 0), 1u);
    EXPECT_FALSE(model.allows(FsImage{}, 0, 0));
}

TEST(ModelStates, AllowsOnlyTheWholeCommitAfterItsSyncfs) {
    ModelStates model(FsImage{}, kCommit);
    EXPECT_TRUE(model.allows(committed("12345678"), 4, 4));
    EXPECT_FALSE(model.allows(committed(""), 4, 4));
    EXPECT_EQ(model.stateCount(4, 4), 1u);
}

TEST(ModelStates, RejectsBytesThatNoPrefixWrites) {
    ModelStates model(FsImage{}, kCommit);
    EXPECT_FALSE(model.allows(committed("12345679"), 0, kCommit.size()));
    EXPECT_FALSE(model.allows(committed("1234"), 0, kCommit.size()));
}

TEST(ModelStates, RespectsTheWindow) {
    ModelStates model(FsImage{}, kCommit);
    // The bytes exist from the write on (cut 2), the name from the rename on.
    EXPECT_FALSE(model.allows(committed("12345678"), 0, 2));
    EXPECT_TRUE(model.allows(committed("12345678"), 3, 3));
    FsImage written;
    putFile(written, "c.tmp", 5, "12345678", {0, 0});
    EXPECT_FALSE(model.allows(written, 0, 1));
    EXPECT_TRUE(model.allows(written, 2, 2));
    EXPECT_TRUE(model.allows(written, 0, 3));
    // Nothing, c.tmp empty, zeros or whole, c empty, zeros or whole: the
    // times of c.tmp that the model tells apart are one state to the store.
    EXPECT_EQ(model.stateCount(0, 3), 7u);
}

TEST(ModelStates, ComparesTheOrderOfCheckTimes) {
    FsImage durable;
    putFile(durable, "a.chk", 1, "A", {10, 0});
    putFile(durable, "b.chk", 2, "B", {20, 0});
    const FsOp touch = opOf(FsOpKind::kUtimens, "a.chk", 1, 30);
    ModelStates model(durable, {touch});
    FsImage touched = durable;
    touched.files.at(1).mtime = {25, 0};
    EXPECT_TRUE(model.allows(touched, 1, 1));
    touched.files.at(1).mtime = {20, 0};
    EXPECT_FALSE(model.allows(touched, 0, 1));
}

TEST(ModelStates, RefusesAWindowOutsideTheRecord) {
    ModelStates model(FsImage{}, kCommit);
    EXPECT_THROW(model.allows(FsImage{}, 0, kCommit.size() + 1), std::out_of_range);
    EXPECT_THROW(model.stateCount(2, 1), std::out_of_range);
    EXPECT_THROW(model.allowsTornWrite(FsImage{}, 0, kCommit.size() + 1, 4096), std::out_of_range);
}

// As the device showed it: a write over a data file's blocks torn at the
// cut, its sectors zeros, 0xFF, new or old, beside the check file.
TEST(ModelStates, AllowsOneTornWriteWithinItsSpanOnly) {
    FsImage durable;
    putFile(durable, "2/data", 3, std::string(5307, 'o'), {1, 0});
    putFile(durable, "2/data.chk", 4, "check", {1, 0});
    ModelStates model(durable, {});
    FsImage torn = durable;
    crash::Bytes& data = torn.files.at(3).data;
    std::fill(data.begin() + 512, data.begin() + 1024, 0);
    std::fill(data.begin() + 2048, data.begin() + 2560, 0xFF);
    data[4100] = 'n';  // sectors 1 to 8: 4096 bytes
    EXPECT_FALSE(model.allows(torn, 0, 0));
    EXPECT_TRUE(model.allowsTornWrite(torn, 0, 0, 8192));
    EXPECT_TRUE(model.allowsTornWrite(torn, 0, 0, 4096));
    EXPECT_FALSE(model.allowsTornWrite(torn, 0, 0, 3584));

    FsImage twoFiles = torn;
    twoFiles.files.at(4).data[0] = 'C';
    EXPECT_FALSE(model.allowsTornWrite(twoFiles, 0, 0, 8192)) << "one write, two files";
    FsImage longer = torn;
    longer.files.at(3).data.push_back('o');
    EXPECT_FALSE(model.allowsTornWrite(longer, 0, 0, 8192)) << "a size the model has not";
    FsImage renamed = torn;
    renamed.dropName("2/data.chk");
    putFile(renamed, "2/data.chk.tmp", 4, "check", {1, 0});
    EXPECT_FALSE(model.allowsTornWrite(renamed, 0, 0, 8192)) << "a name the model has not";
}

}  // namespace
}  // namespace replay
