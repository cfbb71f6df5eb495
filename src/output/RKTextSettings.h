// The text report's settings as the command line gives them: the size format, the option bits
// and the sortable column names. The command line and the text formatter share them.
#pragma once

#include <array>
#include <cctype>
#include <cstdint>
#include <string>
#include <string_view>

enum RKSummaryFormat : int64_t {
    RKSummaryFormatBytes = 0,
    RKSummaryFormatFormatted = 1,
    RKSummaryFormatPages = 2,
};

enum RKTextOption : int64_t {
    RKTextOptionWired = 1,    // show the Wired column
    RKTextOptionSwapped = 2,  // show the Swapped column
    RKTextOptionWide = 4,     // full names, no path truncation
};

// The columns a report can be sorted by, in the order the usage and error messages list them.
// The first one is the default.
inline constexpr std::array<std::string_view, 7> RKTextSortColumns = {
    "Dirty", "Swapped", "Clean", "Reclaimable", "Wired", "Regions", "Category",
};

// A column's name as the command line shows it: in lower case.
inline std::string RKTextSortColumnArgument(std::string_view column) {
    std::string result(column);
    for (char& c : result) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return result;
}
