// Building a range list of many disjoint pieces: the cost must grow as n log n in either order
// of insertion, never quadratically.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <numeric>
#include <random>
#include <vector>

#include "model/RKRangeList.h"

namespace {

constexpr uint64_t kPage = 4096;

// Piece i covers one page at offset 2i pages, so no two pieces touch.
std::vector<uint64_t> pieceIndexes(int64_t count, bool shuffled) {
    std::vector<uint64_t> indexes(static_cast<size_t>(count));
    std::iota(indexes.begin(), indexes.end(), 0);
    if (shuffled) std::shuffle(indexes.begin(), indexes.end(), std::mt19937_64(1));
    return indexes;
}

void buildList(benchmark::State& state, bool shuffled) {
    std::vector<uint64_t> indexes = pieceIndexes(state.range(0), shuffled);
    const RKMemoryTotal sizes{.dirty = kPage};
    for (auto _ : state) {
        RKRangeList list;
        for (uint64_t i : indexes) list.addRange(i * 2 * kPage, kPage, kPage, sizes);
        benchmark::DoNotOptimize(list.nodeCount());
        state.PauseTiming();  // freeing the nodes is not building them
        { RKRangeList discard = std::move(list); }
        state.ResumeTiming();
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
}

void BM_RangeListAscending(benchmark::State& state) { buildList(state, false); }
void BM_RangeListRandomOrder(benchmark::State& state) { buildList(state, true); }

// Every region of an object merging into one node: the common case of many mappings of one file.
void BM_RangeListOverlappingMappings(benchmark::State& state) {
    const RKMemoryTotal sizes{.clean = 16 * kPage};
    for (auto _ : state) {
        RKRangeList list;
        for (int64_t i = 0; i < state.range(0); ++i) list.addRange(0, 16 * kPage, kPage, sizes);
        benchmark::DoNotOptimize(list.sum());
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
}

}  // namespace

BENCHMARK(BM_RangeListAscending)->Arg(1000)->Arg(1000000)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_RangeListRandomOrder)->Arg(1000)->Arg(1000000)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_RangeListOverlappingMappings)->Arg(100000)->Unit(benchmark::kMillisecond);
