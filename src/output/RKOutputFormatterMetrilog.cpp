#include "output/RKOutputFormatterMetrilog.h"

#include "process/RKAnalysisSettings.h"

// The metrics are not recorded yet: the operations below are where the groups and values go.

std::shared_ptr<RKOutputFormatterMetrilog> RKOutputFormatterMetrilog::initWithPath(const std::string& path) {
    File file(std::fopen(path.c_str(), "w"));
    if (!file) {
        std::perror("Unable to open mlwriter");
        return nullptr;
    }
    std::string logName = RKAnalysisSettings::breakDownPhysMemspread() ? "memspread.phys_memspread"
                                                                       : "memspread.vm_object_dirty";
    return std::make_shared<RKOutputFormatterMetrilog>(Opened{}, std::move(file), std::move(logName));
}

void RKOutputFormatterMetrilog::close() { file_.reset(); }

void RKOutputFormatterMetrilog::startAtTime(const RKTime&) {}

void RKOutputFormatterMetrilog::printProcessHeader(const RKProcess&) {}

void RKOutputFormatterMetrilog::printProcessTotal(uint64_t, const RKProcess&) {}

void RKOutputFormatterMetrilog::printProcessCategories(const RKCategoryMap&, const RKMemoryTotal&) {}

void RKOutputFormatterMetrilog::printSharedCategories(const RKCategoryMap&, const RKProcessGroup&,
                                                      const RKProcess&, bool, const RKMemoryTotal&) {}

void RKOutputFormatterMetrilog::printProcessAuxData(const std::shared_ptr<RKAuxDataMap>&) {}

void RKOutputFormatterMetrilog::printSummaryCategories(const RKCategoryMap&, const RKMemoryTotal&, bool) {}

void RKOutputFormatterMetrilog::printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>&) {}

void RKOutputFormatterMetrilog::endAtTime(const RKTime&) {}
