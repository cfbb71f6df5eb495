#include "output/RKTextTable.h"

#include <cinttypes>

#include "output/RKTextSettings.h"

RKTextTable::RKTextTable(int64_t summaryFormat, std::optional<std::string> swappedColumnName,
                         std::optional<std::string> wiredColumnName) {
    // The formatted form is at most seven characters; bytes and pages need more room.
    const bool compact = summaryFormat == RKSummaryFormatFormatted;
    widths_ = compact ? std::array<int, RKTextSizeColumnCount>{7, 11, 11, 13, 11}
                      : std::array<int, RKTextSizeColumnCount>{11, 14, 14, 14, 14};
    titles_ = {"Dirty", swappedColumnName.value_or(""), "Clean", "Reclaimable", wiredColumnName.value_or("")};
    if (!swappedColumnName) widths_[RKTextColumnSwapped] = 0;
    if (!wiredColumnName) widths_[RKTextColumnWired] = 0;
}

void RKTextTable::printColumns(FILE* output, const std::array<const char*, RKTextSizeColumnCount>& texts,
                               const char* regions, const char* category) const {
    for (size_t column = 0; column < RKTextSizeColumnCount; ++column) {
        std::fprintf(output, "%*s", widths_[column], widths_[column] ? texts[column] : "");
    }
    std::fprintf(output, " %10s    %s\n", regions, category);
}

void RKTextTable::printHeader(FILE* output) const {
    std::array<const char*, RKTextSizeColumnCount> texts{};
    for (size_t column = 0; column < RKTextSizeColumnCount; ++column) texts[column] = titles_[column].c_str();
    printColumns(output, texts, "Regions", "Category");
}

void RKTextTable::printRule(FILE* output) const {
    std::array<const char*, RKTextSizeColumnCount> texts{};
    texts.fill("---");
    printColumns(output, texts, "---", "---");
}

void RKTextTable::printRow(FILE* output, const RKTextRow& row) const {
    for (size_t column = 0; column < RKTextSizeColumnCount; ++column) {
        std::fprintf(output, "%*s", widths_[column], widths_[column] ? row.sizes[column].c_str() : "");
    }
    std::fprintf(output, " %10" PRId64 "    %s%s%s\n", row.regions, row.name.c_str(), row.detail.empty() ? "" : " ",
                 row.detail.c_str());
}

void RKTextTable::printSeparator(FILE* output, bool closesBlock) const {
    static constexpr char kTen[] = "==========";
    std::fputs(kTen, output);
    std::fputs(kTen, output);
    std::fputs(kTen, output);
    if (widths_[RKTextColumnSwapped]) std::fputs(kTen, output);
    std::fputs(kTen, output);
    std::fputs(kTen, output);
    if (widths_[RKTextColumnWired]) std::fputs(kTen, output);
    std::fputs(kTen, output);
    std::fputs(kTen, output);
    std::fputs(closesBlock ? "\n\n" : "\n", output);
}
