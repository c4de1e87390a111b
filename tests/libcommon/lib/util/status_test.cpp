#include "lib/util/status.h"

#include <cerrno>
#include <filesystem>
#include <functional>
#include <future>
#include <ios>
#include <string>
#include <system_error>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "log_in_child.h"

namespace {

using testing_support::ProcessResult;
using testing_support::runInChild;

struct Named {
    Status code;
    Status value;
    int errnoValue;
    std::string name;
};

TEST(StatusName, EveryConstantHasItsOwnNameAndErrnoValue) {
    const std::vector<Named> table = {
        {STATUS_OK, 0, 0, "STATUS_OK"},
        {STATUS_NOT_FOUND, 2, ENOENT, "STATUS_NOT_FOUND"},
        {STATUS_NOT_ENOUGH_SPACE, 12, ENOMEM, "STATUS_NOT_ENOUGH_SPACE"},
        {STATUS_NOT_AVAILABLE, 16, EBUSY, "STATUS_NOT_AVAILABLE"},
        {STATUS_INVALID_PARAMETER, 22, EINVAL, "STATUS_INVALID_PARAMETER"},
        {STATUS_OUT_OF_RANGE, 34, ERANGE, "STATUS_OUT_OF_RANGE"},
        {STATUS_NOT_IMPLEMENTED, 38, ENOSYS, "STATUS_NOT_IMPLEMENTED"},
        {STATUS_FAILED, 52, EBADE, "STATUS_FAILED"},
        {STATUS_OVERFLOW, 75, EOVERFLOW, "STATUS_OVERFLOW"},
        {STATUS_INVALID_OPERATION, 95, EOPNOTSUPP, "STATUS_INVALID_OPERATION"},
        {STATUS_DISCONNECTED, 107, ENOTCONN, "STATUS_DISCONNECTED"},
        {STATUS_EXIT, 108, ESHUTDOWN, "STATUS_EXIT"},
        {STATUS_TIMEOUT, 110, ETIMEDOUT, "STATUS_TIMEOUT"},
        {STATUS_NOTHING_TO_DO, 114, EALREADY, "STATUS_NOTHING_TO_DO"},
        {STATUS_NOT_READY, 115, EINPROGRESS, "STATUS_NOT_READY"},
    };
    for (const Named& row : table) {
        EXPECT_EQ(row.code, row.value) << row.name;
        EXPECT_EQ(row.code, static_cast<Status>(row.errnoValue)) << row.name;
        EXPECT_EQ(std::string(statusName(row.value)), row.name) << row.value;
    }
}

TEST(StatusName, OtherValuesAreUnknown) {
    for (const Status value : {1u, 3u, 5u, 13u, 51u, 53u, 116u, 200u, 0x7FFFFFFFu, 0xFFFFFFFFu}) {
        EXPECT_EQ(std::string(statusName(value)), "<unknown>") << value;
    }
}

TEST(StatusName, StringsAreStatic) {
    const char* first = statusName(STATUS_FAILED);
    EXPECT_EQ(statusName(STATUS_FAILED), first);
    EXPECT_EQ(statusName(200), statusName(1));
}

struct ErrorRow {
    std::error_code error;
    Status expected;
};

TEST(StatusFromError, SystemAndGenericPassTheirValueOthersFail) {
    const std::vector<ErrorRow> rows = {
        {std::error_code(), STATUS_OK},
        {std::error_code(EIO, std::system_category()), 5},
        {std::error_code(ENOSPC, std::system_category()), 28},
        {std::error_code(EBUSY, std::generic_category()), STATUS_NOT_AVAILABLE},
        {std::make_error_code(std::errc::no_such_file_or_directory), STATUS_NOT_FOUND},
        {std::make_error_code(std::io_errc::stream), STATUS_FAILED},
        {std::make_error_code(std::future_errc::no_state), STATUS_FAILED},
    };
    for (const ErrorRow& row : rows) {
        EXPECT_EQ(statusFromError(row.error), row.expected) << row.error.category().name() << " " << row.error.value();
    }
}

TEST(StatusFromError, RealFileSystemQuery) {
    std::error_code error;
    (void)std::filesystem::file_size("/nonexistent/for/status/test", error);
    EXPECT_EQ(statusFromError(error), STATUS_NOT_FOUND);
}

// Runs `body` in a child that logs to standard output with threshold `threshold`.
ProcessResult reportInChild(int threshold, const std::function<void()>& body) {
    return testing_support::logInChild(LOG_OUTPUT_STDOUT, threshold, body);
}

TEST(StatusReport, FixedLineReportNamesThisFile) {
    const ProcessResult result = reportInChild(4, [] { LOG_STATUS_AT(427, 16); });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.out, "[tests/libcommon/lib/util/status_test:427] err_code = 16 (STATUS_NOT_AVAILABLE)\n");
    EXPECT_EQ(result.err, "");
}

TEST(StatusReport, ReportCarriesTheSourceLine) {
    const ProcessResult result = reportInChild(4, [] { LOG_STATUS(STATUS_FAILED); });
    const int line = __LINE__ - 1;
    EXPECT_EQ(result.out,
              "[tests/libcommon/lib/util/status_test:" + std::to_string(line) + "] err_code = 52 (STATUS_FAILED)\n");
}

TEST(StatusReport, ExplicitSourcePath) {
    const ProcessResult result = reportInChild(4, [] { reportStatus("lib/storage/storage_target", 427, 16); });
    EXPECT_EQ(result.out, "[lib/storage/storage_target:427] err_code = 16 (STATUS_NOT_AVAILABLE)\n");
}

TEST(StatusReport, CodeIsUnsignedDecimalAndUnknownNamed) {
    const ProcessResult result = reportInChild(4, [] {
        LOG_STATUS_AT(1, 0xFFFFFFFFu);
        LOG_STATUS_AT(0, 200);
        LOG_STATUS_AT(-5, STATUS_OK);
    });
    EXPECT_EQ(result.out,
              "[tests/libcommon/lib/util/status_test:1] err_code = 4294967295 (<unknown>)\n"
              "[tests/libcommon/lib/util/status_test:0] err_code = 200 (<unknown>)\n"
              "[tests/libcommon/lib/util/status_test:-5] err_code = 0 (STATUS_OK)\n");
}

TEST(StatusReport, GoesToStandardErrorInModeTwo) {
    const ProcessResult result = runInChild([] {
        setLogOutput(LOG_OUTPUT_STDERR);
        LOG_STATUS_AT(427, STATUS_TIMEOUT);
        return 0;
    });
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err, "[tests/libcommon/lib/util/status_test:427] err_code = 110 (STATUS_TIMEOUT)\n");
}

struct ThresholdRow {
    int threshold;
    bool written;
};

// Written at error priority: threshold 3 admits it, 2 and below write nothing.
TEST(StatusReport, ThresholdDecides) {
    const std::vector<ThresholdRow> rows = {
        {-1, false}, {0, false}, {1, false}, {2, false}, {3, true}, {4, true}, {6, true}, {7, true},
    };
    for (const ThresholdRow& row : rows) {
        for (const int mode : {LOG_OUTPUT_STDOUT, LOG_OUTPUT_STDERR}) {
            const ProcessResult result = runInChild([&] {
                setLogOutput(mode);
                setLogLevel(row.threshold);
                LOG_STATUS_AT(427, STATUS_NOT_AVAILABLE);
                return 0;
            });
            const std::string line =
                row.written ? "[tests/libcommon/lib/util/status_test:427] err_code = 16 (STATUS_NOT_AVAILABLE)\n" : "";
            EXPECT_EQ(result.out, mode == LOG_OUTPUT_STDOUT ? line : "")
                << "threshold " << row.threshold << " mode " << mode;
            EXPECT_EQ(result.err, mode == LOG_OUTPUT_STDERR ? line : "")
                << "threshold " << row.threshold << " mode " << mode;
        }
    }
}

}  // namespace
