// The seam between memspread and the kernel.
//
// Abstract so it can be faked: RKLinuxPlatform answers from /proc and /sys, RKScriptedPlatform
// answers what a test scripted (and records what was asked). Nothing outside platform/ reads
// /proc or calls the kernel's memory interfaces; everything goes through RKPlatform::current().
//
// The operations speak the vocabulary the rest of the program was designed around (tasks,
// region records, kern_return_t codes, BSD process records); docs/linux.md says how each is
// answered on Linux.
#pragma once

#include <sys/types.h>

#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/RKKernelMemoryInfo.h"
#include "platform/RKKernelTypes.h"

// An open handle on one process. On Linux it is a directory descriptor of /proc/PID, so a
// reused pid is never read by mistake; every read of the process goes through it.
class RKTask {
public:
    virtual ~RKTask() = default;
    virtual pid_t pid() const = 0;
};

// Addresses [from, to).
struct RKPageSpan {
    uint64_t from = 0;
    uint64_t to = 0;
};

class RKPlatform {
public:
    virtual ~RKPlatform() = default;

    // The platform every part of the program uses. Defaults to the Linux one; tests install a
    // scripted platform (and must restore the previous one, see RKScopedPlatform).
    static RKPlatform& current();
    static std::shared_ptr<RKPlatform> setCurrent(std::shared_ptr<RKPlatform> platform);

    // ---- Processes ----
    // proc_listallpids: every pid of the system in the kernel's order, or nothing on failure.
    virtual std::optional<std::vector<pid_t>> listAllPids() = 0;
    // proc_pidinfo(PROC_PIDTBSDINFO): nothing when the process is gone or cannot be inspected.
    virtual std::optional<RKBsdInfo> bsdInfo(pid_t pid) = 0;
    // proc_pidinfo(PROC_PIDT_SHORTBSDINFO): 0 and the status, or the errno of the failure.
    virtual int shortBsdInfoStatus(pid_t pid, uint32_t& status) = 0;
    // KERN_PROCARGS2's executable path (the name rule); nothing when it cannot be read.
    virtual std::optional<std::string> executablePath(pid_t pid) = 0;
    // proc_get_dirty: idle-exit tracking flags; 0 where the platform has none.
    virtual uint32_t dirtyFlags(pid_t pid) = 0;
    // task_for_pid: KERN_SUCCESS and the task, or the failure code.
    virtual kern_return_t taskForPid(pid_t pid, std::unique_ptr<RKTask>& task) = 0;
    // The same three questions asked through an open task, so that they are answered by the
    // process the task was opened on even when its pid has since been reused. The defaults ask
    // by pid, for platforms whose tasks cannot outlive their process.
    virtual std::optional<RKBsdInfo> taskBsdInfo(RKTask& task) { return bsdInfo(task.pid()); }
    virtual int taskShortBsdInfoStatus(RKTask& task, uint32_t& status) {
        return shortBsdInfoStatus(task.pid(), status);
    }
    virtual std::optional<std::string> taskExecutablePath(RKTask& task) { return executablePath(task.pid()); }
    // Whether live processes map a shared library cache at the architecture's fixed shared
    // region. Linux has none, so its live processes get no shared-region bounds.
    virtual bool hasSharedRegion() = 0;

    // ---- Address space ----
    // mach_vm_region_recurse at full depth: the first leaf entry ending above `address`.
    // KERN_INVALID_ADDRESS past the last entry. `count` is the number of 32-bit words of the
    // record that the source filled (19 when object_id_full is valid).
    virtual kern_return_t regionRecurse(RKTask& task, uint64_t& address, uint64_t& size,
                                        RKRegionSubmapInfo& info, uint32_t& count) = 0;
    // mach_vm_region(VM_REGION_BASIC_INFO_64): the top-level entry ending above `address`.
    virtual kern_return_t region(RKTask& task, uint64_t& address, uint64_t& size,
                                 RKRegionBasicInfo& info) = 0;
    // mach_vm_purgable_control(VM_PURGABLE_GET_STATE).
    virtual kern_return_t purgableState(RKTask& task, uint64_t address, int& state) = 0;
    // proc_regionfilename: the path of the file mapped at `address`, nothing when none.
    virtual std::optional<std::string> regionFileName(RKTask& task, uint64_t address) = 0;
    // The segments of the task's loaded images, in no particular order: KERN_SUCCESS, or the
    // failure code of reading the address space.
    virtual kern_return_t imageSegments(RKTask& task, std::vector<RKImageSegmentRecord>& segments) = 0;
    // mach_vm_page_range_query: one disposition word per page of [address, address + size).
    // `count` is in: room in `dispositions`, out: the number written.
    virtual kern_return_t pageRangeQuery(RKTask& task, uint64_t address, uint64_t size,
                                         uint32_t* dispositions, uint64_t& count) = 0;
    // Where page queries of [address, end) (page-aligned) are worth asking: the first stretch at
    // or after `address` whose pages may hold something, as [from, to) with address <= from <=
    // to <= end, and from < to unless from > address. Pages from `address` to `from` answer 0;
    // ask again from `to`. The Mach-style queries answer per page, so the default knows of no
    // hole: [address, end). On Linux the page data read ahead knows where nothing is mapped.
    virtual RKPageSpan pageQueryPopulated(RKTask& task, uint64_t address, uint64_t end) {
        (void)task;
        return {address, end};
    }
    // Reads the page data of `ranges` (ascending, disjoint) in one pass, so that the
    // pageRangeQuery calls that follow inside them are answered without reading again. An empty
    // list releases what was read. A failure here shows in those queries.
    virtual void preparePageRangeQueries(RKTask& task, const std::vector<RKPageQueryRange>& ranges) = 0;
    // What page queries can tell on this system; probed once per run.
    virtual RKPageQueryAbilities pageQueryAbilities() = 0;
    // The anonymous pages of the private `ranges` (ascending, disjoint; in a file mapping its
    // copied-on-write pages) that more than one mapping holds, sorted by `page`; never the zero
    // pages. KERN_SUCCESS; KERN_NOT_SUPPORTED
    // when frames are hidden, with `sharedBytes` = what the kernel counts as shared in those
    // ranges (the bound of what cannot be attributed); KERN_INVALID_ARGUMENT when the process
    // is gone.
    virtual kern_return_t sharedAnonymousPages(RKTask& task, const std::vector<RKPageQueryRange>& ranges,
                                               std::vector<RKSharedAnonymousPage>& pages, uint64_t& sharedBytes) = 0;
    // What the kernel counts as shared in `ranges` (ascending, disjoint), without reading a page:
    // the bound of what the pass across processes would attribute, for a run that skips it.
    virtual uint64_t sharedAnonymousBytes(RKTask& task, const std::vector<RKPageQueryRange>& ranges) = 0;

    // ---- Per-process figures ----
    // proc_pid_rusage: 0, or the errno of the failure.
    virtual int pidRusage(RKTask& task, RKRusageInfo& info) = 0;
    // The ledger template's entry names (ledger(LEDGER_TEMPLATE_INFO)), or the errno.
    virtual int ledgerTemplate(std::vector<std::string>& names) = 0;
    // Balances of the process's ledger entries, in template order, or the errno.
    virtual int ledgerEntries(RKTask& task, std::vector<int64_t>& balances) = 0;
    // sysctl vm.get_owned_vmobjects: 0 and the records, or the errno (ENOENT: not supported).
    virtual int ownedVmObjects(RKTask& task, std::vector<RKOwnedVmObjectRecord>& records) = 0;
    // The system's SysV shared memory segments (those memspread's IPC namespace shows): 0, or
    // the errno.
    virtual int sysVSegments(std::vector<RKSysVSegment>& segments) = 0;
    // One gather of every measured process begins or ends (process/RKGatherScope.h): what is the
    // system's rather than a process's (the SysV table) is read once within it. Gathers may
    // overlap; the outermost one decides.
    virtual void beginGather() {}
    virtual void endGather() {}

    // ---- The kernel ----
    // mach_memory_info: KERN_SUCCESS and the kernel's zones, wired sites, counters and loaded
    // modules, or the failure code.
    virtual kern_return_t memoryInfo(RKKernelMemoryInfo& info) = 0;

    // ---- Settings and host ----
    // sysctl vm.self_region_memspread: 0 or the errno.
    virtual int readSelfRegionMemspread(int32_t& value) = 0;
    virtual int writeSelfRegionMemspread(int32_t value) = 0;
    // mach_get_times: false when the clocks cannot be read.
    virtual bool getTimes(RKClockReadings& readings) = 0;
    virtual RKTimebase timebase() = 0;
    // clock_gettime_nsec_np(CLOCK_UPTIME_RAW_APPROX): monotonic nanoseconds that stand still
    // while the machine sleeps; the sampling timer's clock.
    virtual uint64_t uptimeNanoseconds() = 0;
    // The sampling timer's wait: returns once the uptime clock reads `deadline`, when `wake` is
    // notified, or spuriously. `lock` is held on entry and on return, as for a condition wait.
    virtual void waitForUptime(uint64_t deadline, std::condition_variable& wake,
                               std::unique_lock<std::mutex>& lock) = 0;
    virtual uint64_t kernelPageSize() = 0;
    virtual uid_t effectiveUserId() = 0;
    virtual pid_t ownPid() = 0;
};

// Installs a platform for the lifetime of the object, then puts the previous one back.
class RKScopedPlatform {
public:
    explicit RKScopedPlatform(std::shared_ptr<RKPlatform> platform)
        : previous_(RKPlatform::setCurrent(std::move(platform))) {}
    ~RKScopedPlatform() { RKPlatform::setCurrent(previous_); }
    RKScopedPlatform(const RKScopedPlatform&) = delete;
    RKScopedPlatform& operator=(const RKScopedPlatform&) = delete;

private:
    std::shared_ptr<RKPlatform> previous_;
};

// mach_error_string: a short English text for a code of this layer.
const char* mach_error_string(kern_return_t code);
// mach_error: "label: text\n" on standard error.
void mach_error(const char* label, kern_return_t code);
