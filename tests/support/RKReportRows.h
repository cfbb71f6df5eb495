// Reading numbers back from a text report in bytes (-f bytes).
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

// A column (0 Dirty, 1 Clean, 2 Reclaimable) by category of the first table after the first
// `heading` at or after `from`, up to and including its TOTAL row.
std::map<std::string, uint64_t> RKColumnByCategory(const std::string& report, const std::string& heading,
                                                   size_t from = 0, int column = 0);
