// Stable sort of records by an unsigned 64-bit key, least significant digit first, in as many
// passes of 11 bits as the largest key needs: a process's page records (tens of thousands,
// keyed by frame number) sort in two or three linear passes where a comparison sort needed a
// log of their number.
#pragma once

#include <algorithm>
#include <array>
#include <cstdint>
#include <span>
#include <utility>
#include <vector>

template <class Record, class Key>
void RKRadixSortByKey(std::span<Record> records, Key key) {
    constexpr unsigned kDigitBits = 11;
    constexpr size_t kBuckets = size_t{1} << kDigitBits;
    if (records.size() < 2) return;
    uint64_t largest = 0;
    for (const Record& record : records) largest = std::max<uint64_t>(largest, key(record));
    std::vector<Record> buffer(records.size());
    std::span<Record> from = records, to = buffer;
    for (unsigned shift = 0; shift < 64 && (largest >> shift) != 0; shift += kDigitBits) {
        std::array<size_t, kBuckets> start{};
        for (const Record& record : from) start[(key(record) >> shift) & (kBuckets - 1)]++;
        size_t sum = 0;
        for (size_t& count : start) sum += std::exchange(count, sum);
        for (const Record& record : from) to[start[(key(record) >> shift) & (kBuckets - 1)]++] = record;
        std::swap(from, to);
    }
    if (from.data() != records.data()) std::copy(from.begin(), from.end(), records.begin());
}
