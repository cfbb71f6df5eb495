// Enumerates a sequence in runs of consecutive items, so that a long walk can release what it
// made every few hundred items instead of at the end.
#pragma once

#include <algorithm>
#include <cstddef>
#include <span>

// Calls block(first, count) on consecutive slices of at most `batchSize` items until `items`
// is used up; a batch size of 0 counts as 1. The items must not change during the walk.
template <class T, class Block>
void rk_enumerateObjectsWithBatchSize(std::span<T> items, size_t batchSize, Block&& block) {
    const size_t batch = std::max<size_t>(batchSize, 1);
    for (size_t offset = 0; offset < items.size(); offset += batch) {
        block(items.data() + offset, std::min(batch, items.size() - offset));
    }
}
