// Anonymous memory inherited across fork, end to end: a parent that wrote a few hundred mappings
// and a heap forks workers that each copy a page or two. The summary counts the tree's anonymous
// memory once (the kernel's own figure is the sum of Pss_Anon over the tree), every process is
// still charged what the kernel charges it, and the pages all of them share are in the block
// they all share.
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <map>
#include <regex>

#include "support/RKFixtureProcess.h"
#include "support/RKReportRows.h"
#include "support/RKRunCommand.h"

namespace {

const uint64_t P = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));

// A "Field: N kB" line of a /proc file, in bytes; with no field, the file's first number.
uint64_t statusField(pid_t pid, const std::string& file, const std::string& field) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/" + file);
    if (field.empty()) {
        uint64_t value = 0;
        in >> value;
        return value;
    }
    std::string line;
    while (std::getline(in, line))
        if (line.rfind(field + ":", 0) == 0) return std::stoull(line.substr(field.size() + 1)) * 1024;
    return 0;
}

std::vector<pid_t> treeOf(const RKFixtureProcess& fixture, const std::string& report) {
    std::vector<pid_t> pids;
    static const std::regex header(R"(\[(\d+)\]: 64-bit\tMemspread:)");
    for (std::sregex_iterator it(report.begin(), report.end(), header), end; it != end; ++it)
        pids.push_back(std::stoi((*it)[1]));
    (void)fixture;
    return pids;
}

TEST(RKSharedAnonymous, ForkedWorkersShareTheirParentsMemoryOnce) {
    if (geteuid() != 0) GTEST_SKIP() << "frames are visible to root only";
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FORKTREE_FIXTURE, {"20"})) << fixture.error();
    RKCommandResult run = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "-t", std::to_string(fixture.pid())});
    ASSERT_TRUE(run.exitedWith(0)) << run.standardError;
    const std::string& report = run.standardOutput;
    const std::vector<pid_t> tree = treeOf(fixture, report);
    ASSERT_EQ(tree.size(), 21u) << report;

    // The tree's unique anonymous memory, and each process's own figure, from the kernel.
    uint64_t pssAnon = 0;
    for (pid_t pid : tree) {
        SCOPED_TRACE(pid);
        pssAnon += statusField(pid, "smaps_rollup", "Pss_Anon");
        const uint64_t kernel = statusField(pid, "status", "RssAnon") + statusField(pid, "status", "RssShmem") +
                                statusField(pid, "status", "VmSwap") + statusField(pid, "status", "VmPTE") -
                                statusField(pid, "smaps_rollup", "LazyFree");
        std::smatch match;
        std::regex header("\\[" + std::to_string(pid) + "\\]: 64-bit\tMemspread: (\\d+) B");
        ASSERT_TRUE(std::regex_search(report, match, header));
        EXPECT_EQ(std::stoull(match[1]), kernel);
    }
    auto summary = RKDirtyByCategory(report, "Summary Memspread: ");
    // Anonymous pages in the kernel's sense live in these categories: a private file mapping's
    // copies are under its image segment (relocated ".data", ".data.rel.ro") or its file.
    const uint64_t anonymous = summary["anonymous"] + summary["heap"] + summary["stack"] + summary[".data"] +
                               summary[".data.rel.ro"] + summary["mapped file"];
    EXPECT_NEAR(static_cast<double>(anonymous), static_cast<double>(pssAnon), 0.01 * static_cast<double>(pssAnon))
        << report.substr(report.find("Summary Memspread: "));

    // The parent's mappings, less the pages the workers copied, are in the block all 21 share.
    const size_t parentSection = report.find("[" + std::to_string(fixture.pid()) + "]: 64-bit");
    const size_t all = report.find("Shared with 21 processes:", parentSection);
    ASSERT_NE(all, std::string::npos) << report;
    EXPECT_GE(RKDirtyByCategory(report, "", all)["anonymous"], fixture.area("mappings")->size - 20 * P);
    EXPECT_GE(RKDirtyByCategory(report, "", all)["heap"], fixture.area("heap")->size - 20 * P);
    // A page a worker copied is its own.
    auto own = RKDirtyByCategory(report, "[" + std::to_string(fixture.childPid()) + "]: 64-bit");
    EXPECT_GE(own["anonymous"], P);
    EXPECT_GE(own["heap"], P);
}

// Sets a KSM knob for the test's duration and puts the old value back.
class KsmSetting {
public:
    KsmSetting(const std::string& name, const std::string& value) : path_("/sys/kernel/mm/ksm/" + name) {
        std::ifstream(path_) >> old_;
        ok_ = static_cast<bool>(std::ofstream(path_) << value << std::flush);
    }
    ~KsmSetting() { std::ofstream(path_) << old_; }
    bool ok() const { return ok_; }

private:
    std::string path_, old_;
    bool ok_ = false;
};

TEST(RKSharedAnonymous, PagesMergedByKsmAreSharedByTheirPair) {
    if (geteuid() != 0 || access("/sys/kernel/mm/ksm/run", W_OK) != 0) GTEST_SKIP() << "needs root and KSM";
    KsmSetting scan("pages_to_scan", "10000"), sleep("sleep_millisecs", "10"), run("run", "1");
    ASSERT_TRUE(run.ok());
    RKFixtureProcess fixture;
    ASSERT_TRUE(fixture.start(MEMSPREAD_FORKTREE_FIXTURE, {"--ksm"})) << fixture.error();
    const pid_t second = fixture.childPid();
    // Merging takes a few scans of the mergeable areas.
    for (int i = 0; i < 500 && statusField(second, "ksm_merging_pages", "") == 0; i++) usleep(20000);
    std::ifstream merging("/proc/" + std::to_string(second) + "/ksm_merging_pages");
    uint64_t merged = 0;
    merging >> merged;
    if (merged < 64) GTEST_SKIP() << "KSM merged " << merged << " pages in time";

    RKCommandResult result = RKRunCommand({MEMSPREAD_BINARY, "-f", "bytes", "-t", std::to_string(fixture.pid())});
    ASSERT_TRUE(result.exitedWith(0)) << result.standardError;
    const std::string& report = result.standardOutput;
    // The sibling is the one other process, not the parent, in a block of the second child:
    // their pair's group. (A sanitizer-built parent shares its own pages with each child too.)
    const size_t section = report.find("[" + std::to_string(second) + "]: 64-bit");
    static const std::regex pairHeading(R"(^Shared with [^,\n]+ \[(\d+)\]:$)");
    size_t pair = std::string::npos;
    for (size_t at = report.find("Shared with ", section); at != std::string::npos && pair == std::string::npos;
         at = report.find("Shared with ", at + 1)) {
        if (report.find("Auxiliary data:", section) < at) break;  // past the child's section
        const std::string heading = report.substr(at, report.find('\n', at) - at);
        std::smatch other;
        if (std::regex_match(heading, other, pairHeading) && std::stol(other[1]) != fixture.pid()) pair = at;
    }
    ASSERT_NE(pair, std::string::npos) << report;
    // The merged pages, and any page the parent copied after forking both (then still shared
    // by the two alone).
    EXPECT_GE(RKDirtyByCategory(report, "", pair)["anonymous"], 64 * P) << report;
}

}  // namespace
