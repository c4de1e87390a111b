// The judge on made-up rounds: it must find exactly the violations in
// each, no more.
#include "overlap_judge.h"

#include <cctype>
#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "overlap_blob.h"

namespace {

using overlap::kNoBlob;
using overlap::kNotABlob;
using overlap::Operation;
using overlap::OperationKind;
using overlap::Round;

constexpr std::chrono::nanoseconds kLongestWait{1000};
constexpr int64_t kStarting = 1;

Operation write(int64_t blob, int64_t startNs, int64_t endNs, bool ok = true) {
    return {OperationKind::kWrite, 0, startNs, endNs, ok, blob, true, "writer", ""};
}

Operation read(int64_t blob, int64_t startNs, int64_t endNs, bool ok = true) {
    return {OperationKind::kRead, 0, startNs, endNs, ok, blob, true, "reader", ""};
}

Operation query(bool rightAnswer, bool ok = true) {
    return {OperationKind::kQuery, 0, 5, 6, ok, kNotABlob, rightAnswer, "query", ""};
}

struct JudgeRow {
    const char* name;
    std::vector<Operation> operations;
    int64_t served;
    size_t acknowledged, lost, staleReads, longWaits, failedReads;
};

const std::vector<JudgeRow> kJudgeRows = {
    {"nothing written, starting blob served", {}, kStarting, 0, 0, 0, 0, 0},
    {"nothing written, another blob served", {}, 7, 0, 1, 0, 0, 0},
    {"bytes that are no blob served", {write(2, 10, 20)}, kNotABlob, 1, 1, 0, 0, 0},
    {"nothing served", {write(2, 10, 20)}, kNoBlob, 1, 1, 0, 0, 0},
    {"failed write, starting blob served", {write(2, 10, 20, false)}, kStarting, 0, 0, 0, 0, 0},
    {"failed write served", {write(2, 10, 20, false)}, 2, 0, 1, 0, 0, 0},
    {"last of two writes served", {write(2, 10, 20), write(3, 30, 40)}, 3, 2, 0, 0, 0, 0},
    {"first of two writes served", {write(2, 10, 20), write(3, 30, 40)}, 2, 2, 1, 0, 0, 0},
    {"starting blob served after a write", {write(2, 10, 20)}, kStarting, 1, 1, 0, 0, 0},
    {"either of two overlapping writes (1)", {write(2, 10, 30), write(3, 20, 40)}, 2, 2, 0, 0, 0, 0},
    {"either of two overlapping writes (2)", {write(2, 10, 30), write(3, 20, 40)}, 3, 2, 0, 0, 0, 0},
    {"acknowledged write beside a failed later one", {write(2, 10, 20), write(3, 30, 40, false)}, 2, 1, 0, 0, 0, 0},
    {"starting blob read during a write", {write(2, 10, 30), read(kStarting, 20, 25)}, 2, 1, 0, 0, 0, 0},
    {"starting blob read after a write", {write(2, 10, 30), read(kStarting, 31, 35)}, 2, 1, 0, 1, 0, 0},
    {"new blob read during its write", {write(2, 10, 30), read(2, 20, 25)}, 2, 1, 0, 0, 0, 0},
    {"blob read before its write began", {write(2, 10, 30), read(2, 2, 9)}, 2, 1, 0, 1, 0, 0},
    {"mix read", {write(2, 10, 30), read(kNotABlob, 20, 25)}, 2, 1, 0, 1, 0, 0},
    {"nothing read", {write(2, 10, 30), read(kNoBlob, 20, 25)}, 2, 1, 0, 1, 0, 0},
    {"blob of no write of the round read", {read(9, 20, 25)}, kStarting, 0, 0, 1, 0, 0},
    {"superseded blob read", {write(2, 10, 20), write(3, 30, 40), read(2, 41, 45)}, 3, 2, 0, 1, 0, 0},
    {"blob read while its successor was written",
     {write(2, 10, 20), write(3, 30, 40), read(2, 35, 45)},
     3,
     2,
     0,
     0,
     0,
     0},
    {"blob read whose successor overlapped it",
     {write(2, 10, 30), write(3, 20, 40), read(2, 41, 45)},
     3,
     2,
     0,
     0,
     0,
     0},
    {"blob read that a failed write followed",
     {write(2, 10, 20), write(3, 30, 40, false), read(2, 41, 45)},
     2,
     1,
     0,
     0,
     0,
     0},
    {"read that gave up", {write(2, 10, 20), read(kNotABlob, 21, 25, false)}, 2, 1, 0, 0, 0, 1},
    {"read that took too long", {read(kStarting, 10, 1011)}, kStarting, 0, 0, 0, 1, 0},
    {"write that took exactly the longest wait", {write(2, 10, 1010)}, 2, 1, 0, 0, 0, 0},
    {"query answered rightly", {query(true)}, kStarting, 0, 0, 0, 0, 0},
    {"query answered wrongly", {query(false)}, kStarting, 0, 0, 1, 0, 0},
    {"query that gave up", {query(false, false)}, kStarting, 0, 0, 0, 0, 1},
};

class OverlapJudge : public testing::TestWithParam<JudgeRow> {};

TEST_P(OverlapJudge, FindsExactlyTheViolations) {
    const JudgeRow& row = GetParam();
    Round round;
    round.startNs = 0;
    round.starting = {kStarting};
    round.operations = row.operations;
    round.served = {{{"reader", row.served, ""}}};
    const overlap::Verdict verdict = overlap::judgeRound(round, kLongestWait);
    EXPECT_EQ(verdict.acknowledged, row.acknowledged);
    EXPECT_EQ(verdict.lost, row.lost);
    EXPECT_EQ(verdict.staleReads, row.staleReads);
    EXPECT_EQ(verdict.longWaits, row.longWaits);
    EXPECT_EQ(verdict.failedReads, row.failedReads);
    EXPECT_EQ(verdict.findings.size(), row.lost + row.staleReads + row.longWaits);
}

INSTANTIATE_TEST_SUITE_P(Rows, OverlapJudge, testing::ValuesIn(kJudgeRows),
                         [](const testing::TestParamInfo<JudgeRow>& info) {
                             std::string name;
                             for (const char* c = info.param.name; *c != '\0'; ++c) {
                                 if (std::isalnum(static_cast<unsigned char>(*c))) name += *c;
                             }
                             return name;
                         });

TEST(OverlapJudge, CountsALostSlotOnceHoweverManyReadersSawIt) {
    Round round;
    round.starting = {kStarting, kStarting};
    round.operations = {write(2, 10, 20)};
    round.served = {{{"a", kStarting, ""}, {"b", kStarting, ""}}, {{"a", kStarting, ""}}};
    const overlap::Verdict verdict = overlap::judgeRound(round, kLongestWait);
    EXPECT_EQ(verdict.lost, 1u);
    EXPECT_EQ(verdict.findings.size(), 2u);
}

}  // namespace
