// The metrics log: what one report records (per-process groups, the summary group, aux data and
// the gathering time), that its lines stay JSON objects whatever bytes a name holds, and that a
// log read before close holds every finished report.
#include <gtest/gtest.h>
#include <unistd.h>


#include "model/RKAuxData.h"
#include "model/RKMemoryCategory.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "model/RKProcessGroup.h"
#include "model/RKTime.h"
#include "output/RKOutputFormatterMetrilog.h"
#include "platform/RKScriptedPlatform.h"
#include "process/RKAnalysisSettings.h"
#include "support/RKRunCommand.h"

namespace {

struct TestProcess : RKProcess {
    using RKProcess::errors_;
};

std::shared_ptr<TestProcess> process(pid_t pid, const std::string& name) {
    auto made = std::make_shared<TestProcess>();
    made->setPid(pid);
    made->setName(name);
    return made;
}

// One category per entry, named `name` (full name "name detail") with its dirty and swapped totals.
RKCategoryMap categories(std::initializer_list<std::tuple<std::string, std::string, uint64_t, uint64_t>> list) {
    RKCategoryMap map;
    for (const auto& [name, detail, dirty, swapped] : list) {
        auto region = std::make_shared<RKMemoryRegion>();
        region->name = name;
        region->detailedName = detail;
        auto object = std::make_shared<RKMemoryObject>();
        object->addRegion(region, 4096);
        auto& category = map[name + detail] = std::make_shared<RKMemoryCategory>(false);
        category->setFirstMemoryObject(object);
        category->setTotalDirtySize(dirty);
        category->setTotalSwappedSize(swapped);
    }
    return map;
}

RKTime continuousAt(uint64_t nanoseconds) { return RKTime::fromReadings({0, nanoseconds, 978307200, 0}); }

struct Log {
    std::shared_ptr<RKScriptedPlatform> platform = std::make_shared<RKScriptedPlatform>();  // wall clock at 0
    RKScopedPlatform scope{platform};
    std::string path = testing::TempDir() + "rkmetrilog-" + std::to_string(getpid()) + ".mlj";
    std::shared_ptr<RKOutputFormatterMetrilog> formatter;
    Log() {
        platform->selfRegionValue = 1;
        RKAnalysisSettings::resetCache();
        formatter = RKOutputFormatterMetrilog::initWithPath(path);
    }
    ~Log() { std::remove(path.c_str()); }
};

const std::string kHeader =
    R"({"log":"memspread.phys_memspread","format":1,"description":"Memory measurements gathered by the memspread(1) )"
    R"(tool","primary_metric":"total_memory,process=ALL_PROCESSES"})"
    "\n";

std::string line(int group, const std::string& metric, const std::string& unit, const std::string& value,
                 const std::string& process, const std::string& rest = R"("labels":{},"tags":[])") {
    std::string variables = process.empty() ? "{}" : R"({"process":")" + process + R"("})";
    return R"({"group":)" + std::to_string(group) + R"(,"time":0,"metric":")" + metric + R"(","unit":")" + unit +
           R"(","value":)" + value + R"(,"variables":)" + variables + "," + rest + "}\n";
}

const std::string kContext = R"("labels":{},"tags":["context"])";
const std::string kSummary = R"("labels":{},"tags":["summary"])";

}  // namespace

// A process whose own and shared memory both hold "heap /h" records it once, summed; shared
// memory before any own memory is not recorded; a process with errors records its aux data under
// its own name; a summary without aux data records one "aux_data" of 0; 2.5 ms are 2 ms.
TEST(RKMetricsLog, RecordsProcessGroupsAndTheSummaryGroupOfAReport) {
    Log log;
    ASSERT_TRUE(log.formatter) << log.path;
    RKOutputFormatterMetrilog& out = *log.formatter;
    auto alpha = process(10, "alpha"), beta = process(20, "beta"), failed = process(30, "failed");
    failed->errors_ = {"failed [30]: task_for_pid failed"};
    RKProcessGroupMinimal sharers;
    sharers.addProcess(alpha);
    sharers.addProcess(beta);
    auto both = sharers.immutableCopy();
    const RKCategoryMap sharedHeap = categories({{"heap", "/h", 2000, 0}});

    out.startAtTime(continuousAt(1000000000));
    out.printProcessHeader(*alpha);
    out.printProcessTotal(4000, *alpha);
    out.printProcessCategories(categories({{"heap", "/h", 1000, 24}, {"stack", "", 976, 0}}), {});
    out.printSharedCategories(sharedHeap, *both, *alpha, false, {});
    auto kernel = std::make_shared<RKAuxDataMap>();
    kernel->setObject("page_table", std::make_shared<RKAuxData>(-8, false));
    auto aux = std::make_shared<RKAuxDataMap>();
    aux->setObject("kernel", kernel);
    aux->setObject("phys", std::make_shared<RKAuxData>(7, true));
    out.printProcessAuxData(aux);
    out.printProcessHeader(*beta);
    out.printProcessTotal(2000, *beta);
    out.printSharedCategories(sharedHeap, *both, *beta, false, {});
    out.printProcessAuxData(nullptr);
    out.printProcessHeader(*failed);
    out.printProcessCategories({}, {});
    out.printProcessAuxData(nullptr);
    out.printProcessesWithWarnings({}, {failed}, {});
    out.printSummaryCategories(categories({{"heap", "", 3000, 24}, {"stack", "", 976, 0}}),
                               {.dirty = 3976, .swapped = 24}, true);
    out.printGlobalAuxData(nullptr);
    out.endAtTime(continuousAt(1002500000));
    out.close();

    EXPECT_EQ(RKFileText(log.path),
              kHeader + line(1, "total_memory", "B", "4000", "alpha", R"("labels":{"pid":"10"},"tags":["summary"])") +
                  line(1, "heap /h", "B", "3024", "alpha") + line(1, "stack", "B", "976", "alpha") +
                  line(1, "aux_data.kernel.page_table", "B", "-8", "alpha", kContext) +
                  line(1, "aux_data.phys", "B", "7", "alpha", kContext) +
                  line(2, "total_memory", "B", "2000", "beta", R"("labels":{"pid":"20"},"tags":["summary"])") +
                  line(2, "aux_data", "B", "0", "beta", kContext) + line(3, "aux_data", "B", "0", "failed", kContext) +
                  line(4, "total_memory", "B", "4000", "ALL_PROCESSES", kSummary) +
                  line(4, "heap", "B", "3024", "ALL_PROCESSES") + line(4, "stack", "B", "976", "ALL_PROCESSES") +
                  line(4, "aux_data", "B", "0", "ALL_PROCESSES", kContext) +
                  line(4, "gather_duration", "ms", "2", "", kContext));
}

// Reports of a sampling run append their groups; what a finished report recorded is in the file
// before the log is closed, and stays one JSON object per line whatever bytes a name holds.
TEST(RKMetricsLog, EveryFinishedReportIsInTheFileAsJsonLines) {
    Log log;
    ASSERT_TRUE(log.formatter);
    RKOutputFormatterMetrilog& out = *log.formatter;
    out.configureForMultipleOutputs();
    auto odd = process(5, "q\"b\\n\nt\tc\x01 caf\xc3\xa9 bad\xff\xc0");
    for (uint64_t sample = 0; sample < 2; sample++) {
        out.startAtTime(continuousAt(sample));
        out.printProcessHeader(*odd);
        out.printProcessTotal(sample, *odd);
        out.printProcessCategories(categories({{odd->name(), "", 1, 0}}), {});
        out.printProcessAuxData(nullptr);
        out.printSummaryCategories({}, {}, false);
        out.printGlobalAuxData(nullptr);
        out.endAtTime(continuousAt(sample));
    }
    // Not closed: a reader sees both reports whole, the last line included.
    const char* check = R"(import json, sys
records = [json.loads(line) for line in open(sys.argv[1], encoding="utf-8")]
assert all(isinstance(r, dict) for r in records)
durations = [r["group"] for r in records if r.get("metric") == "gather_duration"]
print(len(records), durations, records[1]["variables"]["process"])
)";
    RKCommandResult parsed = RKRunCommand({"python3", "-c", check, log.path});
    EXPECT_TRUE(parsed.exitedWith(0)) << parsed.standardError;
    EXPECT_EQ(parsed.standardOutput, "13 [2, 4] q\"b\\n\nt\tc\x01 caf\xc3\xa9 bad\xef\xbf\xbd\xef\xbf\xbd\n");
}
