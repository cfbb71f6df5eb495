// The command-line parser, in-process. The refusals, their messages and which error wins are
// checked end to end (tests/data/driver-failures.txt); here: what the options set, the checks
// after parsing, and getopt's state between parses.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "support/RKKeptArgv.h"

namespace {

struct Parsed {
    std::optional<RKMemspreadArgs> args;
    RKError error;
    std::string standardError;
};

// Parses `memspread <arguments>` in-process, capturing what the parser printed. A parser that
// does not reset getopt must then misread the next line rather than read freed memory.
Parsed parse(std::vector<std::string> arguments) {
    Parsed parsed;
    testing::internal::CaptureStderr();
    parsed.args = RKParsedArgs(std::move(arguments), &parsed.error);
    parsed.standardError = testing::internal::GetCapturedStderr();
    return parsed;
}

}  // namespace

TEST(RKMemspreadArgs, FlagsCombineAndLaterValuesOverrideEarlierOnes) {
    Parsed parsed = parse({"-v", "-y", "-a", "-t", "-s", "-f", "bytes", "--format", "pages", "--wired", "--sort",
                           "REGIONS", "--vmObjectDirty", "--physMemspread"});
    const RKMemspreadArgs& args = parsed.args.value();
    EXPECT_TRUE(args.spanlistLikeOutput());
    EXPECT_FALSE(args.summarize()) << "-y after -v only warns";
    EXPECT_EQ(parsed.standardError,
              "WARNING: -y/--summary options are deprecated because summary is the default mode\n"
              "WARNING: --physMemspread option is deprecated because it is the default mode\n");
    EXPECT_TRUE(args.targetAll() && args.targetChildren() && args.skipIdleExitClean());
    EXPECT_EQ(args.summaryFormat(), RKSummaryFormatPages);
    EXPECT_EQ(args.textOptions(), RKTextOptionWired);
    EXPECT_EQ(args.textSort(), "Regions") << "matched in any case, stored in the column's own";
    EXPECT_FALSE(args.shouldGetPhysMemspreadBreakdown());
    EXPECT_EQ(parse({"--swapped", "--wired"}).args->textOptions(), 3);
    EXPECT_EQ(parse({"--wired", "-w"}).args->textOptions(), 7);
    EXPECT_DOUBLE_EQ(parse({"--sample", " +2.5s"}).args->sampleInterval(), 2.5) << "the leading number counts";
}

TEST(RKMemspreadArgs, TargetsFromOptionsAndPermutedPositionals) {
    auto args = parse({"editor", "--proc", "12", "-p", "abc", "--pid", "42x", "--pid", " -7", "-x", "panel",
                       "--exclude", "3", "editor", "--", "-a"}).args.value();
    EXPECT_EQ(args.potentialTargetProcesses(), (std::set<std::string>{"-a", "12", "editor", "abc"}));
    EXPECT_FALSE(args.targetAll()) << "after -- an option is a target";
    EXPECT_EQ(args.targetPids(), (RKMemspreadArgs::PidMap{{-7, std::nullopt}, {42, std::nullopt}}));
    EXPECT_EQ(args.excludedPidsOrProcesses(), (std::set<std::string>{"3", "panel"}));
}

TEST(RKMemspreadArgs, ChecksAfterParsingClearUnmapped) {
    const std::string warning =
        "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
        "support unmapped owned VM objects\n";
    Parsed dirty = parse({"--vmObjectDirty", "-a", "--unmapped"});
    EXPECT_FALSE(dirty.args->searchForUnmapped());
    EXPECT_EQ(dirty.standardError, warning) << "the warning, not also the notice";
    Parsed all = parse({"-a", "--unmapped"});
    EXPECT_FALSE(all.args->searchForUnmapped());
    EXPECT_EQ(all.standardError, "NOTICE: '--unmapped' is redundant when using -a/--all\n");
}

// Regression: getopt keeps its position (and its place inside "-af") between calls; a parse that
// does not fully reset it skips or misreads the next command line.
TEST(RKMemspreadArgs, ParsingTwiceStartsAfresh) {
    EXPECT_EQ(parse({"-af", "Bytes", "x"}).error.code, RKMemspreadErrorFormat);
    RKMemspreadArgs second = parse({"-s", "target"}).args.value();
    EXPECT_TRUE(second.skipIdleExitClean());
    EXPECT_FALSE(second.targetAll());
    EXPECT_EQ(second.potentialTargetProcesses(), std::set<std::string>{"target"});

    EXPECT_EQ(parse({"-ht"}).error.code, RKMemspreadErrorHelp);  // stops inside the cluster
    EXPECT_FALSE(parse({"-v"}).args.value().targetChildren());
}
