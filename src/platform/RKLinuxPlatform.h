// The platform answered from Linux's /proc and /sys (docs/linux.md says how, call by call).
// The roots are injectable so the readers can be tested on small fake trees.
#pragma once

#include <atomic>
#include <memory>
#include <string>

#include "platform/RKPlatform.h"

struct RKLinuxPageProbe;

class RKFrameVerdictsOfGather;
class RKSysVTableOfGather;

class RKLinuxPlatform : public RKPlatform {
public:
    explicit RKLinuxPlatform(std::string procRoot = "/proc", std::string sysRoot = "/sys");

    const std::string& procRoot() const { return procRoot_; }
    const std::string& sysRoot() const { return sysRoot_; }

    // Processes (RKLinuxProcessList.cpp).
    std::optional<std::vector<pid_t>> listAllPids() override;
    std::optional<RKBsdInfo> bsdInfo(pid_t pid) override;
    int shortBsdInfoStatus(pid_t pid, uint32_t& status) override;
    std::optional<std::string> executablePath(pid_t pid) override;
    uint32_t dirtyFlags(pid_t pid) override;
    kern_return_t taskForPid(pid_t pid, std::unique_ptr<RKTask>& task) override;
    // The same records read through the task's directory descriptor.
    std::optional<RKBsdInfo> taskBsdInfo(RKTask& task) override;
    int taskShortBsdInfoStatus(RKTask& task, uint32_t& status) override;
    std::optional<std::string> taskExecutablePath(RKTask& task) override;
    bool hasSharedRegion() override;

    // Address space (RKLinuxRegions.cpp; page queries RKLinuxPages.cpp).
    kern_return_t regionRecurse(RKTask& task, uint64_t& address, uint64_t& size,
                                RKRegionSubmapInfo& info, uint32_t& count) override;
    kern_return_t region(RKTask& task, uint64_t& address, uint64_t& size,
                         RKRegionBasicInfo& info) override;
    kern_return_t purgableState(RKTask& task, uint64_t address, int& state) override;
    std::optional<std::string> regionFileName(RKTask& task, uint64_t address) override;
    kern_return_t imageSegments(RKTask& task, std::vector<RKImageSegmentRecord>& segments) override;
    kern_return_t pageRangeQuery(RKTask& task, uint64_t address, uint64_t size,
                                 uint32_t* dispositions, uint64_t& count) override;
    // Page queries (RKLinuxPages.cpp).
    void preparePageRangeQueries(RKTask& task, const std::vector<RKPageQueryRange>& ranges) override;
    RKPageSpan pageQueryPopulated(RKTask& task, uint64_t address, uint64_t end) override;
    RKPageQueryAbilities pageQueryAbilities() override;
    // Shared anonymous pages (RKLinuxSharedFrames.cpp).
    kern_return_t sharedAnonymousPages(RKTask& task, const std::vector<RKPageQueryRange>& ranges,
                                       std::vector<RKSharedAnonymousPage>& pages, uint64_t& sharedBytes) override;
    uint64_t sharedAnonymousBytes(RKTask& task, const std::vector<RKPageQueryRange>& ranges) override;

    // Per-process figures (RKLinuxFigures.cpp).
    int pidRusage(RKTask& task, RKRusageInfo& info) override;
    int ledgerTemplate(std::vector<std::string>& names) override;
    int ledgerEntries(RKTask& task, std::vector<int64_t>& balances) override;
    int ownedVmObjects(RKTask& task, std::vector<RKOwnedVmObjectRecord>& records) override;
    int sysVSegments(std::vector<RKSysVSegment>& segments) override;
    void beginGather() override;
    void endGather() override;

    // The kernel (RKLinuxKernelMemoryReader.cpp).
    kern_return_t memoryInfo(RKKernelMemoryInfo& info) override;

    // Settings and host (RKLinuxPlatform.cpp).
    int readSelfRegionMemspread(int32_t& value) override;
    int writeSelfRegionMemspread(int32_t value) override;
    bool getTimes(RKClockReadings& readings) override;
    RKTimebase timebase() override;
    uint64_t uptimeNanoseconds() override;
    void waitForUptime(uint64_t deadline, std::condition_variable& wake,
                       std::unique_lock<std::mutex>& lock) override;
    uint64_t kernelPageSize() override;
    uid_t effectiveUserId() override;
    pid_t ownPid() override;

private:
    // What this root's kernel lets pages be read with: asked for every region, probed once.
    const RKLinuxPageProbe& pageProbe();

    std::string procRoot_;
    std::string sysRoot_;
    std::atomic<const RKLinuxPageProbe*> pageProbe_{nullptr};
    std::shared_ptr<RKSysVTableOfGather> sysV_;  // read once a gather (RKLinuxOwnedObjects.cpp)
    std::shared_ptr<RKFrameVerdictsOfGather> frameVerdicts_;  // read once a gather
};
