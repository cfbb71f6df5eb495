// A live user process: construction takes its task, chooses its shared-region bounds and reads
// the figures that need no address space (phys memspread, ledgers, idle-exit status). Gathering
// (the walk of its address space) fills its regions; the snapshot source reuses the walk with
// sources of its own, so every source-specific step is overridable.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

#include "model/RKInternedString.h"
#include "platform/RKPlatform.h"
#include "platform/RKSharedPageList.h"
#include "process/RKProcess.h"
#include "process/RKRegionBlocks.h"

class RKImage;
class RKImageEnumerator;
class RKMemoryRegion;

// One entry of the address-space walk: start, size, the region record, the purge state
// (VM_PURGABLE_*), the path of the mapped file, a ready-made region name (the live walk gives
// none) and whether the region is listed only in verbose output. Returns true to stop the walk.
using RKRegionCallback =
    std::function<bool(uint64_t start, uint64_t size, const RKRegionSubmapInfo& info, int purgeState,
                       const std::optional<std::string>& path, const std::optional<std::string>& name,
                       bool verbose)>;

// Owned VM objects by object id; absent when there is no list at all.
using RKOwnedVmObjectMap = std::map<uint64_t, RKOwnedVmObjectRecord>;

// A region to split into subranges after the walk, with what its page query needs.
struct RKSubrangeCandidate {
    std::shared_ptr<RKMemoryRegion> region;
    int purgeState = VM_PURGABLE_DENY;
    RKPageQueryRange range;
};

// Receives the dispositions of `count` pages, the first of them the `first`th page asked for.
// No dispositions: a hole, pages that all answer 0, handed over whole however long.
using RKDispositionChunkBlock = std::function<void(const uint32_t* dispositions, uint64_t first, uint64_t count)>;

// What one region-building pass carries from region to region and into the steps after it.
struct RKRegionWalkState {
    // Where every region of the pass is made (one per mapping): see RKRegionBlocks.h.
    RKRegionBlocks regionBlocks;
    RKRegionList regions;
    // The region made of the kernel's owned-memory pseudo-region, kept out of `regions` until
    // it has been reduced by the owned memory found mapped.
    std::shared_ptr<RKMemoryRegion> unmappedOwnedRegion;
    uint64_t mappedOwnedTotal = 0;  // bytes of owned memory charged to mapped regions
    // Owned objects already charged whole to a mapping: further mappings add nothing.
    std::unordered_set<uint64_t> chargedOwnedObjects;
    bool hidden = false;
    bool breakDown = false;
    bool sharingAnalysisDisabled = false;
    bool forkSharingDisabled = false;
    // Over the process's images, in ascending address order for the whole walk.
    std::shared_ptr<RKImageEnumerator> imageEnumerator;
    // Regions waiting for their subranges until the walk is over, so that the process's page
    // data is read once, for these regions only (RKUserProcessPages.cpp).
    std::vector<RKSubrangeCandidate> subrangeCandidates;
    // Private anonymous regions holding pages other mappings hold too, and their ranges
    // (RKUserProcessSharedAnonymous.cpp).
    std::vector<std::shared_ptr<RKMemoryRegion>> sharedAnonymousRegions;
    std::vector<RKPageQueryRange> sharedAnonymousRanges;
    // The name of the tag named last: a process's anonymous regions mostly share a tag, and
    // interning the name anew for each would take the intern table's lock every time.
    uint32_t lastNamedTag = UINT32_MAX;
    RKInternedString lastTagName;
};

// Architectures that decide where the shared library cache is mapped.
enum RKPlatformCode : int32_t {
    RKPlatformI386 = 0,
    RKPlatformX86_64 = 1,
    RKPlatformArm = 2,
    RKPlatformArm64 = 3,
    RKPlatformArm64_32 = 4,
    RKPlatformUnknown = 5,
    RKPlatformLinux = 6,  // no shared library cache: the bounds stay 0
};

class RKUserProcess : public RKProcess {
public:
    RKUserProcess() = default;

    // The record's pid, translation, base initialisation (false without a task), shared-region
    // bounds, an empty image list, then phys memspread, ledgers and idle-exit status.
    bool initWithBsdInfo(const RKBsdInfo& info) override;
    // task_for_pid, then a check that the task reaches the process that was listed (its start
    // time), not a newer one under a reused pid; on failure prints the platform's error and the
    // process is not created. The task lives only while the process is being read: from here
    // to the end of initWithBsdInfo, then again from the start to the end of gatherData
    // (RKUserProcessTask.cpp).
    bool _populateTask() override;
    // The name rule, with the executable path read through the task.
    std::string _gatherName(const RKBsdInfo& info) override;
    // Opens the task again for gathering; false (after a warning for a process that is gone, an
    // error otherwise) when it cannot be.
    virtual bool _reopenTaskForGathering();
    // Closes the task: its descriptors go back for the next process.
    void _releaseTask() { task_.reset(); }
    bool _isAlive() const override { return true; }

    // Images, fresh figures and owned objects (unless hidden), then the walk that fills
    // memoryRegions. Once only: a gathered process is left as it is.
    void gatherData() override;
    // Walks the address space in ascending order. A failing kernel call ends the walk after a
    // line on standard error and an error (or, for a process that exited, a warning).
    virtual void enumerateRegions(const RKRegionCallback& callback);
    // The start of the last top-level entry below the shared region, found by bisection; 0 when
    // there is none (always without a shared region).
    uint64_t _lastNonSharedCacheRegion();
    // Builds memoryRegions from the walk, then appends the regions that have no address.
    virtual void _gatherMemoryData();
    // Records a failed kernel call: a warning suffixed " (process exited)" or " (zombie)" when
    // `error` is `expected` and the process is gone, an error otherwise.
    void _processMachVMError(kern_return_t error, kern_return_t expected);
    // "<display>: <description> - <errno text>" on standard error and in the warnings.
    void _addErrnoWarningWithDescription(const std::string& description);

    // A live process is never translated on this platform; the snapshot source reads it.
    virtual void _gatherIsTranslated() {}
    // Sets the bounds of the given platform's shared region. False (after a message on standard
    // error) only for RKPlatformUnknown; codes past it change nothing.
    bool _setSharedRegionFromPlatform(int32_t platform);
    virtual void _gatherPhysMemspread();
    virtual void _gatherLedgers();
    virtual void _gatherIdleExitStatus();
    void _setIdleExitStatusFromDirtyFlags(uint32_t flags);

    // ---- Page dispositions (RKUserProcessPages.cpp) ----
    // Asks for the dispositions of `pagesToQuery` pages from the page-aligned `startAddr`, at
    // most 4096 pages a call, handing each chunk to `block` in order; the holes the platform
    // knows of are handed over as one piece each, never asked about. False, after an error or
    // (for a process that exited) a warning, when a query failed.
    virtual bool _enumerateDispositionChunks(uint64_t startAddr, uint64_t pagesToQuery,
                                             const RKDispositionChunkBlock& block);
    // Sizes a region (dirty and swapped, which must be 0) from page dispositions instead of the
    // region counters. A page shared with the previous region is taken from the disposition
    // cache, and an unused shared-cache region is charged its part of the page it shares with
    // the next. False when a query failed; what was counted stays.
    virtual bool _populateMemoryRegionWithPageQueries(RKMemoryRegion& region, const RKRegionSubmapInfo& info);
    // Splits a region into runs of pages of one state, in object-offset space.
    virtual void _addSubrangesForRegion(RKMemoryRegion& region, int purgeState);
    // Rule 7 of the region callback: notes an eligible region for its subranges.
    void _addSubrangesIfEligible(const std::shared_ptr<RKMemoryRegion>& region, const RKRegionSubmapInfo& info,
                                 int purgeState, RKRegionWalkState& state);
    // After the walk: reads the noted regions' page data at once and builds their subranges.
    void _addPendingSubranges(RKRegionWalkState& state);

    // ---- Anonymous pages shared across fork or by KSM (RKUserProcessSharedAnonymous.cpp) ----
    // Notes a private anonymous region that smaps says shares pages; true when its pages will
    // be identified one by one (frames visible), so subranges would only count them twice.
    bool _noteSharedAnonymousRegion(const std::shared_ptr<RKMemoryRegion>& region, const RKRegionSubmapInfo& info,
                                    RKRegionWalkState& state);
    // After the walk: reads the noted regions' shared pages, or where frames are hidden the
    // bytes the kernel counts as shared in them.
    // A snapshot brings the pages it saved instead.
    virtual void _gatherSharedAnonymousPages(RKRegionWalkState& state);
    // The shared pages, sorted by page; `range` indexes sharedAnonymousRegions(). Held from
    // gathering until the pass across processes has attributed them.
    const RKSharedPageList& sharedAnonymousPages() const { return sharedAnonymousPages_; }
    const std::vector<std::shared_ptr<RKMemoryRegion>>& sharedAnonymousRegions() const { return sharedAnonymousRegions_; }
    void releaseSharedAnonymousPages();
    // Anonymous bytes shared with other mappings that could not be attributed (frames hidden).
    uint64_t unattributedSharedAnonymousBytes() const { return unattributedSharedAnonymousBytes_; }

    // Reads the loaded images into `images`, sorted by start (RKUserProcessImages.cpp).
    virtual void _gatherImageData();
    // Names a region after the image segment it lies in; false when it lies in none.
    bool _nameRegionFromImages(RKMemoryRegion& region, RKRegionWalkState& state);
    // Cuts an entry of the shared region into one region per image segment and one per gap
    // between segments, into `state.regions` (RKUserProcessSharedRegion.cpp). False when a page
    // query failed.
    bool _addRegionsToArray(RKRegionWalkState& state, uint64_t start, uint64_t size, const RKRegionSubmapInfo& info);

    // The VM objects the task owns (RKUserProcessOwned.cpp); none with the breakdown off, when
    // the platform has no list, or when it could not be read.
    virtual std::optional<RKOwnedVmObjectMap> _gatherOwnedVmObjects();
    // Charges a tag-named region from the owned-object list, or without a list a purgeable one
    // from its own counters.
    virtual void _chargeOwnedObjectForRegion(RKMemoryRegion& region, const RKRegionSubmapInfo& info,
                                             int purgeState, RKRegionWalkState& state);
    // Completes a region after it was sized and named, for sources that saved more than the
    // region record (a Linux snapshot). The live walk has nothing to add.
    virtual void _completeRegion(RKMemoryRegion&) {}
    // Appends a region without an address for every owned object the walk did not meet.
    virtual void _addUnconsumedOwnedObjectRegions(RKRegionWalkState& state);
    // One warning for each SysV segment that nobody maps and whose creator is gone: memory that
    // no process holds, so no process's report can show it.
    static std::vector<std::string> unheldSharedMemoryWarnings();

    RKTask* task() const { return task_.get(); }
    uint64_t sharedRegionBase() const { return sharedRegionBase_; }
    uint64_t sharedRegionSize() const { return sharedRegionSize_; }
    uint32_t sharedRegionAlignmentSize() const { return sharedRegionAlignmentSize_; }
    // The kernel's own memspread figure and its peak, as two leaves that are not summed across
    // processes; none when the figure could not be read.
    std::shared_ptr<RKAuxDataMap> auxData() const override;

    uint64_t phys_memspread() const { return phys_memspread_; }
    void setPhys_memspread(uint64_t value) { phys_memspread_ = value; }
    uint64_t phys_memspread_peak() const { return phys_memspread_peak_; }
    // Its resident memory, which the smaps walk and the page reads grow with; known before
    // gathering at no cost.
    uint64_t gatherCostHint() const override { return phys_memspread_; }
    uint64_t ledgers() const { return ledgers_; }
    using RKImageList = std::vector<std::shared_ptr<RKImage>>;
    const std::optional<RKImageList>& images() const { return images_; }

protected:
    std::unique_ptr<RKTask> task_;
    uint64_t sharedRegionBase_ = 0;
    uint64_t sharedRegionSize_ = 0;
    uint32_t sharedRegionAlignmentSize_ = 0;
    uint64_t phys_memspread_ = 0;
    uint64_t phys_memspread_peak_ = 0;
    uint64_t ledgers_ = 0;
    std::optional<RKImageList> images_;  // exists from construction to the end of the walk
    std::optional<RKOwnedVmObjectMap> ownedVmObjects_;  // from gatherData to the end of the walk
    // The start time of the listed process, which a task must reach.
    uint64_t listedStartSeconds_ = 0;
    uint64_t listedStartMicroseconds_ = 0;
    // The disposition of the last page of the latest region sized from dispositions whose end
    // is not page-aligned, and that page's address (0: none).
    uint64_t cachedDispositionAddress_ = 0;
    uint32_t cachedDisposition_ = 0;
    // An unused shared-cache region waiting for the disposition of its last, partial page.
    // Not owned: the region lives in the walk's region list until the walk is over.
    RKMemoryRegion* pendingUnusedSharedRegion_ = nullptr;
    bool pageQueryFailed_ = false;  // a page query failed: the process is gone or unreadable
    RKSharedPageList sharedAnonymousPages_;
    std::vector<std::shared_ptr<RKMemoryRegion>> sharedAnonymousRegions_;
    uint64_t unattributedSharedAnonymousBytes_ = 0;

private:
    // task_for_pid and the start-time check; the task is kept only on success.
    kern_return_t _openListedTask();
    // The callback of _gatherMemoryData for one walked entry.
    bool _addRegionForEntry(RKRegionWalkState& state, uint64_t start, uint64_t size,
                            const RKRegionSubmapInfo& info, int purgeState,
                            const std::optional<std::string>& path, const std::optional<std::string>& name,
                            bool verbose);
    void _setRegionSizes(RKMemoryRegion& region, const RKRegionSubmapInfo& info, int purgeState,
                         bool breakDown) const;
    void _nameRegion(RKMemoryRegion& region, const RKRegionSubmapInfo& info, int purgeState,
                     const std::optional<std::string>& path, const std::optional<std::string>& name,
                     RKRegionWalkState& state);
    void _reconcileUnmappedOwnedRegion(RKRegionWalkState& state);
    void _addPageTableRegion(RKRegionWalkState& state) const;
    // One pass of the walk from `address`; false ends the walk. Advances `address`.
    bool _walkStep(uint64_t& address, uint64_t lastBelowSharedRegion, bool& pseudoRegionSeen,
                   const RKRegionCallback& callback);
};
