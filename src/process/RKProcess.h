// One measured process: identity, name, the errors and warnings that reach the report, and once
// gathered, its memory regions. Subclasses are the sources (live process, kernel, snapshot); the
// base fixes the order of construction steps and each source replaces the steps it sources
// differently. Construction is two-phase: the factory constructs, then calls initWithBsdInfo(),
// and discards the object when that returns false.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/RKKernelTypes.h"
#include "process/RKTargetMap.h"

class RKMemoryRegion;
class RKAuxDataMap;

using RKRegionList = std::vector<std::shared_ptr<RKMemoryRegion>>;
// pid -> the description under which it was found by name, or nullopt when found by number.
using RKPidNameMap = std::map<pid_t, std::optional<std::string>>;

class RKProcess : public std::enable_shared_from_this<RKProcess> {
public:
    RKProcess() = default;  // init: no regions, empty lists, idle-exit status 0
    virtual ~RKProcess() = default;
    RKProcess(const RKProcess&) = delete;
    RKProcess& operator=(const RKProcess&) = delete;

    // Base initialisation: pid, is64bit, task, name, display string, page size. False when the
    // process cannot be read (no task); the caller then discards the object.
    virtual bool initWithBsdInfo(const RKBsdInfo& info);
    virtual uint64_t _gatherPageSize();
    void _addGlobalError(const std::string& error);
    // A warning about the system rather than this process (memory no process holds); the
    // report prints it once.
    void _addGlobalWarning(const std::string& warning) { globalWarnings_.push_back(warning); }

    size_t hash() const { return static_cast<size_t>(pid_); }
    bool isEqual(const RKProcess& other) const { return pid_ == other.pid_; }

    virtual bool _populateTask();  // the base has nothing to read: false
    // Why the task could not be opened (a kern_return_t); KERN_FAILURE when nothing was tried.
    kern_return_t taskResult() const { return taskResult_; }
    virtual void gatherData() {}
    // How much gathering this process is likely to cost, in no particular unit: the workers take
    // the costly ones first, so that none is left alone on one core at the end. 0: unknown.
    virtual uint64_t gatherCostHint() const { return 0; }

    const std::vector<std::string>& globalErrors() const { return globalErrors_; }
    const std::vector<std::string>& globalWarnings() const { return globalWarnings_; }
    std::vector<std::string> errors() const { return errors_; }  // a snapshot copy
    const std::vector<std::string>& warnings() const { return warnings_; }
    int64_t asNumber() const { return pid_; }
    virtual std::shared_ptr<RKAuxDataMap> auxData() const;  // the base: an empty map
    virtual bool _isAlive() const { return false; }
    virtual bool breakDownPhysMemspread() const;  // the program-wide setting
    std::string description() const;

    pid_t pid() const { return pid_; }
    void setPid(pid_t pid) { pid_ = pid; }
    const std::string& name() const { return name_; }
    void setName(const std::string& name) { name_ = name; }
    bool is64bit() const { return is64bit_; }
    void setIs64bit(bool value) { is64bit_ = value; }
    bool isTranslated() const { return isTranslated_; }
    void setIsTranslated(bool value) { isTranslated_ = value; }
    int32_t idleExitStatus() const { return idleExitStatus_; }
    bool hiddenFromDisplay() const { return hiddenFromDisplay_; }
    void setHiddenFromDisplay(bool value) { hiddenFromDisplay_ = value; }
    const std::optional<RKRegionList>& memoryRegions() const { return memoryRegions_; }
    void setMemoryRegions(std::optional<RKRegionList> regions) { memoryRegions_ = std::move(regions); }
    const std::string& displayString() const { return displayString_; }
    void setDisplayString(const std::string& value) { displayString_ = value; }
    uint64_t pageSize() const { return pageSize_; }
    void setPageSize(uint64_t value) { pageSize_ = value; }

    // Factories: the kernel process for the system record, the live user process otherwise.
    static std::shared_ptr<RKProcess> processWithBsdInfo(const RKBsdInfo& info);
    // The same; on failure `taskResult` receives why the process could not be opened.
    static std::shared_ptr<RKProcess> processWithBsdInfo(const RKBsdInfo& info, kern_return_t* taskResult);
    static std::shared_ptr<RKProcess> processWithPid(pid_t pid);
    // The name rule: the executable's last path component, else the record's names, else
    // "Unknown".
    static std::string _nameForBsdInfoCommName(const RKBsdInfo& info);
    static std::string _nameForBsdInfo(const RKBsdInfo& info);
    // The name rule on an executable path already read.
    static std::string _nameForExecutablePath(const std::optional<std::string>& path, const RKBsdInfo& info);
    // The name this process gets at initialisation: the name rule, by pid. A live process asks
    // through its task instead.
    virtual std::string _gatherName(const RKBsdInfo& info) { return _nameForBsdInfo(info); }

    // Target selection over the system's process list.
    static std::optional<RKTargetMap> allProcessesExcludingPids(const std::set<pid_t>& excluded);
    static std::optional<RKPidNameMap> pidsForStringDescriptions(const std::vector<std::string>& descriptions,
                                                                std::vector<std::string>* errors);
    static std::optional<std::vector<pid_t>> childPidsForPids(const std::vector<pid_t>& pids);
    static RKTargetMap removeIdleExitCleanProcessesFrom(const RKTargetMap& targets);

protected:
    void setIdleExitStatus(int32_t status) { idleExitStatus_ = status; }
    // Subclasses append to these directly.
    std::vector<std::string> errors_;
    std::vector<std::string> warnings_;
    kern_return_t taskResult_ = KERN_FAILURE;

private:
    pid_t pid_ = 0;
    bool is64bit_ = false;
    bool isTranslated_ = false;
    int32_t idleExitStatus_ = 0;
    std::vector<std::string> globalErrors_;
    std::vector<std::string> globalWarnings_;
    bool hiddenFromDisplay_ = false;
    std::string name_;
    std::optional<RKRegionList> memoryRegions_;
    std::string displayString_;
    uint64_t pageSize_ = 0;
};

// The system's process list: the BSD record of every process that could be inspected, in the
// kernel's pid order. Nothing when the list cannot be read or no record was kept.
std::optional<std::vector<RKBsdInfo>> RKCopyAllBsdInfo();
