// The plan and the records of a driver in a process of its own go through
// text unchanged.
#include "overlap_driver.h"

#include <stdexcept>
#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace {

using overlap::Operation;
using overlap::OperationKind;

TEST(OverlapDriver, PlanSurvivesItsArguments) {
    const overlap::DriverPlan plan{"/tmp/some base", 4096, {{{0, 5}, {3, 6}}, {}, {{2, 4000000000u}}}};
    const overlap::DriverPlan parsed = overlap::parsePlan(overlap::planArguments(plan));
    EXPECT_EQ(parsed.base, plan.base);
    EXPECT_EQ(parsed.largestBlob, plan.largestBlob);
    ASSERT_EQ(parsed.threads.size(), plan.threads.size());
    for (size_t thread = 0; thread < plan.threads.size(); ++thread) {
        ASSERT_EQ(parsed.threads[thread].size(), plan.threads[thread].size()) << thread;
        for (size_t step = 0; step < plan.threads[thread].size(); ++step) {
            EXPECT_EQ(parsed.threads[thread][step].slot, plan.threads[thread][step].slot);
            EXPECT_EQ(parsed.threads[thread][step].blob, plan.threads[thread][step].blob);
        }
    }
}

TEST(OverlapDriver, PlanWithAStepOutsideTheSlotsIsRefused) {
    EXPECT_THROW(overlap::parsePlan({"/base", "4096", "9:1"}), std::invalid_argument);
    EXPECT_THROW(overlap::parsePlan({"/base", "4096", "1-1"}), std::invalid_argument);
    EXPECT_THROW(overlap::parsePlan({"/base"}), std::invalid_argument);
}

TEST(OverlapDriver, OperationsSurviveTheirText) {
    const std::vector<Operation> operations = {
        {OperationKind::kWrite, 3, -5, 1234567890123, true, 77, true, "driver-2", ""},
        {OperationKind::kRead, 0, 1, 2, true, overlap::kNotABlob, true, "driver-0", "60 bytes beginning like blob 7"},
        {OperationKind::kRead, 1, 3, 4, false, overlap::kNoBlob, true, "driver-1", ""},
        {OperationKind::kQuery, 0, 5, 6, true, overlap::kNotABlob, false, "migrate_settings", ""},
    };
    const std::vector<Operation> parsed = overlap::parseOperations(overlap::operationsText(operations));
    ASSERT_EQ(parsed.size(), operations.size());
    for (size_t i = 0; i < operations.size(); ++i) {
        EXPECT_EQ(parsed[i].kind, operations[i].kind) << i;
        EXPECT_EQ(parsed[i].slot, operations[i].slot) << i;
        EXPECT_EQ(parsed[i].startNs, operations[i].startNs) << i;
        EXPECT_EQ(parsed[i].endNs, operations[i].endNs) << i;
        EXPECT_EQ(parsed[i].ok, operations[i].ok) << i;
        EXPECT_EQ(parsed[i].blob, operations[i].blob) << i;
        EXPECT_EQ(parsed[i].rightAnswer, operations[i].rightAnswer) << i;
        EXPECT_EQ(parsed[i].who, operations[i].who) << i;
        EXPECT_EQ(parsed[i].detail, operations[i].detail) << i;
    }
    EXPECT_THROW(overlap::parseOperations("write 0 1 2\n"), std::invalid_argument);
    EXPECT_THROW(overlap::parseOperations("erase 0 1 2 1 5 1 x \n"), std::invalid_argument);
}

}  // namespace
