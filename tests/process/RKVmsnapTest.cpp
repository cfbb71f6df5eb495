// Snapshots: the file format in both directions (and every kind of damage ending in an error),
// and the snapshot process built from hand-made files: platform, translation, images from typed
// regions, figures from the file, the details a Linux snapshot carries and the shared anonymous
// pages it hands to the pass across processes.
#include <gtest/gtest.h>

#include "analysis/RKSharedAnonymousPass.h"
#include "model/RKMemoryRegion.h"
#include "model/RKRangeList.h"
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
    graph.pid = 7;
    graph.processName = "name with \"quotes\"";
    graph.processDescriptionString = "Linux x86_64";
    graph.vmPageSize = 4096;
    graph.physicalMemspread = 1 << 20;
    graph.showsPhysMemspread = true;
    RKVmsnapRegion region;
    region.address = 0x1000;
    region.length = 0x3000;
    region.object_id = 0x8000000000000001ull;  // past the signed range
    region.details = RKVmsnapRegionDetails{"heap", "", 0x2000, 0, 0x1000, 0, true, false, {{0, 0x2000, 0x2000, 0, 0, 0, 0x2000}}};
    graph.regions = {region};
    graph.unaddressedRegions = {{0x5000, 0, 0xFFFFFFFFFFFFFFFFull, 2, 0, {"page table", "", 0x5000, 0, 0, 0, false, false, {}}}};
    graph.sharedAnonymousPages = {{0, {100, 101, 101, RKSwappedPageKey | 7}}};
    graph.unattributedSharedAnonymousBytes = 0x3000;
    const std::string bytes = RKVmsnapSerialize(graph);
    ASSERT_TRUE(RKVmsnapIsCompressed(bytes));
    RKError error;
    auto back = RKVmsnapParse(bytes, &error);
    ASSERT_TRUE(back) << error.localizedDescription.value_or("");
    EXPECT_EQ(back->processName, graph.processName);
    EXPECT_EQ(back->regions[0].object_id, region.object_id);
    EXPECT_EQ(back->regions[0].details->subranges[0].wired, 0x2000u);
    EXPECT_EQ(back->unaddressedRegions[0].details.name, "page table");
    ASSERT_EQ(back->sharedAnonymousPages.size(), 1u);
    EXPECT_EQ(back->sharedAnonymousPages[0].keys, graph.sharedAnonymousPages[0].keys);
    EXPECT_EQ(back->unattributedSharedAnonymousBytes, 0x3000u);

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
    };
    // Shared pages: [region, key, difference, ...] over one region of 4 pages.
    const auto runs = [](const std::string& list) {
        return snapshot("Linux", R"([{"address":4096,"length":16384}])", R"(,"sharedAnonymousPages":)" + list);
    };
    const std::pair<std::string, std::string> badRuns[] = {
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
    for (const auto& cases : {std::vector(std::begin(damaged), std::end(damaged)),
                              std::vector(std::begin(badRuns), std::end(badRuns))})
    for (const auto& [input, reason] : cases) {
        RKError failure;
        EXPECT_FALSE(RKVmsnapParse(input, &failure)) << reason;
        EXPECT_EQ(failure.domain, "MemspreadErrorDomain");
        EXPECT_EQ(failure.code, 1);
        EXPECT_NE(failure.localizedDescription.value_or("").find(reason), std::string::npos)
            << failure.localizedDescription.value_or("");
    }
}

TEST_F(RKVmsnapTest, DescriptionChoosesThePlatformAndTranslation) {
    const struct {
        std::string description;
        std::string images;
        uint64_t base;
        bool translated;
    } cases[] = {
        {"Linux x86_64 6.18", "", 0, false},
        {"macOS X86-64 (X86 compatible) (translated)", "", 0x7FFF00000000, true},
        {"X86", "", 0x90000000, false},
        {"ARM64_32 watch", "", 0x1A000000, false},
        {"ARM64", "", 0x180000000, false},
        {"ARM", "libfoo (arm64_32)", 0x1A000000, false},
        {"ARM", "libfoo (armv7k)", 0x40000000, false},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.description);
        Opened opened = open(snapshot(c.description, "[]", R"(,"binaryImagesDescription":")" + c.images + "\""));
        ASSERT_TRUE(opened.process);
        EXPECT_EQ(opened.process->sharedRegionBase(), c.base);
        EXPECT_EQ(opened.process->isTranslated(), c.translated);
        EXPECT_EQ(opened.process->displayString(), "tool [42] (vmsnap)");
    }
    Opened unknown = open(snapshot("PowerPC"));
    EXPECT_FALSE(unknown.process);
    EXPECT_EQ(unknown.error.code, 2);
    EXPECT_EQ(unknown.error.localizedDescription, "Unable to determine platform from memory graph process description");
    EXPECT_EQ(unknown.printed, "Unable to determine platform architecture of target\n");
}

TEST_F(RKVmsnapTest, TypedRegionsBecomeImagesAndFiguresComeFromTheFile) {
    // Two segments of one file with an untyped region between them, then a file region with a
    // reserved area's name, all below the x86-64 shared region.
    const std::string regions = R"J([
        {"address":4096,"length":8192,"type":"__TEXT","path":"/bin/tool","external_pager":true,"resident_size":8192},
        {"address":12288,"length":4096,"type":"gap","user_tag":1,"resident_size":4096,"dirty_size":4096},
        {"address":16384,"length":4096,"type":"__DATA","path":"/bin/tool","external_pager":true,
         "resident_size":4096,"dirty_size":4096},
        {"address":20480,"length":4096,"type":"commpage (reserved)"}])J";
    Opened opened = open(snapshot("X86-64", regions,
                                  R"(,"physicalMemspread":123,"physicalMemspreadPeak":456,"showsPhysMemspread":true)"));
    ASSERT_TRUE(opened.process);
    opened.process->gatherData();
    const auto& list = *opened.process->memoryRegions();
    ASSERT_EQ(list.size(), 4u) << "no page-table or owned-object region";
    EXPECT_EQ(list[0]->name, "__TEXT");
    EXPECT_EQ(list[0]->segment, RKSegmentText);
    EXPECT_EQ(list[0]->detailedName, "/bin/tool");
    EXPECT_EQ(list[0]->cleanNonSpecSize, 8192u);
    EXPECT_EQ(list[1]->name, "heap") << "named by its tag: a type that is no segment name makes no image";
    EXPECT_EQ(list[1]->dirtySize, 4096u);
    EXPECT_EQ(list[2]->name, "__DATA");
    EXPECT_EQ(list[2]->segment, RKSegmentData);
    EXPECT_EQ(list[3]->name, "commpage (reserved)");
    EXPECT_TRUE(list[3]->verbose);
    EXPECT_EQ(opened.process->phys_memspread(), 123u);
    EXPECT_EQ(opened.process->phys_memspread_peak(), 456u);
    EXPECT_TRUE(opened.process->breakDownPhysMemspread());
    EXPECT_EQ(platform->callCount("regionRecurse") + platform->callCount("pageRangeQuery"), 0u);
}

TEST_F(RKVmsnapTest, LinuxDetailsRestoreTheRegionsTheLiveRunBuilt) {
    const std::string regions = R"([
        {"address":4096,"length":16384,"user_tag":41,"share_mode":4,"object_id":99,"resident_size":8192,"dirty_size":8192,
         "details":{"name":"memfd","detail":"cache","dirty":8192,"clean":0,"wired":true,
                    "subranges":[[0,4096,4096,0,0,0,4096],[8192,4096,4096,0,0,0,4096]]}}])";
    const std::string unaddressed = R"(,"unaddressedRegions":[{"size":8192,"object_id":18446744073709551615,
        "share_mode":2,"details":{"name":"page table","dirty":8192}}])";
    Opened opened = open(snapshot("Linux x86_64", regions, unaddressed));
    ASSERT_TRUE(opened.process);
    opened.process->gatherData();
    const auto& list = *opened.process->memoryRegions();
    ASSERT_EQ(list.size(), 2u);
    EXPECT_EQ(list[0]->fullName(), "memfd cache");
    EXPECT_TRUE(list[0]->wired);
    ASSERT_TRUE(list[0]->subrangeList());
    EXPECT_EQ(list[0]->subrangeList()->nodeCount(), 2u);
    EXPECT_EQ(list[0]->subrangeList()->sum().dirty, 8192u);
    EXPECT_EQ(list[1]->start, RKRegionNoAddress);
    EXPECT_EQ(list[1]->name, "page table");
    EXPECT_EQ(list[1]->dirtySize, 8192u);
    EXPECT_EQ(list[1]->object_id, 0xFFFFFFFFFFFFFFFFull);
}

TEST_F(RKVmsnapTest, SavedSharedPagesMeetAcrossSnapshotsAsLiveFramesDo) {
    // A forked pair saved together: two pages of each one's heap are the same frames (one of
    // them swapped), a third page the child holds alone, and the parent's heap is the second
    // region. Version 1 files have no pages and so share nothing.
    const std::string heap = R"("user_tag":2,"share_mode":1,"resident_size":12288,"dirty_size":12288,
        "details":{"name":"heap","dirty":12288,"swapped":4096})";
    const std::string parentRegions = R"([{"address":4096,"length":4096,"details":{"name":"stack"}},
        {"address":65536,"length":16384,)" + heap + "}]";
    const std::string childRegions = R"([{"address":65536,"length":16384,)" + heap + "}]";
    auto pair = [&](bool withPages) {
        std::vector<std::shared_ptr<RKProcess>> processes;
        // The child's keys as differences: 100, 101, then the swap entry.
        const std::string toSwapped = std::to_string((RKSwappedPageKey | 9) - 101);
        for (const auto& [regions, pages] : {std::pair{parentRegions, "[[1,100," + std::to_string((RKSwappedPageKey | 9) - 100) + "]]"},
                                             std::pair{childRegions, "[[0,100,1," + toSwapped + "]]"}}) {
            Opened opened = open(snapshot("Linux", regions, withPages ? R"(,"sharedAnonymousPages":)" + pages : ""));
            EXPECT_TRUE(opened.process) << opened.error.localizedDescription.value_or("");
            if (!opened.process) return processes;
            opened.process->gatherData();
            processes.push_back(opened.process);
        }
        return processes;
    };
    auto processes = pair(true);
    ASSERT_EQ(processes.size(), 2u);
    auto& parent = dynamic_cast<RKVmsnapProcess&>(*processes[0]);
    const std::vector<RKSharedAnonymousPage> pages(parent.sharedAnonymousPages().begin(),
                                                   parent.sharedAnonymousPages().end());
    ASSERT_EQ(pages.size(), 2u);
    EXPECT_EQ(pages[0].page(), 100 | RKVmsnapPageKeyMark) << "never a live process's frame";
    EXPECT_TRUE(pages[1].swapped());
    EXPECT_EQ(parent.sharedAnonymousRegions()[0]->name, "heap");

    RKSharedAnonymousSummary summary = RKAttributeSharedAnonymousPages(processes);
    EXPECT_EQ(summary.sharedPages, 2u);
    for (const auto& process : processes) {
        SCOPED_TRACE(process->displayString());
        const auto& regions = *process->memoryRegions();
        const RKMemoryRegion& heapRegion = *regions[regions.size() - 2];
        EXPECT_EQ(heapRegion.dirtySize, 8192u) << "the shared frame left it; the child's own stayed";
        EXPECT_EQ(heapRegion.swappedSize, 0u);
        const RKMemoryRegion& shared = *regions.back();
        EXPECT_EQ(shared.start, RKRegionNoAddress);
        EXPECT_EQ(shared.name, "heap");
        EXPECT_EQ(shared.dirtySize, 4096u);
        EXPECT_EQ(shared.swappedSize, 4096u);
    }
    EXPECT_EQ(RKAttributeSharedAnonymousPages(pair(false)).sharedPages, 0u);
}
