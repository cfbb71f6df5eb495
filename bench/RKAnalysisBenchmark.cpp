// One analysis and report over a synthetic system: many processes that each map private memory,
// shared libraries and a few shared memory segments. The cost must grow linearly with the number
// of regions, in both accounting modes.
#include <benchmark/benchmark.h>

#include "analysis/RKMemspread.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"

namespace {

constexpr uint64_t kPage = 4096;
constexpr int kRegionsPerProcess = 300;
constexpr int kLibraries = 200;
constexpr int kSegments = 8;

// A formatter that only looks at what it is given.
class CountingFormatter : public RKOutputFormatter {
public:
    size_t rows = 0;
    const char* className() const override { return "CountingFormatter"; }
    void printProcessHeader(const RKProcess&) override {}
    void endProcessHeader(const RKProcess&) override {}
    void printProcessTotal(uint64_t, const RKProcess&) override {}
    void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal&) override {
        rows += categories.size();
    }
    void printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup&, const RKProcess&, bool,
                               const RKMemoryTotal&) override {
        rows += categories.size();
    }
    void printProcessAuxData(const std::shared_ptr<RKAuxDataMap>&) override {}
    void printProcessesWithWarnings(const RKProcessList&, const RKProcessList&,
                                    const std::vector<std::string>&) override {}
    void printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal&, bool) override {
        rows += categories.size();
    }
    void printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>&) override {}
    void endAtTime(const RKTime&) override {}
};

std::shared_ptr<RKMemoryRegion> mapping(uint64_t objectId, uint64_t start, uint64_t dirtyPages, uint8_t shareMode,
                                        std::string name) {
    auto region = std::make_shared<RKMemoryRegion>();
    region->object_id = objectId;
    region->start = start;
    region->size = 4 * kPage;
    region->dirtySize = dirtyPages * kPage;
    region->cleanNonSpecSize = region->size - region->dirtySize;
    region->share_mode = shareMode;
    region->segment = RKSegmentNoImage;
    region->name = std::move(name);
    return region;
}

// Private memory in adjacent mappings, keyed the way the Linux walk keys it (pid and page);
// every library and segment shared by all processes.
RKProcessList system(int processCount) {
    RKProcessList processes;
    for (int p = 0; p < processCount; p++) {
        pid_t pid = 100 + p;
        RKRegionList regions;
        for (int r = 0; r < kRegionsPerProcess; r++) {
            uint64_t start = 0x7f0000000000ull + static_cast<uint64_t>(r) * 4 * kPage;
            if (r % 3 == 0) {
                uint64_t privateId = 1ull << 62 | static_cast<uint64_t>(pid) << 40 | start / kPage;
                regions.push_back(mapping(privateId, start, 2, SM_PRIVATE, "anonymous"));
            } else if (r % 3 == 1) {
                uint64_t library = (1ull << 63) | static_cast<uint64_t>(r % kLibraries) << 20;
                regions.push_back(mapping(library, start, 0, SM_COW, "mapped file"));
            } else {
                uint64_t segment = (1ull << 63) | 0xABC000 | static_cast<uint64_t>(r % kSegments);
                regions.push_back(mapping(segment, start, static_cast<uint64_t>(p % 3), SM_SHARED, "memfd"));
            }
        }
        auto process = std::make_shared<RKProcess>();
        process->setPid(pid);
        process->setPageSize(kPage);
        process->setMemoryRegions(std::move(regions));
        processes.push_back(process);
    }
    return processes;
}

void analyzeAndReport(benchmark::State& state, bool breakDown) {
    RKScopedPlatform scope(std::make_shared<RKScriptedPlatform>());
    RKMemspread::setBreakDownPhysMemspread(breakDown);
    const int processCount = static_cast<int>(state.range(0));
    for (auto _ : state) {
        state.PauseTiming();
        auto memspread = std::make_unique<RKMemspread>(system(processCount));
        auto formatter = std::make_shared<CountingFormatter>();
        memspread->addOutputFormatter(formatter);
        state.ResumeTiming();
        memspread->analyzeData();
        memspread->printOutputVerbose(false, false);
        benchmark::DoNotOptimize(formatter->rows);
        state.PauseTiming();  // freeing the processes is not analyzing them
        memspread.reset();
        state.ResumeTiming();
    }
    state.SetItemsProcessed(state.iterations() * state.range(0) * kRegionsPerProcess);
}

void BM_AnalysisBreakdown(benchmark::State& state) { analyzeAndReport(state, true); }
void BM_AnalysisObjectView(benchmark::State& state) { analyzeAndReport(state, false); }

}  // namespace

BENCHMARK(BM_AnalysisBreakdown)->Arg(100)->Arg(1000)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_AnalysisObjectView)->Arg(100)->Arg(1000)->Unit(benchmark::kMillisecond);
