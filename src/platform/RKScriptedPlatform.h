// A platform that answers exactly what a test scripted, and records what was asked of it, so
// that every algorithm can be tested on exact kernel answers, including ones Linux never gives
// (a shared region, purge states, the owned-memory pseudo-region, a timebase of 125/3).
#pragma once

#include <cerrno>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/RKPlatform.h"

struct RKScriptedRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    RKRegionSubmapInfo info;
    uint32_t count = RK_REGION_SUBMAP_INFO_COUNT;
    int purgeState = VM_PURGABLE_DENY;
    std::optional<std::string> path;
    RKRegionBasicInfo basic;  // what a top-level query of this entry answers
};

struct RKScriptedProcess {
    RKBsdInfo info;
    std::optional<std::string> executablePath;
    uint32_t dirtyFlags = 0;
    kern_return_t taskResult = KERN_SUCCESS;
    // Short BSD info: 0 and shortStatus, or this errno.
    int shortStatusErrno = 0;
    uint32_t shortStatus = 0;
    // The walk answers these regions in address order, then walkEnd (KERN_INVALID_ADDRESS is
    // the normal end; anything else is a failed walk).
    std::vector<RKScriptedRegion> regions;
    kern_return_t walkEnd = KERN_INVALID_ADDRESS;
    // What the image lister answers.
    std::vector<RKImageSegmentRecord> images;
    kern_return_t imagesResult = KERN_SUCCESS;
    // Page dispositions by page address; pages not listed answer 0. pageQueryResult != 0 fails.
    std::map<uint64_t, uint32_t> dispositions;
    kern_return_t pageQueryResult = KERN_SUCCESS;
    // The ranges of every preparePageRangeQueries call, in order (an empty list releases).
    std::vector<std::vector<RKPageQueryRange>> preparedRanges;
    // Shared anonymous pages by page address: the frame (or RKSwappedPageKey | swap entry).
    // sharedAnonymousResult != KERN_SUCCESS answers that, with sharedAnonymousBytes, which is
    // also the answer of sharedAnonymousBytes().
    std::map<uint64_t, uint64_t> sharedAnonymous;
    kern_return_t sharedAnonymousResult = KERN_SUCCESS;
    uint64_t sharedAnonymousBytes = 0;
    int rusageErrno = 0;
    RKRusageInfo rusage;
    int ledgerErrno = 0;
    std::vector<int64_t> ledgerBalances;  // in template order; entries not given answer 0
    int ownedErrno = ENOENT;
    std::vector<RKOwnedVmObjectRecord> owned;
    // How long a region walk of this process takes: the uptime clock moves on by this much when
    // the walk starts (at address 0), so a test can make a gather slow without waiting for it.
    uint64_t walkNanoseconds = 0;
    // Added to rusage's phys_memspread at every read: a process whose memory keeps moving.
    uint64_t physMemspreadGrowth = 0;
    // Set when the pid has been reused since the listing: a task opened on it then reads this
    // other process's record and executable path.
    std::optional<RKBsdInfo> reusedBy;
    std::optional<std::string> reusedByExecutablePath;
};

class RKScriptedTask : public RKTask {
public:
    explicit RKScriptedTask(pid_t pid) : pid_(pid) {}
    pid_t pid() const override { return pid_; }

private:
    pid_t pid_;
};

class RKScriptedPlatform : public RKPlatform {
public:
    // Processes in the order listAllPids answers them.
    std::vector<RKScriptedProcess> processes;
    bool listFails = false;
    bool sharedRegion = false;  // live processes map a shared region (arm64 bounds when 64-bit)
    uint64_t pageSize = 4096;
    uid_t euid = 0;
    pid_t selfPid = 999999;
    RKClockReadings clocks;
    bool clocksFail = false;
    RKTimebase base{1, 1};
    // The uptime clock. Scripted time passes only when something makes it: a walk that takes
    // time, or a wait for a deadline, which jumps the clock there at once.
    uint64_t uptime = 0;
    std::vector<std::string> ledgerNames{"page_table"};
    int ledgerTemplateErrno = 0;
    RKPageQueryAbilities pageAbilities;
    int32_t selfRegionValue = 0;
    int selfRegionReadErrno = 0;
    int selfRegionWriteErrno = 0;
    std::vector<RKSysVSegment> segments;  // the system's SysV segments
    // What memoryInfo answers: these records, or this failure.
    RKKernelMemoryInfo kernelMemory;
    kern_return_t kernelMemoryResult = KERN_SUCCESS;

    // Adds a process with a BSD record made of the given fields and returns it for further
    // scripting. The reference stays valid until the next addProcess.
    RKScriptedProcess& addProcess(pid_t pid, const std::string& comm, pid_t ppid = 1,
                                  uint32_t flags = PROC_FLAG_LP64);
    RKScriptedProcess* find(pid_t pid);

    // Every call, in order, as "name pid" or "name" (thread-safe).
    std::vector<std::string> calls() const;
    size_t callCount(const std::string& name) const;

    std::optional<std::vector<pid_t>> listAllPids() override;
    std::optional<RKBsdInfo> bsdInfo(pid_t pid) override;
    int shortBsdInfoStatus(pid_t pid, uint32_t& status) override;
    std::optional<std::string> executablePath(pid_t pid) override;
    uint32_t dirtyFlags(pid_t pid) override;
    kern_return_t taskForPid(pid_t pid, std::unique_ptr<RKTask>& task) override;
    std::optional<RKBsdInfo> taskBsdInfo(RKTask& task) override;
    std::optional<std::string> taskExecutablePath(RKTask& task) override;
    bool hasSharedRegion() override;
    kern_return_t regionRecurse(RKTask& task, uint64_t& address, uint64_t& size,
                                RKRegionSubmapInfo& info, uint32_t& count) override;
    kern_return_t region(RKTask& task, uint64_t& address, uint64_t& size,
                         RKRegionBasicInfo& info) override;
    kern_return_t purgableState(RKTask& task, uint64_t address, int& state) override;
    std::optional<std::string> regionFileName(RKTask& task, uint64_t address) override;
    kern_return_t imageSegments(RKTask& task, std::vector<RKImageSegmentRecord>& segments) override;
    kern_return_t pageRangeQuery(RKTask& task, uint64_t address, uint64_t size,
                                 uint32_t* dispositions, uint64_t& count) override;
    void preparePageRangeQueries(RKTask& task, const std::vector<RKPageQueryRange>& ranges) override;
    RKPageSpan pageQueryPopulated(RKTask& task, uint64_t address, uint64_t end) override;
    RKPageQueryAbilities pageQueryAbilities() override;
    kern_return_t sharedAnonymousPages(RKTask& task, const std::vector<RKPageQueryRange>& ranges,
                                       std::vector<RKSharedAnonymousPage>& pages, uint64_t& sharedBytes) override;
    uint64_t sharedAnonymousBytes(RKTask& task, const std::vector<RKPageQueryRange>& ranges) override;
    int pidRusage(RKTask& task, RKRusageInfo& info) override;
    int ledgerTemplate(std::vector<std::string>& names) override;
    int ledgerEntries(RKTask& task, std::vector<int64_t>& balances) override;
    int ownedVmObjects(RKTask& task, std::vector<RKOwnedVmObjectRecord>& records) override;
    int sysVSegments(std::vector<RKSysVSegment>& segments) override;
    void beginGather() override { record("beginGather"); }
    void endGather() override { record("endGather"); }
    kern_return_t memoryInfo(RKKernelMemoryInfo& info) override;
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
    void record(const std::string& name, pid_t pid = -1);
    const RKScriptedRegion* regionAtOrAbove(pid_t pid, uint64_t address);

    mutable std::mutex mutex_;
    std::vector<std::string> calls_;
};
