// Whole reports of hand-made measurements, made call by call as the analysis makes them, written
// by the text formatter (in several formats) and by the JSON formatter and compared with golden
// files; what the metrics log records of one; and the sort orders the reports cannot show. (That
// the metrics log holds every finished sample as JSON lines before it is closed, and that a JSON
// document larger than the writer's buffer parses, RKSamplingEndToEnd and RKAllProcesses show.)
#include <gtest/gtest.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <functional>
#include <limits>
#include <regex>
#include <string>
#include <tuple>

#include "model/RKAuxData.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "model/RKProcessGroup.h"
#include "model/RKTime.h"
#include "output/RKOutputFormatterJSON.h"
#include "output/RKOutputFormatterMetrilog.h"
#include "output/RKOutputFormatterText.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "support/RKRunCommand.h"

namespace {

// A process of no particular kind, whose errors and warnings a test sets directly.
struct TestProcess : RKProcess {
    using RKProcess::errors_;
    using RKProcess::warnings_;
};

std::shared_ptr<TestProcess> process(pid_t pid, const std::string& name, uint64_t pageSize = 4096) {
    auto made = std::make_shared<TestProcess>();
    made->setPid(pid);
    made->setName(name);
    made->setDisplayString(name + " [" + std::to_string(pid) + "]");
    made->setPageSize(pageSize);
    made->setIs64bit(true);
    return made;
}

std::shared_ptr<RKProcessGroup> group(const std::vector<std::shared_ptr<TestProcess>>& members) {
    RKProcessGroupMinimal made;
    for (const auto& member : members) made.addProcess(member);
    return made.immutableCopy();
}

std::shared_ptr<RKMemoryRegion> region(uint64_t id, const std::string& name, const std::string& detail, uint64_t start,
                                       uint64_t size, RKMemoryTotal sizes = {}) {
    auto made = std::make_shared<RKMemoryRegion>();
    made->object_id = id;
    made->name = name;
    made->detailedName = detail;
    made->start = start;
    made->size = size;
    made->dirtySize = sizes.dirty;
    made->swappedSize = sizes.swapped;
    made->cleanNonSpecSize = sizes.clean;
    made->reclaimableSize = sizes.reclaimable;
    made->wired = sizes.wired != 0;  // then wired whole
    return made;
}

struct Category {
    std::string name, detail;
    RKMemoryTotal sizes;
    bool verbose = false;
};

// Categories keyed by name, each named by a one-region object, with their totals set directly.
// Summary categories leave the detail out of their names.
RKCategoryMap categories(std::initializer_list<Category> list, bool summary = false) {
    RKCategoryMap map;
    for (const auto& [name, detail, sizes, verbose] : list) {
        auto named = region(0, name, detail, 0, 0);
        named->verbose = verbose;
        auto object = std::make_shared<RKMemoryObject>();
        object->addRegion(named, 4096);
        auto& made = map[name] = std::make_shared<RKMemoryCategory>(summary);
        made->setFirstMemoryObject(object);
        made->setTotalDirtySize(sizes.dirty);
        made->setTotalSwappedSize(sizes.swapped);
        made->setTotalCleanSize(sizes.clean);
        made->setTotalReclaimableSize(sizes.reclaimable);
        made->setTotalWiredSize(sizes.wired);
        made->setTotalRegions(static_cast<int32_t>(sizes.regions));
    }
    return map;
}

RKMemoryTotal totalOf(const RKCategoryMap& map) {
    RKMemoryTotal t;
    for (const auto& [key, c] : map) {
        t = {t.dirty + c->totalDirtySize(), t.swapped + c->totalSwappedSize(), t.clean + c->totalCleanSize(),
             t.reclaimable + c->totalReclaimableSize(), t.wired + c->totalWiredSize(),
             t.regions + static_cast<uint32_t>(c->totalRegions())};
    }
    return t;
}

std::shared_ptr<RKAuxDataMap> aux(std::initializer_list<std::pair<const std::string, RKAuxNode>> entries) {
    return std::make_shared<RKAuxDataMap>(RKAuxDataMap::Entries(entries));
}

RKAuxNode leaf(int64_t value) { return std::make_shared<RKAuxData>(value, true); }

// The wall clock reads 2026-11-16T12:08:27Z plus `seconds`; the kernel clocks read `seconds`, the
// continuous one running one second ahead.
RKTime timeAt(uint64_t seconds, int64_t nanoseconds = 0) {
    const int64_t wall = 1794830907 + static_cast<int64_t>(seconds);
    return RKTime::fromReadings({seconds * 1000000000, (seconds + 1) * 1000000000, wall, nanoseconds});
}

// ---- The calls of a report, as the analysis makes them ----

void header(RKOutputFormatter& out, const RKProcess& reported, uint64_t memspread) {
    out.printProcessHeader(reported);
    if (reported.errors().empty()) out.printProcessTotal(memspread, reported);
    out.endProcessHeader(reported);
}

void own(RKOutputFormatter& out, const RKCategoryMap& map) { out.printProcessCategories(map, totalOf(map)); }

void shared(RKOutputFormatter& out, const RKCategoryMap& map, const RKProcessGroup& sharers, const RKProcess& reported,
            bool hasProcessView) {
    out.printSharedCategories(map, sharers, reported, hasProcessView, totalOf(map));
}

// The end of a report, from the lists of processes with warnings and with errors on; errors of
// either kind make the summary "may be invalid".
void summary(RKOutputFormatter& out, const RKCategoryMap& map, const std::shared_ptr<RKAuxDataMap>& globalAux,
             uint64_t endSecond, const RKProcessList& warned = {}, const RKProcessList& failed = {},
             const std::vector<std::string>& globalErrors = {}) {
    out.printProcessesWithWarnings(warned, failed, globalErrors);
    out.printSummaryCategories(map, totalOf(map), !failed.empty() || !globalErrors.empty());
    out.printGlobalAuxData(globalAux);
    out.endAtTime(timeAt(endSecond));
}

// A report without processes: the summary over nothing.
void reportNothing(RKOutputFormatter& out, uint64_t second) {
    out.startAtTime(timeAt(second));
    summary(out, {}, nullptr, second + 1);
}

// Three samples, each a complete report. The first: a process with warnings and memory of its
// own, one sharing memory with it (the same seen from either: one shared record), one with
// errors; global errors and aux data. The second: no process. The third: the sharing process
// alone, whose group is recorded again.
void reportSamples(RKOutputFormatter& out) {
    auto alpha = process(310, "alpha", 16384);
    alpha->warnings_ = {"alpha [310]: region walk\rstopped early", "alpha [310]: ledger unreadable"};
    auto beta = process(42, "beta");
    beta->setIs64bit(false);
    beta->setIsTranslated(true);
    auto gamma = process(7, "gamma");
    gamma->errors_ = {"gamma [7]: task_for_pid failed"};
    auto both = group({alpha, beta});
    const RKMemoryTotal sharedSizes{.dirty = 1048576, .clean = 4096, .wired = 8192, .regions = 2};
    const RKCategoryMap sharedMemory = categories({{"shared memory", "/dev/shm/pool", sharedSizes}});
    const RKMemoryTotal mallocSizes{.dirty = 1048576, .swapped = 65536, .reclaimable = 32768, .regions = 3};
    const RKCategoryMap everything = categories(
        {{"MALLOC_SMALL", "not in summaries", mallocSizes}, {"shared memory", "/dev/shm/pool", sharedSizes}}, true);
    out.configureForMultipleOutputs();
    out.startAtTime(timeAt(10, 123999999));
    header(out, *alpha, 2162688);
    own(out, categories({{"MALLOC_SMALL", "", {.dirty = 1048576, .swapped = 65536, .regions = 3}},
                         {"__TEXT", "/usr/bin/alpha", {.clean = 81920, .regions = 1}},
                         // Level with __TEXT in dirty and reclaimable sizes: the clean size decides.
                         {"DATA", "", {.clean = 4096, .regions = 1}},
                         {"reserved", "", {.regions = 1}, true}}));
    shared(out, sharedMemory, *both, *alpha, false);
    out.printProcessAuxData(aux({{"memspread", leaf(-2162688)}, {"kernel", aux({{"page_table", leaf(16384)}})}}));
    header(out, *beta, 1048576);
    shared(out, sharedMemory, *both, *beta, false);
    out.printProcessAuxData(nullptr);
    header(out, *gamma, 0);
    own(out, {});
    out.printProcessAuxData(nullptr);
    // All bits set: as pages, the count is taken as unsigned and must not wrap while rounding up.
    summary(out, everything, aux({{"memspread", leaf(2162688)}, {"all ones", leaf(-1)}}), 11, {alpha}, {gamma},
            {"Unable to read kernel zones"});
    reportNothing(out, 20);
    out.startAtTime(timeAt(30));
    header(out, *beta, 1048576);
    shared(out, sharedMemory, *both, *beta, false);
    out.printProcessAuxData(nullptr);
    summary(out, everything, nullptr, 31);
}

// Verbose output in VM-object-dirty mode: region listings (mapped, unmapped, at address 0, of one
// byte, none at all), control characters and broken UTF-8 in names, paths that end in "/", and a
// group seen through a view specific to each of its processes (one shared record per view).
void reportViews(RKOutputFormatter& out) {
    auto odd = process(501, "d\"q\\b\x1b" "esc", 16384);
    auto mapped = region(0x8000000000000001ull, "MALLOC_TINY", "", 0x7f0000000000, 1048576,
                         {.dirty = 8192, .swapped = 4096, .clean = 12288, .reclaimable = 16384, .wired = 1});
    mapped->offset = 4096;
    // Printable UTF-8 up to U+10FFFF and the no-break space; then a line end, DEL, a C1 control,
    // a stray byte, a lone continuation byte, an overlong form, a surrogate, a code point above
    // U+10FFFF, a sequence broken by an ASCII byte and one cut short by the end.
    const std::string broken = "/usr/lib/caf\xc3\xa9 \xe2\x82\xac\xf0\x9f\x98\x80\xf4\x8f\xbf\xbf\xc2\xa0|\n"
                               "\x7f\xc2\x9b\xff\x80\xc0\xaf\xed\xa0\x80\xf4\x90\x80\x80\xe2\x82x\xe6\x97";
    odd->setMemoryRegions(RKRegionList{
        mapped, region(0xABCDE12345678, "owned unmapped memory", "(purgeable)", RKRegionNoAddress, 65536),
        region(0, "__PAGEZERO", "", 0, 4096), region(12, "mapped file", broken, 0x1000, 1, {.clean = 1}),
        region(13, "mapped file", "/var/db/cache/", 0x2000, 4096), region(14, "mapped file", "/", 0x3000, 4096)});
    auto empty = process(600, "empty");
    auto both = group({empty, odd});

    out.startAtTime(timeAt(1, 123999999));
    out.printSpanlistLikeOutputForProcess(*odd, *odd->memoryRegions());
    out.printSpanlistLikeOutputForProcess(*empty, {});
    header(out, *odd, 16384);
    own(out, categories({{"MALLOC_TINY", "", {8192, 4096, 12288, 16384, 1048576, 1}},
                         {"reserved", "", {.regions = 1}, true}}));
    shared(out, categories({{"shared memory", "", {.dirty = 4096, .regions = 1}}}), *both, *odd, true);
    // Sizes at the edges of the formatted form: 9999 KB and 600 bytes would round to 10000 KB and
    // take the next unit instead; the most negative count is seven characters too.
    const auto edges = aux({{"a", leaf(9999)}, {"b", leaf(10000)}, {"c", leaf(-5000)}, {"d", leaf(9999 * 1024 + 600)},
                            {"e", leaf(std::numeric_limits<int64_t>::min())}});
    out.printProcessAuxData(aux({{"memspread", leaf(16384)}, {"bell\a", leaf(-5)}, {"edges", edges}}));
    header(out, *empty, 0);
    shared(out, categories({{"shared memory", "", {.clean = 4096, .regions = 1}}}), *both, *empty, true);
    out.printProcessAuxData(nullptr);
    summary(out, {}, nullptr, 2);
}

// Up to twenty sharers are named, the reported process left out; more are counted. No process
// header came first, so no page size is known and sizes are 0 pages.
void reportCrowd(RKOutputFormatter& out) {
    std::vector<std::shared_ptr<TestProcess>> members;
    for (pid_t pid = 1; pid <= 21; ++pid) members.push_back(process(pid, "p" + std::to_string(pid)));
    const RKCategoryMap sharedMemory = categories({{"shared memory", "", {.dirty = 4096, .regions = 1}}});
    shared(out, sharedMemory, *group({members.begin(), members.end() - 1}), *members[0], false);
    shared(out, sharedMemory, *group(members), *members[0], false);
}

// ---- Writing reports ----

using Report = std::function<void(RKOutputFormatter&)>;

constexpr int64_t kJson = -1;

// What the formatter for `format` (a text size format, or kJson) writes for the report. A JSON
// document must also parse (Python's json module).
std::string written(const Report& report, int64_t format, int64_t options = 0, const char* sort = "Dirty") {
    const std::string path = testing::TempDir() + "rkoutput-" + std::to_string(getpid());
    if (format == kJson) {
        auto json = RKOutputFormatterJSON::initWithPath(path);
        if (!json) return "unable to write " + path;
        report(*json);
        json->close();
        EXPECT_EQ(std::system(("python3 -m json.tool " + path + " >/dev/null").c_str()), 0) << "not valid JSON";
    } else {
        FILE* file = std::fopen(path.c_str(), "w");
        RKOutputFormatterText text(format, options, sort, file);
        report(text);
        std::fclose(file);
    }
    std::string text = RKFileText(path);
    std::remove(path.c_str());
    return text;
}

}  // namespace

// Dates are local, written with the offset of the zone (POSIX zone strings, which need no zone
// files: NST3:30 is 3 h 30 min west of Greenwich, IST-5:30 as much east), "Z" when there is none, and milliseconds
// truncated. TZ stays as the last row set it: no other test here writes dates. JSON golden files
// are indented; the document itself is one line.
TEST(RKOutputReport, MatchesGoldenFiles) {
    const int64_t wide = RKTextOptionWide | RKTextOptionSwapped | RKTextOptionWired;
    const std::tuple<const char*, Report, bool, const char*, int64_t, int64_t> reports[] = {
        {"json-samples.json", reportSamples, true, "NST3:30", kJson, 0},
        {"text-samples-bytes-swapped.txt", reportSamples, true, "NST3:30", RKSummaryFormatBytes, RKTextOptionSwapped},
        {"text-samples-pages-wired.txt", reportSamples, true, "IST-5:30", RKSummaryFormatPages, RKTextOptionWired},
        {"text-samples.txt", reportSamples, true, "UTC0", RKSummaryFormatFormatted, 0},
        {"json-views.json", reportViews, false, "UTC0", kJson, 0},
        {"text-views.txt", reportViews, false, "UTC0", RKSummaryFormatFormatted, 0},
        {"text-views-wide.txt", reportViews, false, "UTC0", RKSummaryFormatFormatted, wide},
        {"json-nothing.json", [](RKOutputFormatter& out) { reportNothing(out, 0); }, true, "IST-5:30", kJson, 0},
        {"text-crowd.txt", reportCrowd, true, "UTC0", RKSummaryFormatPages, 0},
    };
    for (const auto& [name, report, breakDown, zone, format, options] : reports) {
        SCOPED_TRACE(name);
        setenv("TZ", zone, 1);
        tzset();
        auto platform = std::make_shared<RKScriptedPlatform>();
        platform->selfRegionValue = breakDown ? 1 : 0;  // the owned-memory breakdown; off in VM-object-dirty mode
        platform->pageSize = 65536;
        RKScopedPlatform scope(platform);
        RKAnalysisSettings::resetCache();
        std::string golden = RKFileText(std::string(MEMSPREAD_TEST_DATA) + "/golden/" + name);
        if (format == kJson) golden = std::regex_replace(golden, std::regex("\n *"), "");
        EXPECT_EQ(written(report, format, options), golden);
    }
}

// Every column gives a different order, "Dirty" breaking a tie on the reclaimable size; the
// names are matched without regard to case.
TEST(RKOutputReport, EverySortColumnOrdersTheRows) {
    const RKCategoryMap rows = categories({
        {"a", "", {.dirty = 100, .clean = 1, .reclaimable = 4, .wired = 3, .regions = 4}},
        {"B", "", {.dirty = 10, .swapped = 50, .clean = 4, .reclaimable = 5, .wired = 1, .regions = 2}},
        {"c", "", {.swapped = 100, .clean = 2, .reclaimable = 3, .wired = 4, .regions = 1}},
        {"D", "", {.dirty = 50, .swapped = 10, .clean = 3, .reclaimable = 2, .wired = 2, .regions = 3}},
    });
    const std::pair<const char*, const char*> cases[] = {
        {"Dirty", "acBD"}, {"swapped", "cBDa"}, {"Clean", "BDca"}, {"RECLAIMABLE", "BacD"},
        {"Wired", "caDB"}, {"Regions", "aDBc"}, {"Category", "BDac"}};
    for (const auto& [sort, expected] : cases) {
        const std::string text =
            written([&](RKOutputFormatter& out) { own(out, rows); }, RKSummaryFormatBytes, 0, sort);
        EXPECT_EQ(std::regex_replace(text, std::regex(".* ([aBcD])\n|.*\n"), "$1"), expected) << sort;
    }
}

// A process whose own and shared memory both hold "heap /h" records it once, summed; shared
// memory before any own memory is not recorded; a process with errors records its aux data under
// its own name; a summary without aux data records one "aux_data" of 0; 2.5 ms are 2 ms.
TEST(RKMetricsLog, RecordsProcessGroupsAndTheSummaryGroupOfAReport) {
    auto platform = std::make_shared<RKScriptedPlatform>();  // wall clock at 0
    platform->selfRegionValue = 1;
    RKScopedPlatform scope(platform);
    RKAnalysisSettings::resetCache();
    const std::string path = testing::TempDir() + "rkmetrilog-" + std::to_string(getpid()) + ".mlj";
    auto log = RKOutputFormatterMetrilog::initWithPath(path);
    ASSERT_TRUE(log) << path;
    auto continuousAt = [](uint64_t nanoseconds) { return RKTime::fromReadings({0, nanoseconds, 978307200, 0}); };
    auto alpha = process(10, "alpha"), beta = process(20, "beta"), failed = process(30, "failed");
    failed->errors_ = {"failed [30]: task_for_pid failed"};
    auto both = group({alpha, beta});
    const RKCategoryMap sharedHeap = categories({{"heap", "/h", {.dirty = 2000}}});

    log->startAtTime(continuousAt(1000000000));
    log->printProcessHeader(*alpha);
    log->printProcessTotal(4000, *alpha);
    log->printProcessCategories(categories({{"heap", "/h", {.dirty = 1000, .swapped = 24}}, {"stack", "", {.dirty = 976}}}), {});
    log->printSharedCategories(sharedHeap, *both, *alpha, false, {});
    log->printProcessAuxData(aux({{"kernel", aux({{"page_table", std::make_shared<RKAuxData>(-8, false)}})},
                                  {"phys", std::make_shared<RKAuxData>(7, true)}}));
    log->printProcessHeader(*beta);
    log->printProcessTotal(2000, *beta);
    log->printSharedCategories(sharedHeap, *both, *beta, false, {});
    log->printProcessAuxData(nullptr);
    log->printProcessHeader(*failed);
    log->printProcessCategories({}, {});
    log->printProcessAuxData(nullptr);
    log->printProcessesWithWarnings({}, {failed}, {});
    log->printSummaryCategories(categories({{"heap", "", {.dirty = 3000, .swapped = 24}}, {"stack", "", {.dirty = 976}}}),
                                {.dirty = 3976, .swapped = 24}, true);
    log->printGlobalAuxData(nullptr);
    log->endAtTime(continuousAt(1002500000));
    log->close();

    auto line = [](int group, const std::string& metric, const std::string& value, const std::string& process,
                   const std::string& rest = R"("labels":{},"tags":[])", const std::string& unit = "B") {
        std::string variables = process.empty() ? "{}" : R"({"process":")" + process + R"("})";
        return R"({"group":)" + std::to_string(group) + R"(,"time":0,"metric":")" + metric + R"(","unit":")" + unit +
               R"(","value":)" + value + R"(,"variables":)" + variables + "," + rest + "}\n";
    };
    const std::string context = R"("labels":{},"tags":["context"])", summary = R"("labels":{},"tags":["summary"])";
    EXPECT_EQ(RKFileText(path),
              R"({"log":"memspread.phys_memspread","format":1,"description":"Memory measurements gathered by the )"
              R"(memspread(1) tool","primary_metric":"total_memory,process=ALL_PROCESSES"})" "\n" +
                  line(1, "total_memory", "4000", "alpha", R"("labels":{"pid":"10"},"tags":["summary"])") +
                  line(1, "heap /h", "3024", "alpha") + line(1, "stack", "976", "alpha") +
                  line(1, "aux_data.kernel.page_table", "-8", "alpha", context) +
                  line(1, "aux_data.phys", "7", "alpha", context) +
                  line(2, "total_memory", "2000", "beta", R"("labels":{"pid":"20"},"tags":["summary"])") +
                  line(2, "aux_data", "0", "beta", context) + line(3, "aux_data", "0", "failed", context) +
                  line(4, "total_memory", "4000", "ALL_PROCESSES", summary) +
                  line(4, "heap", "3024", "ALL_PROCESSES") + line(4, "stack", "976", "ALL_PROCESSES") +
                  line(4, "aux_data", "0", "ALL_PROCESSES", context) +
                  line(4, "gather_duration", "2", "", context, "ms"));
    std::remove(path.c_str());
}
