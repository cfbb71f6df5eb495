// The JSON document, driven call by call as the analysis drives a report, compared with golden
// documents and checked by a real JSON parser. Golden files are written readable: each line's
// leading blanks and every line end are removed before comparing, which leaves the one-line
// document (no golden line breaks inside a string).
#include <gtest/gtest.h>
#include <time.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <optional>
#include <sstream>
#include <string>

#include "model/RKAuxData.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "model/RKProcessGroup.h"
#include "model/RKTime.h"
#include "output/RKJsonDateFormatter.h"
#include "output/RKOutputFormatterJSON.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"

namespace fs = std::filesystem;

namespace {

// TZ for one test (a POSIX zone string, which needs no zone files), then the previous zone.
class ScopedTimeZone {
public:
    explicit ScopedTimeZone(const char* zone) {
        if (const char* previous = std::getenv("TZ")) previous_ = previous;
        setenv("TZ", zone, 1);
        tzset();
    }
    ~ScopedTimeZone() {
        previous_ ? setenv("TZ", previous_->c_str(), 1) : unsetenv("TZ");
        tzset();
    }

private:
    std::optional<std::string> previous_;
};

class JsonTestProcess : public RKProcess {
public:
    void addError(const std::string& text) { errors_.push_back(text); }
    void addWarning(const std::string& text) { warnings_.push_back(text); }
};

std::shared_ptr<JsonTestProcess> makeProcess(pid_t pid, const std::string& name, uint64_t pageSize) {
    auto process = std::make_shared<JsonTestProcess>();
    process->setPid(pid);
    process->setName(name);
    process->setPageSize(pageSize);
    return process;
}

// A category named by one region (name and detail) with the given totals.
std::shared_ptr<RKMemoryCategory> makeCategory(const std::string& name, const std::string& detail, RKMemoryTotal sizes,
                                               bool summary = false, bool verbose = false) {
    auto region = std::make_shared<RKMemoryRegion>();
    region->name = name;
    region->detailedName = detail;
    region->verbose = verbose;
    auto object = std::make_shared<RKMemoryObject>();
    object->addRegion(region, 4096);
    auto category = std::make_shared<RKMemoryCategory>(summary);
    category->setFirstMemoryObject(object);
    category->setTotalDirtySize(sizes.dirty);
    category->setTotalSwappedSize(sizes.swapped);
    category->setTotalCleanSize(sizes.clean);
    category->setTotalReclaimableSize(sizes.reclaimable);
    category->setTotalWiredSize(sizes.wired);
    category->setTotalRegions(static_cast<int32_t>(sizes.regions));
    return category;
}

std::shared_ptr<RKMemoryRegion> makeRegion(uint64_t id, const std::string& name, const std::string& detail,
                                           uint64_t start, uint64_t size) {
    auto region = std::make_shared<RKMemoryRegion>();
    region->object_id = id;
    region->name = name;
    region->detailedName = detail;
    region->start = start;
    region->size = size;
    return region;
}

std::shared_ptr<RKProcessGroup> makeGroup(std::initializer_list<std::shared_ptr<RKProcess>> members) {
    RKProcessGroupMinimal group;
    for (const auto& member : members) group.addProcess(member);
    return group.immutableCopy();
}

// With the scripted timebase of 125/3, `seconds` x 24,000,000 ticks are `seconds` x 1e9 ns; the
// continuous clock runs one second ahead. The wall clock is 2026-11-16T12:08:27Z plus `seconds`.
RKTime timeAt(uint64_t seconds, int64_t nanoseconds = 0) {
    RKClockReadings readings;
    readings.absolute = seconds * 24000000;
    readings.continuous = (seconds + 1) * 24000000;
    readings.wallSeconds = 1794830907 + static_cast<int64_t>(seconds);
    readings.wallNanoseconds = nanoseconds;
    return RKTime::fromReadings(readings);
}

std::shared_ptr<RKAuxDataMap> auxMap(std::initializer_list<std::pair<const std::string, RKAuxNode>> entries) {
    return std::make_shared<RKAuxDataMap>(RKAuxDataMap::Entries(entries));
}

RKAuxNode leaf(int64_t value) { return std::make_shared<RKAuxData>(value, true); }

std::string golden(const std::string& name) {
    std::ifstream file(std::string(MEMSPREAD_TEST_DATA) + "/golden/json-" + name + ".json");
    EXPECT_TRUE(file) << name;
    std::string joined, line;
    while (std::getline(file, line)) joined += line.substr(std::min(line.find_first_not_of(' '), line.size()));
    return joined;
}

// Parses with Python's json module, refusing duplicate keys within one object.
const char* kStrictParse =
    "python3 -c 'import json,sys\n"
    "def pairs(p):\n"
    "    keys=[k for k,_ in p]\n"
    "    assert len(keys)==len(set(keys)), keys\n"
    "    return dict(p)\n"
    "json.load(open(sys.argv[1],encoding=\"utf-8\"),object_pairs_hook=pairs)' ";

class RKOutputFormatterJSONTest : public testing::Test {
protected:
    RKOutputFormatterJSONTest() : zone_("UTC0"), platform_(std::make_shared<RKScriptedPlatform>()), scope_(platform_) {
        platform_->base = {125, 3};
        platform_->selfRegionValue = 1;  // owned-memory breakdown on
    }
    void SetUp() override {
        RKAnalysisSettings::resetCache();
        RKTime::resetTimebase();
        std::string pattern = (fs::temp_directory_path() / "rkjson-XXXXXX").string();
        ASSERT_NE(mkdtemp(pattern.data()), nullptr);
        directory_ = pattern;
    }
    void TearDown() override {
        RKAnalysisSettings::resetCache();
        RKTime::resetTimebase();
        fs::remove_all(directory_);
    }

    std::shared_ptr<RKOutputFormatterJSON> open() {
        auto json = RKOutputFormatterJSON::initWithPath((directory_ / "out.json").string());
        EXPECT_NE(json, nullptr);
        return json;
    }

    // Closes the formatter and returns the document, which must parse.
    std::string finish(RKOutputFormatterJSON& json) {
        json.close();
        const std::string path = (directory_ / "out.json").string();
        EXPECT_EQ(std::system((kStrictParse + path).c_str()), 0) << "not valid JSON: " << path;
        std::ifstream file(path);
        std::stringstream text;
        text << file.rdbuf();
        return text.str();
    }

    // One process's calls as the analysis makes them.
    static void printProcess(RKOutputFormatter& json, const RKProcess& process, uint64_t memspread) {
        json.printProcessHeader(process);
        if (process.errors().empty()) json.printProcessTotal(memspread, process);
        json.endProcessHeader(process);
    }

    static void endReport(RKOutputFormatter& json, const RKMemoryTotal& total, int endSecond) {
        json.printProcessesWithWarnings({}, {}, {});
        json.printSummaryCategories({}, total, false);
        json.printGlobalAuxData(nullptr);
        json.endAtTime(timeAt(endSecond));
    }

    ScopedTimeZone zone_;
    std::shared_ptr<RKScriptedPlatform> platform_;
    RKScopedPlatform scope_;
    fs::path directory_;
};

}  // namespace

// Warnings, errors, own and shared categories, aux data and the summary of one report; the group
// that two processes print without a process view is recorded once.
TEST_F(RKOutputFormatterJSONTest, SingleRunDocument) {
    auto alpha = makeProcess(310, "alpha", 16384);
    alpha->addWarning("alpha [310]: region walk stopped early");
    alpha->addWarning("alpha [310]: ledger unreadable");
    auto beta = makeProcess(42, "beta", 4096);
    beta->setIsTranslated(true);
    auto gamma = makeProcess(7, "gamma", 4096);
    gamma->addError("gamma [7]: task_for_pid failed");
    auto both = makeGroup({alpha, beta});
    const RKCategoryMap own = {
        {"MALLOC_SMALL", makeCategory("MALLOC_SMALL", "", {.dirty = 1048576, .swapped = 65536, .regions = 3})},
        {"__TEXT", makeCategory("__TEXT", "/usr/bin/alpha", {.clean = 81920, .regions = 1})}};
    const RKMemoryTotal sharedSizes{.dirty = 1048576, .clean = 4096, .wired = 8192, .regions = 2};
    const RKCategoryMap shared = {{"shared memory", makeCategory("shared memory", "", sharedSizes)}};

    auto json = open();
    json->startAtTime(timeAt(1, 123456789));
    printProcess(*json, *alpha, 2162688);
    json->printProcessCategories(own, {});
    json->printSharedCategories(shared, *both, *alpha, false, {});
    json->printProcessAuxData(
        auxMap({{"memspread", leaf(-2162688)}, {"kernel", auxMap({{"page_table", leaf(16384)}})}}));
    printProcess(*json, *beta, 0);
    json->printSharedCategories(shared, *both, *beta, false, {});
    json->printProcessAuxData(nullptr);
    printProcess(*json, *gamma, 0);
    json->printProcessCategories({}, {});
    json->printProcessAuxData(nullptr);
    json->printProcessesWithWarnings({alpha}, {gamma}, {"Unable to read kernel zones"});
    const RKCategoryMap summary = {
        {"MALLOC_SMALL", makeCategory("MALLOC_SMALL", "detail left out of summaries",
                                      {.dirty = 1048576, .swapped = 65536, .reclaimable = 32768, .regions = 3}, true)},
        {"shared memory", makeCategory("shared memory", "", sharedSizes, true)}};
    json->printSummaryCategories(summary, {2097152, 65536, 4096, 32768, 8192, 5}, true);
    json->printGlobalAuxData(auxMap({{"memspread", leaf(2162688)}}));
    json->endAtTime(timeAt(2));
    EXPECT_EQ(finish(*json), golden("single"));
}

// Regions (mapped, unmapped, at address 0), verbose categories, process views, escaping of the
// name, and the VM-object-dirty mark.
TEST_F(RKOutputFormatterJSONTest, VerboseDocumentWithProcessViews) {
    platform_->selfRegionValue = 0;
    auto odd = makeProcess(501, "d\"q\\b\x1b" "esc", 16384);
    auto mapped = makeRegion(0x8000000000000001ull, "MALLOC_TINY", "", 0x7f0000000000, 1048576);
    mapped->offset = 4096;
    mapped->dirtySize = 8192;
    mapped->swappedSize = 4096;
    mapped->cleanNonSpecSize = 12288;
    mapped->reclaimableSize = 16384;
    mapped->wired = true;
    auto unmapped = makeRegion(77, "owned unmapped memory", "(purgeable)", RKRegionNoAddress, 65536);
    auto pageZero = makeRegion(0, "__PAGEZERO", "", 0, 4096);
    odd->setMemoryRegions(RKRegionList{mapped, unmapped, pageZero});
    auto empty = makeProcess(600, "empty", 4096);
    auto group = makeGroup({empty, odd});

    auto json = open();
    json->startAtTime(timeAt(1, 123456789));
    json->printSpanlistLikeOutputForProcess(*odd, *odd->memoryRegions());
    json->printSpanlistLikeOutputForProcess(*empty, {});
    printProcess(*json, *odd, 12288);
    json->printProcessCategories(
        {{"MALLOC_TINY", makeCategory("MALLOC_TINY", "", {8192, 4096, 12288, 16384, 1048576, 1})},
         {"reserved", makeCategory("reserved", "", {.regions = 1}, false, true)}},
        {});
    json->printSharedCategories({{"shared memory", makeCategory("shared memory", "", {.dirty = 4096, .regions = 1})}},
                                *group, *odd, true, {});
    json->printProcessAuxData(auxMap({{"memspread", leaf(12288)}}));
    printProcess(*json, *empty, 0);
    json->printSharedCategories({{"shared memory", makeCategory("shared memory", "", {.clean = 4096, .regions = 1})}},
                                *group, *empty, true, {});
    json->printProcessAuxData(nullptr);
    endReport(*json, {}, 2);
    EXPECT_EQ(finish(*json), golden("verbose"));
}

// Each sample is a complete report of its own: its shared records start afresh, so a group
// recorded in one sample is recorded again in a later one.
TEST_F(RKOutputFormatterJSONTest, ThreeSamplesInOneDocument) {
    auto sampler = makeProcess(900, "sampler", 16384);
    auto group = makeGroup({sampler, makeProcess(901, "peer", 4096)});
    auto json = open();
    json->configureForMultipleOutputs();
    for (int sample = 1; sample <= 3; sample++) {
        json->startAtTime(timeAt(sample * 10));
        const uint64_t dirty = sample == 1 ? 8192 : 12288;
        if (sample != 2) {
            printProcess(*json, *sampler, dirty);
            json->printSharedCategories(
                {{"shared memory", makeCategory("shared memory", "", {.dirty = dirty, .regions = 1})}}, *group,
                *sampler, false, {});
            json->printProcessAuxData(nullptr);
        }
        endReport(*json, sample == 2 ? RKMemoryTotal{} : RKMemoryTotal{.dirty = dirty, .regions = 1}, sample * 10 + 1);
    }
    EXPECT_EQ(finish(*json), golden("samples"));
}

TEST_F(RKOutputFormatterJSONTest, PageSizeIsTheKernelsWhenNoProcessWasReported) {
    platform_->pageSize = 65536;
    auto json = open();
    json->startAtTime(timeAt(0));
    endReport(*json, {}, 1);
    const std::string document = finish(*json);
    EXPECT_EQ(document.substr(document.rfind(",\"")), ",\"page size\":65536}");
}

TEST_F(RKOutputFormatterJSONTest, UnopenableFileGivesNoFormatterAndSaysWhy) {
    testing::internal::CaptureStderr();
    auto json = RKOutputFormatterJSON::initWithPath((directory_ / "missing" / "out.json").string());
    EXPECT_EQ(json, nullptr);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "Unable to open JSON writer: No such file or directory\n");
}

TEST(RKJsonDateFormatter, WritesLocalTimeWithMillisecondsAndZone) {
    using namespace std::chrono;
    // 2026-11-16 12:08:27.123999 UTC; milliseconds are truncated.
    const auto instant = system_clock::time_point(seconds(1794830907)) + microseconds(123999);
    for (const auto& [zone, expected] : {std::pair{"UTC0", "2026-11-16T12:08:27.123Z"},
                                         {"<+0530>-5:30", "2026-11-16T17:38:27.123+05:30"},
                                         {"<-0330>3:30", "2026-11-16T08:38:27.123-03:30"}}) {
        ScopedTimeZone scoped(zone);
        EXPECT_EQ(RKJsonDateFormatter().stringFromDate(instant), expected) << zone;
    }
    ScopedTimeZone utc("UTC0");
    // Before 1970 the milliseconds still count forward from the second.
    EXPECT_EQ(RKJsonDateFormatter().stringFromDate(system_clock::time_point(milliseconds(-500))),
              "1969-12-31T23:59:59.500Z");
}
