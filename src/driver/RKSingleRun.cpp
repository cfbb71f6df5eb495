#include "driver/RKSingleRun.h"

#include <unistd.h>

#include <cstdio>
#include <memory>
#include <utility>

#include "analysis/RKCancelSource.h"
#include "analysis/RKMemspread.h"

namespace {

// The last run's processes, regions, objects and groups. The program exits right after its
// report, and releasing hundreds of thousands of them one by one only delays that exit: they
// stay reachable from here (leak checkers count them as in use) until the next run, if any.
RKMemspread::ReportRemains* gLastRunRemains = nullptr;

}  // namespace

void RKSingleRun(const RKMemspreadArgs& args, const RKTargetMap& targets,
                 const RKOutputFormatterList& formatters) {
    // The map is ordered by key (pid for live processes), which makes the identity tie-breaks of
    // the analysis repeatable from run to run.
    RKProcessList processes;
    processes.reserve(targets.size());
    for (const auto& entry : targets) processes.push_back(entry.second);
    RKMemspread memspread(std::move(processes));
    memspread.setMeasuresWholeSystem(args.targetAll());
    memspread.setKeepsReportRemains(true);

    // On a terminal Ctrl-C simply ends the program; with redirected output it cuts gathering
    // short and the report of what was gathered is still written.
    std::unique_ptr<RKCancelSource> cancelSource;
    if (!isatty(STDOUT_FILENO)) {
        cancelSource = RKMemspread::installCancelHandler([&memspread] {
            memspread.cancel();
            std::fprintf(stderr, "Exiting early due to SIGINT\n");
        });
    }
    memspread.gatherData();
    memspread.analyzeData();
    // Restores SIGINT's default action before any output, so Ctrl-C while writing ends the process.
    cancelSource.reset();

    for (const auto& formatter : formatters) memspread.addOutputFormatter(formatter);
    memspread.printOutputVerbose(args.spanlistLikeOutput(), args.summarize());
    delete std::exchange(gLastRunRemains, new RKMemspread::ReportRemains(memspread.takeReportRemains()));
}
