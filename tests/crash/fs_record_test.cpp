#include "fs_record.h"

#include <stdexcept>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "files.h"
#include "scratch_dir.h"

namespace {

using crash::describe;
using crash::FsOp;
using crash::FsOpKind;
using crash::parseFsRecord;

struct timespec at(time_t seconds, long nanoseconds) {
    struct timespec time {};
    time.tv_sec = seconds;
    time.tv_nsec = nanoseconds;
    return time;
}

FsOp op(FsOpKind kind, const std::string& path) {
    FsOp result;
    result.kind = kind;
    result.path = path;
    return result;
}

void expectSameOp(const FsOp& actual, const FsOp& expected, const std::string& line) {
    EXPECT_EQ(actual.kind, expected.kind) << line;
    EXPECT_EQ(actual.path, expected.path) << line;
    EXPECT_EQ(actual.toPath, expected.toPath) << line;
    EXPECT_EQ(actual.inode, expected.inode) << line;
    EXPECT_EQ(actual.replacedInode, expected.replacedInode) << line;
    EXPECT_EQ(actual.offset, expected.offset) << line;
    EXPECT_EQ(actual.size, expected.size) << line;
    EXPECT_EQ(actual.data, expected.data) << line;
    EXPECT_EQ(actual.mtime.tv_sec, expected.mtime.tv_sec) << line;
    EXPECT_EQ(actual.mtime.tv_nsec, expected.mtime.tv_nsec) << line;
}

struct GoodRow {
    std::string line;
    FsOp expected;
};

std::vector<GoodRow> goodRows() {
    std::vector<GoodRow> rows;
    FsOp create = op(FsOpKind::kCreate, "/s/1/data");
    create.inode = 12;
    create.mtime = at(1700000000, 5);
    rows.push_back({"create /s/1/data 12 1700000000.000000005", create});

    FsOp truncate = op(FsOpKind::kTruncate, "/s/1/data");
    truncate.inode = 12;
    truncate.size = 4096;
    truncate.mtime = at(0, 0);
    rows.push_back({"truncate /s/1/data 12 4096 0.000000000", truncate});

    FsOp write = op(FsOpKind::kWrite, "/s/1/data");
    write.inode = 12;
    write.offset = 9223372036854775807;
    write.data = {0x00, 0xab, 0xff, 0x10};
    write.mtime = at(-5, 999999999);
    rows.push_back({"write /s/1/data 12 9223372036854775807 00abff10 -5.999999999", write});

    FsOp emptyWrite = op(FsOpKind::kWrite, "/s/x");
    emptyWrite.inode = 18446744073709551615u;
    emptyWrite.mtime = at(1, 0);
    rows.push_back({"write /s/x 18446744073709551615 0 - 1.000000000", emptyWrite});

    FsOp unlink = op(FsOpKind::kUnlink, "/s/1/data.chk");
    unlink.inode = 7;
    rows.push_back({"unlink /s/1/data.chk 7", unlink});

    rows.push_back({"rmdir /s/1", op(FsOpKind::kRmdir, "/s/1")});
    rows.push_back({"mkdir /s/2", op(FsOpKind::kMkdir, "/s/2")});

    FsOp rename = op(FsOpKind::kRename, "/s/1/data.chk.tmp");
    rename.toPath = "/s/1/data.chk";
    rename.inode = 30;
    rename.replacedInode = 29;
    rows.push_back({"rename /s/1/data.chk.tmp /s/1/data.chk 30 29", rename});

    FsOp utimens = op(FsOpKind::kUtimens, "/s/1/data.chk.tmp");
    utimens.inode = 30;
    utimens.mtime = at(1700000002, 123456789);
    rows.push_back({"utimens /s/1/data.chk.tmp 30 1700000002.123456789", utimens});

    FsOp fsync = op(FsOpKind::kFsync, "/s");
    fsync.inode = 2;
    rows.push_back({"fsync /s 2", fsync});

    FsOp syncfs;
    syncfs.kind = FsOpKind::kSyncfs;
    rows.push_back({"syncfs", syncfs});

    FsOp chmod = op(FsOpKind::kChmod, "/s/1/data");
    chmod.inode = 12;
    rows.push_back({"chmod /s/1/data 12", chmod});

    FsOp escapes = op(FsOpKind::kMkdir, "/a b/%20/\n/100%");
    rows.push_back({"mkdir /a%20b/%2520/%0A/100%25", escapes});

    FsOp renameEscaped = op(FsOpKind::kRename, "/odd %name\n");
    renameEscaped.toPath = "/a b";
    renameEscaped.inode = 1;
    rows.push_back({"rename /odd%20%25name%0A /a%20b 1 0", renameEscaped});
    return rows;
}

TEST(FsRecord, ParsesEveryKindAndDescribesItAsItsLine) {
    for (const GoodRow& row : goodRows()) {
        const std::vector<FsOp> ops = parseFsRecord(row.line + "\n");
        ASSERT_EQ(ops.size(), 1u) << row.line;
        expectSameOp(ops[0], row.expected, row.line);
        EXPECT_EQ(describe(ops[0]), row.line);
    }
}

TEST(FsRecord, ParsesLinesInOrder) {
    std::string text;
    for (const GoodRow& row : goodRows()) text += row.line + "\n";
    const std::vector<FsOp> ops = parseFsRecord(text);
    const std::vector<GoodRow> rows = goodRows();
    ASSERT_EQ(ops.size(), rows.size());
    for (size_t i = 0; i < ops.size(); ++i) expectSameOp(ops[i], rows[i].expected, rows[i].line);
    EXPECT_TRUE(parseFsRecord("").empty());
}

TEST(FsRecord, RejectsMalformedLinesNamingThem) {
    struct BadRow {
        std::string text;
        std::string message;
    };
    const std::vector<BadRow> rows = {
        {"bogus /a 1\n", "fs record line 1 \"bogus /a 1\": unknown kind bogus"},
        {"syncfs\nmkdir /a\nmkdir\n", "fs record line 3 \"mkdir\": mkdir takes 1 fields, not 0"},
        {"syncfs x\n", "fs record line 1 \"syncfs x\": syncfs takes 0 fields, not 1"},
        {"unlink /a 1 2\n", "fs record line 1 \"unlink /a 1 2\": unlink takes 2 fields, not 3"},
        {"mkdir  /a\n", "fs record line 1 \"mkdir  /a\": empty field"},
        {"mkdir /a \n", "fs record line 1 \"mkdir /a \": empty field"},
        {"\n", "fs record line 1 \"\": empty field"},
        {"mkdir /a", "fs record line 1 \"mkdir /a\": no newline at its end"},
        {"syncfs\nmkdir /a", "fs record line 2 \"mkdir /a\": no newline at its end"},
        {"mkdir a\n", "fs record line 1 \"mkdir a\": path not absolute: a"},
        {"rename /a b 1 0\n", "fs record line 1 \"rename /a b 1 0\": path not absolute: b"},
        {"mkdir /a%2\n", "fs record line 1 \"mkdir /a%2\": bad escape in path: /a%2"},
        {"mkdir /a%0a\n", "fs record line 1 \"mkdir /a%0a\": bad escape in path: /a%0a"},
        {"mkdir /a%41\n", "fs record line 1 \"mkdir /a%41\": bad escape in path: /a%41"},
        {"unlink /a x\n", "fs record line 1 \"unlink /a x\": not a decimal number: x"},
        {"unlink /a -1\n", "fs record line 1 \"unlink /a -1\": not a decimal number: -1"},
        {"unlink /a 18446744073709551616\n",
         "fs record line 1 \"unlink /a 18446744073709551616\": number out of range: 18446744073709551616"},
        {"write /a 1 9223372036854775808 00 0.000000000\n",
         "fs record line 1 \"write /a 1 9223372036854775808 00 0.000000000\": number out of range: "
         "9223372036854775808"},
        {"create /a 1 5\n", "fs record line 1 \"create /a 1 5\": time not SEC.NNNNNNNNN: 5"},
        {"create /a 1 5.12345678\n", "fs record line 1 \"create /a 1 5.12345678\": time not SEC.NNNNNNNNN: 5.12345678"},
        {"create /a 1 .000000000\n", "fs record line 1 \"create /a 1 .000000000\": not a decimal number: "},
        {"create /a 1 5.00000000x\n", "fs record line 1 \"create /a 1 5.00000000x\": not a decimal number: 00000000x"},
        {"write /a 1 0 ? 0.000000000\n",
         "fs record line 1 \"write /a 1 0 ? 0.000000000\": bytes that were not read back"},
        {"write /a 1 0 abc 0.000000000\n", "fs record line 1 \"write /a 1 0 abc 0.000000000\": hex of odd length"},
        {"write /a 1 0 AB 0.000000000\n", "fs record line 1 \"write /a 1 0 AB 0.000000000\": not lowercase hex: AB"},
        {"truncate /a 1 x 0.000000000\n", "fs record line 1 \"truncate /a 1 x 0.000000000\": not a decimal number: x"},
    };
    for (const BadRow& row : rows) {
        try {
            parseFsRecord(row.text);
            ADD_FAILURE() << "accepted: " << row.text;
        } catch (const std::runtime_error& error) {
            EXPECT_EQ(std::string(error.what()), row.message);
        }
    }
}

TEST(FsRecord, ReadsAFileAndTakesAMissingOneAsEmpty) {
    testing_support::ScratchDir dir;
    EXPECT_TRUE(crash::readFsRecord(dir / "missing").empty());
    testing_support::writeText(dir / "record", "mkdir /a\nsyncfs\n");
    const std::vector<FsOp> ops = crash::readFsRecord(dir / "record");
    ASSERT_EQ(ops.size(), 2u);
    EXPECT_EQ(describe(ops[0]), "mkdir /a");
    EXPECT_EQ(describe(ops[1]), "syncfs");
    EXPECT_THROW(crash::readFsRecord(dir.path()), std::runtime_error);
}

}  // namespace
