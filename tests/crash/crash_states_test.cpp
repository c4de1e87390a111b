// The crash model on small hand-made records: which states it allows and,
// as much, which it never does.
#include <set>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "crash_states.h"
#include "fs_op_of.h"

namespace crash {
namespace {

FsOp create(const std::string& path, uint64_t inode, int64_t seconds) {
    return opOf(FsOpKind::kCreate, path, inode, seconds);
}

FsOp write(const std::string& path, uint64_t inode, int64_t offset, const std::string& bytes, int64_t seconds) {
    FsOp op = opOf(FsOpKind::kWrite, path, inode, seconds);
    op.offset = offset;
    op.data.assign(bytes.begin(), bytes.end());
    return op;
}

FsOp truncate(const std::string& path, uint64_t inode, uint64_t size, int64_t seconds) {
    FsOp op = opOf(FsOpKind::kTruncate, path, inode, seconds);
    op.size = size;
    return op;
}

FsOp rename(const std::string& from, const std::string& to, uint64_t inode) {
    FsOp op = opOf(FsOpKind::kRename, from, inode);
    op.toPath = to;
    return op;
}

FsOp syncfs() { return opOf(FsOpKind::kSyncfs, "", 0); }

FsImage withFile(const std::string& path, uint64_t inode, const std::string& bytes, int64_t seconds) {
    FsImage image;
    image.names[path] = inode;
    image.files[inode] = FileNode{Bytes(bytes.begin(), bytes.end()), timespec{seconds, 0}};
    return image;
}

// Each state as "name=contents@seconds ..." in name order.
std::set<std::string> statesAfter(const FsImage& durable, const std::vector<FsOp>& ops, size_t crashPoint,
                                  MetadataOrder order = MetadataOrder::kInOrder) {
    std::set<std::string> states;
    forEachCrashState(durable, ops, crashPoint, order, [&states](const FsImage& image) {
        std::string state;
        for (const auto& [name, inode] : image.names) {
            const FileNode& file = image.files.at(inode);
            if (!state.empty()) state += ' ';
            state +=
                name + '=' + std::string(file.data.begin(), file.data.end()) + '@' + std::to_string(file.mtime.tv_sec);
        }
        states.insert(state);
    });
    return states;
}

TEST(CrashStates, AFileRenamedIntoPlaceBeforeItsDataLandedIsEmpty) {
    const std::vector<FsOp> ops = {create("c.tmp", 10, 1), write("c.tmp", 10, 0, "12345678", 2),
                                   rename("c.tmp", "c", 10)};
    const std::set<std::string> states = statesAfter(FsImage{}, ops, ops.size());
    const std::string zeros(8, '\0');
    EXPECT_EQ(states, (std::set<std::string>{"", "c.tmp=@1", "c.tmp=12345678@1", "c.tmp=" + zeros + "@1", "c.tmp=@2",
                                             "c.tmp=12345678@2", "c.tmp=" + zeros + "@2", "c=@2", "c=12345678@2",
                                             "c=" + zeros + "@2"}));
}

TEST(CrashStates, NothingIsLeftToChanceAfterSyncfs) {
    std::vector<FsOp> ops = {create("c.tmp", 10, 1), write("c.tmp", 10, 0, "12345678", 2), rename("c.tmp", "c", 10),
                             syncfs()};
    EXPECT_EQ(statesAfter(FsImage{}, ops, ops.size()), (std::set<std::string>{"c=12345678@2"}));
    ops.push_back(opOf(FsOpKind::kUnlink, "c", 10));
    EXPECT_EQ(statesAfter(FsImage{}, ops, ops.size()), (std::set<std::string>{"", "c=12345678@2"}));
}

TEST(CrashStates, MetadataPersistsInOrderUnlessFilesMayReorder) {
    const FsImage durable = withFile("a", 1, "A", 1);
    const std::vector<FsOp> ops = {opOf(FsOpKind::kUnlink, "a", 1), create("b", 2, 3)};
    EXPECT_EQ(statesAfter(durable, ops, 2), (std::set<std::string>{"a=A@1", "", "b=@3"}));
    EXPECT_EQ(statesAfter(durable, ops, 2, MetadataOrder::kPerFile),
              (std::set<std::string>{"a=A@1", "", "b=@3", "a=A@1 b=@3"}));
}

TEST(CrashStates, EachBlockLandsInAnyOfItsVersionsWithTheSizeThatCoversIt) {
    const std::string first(2 * kBlockSize, 'x');
    const std::vector<FsOp> ops = {create("f", 1, 1), write("f", 1, 0, first, 2), write("f", 1, 0, "yy", 3)};
    std::set<std::string> contents;
    forEachCrashState(FsImage{}, ops, ops.size(), MetadataOrder::kInOrder, [&contents](const FsImage& image) {
        if (image.names.count("f") == 0) return;
        const Bytes& data = image.files.at(image.names.at("f")).data;
        contents.insert(std::string(data.begin(), data.end()));
    });
    const std::string x(kBlockSize, 'x');
    const std::string y = "yy" + std::string(kBlockSize - 2, 'x');
    const std::string hole(kBlockSize, '\0');
    // Both blocks are allocated by the writes: each may also read as zeros.
    EXPECT_EQ(contents,
              (std::set<std::string>{"", x, y, hole, hole + x, x + x, y + x, hole + hole, x + hole, y + hole}));
}

TEST(CrashStates, DataNeverLandsBeforeTheTruncationThatPrecedesIt) {
    const FsImage durable = withFile("f", 1, "AAAA", 1);
    const std::vector<FsOp> ops = {truncate("f", 1, 0, 2), write("f", 1, 0, "BB", 3)};
    EXPECT_EQ(statesAfter(durable, ops, ops.size()),
              (std::set<std::string>{"f=AAAA@1", "f=@2", "f=BB@2", std::string("f=\0\0@2", 6), "f=@3", "f=BB@3",
                                     std::string("f=\0\0@3", 6)}));
}

TEST(CrashStates, FsyncPutsOneFileOnDisk) {
    const std::vector<FsOp> ops = {create("a", 1, 1), write("a", 1, 0, "1", 1), create("b", 2, 1),
                                   write("b", 2, 0, "2", 1), opOf(FsOpKind::kFsync, "a", 1)};
    const std::set<std::string> states = statesAfter(FsImage{}, ops, ops.size(), MetadataOrder::kPerFile);
    EXPECT_EQ(states, (std::set<std::string>{"a=1@1", "a=1@1 b=@1", "a=1@1 b=2@1", std::string("a=1@1 b=\0@1", 11)}));
}

// Seen on the device's ext4 (4 KiB blocks): a data file truncated and
// rewritten, then a check file renamed into place, and after the cut the
// data file had its new size and read as zeros.
TEST(CrashStates, ABlockAllocatedBeforeItsDataLandedReadsAsZeros) {
    const FsImage durable = withFile("data", 1, "OLD", 1);
    const std::vector<FsOp> ops = {truncate("data", 1, 0, 2), write("data", 1, 0, "NEWDATA", 2),
                                   create("chk.tmp", 2, 3), write("chk.tmp", 2, 0, "CHK", 3),
                                   rename("chk.tmp", "chk", 2)};
    const std::set<std::string> states = statesAfter(durable, ops, ops.size());
    EXPECT_EQ(states.count("chk=CHK@3 " + std::string("data=") + std::string(7, '\0') + "@2"), 1u);
    EXPECT_EQ(states.count(std::string("chk=\0\0\0@3 data=NEWDATA@2", 24)), 1u);
}

TEST(CrashStates, ABlockWrittenInPlaceNeverReadsAsZeros) {
    const FsImage durable = withFile("f", 1, "AAAA", 1);
    const std::vector<FsOp> ops = {write("f", 1, 0, "BB", 2)};
    EXPECT_EQ(statesAfter(durable, ops, ops.size()),
              (std::set<std::string>{"f=AAAA@1", "f=BBAA@1", "f=AAAA@2", "f=BBAA@2"}));
}

TEST(CrashStates, ANameOnlyPersistsInADirectoryThatDoes) {
    const std::vector<FsOp> ops = {opOf(FsOpKind::kMkdir, "d", 0), create("d/f", 1, 1)};
    size_t states = 0;
    forEachCrashState(FsImage{}, ops, ops.size(), MetadataOrder::kPerFile, [&states](const FsImage& image) {
        ++states;
        if (image.names.count("d/f") != 0) {
            EXPECT_EQ(image.directories.count("d"), 1u);
        }
    });
    EXPECT_EQ(states, 3u);
}

TEST(CrashStates, PreparingARecordKeepsItsTreeAndTellsReusedInodesApart) {
    const FsImage durable = withFile("c", 5, "old", 1);
    const std::vector<FsOp> ops = {opOf(FsOpKind::kUnlink, "/root/c", 5), create("/root/t", 5, 2),
                                   create("/elsewhere/x", 6, 2), syncfs(), opOf(FsOpKind::kMkdir, "/root", 0)};
    const std::vector<FsOp> prepared = prepareRecord(ops, "/root", durable);
    ASSERT_EQ(prepared.size(), 3u);
    EXPECT_EQ(prepared[0].path, "c");
    EXPECT_EQ(prepared[0].inode, 5u);
    EXPECT_EQ(prepared[1].path, "t");
    EXPECT_NE(prepared[1].inode, 5u);
    EXPECT_EQ(prepared[2].kind, FsOpKind::kSyncfs);
    // Both files can be there at once: an unlink that did not persist.
    EXPECT_EQ(statesAfter(durable, prepared, 2, MetadataOrder::kPerFile),
              (std::set<std::string>{"c=old@1", "", "t=@2", "c=old@1 t=@2"}));
}

}  // namespace
}  // namespace crash
