// Reading numbers back from a text report in bytes (-f bytes).
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

// The Dirty column by category of the first table after the first `heading` at or after `from`,
// up to and including its TOTAL row.
std::map<std::string, uint64_t> RKColumnByCategory(const std::string& report, const std::string& heading,
                                                   size_t from = 0);
