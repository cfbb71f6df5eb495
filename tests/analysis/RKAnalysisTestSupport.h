// Builders for the analysis tests: processes made directly with the regions a test needs, and
// the program-wide settings installed on a scripted platform for one test.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "support/RKRecordingFormatter.h"
#include "analysis/RKMemspread.h"
#include "model/RKAuxData.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"

inline constexpr uint64_t kPage = 4096;

// A process whose errors, warnings and aux data a test can set.
class RKTestProcess : public RKProcess {
public:
    void addError(const std::string& text) { errors_.push_back(text); }
    void addWarning(const std::string& text) { warnings_.push_back(text); }
    std::shared_ptr<RKAuxDataMap> aux;
    std::shared_ptr<RKAuxDataMap> auxData() const override { return aux; }
};

inline std::shared_ptr<RKTestProcess> makeProcess(pid_t pid, RKRegionList regions, bool hidden = false) {
    auto process = std::make_shared<RKTestProcess>();
    process->setPid(pid);
    process->setPageSize(kPage);
    process->setHiddenFromDisplay(hidden);
    process->setMemoryRegions(std::move(regions));
    return process;
}

// A shared mapping of [offset, offset + size) of `objectId` with `dirty` bytes, the rest clean.
inline std::shared_ptr<RKMemoryRegion> region(uint64_t objectId, uint64_t offset, uint64_t size, uint64_t dirty,
                                              const std::string& name = "shared") {
    auto made = std::make_shared<RKMemoryRegion>();
    made->object_id = objectId;
    made->offset = offset;
    made->start = 0x10000000 + offset;
    made->size = size;
    made->dirtySize = dirty;
    made->cleanNonSpecSize = size - dirty;
    made->share_mode = SM_SHARED;
    made->segment = RKSegmentNoImage;
    made->name = name;
    return made;
}

// Program-wide settings for one test, kept in a scripted platform.
class ScopedSettings {
public:
    explicit ScopedSettings(bool breakDown, bool sharingDisabled = false)
        : scope_(std::make_shared<RKScriptedPlatform>()) {
        RKMemspread::setBreakDownPhysMemspread(breakDown);
        RKMemspread::setSharingAnalysisDisabled(sharingDisabled);
    }
    ~ScopedSettings() {
        RKMemspread::setSharingAnalysisDisabled(false);
        RKAnalysisSettings::resetCache();
    }

private:
    RKScopedPlatform scope_;
};

template <class... Process>
RKProcessList processList(const std::shared_ptr<Process>&... processes) {
    return RKProcessList{processes...};
}

// Analyzes `processes` and prints one report on `formatters`.
inline std::unique_ptr<RKMemspread> report(RKProcessList processes, const RKOutputFormatterList& formatters,
                                           bool verbose = false, bool summarize = false) {
    auto memspread = std::make_unique<RKMemspread>(std::move(processes));
    memspread->analyzeData();
    for (const auto& formatter : formatters) memspread->addOutputFormatter(formatter);
    memspread->printOutputVerbose(verbose, summarize);
    return memspread;
}
