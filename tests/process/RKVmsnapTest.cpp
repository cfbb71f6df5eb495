// Snapshots: the file format in both directions (and every kind of damage ending in an error),
// and the snapshot process built from hand-made files: platform, translation, images from typed
// regions, shared-region pieces in bytes and figures from the file. That a Linux snapshot reports
// as its live process did (details, subranges, shared anonymous pages) is RKVmsnapEndToEnd's.
#include <gtest/gtest.h>

#include <tuple>

#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKVmsnapCompression.h"
#include "process/RKVmsnapProcess.h"

namespace {

// A snapshot document around `regions` (a JSON array) with `extra` members.
std::string snapshot(const std::string& description, const std::string& regions = "[]",
                     const std::string& extra = "") {
    return R"({"format":"memspread-vmsnap","version":1,"pid":42,"processName":"tool","vmPageSize":4096,)"
           R"("processDescription":")" + description + R"(","regions":)" + regions + extra + "}";
}

struct Opened {
    std::shared_ptr<RKVmsnapProcess> process;
    RKError error;
    std::string printed;
};

Opened open(const std::string& bytes) {
    Opened result{std::make_shared<RKVmsnapProcess>(), {}, {}};
    testing::internal::CaptureStderr();
    if (!result.process->initWithVmsnapData(bytes, &result.error)) result.process.reset();
    result.printed = testing::internal::GetCapturedStderr();
    return result;
}

class RKVmsnapTest : public ::testing::Test {
protected:
    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();
    RKScopedPlatform scoped{platform};
};

}  // namespace

TEST_F(RKVmsnapTest, GraphSurvivesTheFileCompressedAndEveryDamageIsAnError) {
    RKVmsnapGraph graph;
    graph.pid = 7, graph.processName = "tool", graph.processDescriptionString = "Linux x86_64";
    graph.vmPageSize = 4096;
    RKVmsnapRegion region;
    region.address = 0x1000, region.length = 0x3000;
    region.object_id = 0x8000000000000001ull;  // past the signed range
    graph.regions = {region};
    graph.sharedAnonymousPages = {{0, {100, 101, 101, RKSwappedPageKey | 7}}};  // a repeated key, a swap entry
    graph.unattributedSharedAnonymousBytes = 0x3000;
    const std::string bytes = RKVmsnapSerialize(graph);
    ASSERT_TRUE(RKVmsnapIsCompressed(bytes));
    RKError error;
    auto back = RKVmsnapParse(bytes, &error);
    ASSERT_TRUE(back) << error.localizedDescription.value_or("");
    EXPECT_EQ(back->regions[0].object_id, region.object_id);
    ASSERT_EQ(back->sharedAnonymousPages.size(), 1u);
    EXPECT_EQ(back->sharedAnonymousPages[0].keys, graph.sharedAnonymousPages[0].keys);
    EXPECT_EQ(back->unattributedSharedAnonymousBytes, 0x3000u);

    // Shared pages: [region, key, difference, ...] over one region of 4 pages.
    const auto runs = [](const std::string& list) {
        return snapshot("Linux", R"([{"address":4096,"length":16384}])", R"(,"sharedAnonymousPages":)" + list);
    };
    const std::pair<std::string, std::string> damaged[] = {
        {"", "not valid JSON"},
        {bytes.substr(0, bytes.size() / 2), "truncated compressed data"},
        {bytes.substr(0, 4) + std::string(40, 'x'), "damaged compressed data"},
        {bytes + bytes, "data after the end"},
        {"[1,2]", "not a vmsnap"},
        {R"({"format":"other"})", "not a memspread vmsnap"},
        {snapshot("Linux", "[]", R"(,"version":3)").replace(0, 1, "{\"version\":3,"), "unsupported version 3"},
        {snapshot("Linux", R"([{"address":4096,"length":"big"}])"), "region 0 \"length\" is not an unsigned integer"},
        {snapshot("Linux", R"([{"address":8192,"length":4096},{"address":4096,"length":4096}])"), "region 1 overlaps"},
        {snapshot("Linux", R"([{"address":18446744073709547520,"length":8192}])"), "wraps around"},
        {snapshot("Linux", R"([{"address":4096,"length":4096,"details":{"subranges":[[1,2]]}}])"), "subrange 0 is not an array of 7"},
        {snapshot("Linux").replace(snapshot("Linux").find("4096"), 4, "3000"), "\"vmPageSize\" is not a page size"},
        {runs("[[0]]"), "shared pages 0 is not an array of a region and its pages"},
        {runs("[[0,5,-1]]"), "not an unsigned integer"},
        {runs("[[1,5]]"), "names a region the snapshot does not have"},
        {runs("[[0,4611686018427387904]]"), "holds a key that is no frame number"},
        {runs("[[0,9223372036854775807,9223372036854775807]]"), "holds a key that is no frame number"},
        {runs("[[0,9223372036854775808,9223372036854775808]]"), "goes past the largest key"},
        {runs("[[0,1,1,1,1,1,1]]"), "holds more pages than its region"},
        {runs("[[0,1,1,1],[0,9,1,1]]"), "shared pages 1 holds more pages than its region"},
        {runs("{}"), "\"sharedAnonymousPages\" is not an array"},
    };
    for (const auto& [input, reason] : damaged) {
        RKError failure;
        EXPECT_FALSE(RKVmsnapParse(input, &failure)) << reason;
        EXPECT_EQ(failure.domain, "MemspreadErrorDomain");
        EXPECT_EQ(failure.code, 1);
        EXPECT_NE(failure.localizedDescription.value_or("").find(reason), std::string::npos)
            << failure.localizedDescription.value_or("");
    }
}

TEST_F(RKVmsnapTest, DescriptionChoosesThePlatformAndTranslation) {
    // Description, image descriptions, the shared region's base, translated.
    const std::tuple<std::string, std::string, uint64_t, bool> cases[] = {
        {"Linux x86_64 6.18", "", 0, false},
        {"macOS X86-64 (X86 compatible) (translated)", "", 0x7FFF00000000, true},
        {"X86", "", 0x90000000, false},
        {"ARM64_32 watch", "", 0x1A000000, false},
        {"ARM64", "", 0x180000000, false},
        {"ARM", "libfoo (arm64_32)", 0x1A000000, false},
        {"ARM", "libfoo (armv7k)", 0x40000000, false},
    };
    for (const auto& [description, images, base, translated] : cases) {
        SCOPED_TRACE(description);
        Opened opened = open(snapshot(description, "[]", R"(,"binaryImagesDescription":")" + images + "\""));
        ASSERT_TRUE(opened.process);
        EXPECT_EQ(std::pair(opened.process->sharedRegionBase(), opened.process->isTranslated()), std::pair(base, translated));
        EXPECT_EQ(opened.process->displayString(), "tool [42] (vmsnap)");
    }
    Opened unknown = open(snapshot("PowerPC"));
    EXPECT_FALSE(unknown.process);
    EXPECT_EQ(unknown.error.code, 2);
    EXPECT_EQ(unknown.error.localizedDescription, "Unable to determine platform from memory graph process description");
    EXPECT_EQ(unknown.printed, "Unable to determine platform architecture of target\n");
}

TEST_F(RKVmsnapTest, TypedRegionsBecomeImagesAndFiguresComeFromTheFile) {
    // Two segments of one file with an untyped region between them, a file region with a
    // reserved area's name, then two pieces of the arm64 shared region, which carry bytes.
    const std::string regions = R"J([
        {"address":4096,"length":8192,"type":"__TEXT","path":"/bin/tool","external_pager":true,"resident_size":8192},
        {"address":12288,"length":4096,"type":"gap","user_tag":1,"resident_size":4096,"dirty_size":4096},
        {"address":16384,"length":4096,"type":"__DATA","path":"/bin/tool","external_pager":true,
         "resident_size":4096,"dirty_size":4096},
        {"address":20480,"length":4096,"type":"commpage (reserved)"},
        {"address":6442450944,"length":16384,"type":"__DATA","path":"/usr/lib/libA.dylib","dirty_size":8192,
         "swapped_out_size":4096,"resident_size":16384},
        {"address":6442467328,"length":16384,"type":"__LINKEDIT","path":"/usr/lib/libA.dylib"}])J";
    Opened opened = open(snapshot("iOS ARM64", regions,
                                  R"(,"physicalMemspread":123,"physicalMemspreadPeak":456,"showsPhysMemspread":true)"));
    ASSERT_TRUE(opened.process);
    opened.process->gatherData();
    const auto& list = *opened.process->memoryRegions();
    // Name, segment, detail, dirty, swapped and clean bytes; named by its tag, a type that is no
    // segment name makes no image. No page-table or owned-object region.
    using Row = std::tuple<std::string, uint8_t, std::string, uint64_t, uint64_t, uint64_t>;
    std::vector<Row> rows;
    for (const auto& r : list)
        rows.emplace_back(r->name, r->segment, r->detailedName, r->dirtySize, r->swappedSize, r->cleanNonSpecSize);
    ASSERT_EQ(rows, (std::vector<Row>{{"__TEXT", RKSegmentText, "/bin/tool", 0, 0, 8192},
                                      {"heap", RKSegmentNoImage, "", 4096, 0, 0},
                                      {"__DATA", RKSegmentData, "/bin/tool", 4096, 0, 0},
                                      {"commpage (reserved)", RKSegmentNoImage, "", 0, 0, 0},
                                      {"__DATA", RKSegmentData, "/usr/lib/libA.dylib", 8192, 4096, 0},
                                      {"__LINKEDIT", RKSegmentLinkedit, "lodr shared cache", 0, 0, 0}}));
    EXPECT_TRUE(list[3]->verbose && list[5]->inSharedCache);
    EXPECT_EQ(opened.process->phys_memspread(), 123u);
    EXPECT_EQ(opened.process->phys_memspread_peak(), 456u);
    EXPECT_TRUE(opened.process->breakDownPhysMemspread());
    EXPECT_EQ(platform->callCount("regionRecurse") + platform->callCount("pageRangeQuery"), 0u);
}
