#include "driver/RKSampling.h"

#include <cstdio>

#include "analysis/RKCancelSource.h"
#include "analysis/RKMemspread.h"
#include "driver/RKSampler.h"

namespace {

void configureFormatters(const RKOutputFormatterList& formatters) {
    for (const auto& formatter : formatters) {
        if (!formatter->implementsConfigureForMultipleOutputs()) {
            std::fprintf(stderr, "Selected output format (%s) does not support sampling mode\n",
                         formatter->className());
            continue;
        }
        formatter->configureForMultipleOutputs();
    }
}

// The first resolution took every snapshot file out of the targets, and samples measure live
// processes only: when nothing live is left to resolve, no sample could ever measure anything.
bool hasLiveTargets(const RKMemspreadArgs& args) {
    return args.targetAll() || !args.targetPids().empty() || !args.potentialTargetProcesses().empty();
}

}  // namespace

int RKRunSampling(RKMemspreadArgs& args, RKOutputFormatterList& formatters) {
    if (!hasLiveTargets(args)) {
        std::fprintf(stderr, "Sampling mode measures live processes only; vmsnap files cannot be sampled\n");
        return 1;
    }
    configureFormatters(formatters);
    RKSampler sampler(args, formatters);

    // Routed before any sampling thread exists, so that every thread inherits SIGINT blocked
    // and the signal reaches the handler. Without it Ctrl-C would end the program with its
    // outputs unfinished, so sampling does not start.
    std::unique_ptr<RKCancelSource> cancelSource = RKMemspread::installCancelHandler([&sampler] { sampler.stop(); });
    if (!cancelSource) {
        std::fprintf(stderr, "Unable to receive SIGINT, so sampling could not be stopped cleanly\n");
        return 1;
    }
    sampler.start();
    std::fprintf(stderr, "Sampling at %.3gs interval... (<ctrl-c> to stop)\n", args.sampleInterval());
    sampler.waitForStop();
    std::fprintf(stderr, "Analyzing and writing output...\n");
    cancelSource.reset();
    sampler.drain();
    return 0;
}
