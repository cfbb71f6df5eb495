// Builders for the analysis tests: processes made directly with the regions a test needs, and
// the program-wide settings installed on a scripted platform for one test.
#pragma once

#include <memory>
#include <string>

#include "analysis/RKMemspread.h"
#include "model/RKAuxData.h"
#include "model/RKMemoryRegion.h"
#include "platform/RKScriptedPlatform.h"
#include "support/RKRecordingFormatter.h"

// A process whose errors, warnings and aux data a test can set.
class RKTestProcess : public RKProcess {
public:
    void addError(const std::string& text) { errors_.push_back(text); }
    void addWarning(const std::string& text) { warnings_.push_back(text); }
    int64_t auxMemspread = 0;  // aux data with this "memspread" leaf; none when 0
    std::shared_ptr<RKAuxDataMap> auxData() const override {
        if (auxMemspread == 0) return nullptr;
        return std::make_shared<RKAuxDataMap>(
            RKAuxDataMap::Entries{{"memspread", std::make_shared<RKAuxData>(auxMemspread, true)}});
    }
};

inline std::shared_ptr<RKTestProcess> makeProcess(pid_t pid, RKRegionList regions, bool hidden = false) {
    auto process = std::make_shared<RKTestProcess>();
    process->setPid(pid);
    process->setPageSize(4096);
    process->setHiddenFromDisplay(hidden);
    process->setMemoryRegions(std::move(regions));
    return process;
}

// A shared mapping, named "shared", of [offset, offset + size) of `objectId` with `dirty` bytes,
// the rest clean.
inline std::shared_ptr<RKMemoryRegion> region(uint64_t objectId, uint64_t offset, uint64_t size, uint64_t dirty) {
    auto made = std::make_shared<RKMemoryRegion>();
    made->object_id = objectId;
    made->offset = offset;
    made->start = 0x10000000 + offset;
    made->size = size;
    made->dirtySize = dirty;
    made->cleanNonSpecSize = size - dirty;
    made->share_mode = SM_SHARED;
    made->name = "shared";
    return made;
}

// Program-wide settings for one test, kept in a scripted platform.
struct ScopedSettings {
    explicit ScopedSettings(bool breakDown, bool sharingDisabled = false) {
        RKMemspread::setBreakDownPhysMemspread(breakDown);
        RKMemspread::setSharingAnalysisDisabled(sharingDisabled);
    }
    ~ScopedSettings() {
        RKMemspread::setSharingAnalysisDisabled(false);
        RKAnalysisSettings::resetCache();
    }
    RKScopedPlatform scope{std::make_shared<RKScriptedPlatform>()};
};

// Analyzes `processes` and prints one report on `formatters`.
inline void report(RKProcessList processes, const RKOutputFormatterList& formatters, bool verbose = false) {
    RKMemspread memspread(std::move(processes));
    memspread.analyzeData();
    for (const auto& formatter : formatters) memspread.addOutputFormatter(formatter);
    memspread.printOutputVerbose(verbose, false);
}
