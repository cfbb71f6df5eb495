// The column layout that every table of the text report shares: five right-aligned size columns
// whose widths follow the size format, the region count and the category. The optional Swapped
// and Wired columns take no room at all when hidden.
#pragma once

#include <array>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>

enum RKTextSizeColumn : size_t {
    RKTextColumnDirty,
    RKTextColumnSwapped,
    RKTextColumnClean,
    RKTextColumnReclaimable,
    RKTextColumnWired,
    RKTextSizeColumnCount,
};

// One category or TOTAL row: the five sizes already formatted (a hidden column's text is
// ignored), the region count, the name and the detail ("" when there is none).
struct RKTextRow {
    std::array<std::string, RKTextSizeColumnCount> sizes;
    int64_t regions = 0;
    std::string name;
    std::string detail;
};

class RKTextTable {
public:
    // A column name that is absent hides that column.
    RKTextTable(int64_t summaryFormat, std::optional<std::string> swappedColumnName,
                std::optional<std::string> wiredColumnName);

    void printHeader(FILE* output) const;
    void printRule(FILE* output) const;
    void printRow(FILE* output, const RKTextRow& row) const;
    // The "=" line around headers and summaries; it ends in a blank line when it closes a block.
    void printSeparator(FILE* output, bool closesBlock) const;

private:
    void printColumns(FILE* output, const std::array<const char*, RKTextSizeColumnCount>& texts,
                      const char* regions, const char* category) const;

    std::array<int, RKTextSizeColumnCount> widths_{};  // 0 for a hidden column
    std::array<std::string, RKTextSizeColumnCount> titles_;
};
