// Private anonymous pages that a process holds together with others (inherited across fork, or
// merged by KSM): no object id tells them apart, so their frames are read for the pass across
// processes (analysis/RKSharedAnonymousPass.cpp) that counts each once.
#include <cstdio>

#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxTags.h"
#include "process/RKUserProcess.h"

namespace {

bool isAnonymousTag(uint32_t tag) { return tag == RKTagAnonymous || tag == RKTagHeap || tag == RKTagStack; }

}  // namespace

bool RKUserProcess::_noteSharedAnonymousRegion(const std::shared_ptr<RKMemoryRegion>& region,
                                               const RKRegionSubmapInfo& info, RKRegionWalkState& state) {
    if (state.hidden || state.sharingAnalysisDisabled || !_isAlive() || info.share_mode != SM_COW ||
        region->start == RKRegionNoAddress)
        return false;
    // Copy-on-write share mode on private anonymous memory: smaps shows shared pages. A private
    // file mapping's copied pages (relocated data) are inherited across fork the same way.
    const bool file = info.external_pager != 0;
    if (file ? region->dirtySize == 0 : !isAnonymousTag(info.user_tag)) return false;
    state.sharedAnonymousRegions.push_back(region);
    state.sharedAnonymousRanges.push_back(
        RKPageQueryRange{region->start, region->size, file, 0, info.pages_resident + info.pages_swapped_out});
    return RKPlatform::current().pageQueryAbilities().frames && !state.forkSharingDisabled;
}

void RKUserProcess::_gatherSharedAnonymousPages(RKRegionWalkState& state) {
    if (state.sharedAnonymousRanges.empty() || !task_) return;
    if (state.forkSharingDisabled) {
        // Only the bound: the regions keep their pages, as where frames are hidden.
        unattributedSharedAnonymousBytes_ = RKPlatform::current().sharedAnonymousBytes(*task_, state.sharedAnonymousRanges);
    } else {
        uint64_t sharedBytes = 0;
        std::vector<RKSharedAnonymousPage> pages;
        kern_return_t result =
            RKPlatform::current().sharedAnonymousPages(*task_, state.sharedAnonymousRanges, pages, sharedBytes);
        if (result == KERN_SUCCESS) {
            sharedAnonymousPages_ = RKSharedPageList(std::move(pages));
            sharedAnonymousRegions_ = std::move(state.sharedAnonymousRegions);
        } else if (result == KERN_NOT_SUPPORTED) {
            unattributedSharedAnonymousBytes_ = sharedBytes;
        } else if (!pageQueryFailed_) {
            mach_error("shared anonymous pages", result);
            _processMachVMError(result, KERN_INVALID_ARGUMENT);
        }
    }
    state.sharedAnonymousRegions.clear();
    state.sharedAnonymousRanges.clear();
}

void RKUserProcess::releaseSharedAnonymousPages() {
    sharedAnonymousPages_.release();
    // Swapped with an empty vector: assigning {} would keep its capacity.
    RKRegionList().swap(sharedAnonymousRegions_);
}
