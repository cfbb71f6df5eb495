// The pieces of the text report: sizes, names, escaping and timestamps.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <limits>

#include "output/RKTextCategorySort.h"
#include "output/RKTextDate.h"
#include "output/RKTextNames.h"
#include "output/RKTextSettings.h"
#include "output/RKTextSizeFormat.h"

namespace {

std::string formatted(int64_t bytes) { return RKTextFormattedSize(bytes, RKSummaryFormatFormatted, 4096); }

TEST(RKTextSizeFormat, FormattedSizesScaleByPowersOf1024) {
    EXPECT_EQ(formatted(9999), "9999 B");
    EXPECT_EQ(formatted(10000), "10 KB");
    EXPECT_EQ(formatted(1048576), "1024 KB");
    EXPECT_EQ(formatted(-5000), "-5 KB");
    // 9999 KB and 600 bytes would round to 10000 KB: the next unit instead.
    EXPECT_EQ(formatted(9999 * 1024 + 600), "10 MB");
    // Never wider than the seven-character Dirty column, at both ends of the range.
    EXPECT_EQ(formatted(std::numeric_limits<int64_t>::min()), "-8 EB");
    EXPECT_LE(formatted(std::numeric_limits<int64_t>::max()).size(), 7u);
}

TEST(RKTextSizeFormat, BytesAreSignedAndPagesRoundUp) {
    EXPECT_EQ(RKTextFormattedSize(4096, RKSummaryFormatBytes, 0), "4096 B");
    EXPECT_EQ(RKTextFormattedSize(-12, RKSummaryFormatBytes, 0), "-12 B");
    EXPECT_EQ(RKTextFormattedSize(1, RKSummaryFormatPages, 4096), "1 pages");
    EXPECT_EQ(RKTextFormattedSize(4097, RKSummaryFormatPages, 4096), "2 pages");
    EXPECT_EQ(RKTextFormattedSize(1 << 20, RKSummaryFormatPages, 0), "0 pages");
    // The largest count (read as unsigned) must not wrap while rounding up.
    EXPECT_EQ(RKTextFormattedSize(-1, RKSummaryFormatPages, 4096), "4503599627370496 pages");
}

TEST(RKTextNames, PathsShortenToTheirLastComponentUnlessWide) {
    EXPECT_EQ(RKTextTruncatedName("/var/db/cache/index.db", false), ".../index.db");
    EXPECT_EQ(RKTextTruncatedName("/var/db/cache/", false), ".../cache");
    EXPECT_EQ(RKTextTruncatedName("(hidden)", false), "(hidden)");
    EXPECT_EQ(RKTextTruncatedName("/", false), "/");
    EXPECT_EQ(RKTextTruncatedName("/var/db/cache/index.db", true), "/var/db/cache/index.db");
}

TEST(RKTextNames, ControlBytesAndBrokenUtf8AreEscaped) {
    EXPECT_EQ(RKTextEscaped("a\x1b[31mb"), "a\\x1b[31mb");
    EXPECT_EQ(RKTextEscaped(std::string("nul\0tab\t", 8)), "nul\\x00tab\\x09");
    EXPECT_EQ(RKTextEscaped("del\x7f"), "del\\x7f");
    EXPECT_EQ(RKTextEscaped("csi\xc2\x9b"), "csi\\xc2\\x9b");     // C1 control in UTF-8
    EXPECT_EQ(RKTextEscaped("latin1 \xe9t\xe9"), "latin1 \\xe9t\\xe9");  // not UTF-8
    EXPECT_EQ(RKTextEscaped("cut \xe6\x97"), "cut \\xe6\\x97");     // sequence cut short
    EXPECT_EQ(RKTextEscaped("\xc0\xaf"), "\\xc0\\xaf");              // overlong "/"
    EXPECT_EQ(RKTextEscaped("\xed\xa0\x80"), "\\xed\\xa0\\x80");     // surrogate
    const std::string printable = "na\xc3\xafve \xe6\x97\xa5\xe6\x9c\xac \xf0\x9f\x98\x80 \xc2\xa0~";
    EXPECT_EQ(RKTextEscaped(printable), printable);
}

TEST(RKTextDate, IsoDateWithMillisecondsAndZone) {
    using namespace std::chrono;
    const system_clock::time_point at(milliseconds(978307200500));  // 2001-01-01 00:00:00.500 UTC
    EXPECT_EQ(RKTextIsoDate(at, 0), "2001-01-01 00:00:00.500Z");
    EXPECT_EQ(RKTextIsoDate(at, 3600), "2001-01-01 01:00:00.500+01:00");
    EXPECT_EQ(RKTextIsoDate(at, -(3 * 3600 + 1800)), "2000-12-31 20:30:00.500-03:30");
    EXPECT_EQ(RKTextIsoDate(at + microseconds(999), 0), "2001-01-01 00:00:00.500Z");  // truncated
    EXPECT_EQ(RKTextIsoDate(system_clock::time_point(milliseconds(-1)), 0), "1969-12-31 23:59:59.999Z");
}

// The enum and the column names of the command line must stay in step.
TEST(RKTextCategorySort, ColumnNamesMatchTheEnumInOrder) {
    for (size_t index = 0; index < RKTextSortColumns.size(); ++index) {
        auto column = RKTextSortColumnNamed(RKTextSortColumns[index]);
        ASSERT_TRUE(column.has_value()) << RKTextSortColumns[index];
        EXPECT_EQ(static_cast<size_t>(*column), index);
    }
    EXPECT_EQ(RKTextSortColumnNamed("category"), RKTextSortColumn::Category);
    EXPECT_FALSE(RKTextSortColumnNamed("Dirt").has_value());
    EXPECT_FALSE(RKTextSortColumnNamed("").has_value());
}

}  // namespace
