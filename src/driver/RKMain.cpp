#include "driver/RKMain.h"

#include <unistd.h>

#include <cstdio>
#include <new>

#include "analysis/RKMemspread.h"
#include "driver/RKMemspreadArgs.h"
#include "driver/RKSampling.h"
#include "driver/RKSingleRun.h"
#include "output/RKOutputFormatterJSON.h"
#include "output/RKOutputFormatterMetrilog.h"
#include "output/RKOutputFormatterText.h"
#include "platform/RKPlatform.h"
#include "process/RKAnalysisSettings.h"

namespace {

constexpr int kExitSuccess = 0;
constexpr int kExitFailure = 1;

// A start that failed after output files were named: none of them may survive, even one that
// existed before this run, since it would look like a report.
int outputRemovalExit(const RKMemspreadArgs& args) {
    if (args.JSONOutputFile()) unlink(args.JSONOutputFile()->c_str());
    if (args.metrilogOutputFile()) unlink(args.metrilogOutputFile()->c_str());
    return kExitFailure;
}

// An argument error: its description (if it has one; getopt_long has spoken for itself
// otherwise), then the usage. Only -h is a success.
int argumentErrorExit(const RKError& error) {
    if (error.localizedDescription) std::fprintf(stderr, "%s\n", error.localizedDescription->c_str());
    printUsage(stdout);
    bool help = error.domain == RKMemspreadErrorDomain && error.code == RKMemspreadErrorHelp;
    return help ? kExitSuccess : kExitFailure;
}

std::shared_ptr<RKOutputFormatterText> makeTextFormatter(const RKMemspreadArgs& args) {
    try {
        return std::make_shared<RKOutputFormatterText>(args.summaryFormat(), args.textOptions(), args.textSort());
    } catch (const std::bad_alloc&) {
        return nullptr;
    }
}

// The JSON and metrics-log formatters, in that order after the text formatter. False when one of
// them cannot be opened (the message is already printed).
bool appendFileFormatters(const RKMemspreadArgs& args, RKOutputFormatterList& formatters) {
    if (args.JSONOutputFile()) {
        auto json = RKOutputFormatterJSON::initWithPath(*args.JSONOutputFile());
        if (!json) {
            std::fprintf(stderr, "Unable to create JSON output\n");
            return false;
        }
        formatters.push_back(std::move(json));
    }
    if (args.metrilogOutputFile()) {
        auto metrilog = RKOutputFormatterMetrilog::initWithPath(*args.metrilogOutputFile());
        if (!metrilog) {
            std::fprintf(stderr, "Unable to create metrilog output\n");
            return false;
        }
        formatters.push_back(std::move(metrilog));
    }
    return true;
}

// Target resolution with the driver's messages. Nothing when the run cannot go on.
std::optional<RKTargetMap> resolveTargets(RKMemspreadArgs& args) {
    RKError error;
    std::optional<RKTargetMap> targets = args.targetProcessesAndError(&error);
    if (!targets) {
        // Only an unreadable process list under -a or --unmapped fails without a description.
        std::fprintf(stderr, "%s\n",
                     error.localizedDescription ? error.localizedDescription->c_str()
                                                : "Unable to obtain system process list");
        printUsage(stdout);
        return std::nullopt;
    }
    if (targets->empty()) {
        std::fprintf(stderr, "Unable to find any processes matching the supplied process names or pids "
                             "(try as root?)\n");
        return std::nullopt;
    }
    if (error.localizedDescription) std::fprintf(stderr, "%s\n", error.localizedDescription->c_str());
    return targets;
}

void closeFormatters(const RKOutputFormatterList& formatters) {
    for (const auto& formatter : formatters) {
        if (formatter->implementsClose()) formatter->close();
    }
}

}  // namespace

int RKMain(int argc, char** argv) {
    RKOutputFormatterList formatters;
    RKError parseError;
    std::optional<RKMemspreadArgs> args = RKMemspreadArgs::initWithArgc(argc, argv, &parseError);
    if (!args) return argumentErrorExit(parseError);
    if (!RKAnalysisSettings::applyEnvironment("memspread")) return kExitFailure;

    if (args->shouldGetPhysMemspreadBreakdown()) RKMemspread::setBreakDownPhysMemspread(true);

    if ((args->targetAll() || args->searchForUnmapped()) && RKPlatform::current().effectiveUserId() != 0) {
        std::fprintf(stderr, "Must run as root.\n");
        return kExitFailure;
    }

    auto text = makeTextFormatter(*args);
    if (!text) {
        std::fprintf(stderr, "Unable to initialize text output\n");
        return kExitFailure;
    }
    formatters.push_back(std::move(text));
    if (!appendFileFormatters(*args, formatters)) return outputRemovalExit(*args);

    std::optional<RKTargetMap> targets = resolveTargets(*args);
    if (!targets) return outputRemovalExit(*args);

    if (args->sampleInterval() != 0) {
        // Sampling resolves the targets anew at every sample; this map only proved there are some.
        targets.reset();
        int status = RKRunSampling(*args, formatters);
        closeFormatters(formatters);
        if (status != kExitSuccess) return outputRemovalExit(*args);
    } else {
        RKSingleRun(*args, *targets, formatters);
        closeFormatters(formatters);
    }
    return kExitSuccess;
}
