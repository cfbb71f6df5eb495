#include "process/RKKernelProcess.h"

#include "model/RKAuxData.h"

bool RKKernelProcess::initWithBsdInfo(const RKBsdInfo& info) {
    if (!RKProcess::initWithBsdInfo(info)) return false;
    setIdleExitStatus(1);
    counters_ = std::make_shared<RKAuxDataMap>();
    return true;
}

void RKKernelProcess::gatherData() {
    if (memoryRegions()) return;
    setMemoryRegions(RKRegionList{});
    warnings_.push_back(displayString() + ": the kernel's memory is not measured yet");
}

std::shared_ptr<RKAuxDataMap> RKKernelProcess::auxData() const {
    auto map = std::make_shared<RKAuxDataMap>();
    map->setObject("Maps", counters_ ? counters_ : std::make_shared<RKAuxDataMap>());
    return map;
}
