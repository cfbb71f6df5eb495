#include "platform/RKScriptedPlatform.h"

#include <algorithm>
#include <cstring>

RKScriptedProcess& RKScriptedPlatform::addProcess(pid_t pid, const std::string& comm, pid_t ppid,
                                                  uint32_t flags) {
    RKScriptedProcess process;
    process.info.pbi_pid = pid;
    process.info.pbi_ppid = ppid;
    process.info.pbi_flags = flags;
    std::strncpy(process.info.pbi_comm, comm.c_str(), MAXCOMLEN);
    processes.push_back(std::move(process));
    return processes.back();
}

RKScriptedProcess* RKScriptedPlatform::find(pid_t pid) {
    for (auto& process : processes)
        if (process.info.pbi_pid == pid) return &process;
    return nullptr;
}

void RKScriptedPlatform::record(const std::string& name, pid_t pid) {
    std::lock_guard<std::mutex> lock(mutex_);
    calls_.push_back(pid < 0 ? name : name + " " + std::to_string(pid));
}

std::vector<std::string> RKScriptedPlatform::calls() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return calls_;
}

size_t RKScriptedPlatform::callCount(const std::string& name) const {
    std::lock_guard<std::mutex> lock(mutex_);
    return static_cast<size_t>(std::count_if(calls_.begin(), calls_.end(), [&](const std::string& call) {
        return call == name || call.rfind(name + " ", 0) == 0;
    }));
}

std::optional<std::vector<pid_t>> RKScriptedPlatform::listAllPids() {
    record("listAllPids");
    if (listFails) return std::nullopt;
    std::vector<pid_t> pids;
    for (const auto& process : processes) pids.push_back(process.info.pbi_pid);
    return pids;
}

std::optional<RKBsdInfo> RKScriptedPlatform::bsdInfo(pid_t pid) {
    record("bsdInfo", pid);
    if (auto* process = find(pid)) return process->info;
    return std::nullopt;
}

int RKScriptedPlatform::shortBsdInfoStatus(pid_t pid, uint32_t& status) {
    record("shortBsdInfoStatus", pid);
    auto* process = find(pid);
    if (!process) return ESRCH;
    if (process->shortStatusErrno != 0) return process->shortStatusErrno;
    status = process->shortStatus;
    return 0;
}

std::optional<std::string> RKScriptedPlatform::executablePath(pid_t pid) {
    record("executablePath", pid);
    if (auto* process = find(pid)) return process->executablePath;
    return std::nullopt;
}

std::optional<RKBsdInfo> RKScriptedPlatform::taskBsdInfo(RKTask& task) {
    record("taskBsdInfo", task.pid());
    auto* process = find(task.pid());
    if (!process) return std::nullopt;
    return process->reusedBy ? process->reusedBy : process->info;
}

std::optional<std::string> RKScriptedPlatform::taskExecutablePath(RKTask& task) {
    record("taskExecutablePath", task.pid());
    auto* process = find(task.pid());
    if (!process) return std::nullopt;
    return process->reusedBy ? process->reusedByExecutablePath : process->executablePath;
}

uint32_t RKScriptedPlatform::dirtyFlags(pid_t pid) {
    record("dirtyFlags", pid);
    if (auto* process = find(pid)) return process->dirtyFlags;
    return 0;
}

kern_return_t RKScriptedPlatform::taskForPid(pid_t pid, std::unique_ptr<RKTask>& task) {
    record("taskForPid", pid);
    auto* process = find(pid);
    if (!process) return KERN_INVALID_ARGUMENT;
    if (process->taskResult != KERN_SUCCESS) return process->taskResult;
    task = std::make_unique<RKScriptedTask>(pid);
    return KERN_SUCCESS;
}

bool RKScriptedPlatform::hasSharedRegion() { return sharedRegion; }

const RKScriptedRegion* RKScriptedPlatform::regionAtOrAbove(pid_t pid, uint64_t address) {
    auto* process = find(pid);
    if (!process) return nullptr;
    for (const auto& region : process->regions)
        if (region.start + region.size > address) return &region;
    return nullptr;
}

kern_return_t RKScriptedPlatform::regionRecurse(RKTask& task, uint64_t& address, uint64_t& size,
                                                RKRegionSubmapInfo& info, uint32_t& count) {
    record("regionRecurse", task.pid());
    if (address == 0) {
        auto* process = find(task.pid());
        std::lock_guard<std::mutex> lock(mutex_);
        if (process) uptime += process->walkNanoseconds;
    }
    const auto* region = regionAtOrAbove(task.pid(), address);
    if (!region) {
        auto* process = find(task.pid());
        return process ? process->walkEnd : MACH_SEND_INVALID_DEST;
    }
    address = region->start;
    size = region->size;
    info = region->info;
    count = region->count;
    return KERN_SUCCESS;
}

kern_return_t RKScriptedPlatform::region(RKTask& task, uint64_t& address, uint64_t& size,
                                         RKRegionBasicInfo& info) {
    record("region", task.pid());
    const auto* region = regionAtOrAbove(task.pid(), address);
    if (!region) {
        auto* process = find(task.pid());
        return process ? process->walkEnd : MACH_SEND_INVALID_DEST;
    }
    address = region->start;
    size = region->size;
    info = region->basic;
    return KERN_SUCCESS;
}

kern_return_t RKScriptedPlatform::purgableState(RKTask& task, uint64_t address, int& state) {
    record("purgableState", task.pid());
    const auto* region = regionAtOrAbove(task.pid(), address);
    if (!region || region->start > address) return KERN_INVALID_ADDRESS;
    state = region->purgeState;
    return KERN_SUCCESS;
}

std::optional<std::string> RKScriptedPlatform::regionFileName(RKTask& task, uint64_t address) {
    record("regionFileName", task.pid());
    const auto* region = regionAtOrAbove(task.pid(), address);
    if (!region || region->start > address) return std::nullopt;
    return region->path;
}

kern_return_t RKScriptedPlatform::imageSegments(RKTask& task, std::vector<RKImageSegmentRecord>& segments) {
    record("imageSegments", task.pid());
    auto* process = find(task.pid());
    if (!process) return MACH_SEND_INVALID_DEST;
    if (process->imagesResult != KERN_SUCCESS) return process->imagesResult;
    segments = process->images;
    return KERN_SUCCESS;
}

kern_return_t RKScriptedPlatform::pageRangeQuery(RKTask& task, uint64_t address, uint64_t size,
                                                 uint32_t* dispositions, uint64_t& count) {
    record("pageRangeQuery", task.pid());
    auto* process = find(task.pid());
    if (!process) return KERN_INVALID_ARGUMENT;
    if (process->pageQueryResult != KERN_SUCCESS) return process->pageQueryResult;
    uint64_t pages = std::min<uint64_t>(count, (size + pageSize - 1) / pageSize);
    for (uint64_t i = 0; i < pages; i++) {
        auto it = process->dispositions.find(address + i * pageSize);
        dispositions[i] = it == process->dispositions.end() ? 0 : it->second;
    }
    count = pages;
    return KERN_SUCCESS;
}

RKPageSpan RKScriptedPlatform::pageQueryPopulated(RKTask& task, uint64_t address, uint64_t end) {
    record("pageQueryPopulated", task.pid());
    auto* process = find(task.pid());
    // A query that fails is asked, so that it fails.
    if (!process || process->pageQueryResult != KERN_SUCCESS) return {address, end};
    // The scripted pages hold something; every other page answers 0.
    auto it = process->dispositions.lower_bound(address);
    if (it == process->dispositions.end() || it->first >= end) return {end, end};
    RKPageSpan span{it->first, it->first};
    for (; it != process->dispositions.end() && it->first == span.to && span.to < end; ++it) span.to += pageSize;
    span.to = std::min(span.to, end);
    return span;
}

void RKScriptedPlatform::preparePageRangeQueries(RKTask& task, const std::vector<RKPageQueryRange>& ranges) {
    record("preparePageRangeQueries", task.pid());
    std::lock_guard lock(mutex_);
    if (auto* process = find(task.pid())) process->preparedRanges.push_back(ranges);
}

RKPageQueryAbilities RKScriptedPlatform::pageQueryAbilities() { return pageAbilities; }

kern_return_t RKScriptedPlatform::sharedAnonymousPages(RKTask& task, const std::vector<RKPageQueryRange>& ranges,
                                                       std::vector<RKSharedAnonymousPage>& pages, uint64_t& sharedBytes) {
    record("sharedAnonymousPages", task.pid());
    pages.clear();
    sharedBytes = 0;
    auto* process = find(task.pid());
    if (!process) return KERN_INVALID_ARGUMENT;
    if (process->sharedAnonymousResult != KERN_SUCCESS) {
        sharedBytes = process->sharedAnonymousBytes;
        return process->sharedAnonymousResult;
    }
    for (uint32_t r = 0; r < ranges.size(); r++) {
        for (auto it = process->sharedAnonymous.lower_bound(ranges[r].start);
             it != process->sharedAnonymous.end() && it->first < ranges[r].start + ranges[r].size; ++it)
            pages.emplace_back(it->second, r);
    }
    std::sort(pages.begin(), pages.end(), [](const auto& a, const auto& b) { return a.page() < b.page(); });
    return KERN_SUCCESS;
}

uint64_t RKScriptedPlatform::sharedAnonymousBytes(RKTask& task, const std::vector<RKPageQueryRange>&) {
    record("sharedAnonymousBytes", task.pid());
    auto* process = find(task.pid());
    return process ? process->sharedAnonymousBytes : 0;
}

int RKScriptedPlatform::pidRusage(RKTask& task, RKRusageInfo& info) {
    record("pidRusage", task.pid());
    auto* process = find(task.pid());
    if (!process) return ESRCH;
    if (process->rusageErrno != 0) return process->rusageErrno;
    std::lock_guard<std::mutex> lock(mutex_);
    process->rusage.ri_phys_memspread += process->physMemspreadGrowth;
    info = process->rusage;
    return 0;
}

int RKScriptedPlatform::ledgerTemplate(std::vector<std::string>& names) {
    record("ledgerTemplate");
    if (ledgerTemplateErrno != 0) return ledgerTemplateErrno;
    names = ledgerNames;
    return 0;
}

int RKScriptedPlatform::ledgerEntries(RKTask& task, std::vector<int64_t>& balances) {
    record("ledgerEntries", task.pid());
    auto* process = find(task.pid());
    if (!process) return ESRCH;
    if (process->ledgerErrno != 0) return process->ledgerErrno;
    balances = process->ledgerBalances;
    // A kernel answers every entry of its template; unscripted ones hold 0.
    if (balances.size() < ledgerNames.size()) balances.resize(ledgerNames.size(), 0);
    return 0;
}

int RKScriptedPlatform::ownedVmObjects(RKTask& task, std::vector<RKOwnedVmObjectRecord>& records) {
    record("ownedVmObjects", task.pid());
    auto* process = find(task.pid());
    if (!process) return ESRCH;
    if (process->ownedErrno != 0) return process->ownedErrno;
    records = process->owned;
    return 0;
}

int RKScriptedPlatform::sysVSegments(std::vector<RKSysVSegment>& answer) {
    record("sysVSegments");
    answer = segments;
    return 0;
}

kern_return_t RKScriptedPlatform::memoryInfo(RKKernelMemoryInfo& info) {
    record("memoryInfo");
    if (kernelMemoryResult != KERN_SUCCESS) return kernelMemoryResult;
    info = kernelMemory;
    return KERN_SUCCESS;
}

int RKScriptedPlatform::readSelfRegionMemspread(int32_t& value) {
    record("readSelfRegionMemspread");
    if (selfRegionReadErrno != 0) return selfRegionReadErrno;
    value = selfRegionValue;
    return 0;
}

int RKScriptedPlatform::writeSelfRegionMemspread(int32_t value) {
    record("writeSelfRegionMemspread");
    if (selfRegionWriteErrno != 0) return selfRegionWriteErrno;
    selfRegionValue = value;
    return 0;
}

bool RKScriptedPlatform::getTimes(RKClockReadings& readings) {
    record("getTimes");
    if (clocksFail) return false;
    readings = clocks;
    return true;
}

RKTimebase RKScriptedPlatform::timebase() {
    record("timebase");
    return base;
}

uint64_t RKScriptedPlatform::uptimeNanoseconds() {
    std::lock_guard<std::mutex> lock(mutex_);
    return uptime;
}

void RKScriptedPlatform::waitForUptime(uint64_t deadline, std::condition_variable&, std::unique_lock<std::mutex>&) {
    std::lock_guard<std::mutex> lock(mutex_);
    uptime = std::max(uptime, deadline);
}

uint64_t RKScriptedPlatform::kernelPageSize() { return pageSize; }

uid_t RKScriptedPlatform::effectiveUserId() { return euid; }

pid_t RKScriptedPlatform::ownPid() { return selfPid; }
