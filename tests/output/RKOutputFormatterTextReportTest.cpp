// Whole text reports for hand-made measurements, compared with golden text.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <optional>
#include <sstream>

#include "model/RKAuxData.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "model/RKProcessGroup.h"
#include "model/RKTime.h"
#include "output/RKOutputFormatterText.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"

namespace {

class TestProcess : public RKProcess {
public:
    TestProcess(pid_t pid, const std::string& name, uint64_t pageSize) {
        setPid(pid);
        setName(name);
        setDisplayString(name + " [" + std::to_string(pid) + "]");
        setPageSize(pageSize);
        setIs64bit(true);
    }
    void addError(const std::string& text) { errors_.push_back(text); }
    void addWarning(const std::string& text) { warnings_.push_back(text); }
};

std::shared_ptr<TestProcess> process(pid_t pid, const std::string& name, uint64_t pageSize = 4096) {
    return std::make_shared<TestProcess>(pid, name, pageSize);
}

struct Sizes {
    uint64_t dirty = 0, swapped = 0, clean = 0, reclaimable = 0, wired = 0;
    int32_t regions = 0;
};

// A category named by a one-region object, with its totals set directly.
std::shared_ptr<RKMemoryCategory> category(const std::string& name, const std::string& detail, Sizes sizes,
                                           bool verbose = false) {
    auto region = std::make_shared<RKMemoryRegion>();
    region->name = name;
    region->detailedName = detail;
    region->verbose = verbose;
    auto object = std::make_shared<RKMemoryObject>();
    object->addRegion(region, 4096);
    object->finalize();
    auto made = std::make_shared<RKMemoryCategory>();
    made->setFirstMemoryObject(object);
    made->setTotalDirtySize(sizes.dirty);
    made->setTotalSwappedSize(sizes.swapped);
    made->setTotalCleanSize(sizes.clean);
    made->setTotalReclaimableSize(sizes.reclaimable);
    made->setTotalWiredSize(sizes.wired);
    made->setTotalRegions(sizes.regions);
    return made;
}

RKMemoryTotal totalOf(const RKCategoryMap& categories) {
    RKMemoryTotal total;
    for (const auto& [key, made] : categories) {
        total.dirty += made->totalDirtySize();
        total.swapped += made->totalSwappedSize();
        total.clean += made->totalCleanSize();
        total.reclaimable += made->totalReclaimableSize();
        total.wired += made->totalWiredSize();
        total.regions += static_cast<uint32_t>(made->totalRegions());
    }
    return total;
}

std::shared_ptr<RKAuxDataMap> aux(std::initializer_list<std::pair<const std::string, RKAuxNode>> entries) {
    return std::make_shared<RKAuxDataMap>(RKAuxDataMap::Entries(entries));
}
RKAuxNode leaf(int64_t value) { return std::make_shared<RKAuxData>(value, true); }

RKTime timeAt(int64_t wallSeconds, int64_t nanoseconds = 0) {
    RKClockReadings readings;
    readings.wallSeconds = wallSeconds;
    readings.wallNanoseconds = nanoseconds;
    return RKTime::fromReadings(readings);
}

std::string golden(const std::string& name) {
    std::ifstream file(std::string(MEMSPREAD_TEST_DATA) + "/golden/" + name, std::ios::binary);
    std::ostringstream text;
    text << file.rdbuf();
    return text.str();
}

std::shared_ptr<RKScriptedPlatform> platformWithBreakdown(bool on) {
    auto platform = std::make_shared<RKScriptedPlatform>();
    platform->selfRegionValue = on ? 1 : 0;
    RKAnalysisSettings::resetCache();
    return platform;
}

// One formatter writing into memory; the owned-memory breakdown is on unless a test says.
struct Report {
    explicit Report(int64_t format = RKSummaryFormatFormatted, int64_t options = 0, const char* sort = "Dirty",
                    bool breakDown = true)
        : platform(platformWithBreakdown(breakDown)),
          stream(open_memstream(&buffer, &size)),
          formatter(format, options, sort, stream) {}
    ~Report() {
        std::fclose(stream);
        std::free(buffer);
        RKAnalysisSettings::resetCache();
    }
    std::string text() {
        std::fflush(stream);
        return std::string(buffer, size);
    }

    void header(const RKProcess& reported, uint64_t memspread) {
        formatter.printProcessHeader(reported);
        if (reported.errors().empty()) formatter.printProcessTotal(memspread, reported);
        formatter.endProcessHeader(reported);
    }
    void own(const RKCategoryMap& categories) { formatter.printProcessCategories(categories, totalOf(categories)); }
    void shared(const RKCategoryMap& categories, const RKProcessGroup& group, const RKProcess& reported) {
        formatter.printSharedCategories(categories, group, reported, false, totalOf(categories));
    }
    void end(const RKCategoryMap& summary, const std::shared_ptr<RKAuxDataMap>& globalAux = nullptr,
             bool hadErrors = false) {
        formatter.printSummaryCategories(summary, totalOf(summary), hadErrors);
        formatter.printGlobalAuxData(globalAux);
        formatter.endAtTime(timeAt(0));
    }

    RKScopedPlatform platform;
    char* buffer = nullptr;
    size_t size = 0;
    FILE* stream;
    RKOutputFormatterText formatter;
};

RKRegionList listedRegions() {
    auto mapped = std::make_shared<RKMemoryRegion>();
    mapped->start = 0x7f0000000000;
    mapped->size = 0x3000;
    mapped->object_id = 0x12345;
    mapped->dirtySize = mapped->swappedSize = mapped->cleanNonSpecSize = 4096;
    mapped->wired = true;
    mapped->name = "mapped file";
    mapped->detailedName = "/usr/lib/libfoo.so.1";
    auto owned = std::make_shared<RKMemoryRegion>();
    owned->start = RKRegionNoAddress;
    owned->size = owned->dirtySize = 8192;
    owned->object_id = 0xABCDE12345678;  // wider than the 40 bits shown
    owned->name = "Owned physical memspread (unmapped)";
    return {mapped, owned};
}

TEST(RKOutputFormatterTextReport, OneProcessHasNoSummaryAndSkipsVerboseCategories) {
    Report report;
    auto demo = process(42, "demo");
    RKCategoryMap categories{
        {"MALLOC_SMALL", category("MALLOC_SMALL", "", {.dirty = 3145728, .swapped = 1048576, .regions = 12})},
        {"mapped file",
         category("mapped file", "/usr/lib/libfoo.so.1", {.clean = 123456789, .reclaimable = 10000, .regions = 3})},
        {"stack", category("stack", "", {.dirty = 9999, .clean = 1023, .regions = 1})},
        {"reserved", category("reserved", "", {}, true)},  // shown only after a region listing
    };
    report.formatter.startAtTime(timeAt(0));
    report.header(*demo, 4204303);
    report.own(categories);
    report.formatter.printProcessAuxData(aux({{"memspread", leaf(4204303)}, {"peak", aux({{"lifetime", leaf(5000000)}})}}));
    report.formatter.printProcessesWithWarnings({}, {}, {});
    report.end(categories, aux({{"memspread", leaf(1)}}));
    EXPECT_EQ(report.text(), golden("text-one-process.txt"));
}

TEST(RKOutputFormatterTextReport, SharedMemoryInBytesWithSwappedColumn) {
    Report report(RKSummaryFormatBytes, RKTextOptionSwapped);
    auto alpha = process(100, "alpha");
    auto beta = process(200, "beta");
    beta->setIs64bit(false);
    RKProcessGroupMinimal members;
    members.addProcess(alpha);
    members.addProcess(beta);
    auto group = members.immutableCopy();
    const Sizes sharedSizes{.dirty = 1048576, .swapped = 4096, .clean = 4096, .regions = 2};
    RKCategoryMap shared{{"shared memory", category("shared memory", "/dev/shm/pool", sharedSizes)}};
    RKCategoryMap stack{{"stack", category("stack", "", {.dirty = 8192, .regions = 1})}};

    report.formatter.startAtTime(timeAt(0));
    report.header(*alpha, 1060864);
    report.own(stack);
    report.shared(shared, *group, *alpha);
    report.formatter.printProcessAuxData(aux({{"memspread", leaf(1060864)}}));
    report.header(*beta, 1052672);
    report.shared(shared, *group, *beta);
    report.formatter.printProcessAuxData(nullptr);
    report.formatter.printProcessesWithWarnings({}, {}, {});
    Sizes summarySizes = sharedSizes;
    summarySizes.regions = 4;
    RKCategoryMap summary = stack;
    summary["shared memory"] = category("shared memory", "", summarySizes);
    report.end(summary, aux({{"memspread", leaf(2113536)}}));
    EXPECT_EQ(report.text(), golden("text-shared-bytes-swapped.txt"));
}

// Pages follow the page size of the last process header, so the summary counts 4 KB pages.
TEST(RKOutputFormatterTextReport, WarningsAndErrorsInPagesWithWiredColumn) {
    Report report(RKSummaryFormatPages, RKTextOptionWired);
    auto gamma = process(300, "gamma", 16384);
    gamma->setIsTranslated(true);
    gamma->addWarning("region vanished at 0x1000");
    auto delta = process(400, "delta");
    delta->setIs64bit(false);
    delta->addError("task_for_pid failed");
    RKCategoryMap malloc{{"MALLOC", category("MALLOC", "", {.dirty = 32768, .swapped = 7232, .clean = 16385,
                                                            .wired = 16384, .regions = 2})}};

    report.formatter.startAtTime(timeAt(0));
    report.header(*gamma, 40000);
    report.own(malloc);
    report.formatter.printProcessAuxData(nullptr);
    report.header(*delta, 0);
    report.own({});
    report.formatter.printProcessAuxData(nullptr);
    report.formatter.printProcessesWithWarnings({gamma}, {delta}, {"kernel zones unreadable"});
    report.end(malloc, nullptr, true);
    EXPECT_EQ(report.text(), golden("text-errors-pages-wired.txt"));
}

// -w: every optional column, full paths, verbose categories after the listing, the clean size
// breaking a tie of dirty sizes, and the VM-object mode line although one process prints no summary.
TEST(RKOutputFormatterTextReport, WideVerboseReportInVmObjectMode) {
    Report report(RKSummaryFormatFormatted, RKTextOptionWired | RKTextOptionSwapped | RKTextOptionWide, "Dirty", false);
    auto demo = process(42, "demo");
    RKRegionList regions = listedRegions();
    auto reserved = std::make_shared<RKMemoryRegion>();
    reserved->start = 0x1000;
    reserved->size = 1;
    reserved->name = "reserved";
    regions.push_back(reserved);

    report.formatter.startAtTime(timeAt(0));
    report.formatter.printSpanlistLikeOutputForProcess(*demo, regions);
    report.header(*demo, 16384);
    const Sizes mapped{.dirty = 4096, .swapped = 4096, .clean = 4096, .wired = 12288, .regions = 1};
    report.own({{"mapped file", category("mapped file", "/usr/lib/libfoo.so.1", mapped)},
                {"Owned physical memspread (unmapped)",
                 category("Owned physical memspread (unmapped)", "", {.dirty = 8192, .regions = 1})},
                {"reserved", category("reserved", "", {.regions = 1}, true)}});
    report.formatter.printProcessAuxData(nullptr);
    report.formatter.printProcessesWithWarnings({}, {}, {});
    report.end({});
    EXPECT_EQ(report.text(), golden("text-wide-listing.txt"));
}

TEST(RKOutputFormatterTextReport, ListingTruncatesNamesAndShowsEmptyProcesses) {
    Report report;
    report.formatter.printSpanlistLikeOutputForProcess(*process(5, "empty"), {});
    report.formatter.printSpanlistLikeOutputForProcess(*process(42, "demo"), listedRegions());
    EXPECT_EQ(report.text(), golden("text-listing.txt"));
}

TEST(RKOutputFormatterTextReport, SharingLineListsUpToTwentyProcesses) {
    std::vector<std::shared_ptr<TestProcess>> members;
    for (pid_t pid = 1; pid <= 21; ++pid) members.push_back(process(pid, "p" + std::to_string(pid)));
    auto sharingLine = [&](size_t count) {
        RKProcessGroupMinimal group;
        for (size_t index = 0; index < count; ++index) group.addProcess(members[index]);
        Report report;
        report.shared({}, *group.immutableCopy(), *members[0]);
        std::string text = report.text();
        return text.substr(0, text.find('\n'));
    };
    std::string twenty = sharingLine(20);
    EXPECT_TRUE(twenty.starts_with("Shared with p2 [2], p3 [3], ")) << twenty;
    EXPECT_TRUE(twenty.ends_with(", p20 [20]:")) << twenty;
    EXPECT_EQ(std::count(twenty.begin(), twenty.end(), '['), 19);  // the reported process left out
    EXPECT_EQ(sharingLine(21), "Shared with 21 processes:");
    EXPECT_EQ(sharingLine(2), "Shared with p2 [2]:");
}

// Every column gives a different order; in bytes mode names start after 54 characters.
TEST(RKOutputFormatterTextReport, EverySortColumnOrdersTheRows) {
    RKCategoryMap categories{
        {"a", category("a", "", {.dirty = 100, .clean = 1, .reclaimable = 4, .wired = 3, .regions = 4})},
        {"B", category("B", "", {.dirty = 10, .swapped = 50, .clean = 4, .reclaimable = 5, .wired = 1, .regions = 2})},
        {"c", category("c", "", {.swapped = 100, .clean = 2, .reclaimable = 3, .wired = 4, .regions = 1})},
        {"D", category("D", "", {.dirty = 50, .swapped = 10, .clean = 3, .reclaimable = 2, .wired = 2, .regions = 3})},
    };
    const std::pair<const char*, const char*> cases[] = {
        {"Dirty", "acBD"}, {"swapped", "cBDa"}, {"Clean", "BDca"},    {"RECLAIMABLE", "BacD"},
        {"Wired", "caDB"}, {"Regions", "aDBc"}, {"Category", "BDac"},
    };
    for (const auto& [sort, expected] : cases) {
        Report report(RKSummaryFormatBytes, 0, sort);
        report.own(categories);
        std::istringstream text(report.text());
        std::string header, rule, line, order;
        std::getline(text, header);
        std::getline(text, rule);
        while (std::getline(text, line) && line != rule) order += line.substr(54);
        EXPECT_EQ(order, expected) << sort;
    }
    EXPECT_DEATH(RKOutputFormatterText(RKSummaryFormatFormatted, 0, "Size"), "Unhandled text sort column");
}

// Regression: names and paths from other processes once reached the terminal raw.
TEST(RKOutputFormatterTextReport, ControlCharactersAreNeverWrittenRaw) {
    Report report;
    auto evil = process(7, "evil\x1b[2J");
    evil->addWarning("bad\rline");
    report.formatter.printProcessHeader(*evil);
    report.own({{"k", category("mapped\x07", "/tmp/a\nb", {})}});
    report.formatter.printProcessAuxData(aux({{"key\x1b", leaf(1)}}));
    std::string text = report.text();
    EXPECT_NE(text.find("evil\\x1b[2J [7]: 64-bit\n"), std::string::npos) << text;
    EXPECT_NE(text.find("\tbad\\x0dline\n"), std::string::npos);
    EXPECT_NE(text.find("    mapped\\x07 .../a\\x0ab\n"), std::string::npos);
    EXPECT_NE(text.find("\tkey\\x1b: 1 B\n"), std::string::npos);
    EXPECT_TRUE(std::all_of(text.begin(), text.end(),
                            [](char c) { return c == '\n' || c == '\t' || static_cast<unsigned char>(c) >= 0x20; }));
}

// Each sample is a complete report that starts with its time in the local zone.
TEST(RKOutputFormatterTextReport, MultipleOutputsStampEachCompleteReport) {
    const char* zone = std::getenv("TZ");
    const std::optional<std::string> savedZone = zone ? std::optional<std::string>(zone) : std::nullopt;
    setenv("TZ", "CET-1", 1);
    tzset();
    Report report;
    report.formatter.configureForMultipleOutputs();
    auto demo = process(42, "demo");
    for (int sample = 0; sample < 2; ++sample) {
        report.formatter.startAtTime(timeAt(978307200 + sample, 500000000));
        report.header(*demo, 0);
        report.end({});
    }
    savedZone ? setenv("TZ", savedZone->c_str(), 1) : unsetenv("TZ");
    tzset();
    std::string text = report.text();
    EXPECT_TRUE(text.starts_with("Time: 2001-01-01 01:00:00.500+01:00\n=")) << text;
    EXPECT_NE(text.find("\nTime: 2001-01-01 01:00:01.500+01:00\n="), std::string::npos) << text;
    // One process per sample: the count restarts, so neither sample prints a summary.
    EXPECT_EQ(text.find("Summary Memspread"), std::string::npos) << text;
}

}  // namespace
