#include "json_text.h"

#include <string>

#include <gtest/gtest.h>

#include "json_value.h"
#include "store_report.h"

namespace {

struct Row {
    std::string text;
    std::string quoted;
};

const Row kRows[] = {
    {"", "\"\""},
    {"plain/path", "\"plain/path\""},
    {"a\"b", "\"a\\\"b\""},
    {"back\\slash", "\"back\\\\slash\""},
    {"tab\tnew\nline\r", "\"tab\\tnew\\nline\\r\""},
    {std::string("nul\0x", 5), "\"nul\\u0000x\""},
    {"\x01\x1f\x7f\b\f", "\"\\u0001\\u001f\\u007f\\b\\f\""},
    {"caf\xc3\xa9", "\"caf\xc3\xa9\""},
};

TEST(JsonQuoted, EscapesWhatJsonRequires) {
    for (const Row& row : kRows) {
        EXPECT_EQ(jsonQuoted(row.text), row.quoted);
        // And a strict reader gets the text back.
        if (row.text.find('\xc3') == std::string::npos) {
            EXPECT_EQ(testing_support::parseJson(row.quoted).text, row.text);
        }
    }
}

TEST(IsoTime, UtcWithNanoseconds) {
    EXPECT_EQ(isoTime({0, 0}), "1970-01-01T00:00:00.000000000Z");
    EXPECT_EQ(isoTime({1795594202, 123456789}), "2026-11-25T08:10:02.123456789Z");
    EXPECT_EQ(isoTime({951782400, 5}), "2000-02-29T00:00:00.000000005Z");
}

}  // namespace
