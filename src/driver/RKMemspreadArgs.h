// The arguments record: the command line parsed once, at start, into typed settings. The run
// driver reads it, target selection reads and extends its target sets, sampling reads it again at
// every sample.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <cstdio>
#include <map>
#include <optional>
#include <set>
#include <string>

#include "model/RKError.h"
#include "output/RKTextSettings.h"
#include "process/RKTargetMap.h"

// Codes of the RKMemspreadError domain (command line and target selection).
enum RKMemspreadErrorCode : int64_t {
    RKMemspreadErrorCreate = 0,          // the record could not be created
    RKMemspreadErrorHelp = 1,            // -h / --help: not a failure, exit status 0
    RKMemspreadErrorFormat = 2,          // -f / --format with an unknown value
    RKMemspreadErrorSort = 3,            // --sort with an unknown column
    RKMemspreadErrorPid = 4,             // --pid without digits; unresolved targets
    RKMemspreadErrorOption = 5,          // unknown option or missing argument (getopt complained)
    RKMemspreadErrorVmsnapMode = 6,      // vmsnaps of conflicting analysis modes
    RKMemspreadErrorVmsnapOpen = 7,      // a path that is neither a vmsnap nor a process
    RKMemspreadErrorNoTarget = 8,        // nothing to measure
    RKMemspreadErrorSample = 9,          // --sample value refused
};

class RKMemspreadArgs {
public:
    // pid -> the name under which it was found, or nullopt when it was given as a number.
    using PidMap = std::map<pid_t, std::optional<std::string>>;
    using StringSet = std::set<std::string>;

    RKMemspreadArgs() = default;  // every field at its initial value

    // initWithArgc:argv:error: parses the command line with getopt_long (which permutes argv and
    // prints its own complaints). Warnings and notices go to standard error as they are met.
    // Returns nothing on an argument error, and fills `error` when given (RKMemspreadErrorHelp
    // for -h). Resets getopt's global state first, so it can be called more than once.
    static std::optional<RKMemspreadArgs> initWithArgc(int argc, char** argv, RKError* error = nullptr);

    // Resolves the target sets to process objects (target selection). Changes the record: vmsnap
    // paths leave potentialTargetProcesses, resolved names and children enter targetPids, vmsnap
    // inputs may set the analysis-mode fields.
    std::optional<RKTargetMap> targetProcessesAndError(RKError* error = nullptr);

    bool targetChildren() const { return targetChildren_; }
    void setTargetChildren(bool value) { targetChildren_ = value; }
    bool targetAll() const { return targetAll_; }
    void setTargetAll(bool value) { targetAll_ = value; }
    bool skipIdleExitClean() const { return skipIdleExitClean_; }
    void setSkipIdleExitClean(bool value) { skipIdleExitClean_ = value; }
    bool spanlistLikeOutput() const { return spanlistLikeOutput_; }
    void setSpanlistLikeOutput(bool value) { spanlistLikeOutput_ = value; }
    bool summarize() const { return summarize_; }
    void setSummarize(bool value) { summarize_ = value; }
    bool shouldGetPhysMemspreadBreakdown() const { return shouldGetPhysMemspreadBreakdown_; }
    void setShouldGetPhysMemspreadBreakdown(bool value) { shouldGetPhysMemspreadBreakdown_ = value; }
    bool didSetShouldGetPhysMemspreadBreakdown() const { return didSetShouldGetPhysMemspreadBreakdown_; }
    void setDidSetShouldGetPhysMemspreadBreakdown(bool value) { didSetShouldGetPhysMemspreadBreakdown_ = value; }
    bool searchForUnmapped() const { return searchForUnmapped_; }
    void setSearchForUnmapped(bool value) { searchForUnmapped_ = value; }
    bool excludeSelf() const { return excludeSelf_; }
    void setExcludeSelf(bool value) { excludeSelf_ = value; }
    int64_t summaryFormat() const { return summaryFormat_; }
    void setSummaryFormat(int64_t value) { summaryFormat_ = value; }
    int64_t textOptions() const { return textOptions_; }
    void setTextOptions(int64_t value) { textOptions_ = value; }
    const std::string& textSort() const { return textSort_; }
    void setTextSort(std::string value) { textSort_ = std::move(value); }
    const std::optional<std::string>& JSONOutputFile() const { return JSONOutputFile_; }
    void setJSONOutputFile(std::optional<std::string> value) { JSONOutputFile_ = std::move(value); }
    const std::optional<std::string>& metrilogOutputFile() const { return metrilogOutputFile_; }
    void setMetrilogOutputFile(std::optional<std::string> value) { metrilogOutputFile_ = std::move(value); }
    const PidMap& targetPids() const { return targetPids_; }
    PidMap& targetPids() { return targetPids_; }
    void setTargetPids(PidMap value) { targetPids_ = std::move(value); }
    const StringSet& potentialTargetProcesses() const { return potentialTargetProcesses_; }
    StringSet& potentialTargetProcesses() { return potentialTargetProcesses_; }
    void setPotentialTargetProcesses(StringSet value) { potentialTargetProcesses_ = std::move(value); }
    const StringSet& excludedPidsOrProcesses() const { return excludedPidsOrProcesses_; }
    StringSet& excludedPidsOrProcesses() { return excludedPidsOrProcesses_; }
    void setExcludedPidsOrProcesses(StringSet value) { excludedPidsOrProcesses_ = std::move(value); }
    double sampleInterval() const { return sampleInterval_; }
    void setSampleInterval(double value) { sampleInterval_ = value; }

private:
    // One option as getopt_long returned it; false (and `error`) ends parsing.
    bool _applyOption(int option, const char* argument, RKError* error);
    // The WARNING / NOTICE checks that run when the options ended normally.
    void _checkAfterParsing();

    bool targetChildren_ = false;
    bool targetAll_ = false;
    bool skipIdleExitClean_ = false;
    bool spanlistLikeOutput_ = false;
    bool summarize_ = true;
    bool shouldGetPhysMemspreadBreakdown_ = true;
    bool didSetShouldGetPhysMemspreadBreakdown_ = false;
    bool searchForUnmapped_ = false;
    bool excludeSelf_ = true;
    int64_t summaryFormat_ = RKSummaryFormatFormatted;
    int64_t textOptions_ = 0;
    std::string textSort_{RKTextSortColumns.front()};
    std::optional<std::string> JSONOutputFile_;
    std::optional<std::string> metrilogOutputFile_;
    PidMap targetPids_;
    StringSet potentialTargetProcesses_;
    StringSet excludedPidsOrProcesses_;
    double sampleInterval_ = 0.0;
};

// The usage text (standard output unless told otherwise). Never exits.
void printUsage(FILE* out = stdout);
