#include "output/RKTextCategorySort.h"

#include <algorithm>
#include <cstddef>
#include <strings.h>
#include <tuple>

#include "model/RKMemoryCategory.h"
#include "output/RKTextSettings.h"

std::optional<RKTextSortColumn> RKTextSortColumnNamed(std::string_view name) {
    for (size_t index = 0; index < RKTextSortColumns.size(); ++index) {
        const std::string_view column = RKTextSortColumns[index];
        if (column.size() == name.size() && strncasecmp(column.data(), name.data(), name.size()) == 0) {
            return static_cast<RKTextSortColumn>(index);
        }
    }
    return std::nullopt;
}

namespace {

// Larger sorts first; a tuple compares its members in order.
auto sortValue(const RKMemoryCategory& category, RKTextSortColumn column) {
    using Value = std::tuple<uint64_t, uint64_t, uint64_t>;
    switch (column) {
    case RKTextSortColumn::Dirty:
        return Value{category.totalDirtySize() + category.totalSwappedSize(), category.totalReclaimableSize(),
                     category.totalCleanSize()};
    case RKTextSortColumn::Swapped:
        return Value{category.totalSwappedSize(), 0, 0};
    case RKTextSortColumn::Clean:
        return Value{category.totalCleanSize(), 0, 0};
    case RKTextSortColumn::Reclaimable:
        return Value{category.totalReclaimableSize(), 0, 0};
    case RKTextSortColumn::Wired:
        return Value{category.totalWiredSize(), 0, 0};
    case RKTextSortColumn::Regions:
        // The count is signed: a negative one (never made by the analysis) sorts last.
        return Value{static_cast<uint64_t>(static_cast<int64_t>(category.totalRegions())) ^ (uint64_t{1} << 63), 0, 0};
    case RKTextSortColumn::Category:
        break;
    }
    return Value{0, 0, 0};
}

}  // namespace

std::vector<RKTextSortedCategory> RKTextSortedCategories(const RKCategoryMap& categories, RKTextSortColumn column) {
    // The map iterates in ascending key order (bytes compared as unsigned), which is the Category
    // order and the order in which ties stay.
    std::vector<RKTextSortedCategory> entries;
    entries.reserve(categories.size());
    for (const auto& [key, category] : categories) {
        if (category) entries.push_back({&key, category.get()});
    }
    if (column != RKTextSortColumn::Category) {
        std::stable_sort(entries.begin(), entries.end(),
                         [column](const RKTextSortedCategory& a, const RKTextSortedCategory& b) {
                             return sortValue(*a.category, column) > sortValue(*b.category, column);
                         });
    }
    return entries;
}
