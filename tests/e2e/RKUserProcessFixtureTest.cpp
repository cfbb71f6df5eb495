// A live process measured end to end: the fixture maps one area of each kind and forks a child
// that shares the shared kinds. Gathered in this process, each area must come out as a region of
// the right name, detail, share mode, identity and size; through the binary, the report must
// show the shared kinds once, in the block of memory the two processes share.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <regex>

#include "model/RKMemoryRegion.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"
#include "support/RKFixtureProcess.h"
#include "support/RKRunCommand.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

std::shared_ptr<RKProcess> gathered(pid_t pid) {
    auto process = RKProcess::processWithPid(pid);
    if (process) process->gatherData();
    return process;
}

const RKMemoryRegion* regionAt(const RKProcess& process, uint64_t address) {
    for (const auto& region : *process.memoryRegions())
        if (region->start <= address && address < region->end()) return region.get();
    return nullptr;
}

class RKUserProcessFixtureTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        RKAnalysisSettings::setBreakDownPhysMemspread(true);  // what the program does by default
        fixture_ = std::make_unique<RKFixtureProcess>();
        if (!fixture_->start(MEMSPREAD_FIXTURE)) return;
        parent_ = gathered(fixture_->pid());
        child_ = gathered(fixture_->childPid());
    }
    static void TearDownTestSuite() {
        fixture_.reset();
        parent_.reset();
        child_.reset();
        RKAnalysisSettings::setBreakDownPhysMemspread(false);
    }
    void SetUp() override {
        ASSERT_TRUE(parent_ && child_) << fixture_->error();
        ASSERT_TRUE(parent_->memoryRegions() && child_->memoryRegions());
        ASSERT_TRUE(parent_->errors().empty() && parent_->warnings().empty());
    }

    static inline std::unique_ptr<RKFixtureProcess> fixture_;
    static inline std::shared_ptr<RKProcess> parent_, child_;
};

struct AreaExpectation {
    const char* area;
    const char* name;
    std::string detail;  // a suffix of the detailed name
    uint8_t shareMode;
    uint64_t dirtyPages;
    bool sharedWithChild;
};

}  // namespace

TEST_F(RKUserProcessFixtureTest, EveryKindOfMappingBecomesItsRegion) {
    const std::string files = "memspread-fixture-" + std::to_string(fixture_->pid());
    const AreaExpectation expectations[] = {
        {"memfd", "memfd", "memspread-fixture", SM_SHARED, 32, true},
        {"shared_anon", "shared anonymous", "", SM_SHARED, 16, true},
        {"sysv", "SysV shared memory", "/SYSV00000000", SM_SHARED, 16, true},
        {"dev_shm", "POSIX shared memory", "/dev/shm/" + files, SM_SHARED, 16, false},
        {"file_cow", "mapped file", files + "-cow", SM_COW, 4, false},
        {"file_private", "mapped file", files + "-private", SM_COW, 0, false},
        {"anon_written", "anonymous", "", SM_PRIVATE, 64, false},
        {"anon_inherited", "anonymous", "", SM_COW, 16, false},  // its pages are the child's too
        {"mlocked", "anonymous", "", SM_PRIVATE, 8, false},
    };
    for (const auto& expected : expectations) {
        SCOPED_TRACE(expected.area);
        auto area = fixture_->area(expected.area);
        if (!area) continue;  // no /dev/shm on this machine
        const RKMemoryRegion* region = regionAt(*parent_, area->address);
        ASSERT_TRUE(region);
        EXPECT_EQ(region->start, area->address);
        EXPECT_EQ(region->size, area->size);
        EXPECT_EQ(region->name, expected.name);
        EXPECT_TRUE(region->detailedName.ends_with(expected.detail)) << region->detailedName;
        if (expected.detail.empty()) {
            EXPECT_EQ(region->detailedName, "");
        }
        EXPECT_EQ(region->share_mode, expected.shareMode);
        EXPECT_EQ(region->dirtySize, expected.dirtyPages * P);
        EXPECT_NE(region->object_id, 0u);
        const RKMemoryRegion* inChild = regionAt(*child_, area->address);
        if (expected.sharedWithChild || std::string(expected.area) == "anon_inherited") {
            ASSERT_TRUE(inChild);
            EXPECT_EQ(inChild->object_id == region->object_id, expected.sharedWithChild)
                << "one object for shared memory, never for private anonymous memory";
        }
    }
    EXPECT_EQ(regionAt(*parent_, fixture_->area("file_private")->address)->cleanNonSpecSize, 16 * P);
    EXPECT_TRUE(regionAt(*parent_, fixture_->area("mlocked")->address)->wired);
    const RKMemoryRegion* freed = regionAt(*parent_, fixture_->area("madv_free")->address);
    EXPECT_EQ(freed->dirtySize + freed->reclaimableSize, 64 * P) << "lazily freed pages are reclaimable";
    const RKMemoryRegion* shared = regionAt(*parent_, fixture_->area("file_shared")->address);
    EXPECT_EQ(shared->name, "mapped file");
    EXPECT_EQ(shared->dirtySize + shared->cleanNonSpecSize, 8 * P) << "written pages, dirty until written back";
    const RKMemoryRegion* heap = regionAt(*parent_, fixture_->area("heap")->address);
    EXPECT_EQ(heap->name, "heap");
    EXPECT_GE(heap->dirtySize, 16 * P);

    // Regions of the walk in address order, then those without an address: the page table.
    const auto& regions = *parent_->memoryRegions();
    EXPECT_TRUE(std::is_sorted(regions.begin(), regions.end() - 1,
                               [](const auto& a, const auto& b) { return a->start < b->start; }));
    EXPECT_EQ(regions.back()->name, "page table");
    EXPECT_GT(regions.back()->dirtySize, 0u);
    EXPECT_TRUE(std::any_of(regions.begin(), regions.end(), [](const auto& r) { return r->name == "stack"; }));
}

namespace {

// Category rows of a report by block ("own", "shared", "summary") and pid (0 for the summary):
// the Dirty column of each category, from a report in bytes.
struct ReportRows {
    std::map<std::pair<std::string, pid_t>, std::map<std::string, uint64_t>> dirty;
    std::map<pid_t, uint64_t> memspread;
    uint64_t summary = 0;

    std::map<std::string, uint64_t>& of(const std::string& block, pid_t pid) { return dirty[std::make_pair(block, pid)]; }
};

ReportRows parseReport(const std::string& text) {
    static const std::regex header(R"(\[(\d+)\]: (32|64)-bit)"), total(R"(\tMemspread: (\d+) B \()"),
        row(R"(^ *(\d+) B +(\d+) B +(\d+) B +(\d+)    (.+)$)"), summary(R"(^Summary Memspread: (\d+) B)");
    ReportRows rows;
    std::string block;
    pid_t pid = 0;
    for (const std::string& line : RKSplitLines(text)) {
        std::smatch match;
        if (std::regex_search(line, match, header)) {
            pid = std::stoi(match[1]);
            block = "own";
        }
        if (std::regex_search(line, match, total)) rows.memspread[pid] = std::stoull(match[1]);
        if (line.starts_with("Shared with")) block = "shared";
        if (std::regex_search(line, match, summary)) {
            rows.summary = std::stoull(match[1]);
            block = "summary";
            pid = 0;
        }
        if (std::regex_match(line, match, row)) rows.of(block, pid)[match[5]] = std::stoull(match[1]);
    }
    return rows;
}

}  // namespace

TEST_F(RKUserProcessFixtureTest, ReportShowsSharedMemoryOnce) {
    const pid_t parent = fixture_->pid(), child = fixture_->childPid();
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", std::to_string(parent), std::to_string(child)});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    ReportRows rows = parseReport(run.standardOutput);
    const std::map<std::string, uint64_t> sharedKinds = {
        {"memfd", 32 * P}, {"shared anonymous", 16 * P}, {"SysV shared memory", 16 * P}};
    for (pid_t pid : {parent, child}) {
        SCOPED_TRACE(pid);
        auto& shared = rows.of("shared", pid);
        for (const auto& [kind, bytes] : sharedKinds) {
            EXPECT_EQ(shared[kind], bytes) << kind;
            EXPECT_EQ(rows.of("own", pid).count(kind), 0u) << kind << " is not the process's alone";
        }
    }
    EXPECT_GE(rows.of("own", parent)["anonymous"], 64 * P);
    for (const auto& [kind, bytes] : sharedKinds) EXPECT_EQ(rows.of("summary", 0)[kind], bytes) << kind;
    // Each process's figure includes the memory they share; the summary counts it once.
    uint64_t sharedTotal = rows.of("shared", parent)["TOTAL"];
    EXPECT_EQ(rows.summary, rows.memspread[parent] + rows.memspread[child] - sharedTotal) << run.standardOutput;
    EXPECT_EQ(rows.of("summary", 0)["TOTAL"], rows.summary);
}

TEST_F(RKUserProcessFixtureTest, AllProcessesAreReported) {
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-a", "-f", "bytes"});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    ReportRows rows = parseReport(run.standardOutput);
    for (pid_t pid : {getpid(), fixture_->pid(), fixture_->childPid()})
        EXPECT_EQ(rows.memspread.count(pid), 1u) << "no report for pid " << pid;
    EXPECT_NE(run.standardOutput.find("kernel [0]: 64-bit"), std::string::npos);
    EXPECT_GT(rows.memspread.size(), 3u);
    EXPECT_GT(rows.summary, 0u);
}
