#include <gtest/gtest.h>

#include <deque>
#include <string>
#include <vector>

#include "driver/RKMemspreadArgs.h"

namespace {

struct Parsed {
    std::optional<RKMemspreadArgs> args;
    RKError error;
    std::string standardError;
};

// Parses `memspread <arguments>` in-process, capturing what the parser printed. Every command
// line stays alive to the end of the test program: getopt keeps pointers into the last one, and a
// parser that does not reset it must then misread the next line rather than read freed memory.
Parsed parse(std::vector<std::string> arguments) {
    static std::deque<std::vector<std::string>> commandLines;
    arguments.insert(arguments.begin(), "memspread");
    std::vector<std::string>& kept = commandLines.emplace_back(std::move(arguments));
    std::vector<char*> argv;
    for (std::string& argument : kept) argv.push_back(argument.data());
    argv.push_back(nullptr);
    Parsed parsed;
    testing::internal::CaptureStderr();
    parsed.args = RKMemspreadArgs::initWithArgc(static_cast<int>(kept.size()), argv.data(), &parsed.error);
    parsed.standardError = testing::internal::GetCapturedStderr();
    return parsed;
}

void expectFailure(const std::vector<std::string>& arguments, int64_t code,
                   const std::optional<std::string>& description) {
    Parsed parsed = parse(arguments);
    std::string line = arguments.empty() ? "" : arguments.front();
    EXPECT_FALSE(parsed.args) << line;
    EXPECT_EQ(parsed.error.domain, RKMemspreadErrorDomain) << line;
    EXPECT_EQ(parsed.error.code, code) << line;
    EXPECT_EQ(parsed.error.localizedDescription, description) << line;
}

}  // namespace

TEST(RKMemspreadArgs, FlagsCombineAndLaterValuesOverrideEarlierOnes) {
    Parsed parsed = parse({"-v", "-y", "-a", "-t", "-s", "-f", "bytes", "--format", "pages", "--wired"});
    ASSERT_TRUE(parsed.args);
    const RKMemspreadArgs& args = *parsed.args;
    EXPECT_TRUE(args.spanlistLikeOutput());
    EXPECT_FALSE(args.summarize()) << "-y after -v only warns";
    EXPECT_EQ(parsed.standardError,
              "WARNING: -y/--summary options are deprecated because summary is the default mode\n");
    EXPECT_TRUE(args.targetAll() && args.targetChildren() && args.skipIdleExitClean());
    EXPECT_EQ(args.summaryFormat(), RKSummaryFormatPages);
    EXPECT_EQ(args.textOptions(), RKTextOptionWired);

    EXPECT_EQ(parse({"--swapped", "--wired"}).args->textOptions(), 3);
    EXPECT_EQ(parse({"--wired", "-w"}).args->textOptions(), 7);

    Parsed vmObject = parse({"--vmObjectDirty", "--physMemspread"});
    EXPECT_FALSE(vmObject.args->shouldGetPhysMemspreadBreakdown());
    EXPECT_TRUE(vmObject.args->didSetShouldGetPhysMemspreadBreakdown());
    EXPECT_EQ(vmObject.standardError, "WARNING: --physMemspread option is deprecated because it is the default mode\n");
}

TEST(RKMemspreadArgs, TargetsFromOptionsAndPermutedPositionals) {
    Parsed parsed = parse({"Finder", "--proc", "12", "-p", "abc", "--pid", "42x", "--pid", " -7",
                           "-x", "dock", "--exclude", "3", "Finder", "--", "-a"});
    ASSERT_TRUE(parsed.args);
    const RKMemspreadArgs& args = *parsed.args;
    EXPECT_EQ(args.potentialTargetProcesses(), (std::set<std::string>{"-a", "12", "Finder", "abc"}));
    EXPECT_FALSE(args.targetAll()) << "after -- an option is a target";
    RKMemspreadArgs::PidMap pids{{-7, std::nullopt}, {42, std::nullopt}};
    EXPECT_EQ(args.targetPids(), pids);
    EXPECT_EQ(args.excludedPidsOrProcesses(), (std::set<std::string>{"3", "dock"}));
}

TEST(RKMemspreadArgs, ValueOptionsAreCheckedStrictly) {
    expectFailure({"-f", "Bytes"}, RKMemspreadErrorFormat,
                  "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.");
    expectFailure({"--sort", "size"}, RKMemspreadErrorSort,
                  "Unrecognized argument 'size' to --sort.\n"
                  "Accepted arguments: dirty, swapped, clean, reclaimable, wired, regions, category");
    expectFailure({"--sort", "Dirt"}, RKMemspreadErrorSort,
                  "Unrecognized argument 'Dirt' to --sort.\n"
                  "Accepted arguments: dirty, swapped, clean, reclaimable, wired, regions, category");
    expectFailure({"--pid", "abc"}, RKMemspreadErrorPid,
                  "'abc' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process name.");
    EXPECT_EQ(parse({"--sort", "REGIONS"}).args->textSort(), "Regions");
    EXPECT_EQ(parse({"--sort", "category"}).args->textSort(), "Category");
}

TEST(RKMemspreadArgs, SampleIntervalMustBeAPositiveNormalNumber) {
    for (const char* refused : {"0", "-1", "abc", "inf", "nan", "1e-310", "1e999", "0x10", "--5", "-0.5"}) {
        expectFailure({"--sample", refused}, RKMemspreadErrorSample,
                      std::string("Invalid sampling interval '") + refused + "'");
    }
    EXPECT_DOUBLE_EQ(parse({"--sample", "0.25"}).args->sampleInterval(), 0.25);
    EXPECT_DOUBLE_EQ(parse({"--sample", " +2.5s"}).args->sampleInterval(), 2.5);
    EXPECT_DOUBLE_EQ(parse({"--sample", ".5"}).args->sampleInterval(), 0.5);
    EXPECT_DOUBLE_EQ(parse({"--sample", "3e-2"}).args->sampleInterval(), 0.03);
}

TEST(RKMemspreadArgs, ChecksAfterParsingClearUnmapped) {
    const std::string warning =
        "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
        "support unmapped owned VM objects\n";
    const std::string notice = "NOTICE: '--unmapped' is redundant when using -a/--all\n";

    Parsed dirty = parse({"--unmapped", "--vmObjectDirty"});
    EXPECT_FALSE(dirty.args->searchForUnmapped());
    EXPECT_EQ(dirty.standardError, warning);

    Parsed all = parse({"-a", "--unmapped"});
    EXPECT_FALSE(all.args->searchForUnmapped());
    EXPECT_EQ(all.standardError, notice);

    EXPECT_EQ(parse({"--vmObjectDirty", "-a", "--unmapped"}).standardError, warning);
    EXPECT_TRUE(parse({"--unmapped"}).args->searchForUnmapped());

    // Checks run only when the options ended normally.
    EXPECT_EQ(parse({"--vmObjectDirty", "--unmapped", "-f", "bad"}).standardError, "");
}

TEST(RKMemspreadArgs, FirstErrorWinsAndHelpIsAnErrorWithoutDescription) {
    expectFailure({"-h", "--sort", "bad", "-q"}, RKMemspreadErrorHelp, std::nullopt);
    expectFailure({"--sort", "bad", "-h"}, RKMemspreadErrorSort,
                  "Unrecognized argument 'bad' to --sort.\n"
                  "Accepted arguments: dirty, swapped, clean, reclaimable, wired, regions, category");

    Parsed unknown = parse({"-q"});
    EXPECT_EQ(unknown.error.code, RKMemspreadErrorOption);
    EXPECT_FALSE(unknown.error.localizedDescription);
    EXPECT_NE(unknown.standardError.find("invalid option"), std::string::npos) << unknown.standardError;
    expectFailure({"-j"}, RKMemspreadErrorOption, std::nullopt);
    expectFailure({"--bogus"}, RKMemspreadErrorOption, std::nullopt);
}

// Regression: getopt keeps its position (and its place inside "-af") between calls; a parse that
// does not fully reset it skips or misreads the next command line.
TEST(RKMemspreadArgs, ParsingTwiceStartsAfresh) {
    expectFailure({"-af", "Bytes", "x"}, RKMemspreadErrorFormat,
                  "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'.");
    Parsed second = parse({"-s", "target"});
    ASSERT_TRUE(second.args);
    EXPECT_TRUE(second.args->skipIdleExitClean());
    EXPECT_FALSE(second.args->targetAll());
    EXPECT_EQ(second.args->potentialTargetProcesses(), std::set<std::string>{"target"});

    expectFailure({"-ht"}, RKMemspreadErrorHelp, std::nullopt);  // stops inside the cluster
    Parsed third = parse({"-v"});
    ASSERT_TRUE(third.args);
    EXPECT_FALSE(third.args->targetChildren());
}

TEST(RKMemspreadArgs, UsageLinesAreAlignedAndListEveryPublicOption) {
    char* text = nullptr;
    size_t size = 0;
    FILE* out = open_memstream(&text, &size);
    printUsage(out);
    std::fclose(out);
    std::string usage(text, size);
    std::free(text);

    std::vector<std::string> lines;
    for (size_t start = 0, end; (end = usage.find('\n', start)) != std::string::npos; start = end + 1) {
        lines.push_back(usage.substr(start, end - start));
    }
    ASSERT_EQ(lines.size(), 17u);
    EXPECT_EQ(usage.back(), '\n');
    for (size_t index = 2; index < lines.size(); ++index) {
        const std::string& line = lines[index];
        size_t column = line.compare(4, 8, "--sample") == 0 ? 43 : 42;
        ASSERT_GT(line.size(), column) << line;
        EXPECT_EQ(line.substr(0, 4), "    ") << line;
        EXPECT_EQ(line[column - 1], ' ') << line;
        EXPECT_NE(line[column], ' ') << line;
    }
    EXPECT_NE(lines[10].find("(default: dirty)"), std::string::npos);
    EXPECT_NE(lines[16].find("fractional \xE2\x80\x94 e.g. 0.5)"), std::string::npos);
    EXPECT_EQ(usage.find("--metrilog"), std::string::npos);
    EXPECT_EQ(parse({"--metrilog", "out.mlj"}).args->metrilogOutputFile(), "out.mlj");
}
