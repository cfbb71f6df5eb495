// The order of category rows in the text report, by one of the sortable columns.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "model/RKCategoryMap.h"

class RKMemoryCategory;

// In the order of RKTextSortColumns: a column's value is its index there.
enum class RKTextSortColumn {
    Dirty,
    Swapped,
    Clean,
    Reclaimable,
    Wired,
    Regions,
    Category,
};

// The column named `name` (any case), or nothing for a name that is not a column.
std::optional<RKTextSortColumn> RKTextSortColumnNamed(std::string_view name);

// A category and its key, pointing into the map it came from.
struct RKTextSortedCategory {
    const std::string* key;
    const RKMemoryCategory* category;
};

// The entries of `categories`, largest first by `column` (dirty + swapped for Dirty, ties broken
// by reclaimable, then clean), or ascending by key for Category. Rows that tie keep key order.
// Valid while the map is unchanged.
std::vector<RKTextSortedCategory> RKTextSortedCategories(const RKCategoryMap& categories, RKTextSortColumn column);
