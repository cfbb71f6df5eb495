#include "support/RKReportRows.h"

#include <algorithm>
#include <regex>

#include "support/RKRunCommand.h"

std::map<std::string, uint64_t> RKColumnByCategory(const std::string& report, const std::string& heading,
                                                   size_t from) {
    static const std::regex row(R"(^ *(\d+) B +\d+ B +\d+ B +\d+    (.+)$)");
    std::map<std::string, uint64_t> rows;
    for (const std::string& line : RKSplitLines(report.substr(std::min(report.find(heading, from), report.size())))) {
        std::smatch match;
        if (!rows.count("TOTAL") && std::regex_match(line, match, row)) rows[match[2]] = std::stoull(match[1]);
    }
    return rows;
}
