#include "analysis/RKSharedAnonymousPass.h"

#include <cstdio>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <string>
#include <unordered_map>
#include <vector>

#include "analysis/RKMemspread.h"
#include "analysis/RKPageKeyRanks.h"
#include "analysis/RKProcessSetTrie.h"
#include "model/RKMemoryRegion.h"
#include "model/RKMemoryTotal.h"
#include "platform/RKFreedHeap.h"
#include "platform/RKWorkerPool.h"
#include "process/RKAnalysisSettings.h"
#include "process/RKUserProcess.h"

namespace {

// One member's region of one shared object, built run by run in ascending page index. Members
// are filled side by side, each by its own thread: a cache line each, so that the runs one
// thread extends page by page never share a line with another thread's.
class alignas(64) MemberRegion {
public:
    MemberRegion(const RKMemoryRegion& namedAfter, uint64_t objectId) : region_(std::make_shared<RKMemoryRegion>()) {
        region_->start = RKRegionNoAddress;
        region_->name = namedAfter.name;
        region_->detailedName = namedAfter.detailedName;
        region_->user_tag = namedAfter.user_tag;
        region_->share_mode = SM_COW;
        region_->segment = RKSegmentNoImage;
        region_->object_id = objectId;
    }
    void add(uint64_t index, bool swapped, uint64_t pageSize) {
        if (length_ != 0 && (index != start_ + length_ || swapped != swapped_)) flush(pageSize);
        if (length_ == 0) start_ = index, swapped_ = swapped;
        length_++;
    }
    std::shared_ptr<RKMemoryRegion> finish(uint64_t pageSize) {
        flush(pageSize);
        return region_;
    }

private:
    void flush(uint64_t pageSize) {
        if (length_ == 0) return;
        const uint64_t bytes = length_ * pageSize;
        RKMemoryTotal total{};
        (swapped_ ? total.swapped : total.dirty) = bytes;
        region_->addSubrange(start_ * pageSize, bytes, total, pageSize);
        (swapped_ ? region_->swappedSize : region_->dirtySize) += bytes;
        region_->size += bytes;
        length_ = 0;
    }

    std::shared_ptr<RKMemoryRegion> region_;
    uint64_t start_ = 0;
    uint64_t length_ = 0;
    bool swapped_ = false;
};

struct SharedObject {
    uint64_t nextIndex = 0;
    std::vector<uint32_t> members;  // process numbers, ascending
    std::vector<MemberRegion> regions;  // one per member, in the same order
};

class Pass {
public:
    explicit Pass(const std::vector<std::shared_ptr<RKProcess>>& processes) {
        for (const auto& process : processes) {
            auto* user = dynamic_cast<RKUserProcess*>(process.get());
            if (!user) continue;
            summary_.unattributedBytes += user->unattributedSharedAnonymousBytes();
            if (!user->sharedAnonymousPages().empty()) processes_.push_back(user);
        }
    }

    RKSharedAnonymousSummary run() {
        if (processes_.size() < 2) {
            for (RKUserProcess* process : processes_) process->releaseSharedAnonymousPages();
            return summary_;
        }
        planSlices();
        rankPages();
        collectSets();
        makeObjects();
        attributePages();  // releases each process's pages once read
        attach();
        return summary_;
    }

private:
    static constexpr uint32_t kNoObject = UINT32_MAX;
    // Each slice beyond the first costs 4 bytes a distinct page while the pass runs.
    static constexpr size_t kMostSlices = 4;
    // Apart by cache lines: each thread's trie keeps its last lookup.
    struct alignas(64) Slice {
        uint32_t begin = 0, end = 0;  // process numbers
        RKPageKeyRanks ranks;         // until joined
        RKProcessSetTrie sets;
        std::vector<uint32_t> setOf;  // by page rank
    };
    // A page's first holder: process number, then range.
    static constexpr uint64_t kNoHolder = UINT64_MAX;

    // Contiguous slices of the processes, of about equal page counts: the ranks and the sets
    // are found slice by slice, a thread each, then joined.
    void planSlices() {
        const size_t count = std::min(RKOnlineCpuCount(), kMostSlices);
        uint64_t pages = 0;
        for (RKUserProcess* process : processes_) pages += process->sharedAnonymousPages().size();
        std::vector<uint32_t> begins;
        uint64_t before = 0;
        for (uint32_t p = 0; p < processes_.size(); p++) {
            if (begins.size() < count && before >= pages * begins.size() / count) begins.push_back(p);
            before += processes_[p]->sharedAnonymousPages().size();
        }
        slices_ = std::vector<Slice>(begins.size());
        for (size_t s = 0; s < begins.size(); s++) {
            slices_[s].begin = begins[s];
            slices_[s].end = s + 1 < begins.size() ? begins[s + 1] : static_cast<uint32_t>(processes_.size());
        }
    }

    void rankPages() {
        RKParallelApplyOnEveryCpu(slices_.size(), [this](size_t s) {
            Slice& slice = slices_[s];
            for (uint32_t p = slice.begin; p < slice.end; p++)
                for (const RKSharedAnonymousPage& page : processes_[p]->sharedAnonymousPages()) slice.ranks.add(page.page());
        });
        for (Slice& slice : slices_) ranks_.addAll(std::move(slice.ranks));
        ranks_.seal();
    }

    // Every page's set of measured holders in each slice, and where the first of them holds it.
    // Each process's pages are read in order, one process after another: the arrays by rank are
    // walked ascending once a process, never one page across every process.
    void collectSets() {
        firstHolder_.assign(ranks_.size(), kNoHolder);
        RKParallelApplyOnEveryCpu(slices_.size(), [this](size_t s) { collectSetsOf(slices_[s]); });
    }

    void collectSetsOf(Slice& slice) {
        slice.setOf.assign(ranks_.size(), RKProcessSetTrie::kEmpty);
        RKPageKeyRanks::Reader ranks(ranks_);
        for (uint32_t p = slice.begin; p < slice.end; p++) {
            for (const RKSharedAnonymousPage& page : processes_[p]->sharedAnonymousPages()) {
                const uint32_t rank = ranks.rank(page.page());
                uint32_t& set = slice.setOf[rank];
                if (set == RKProcessSetTrie::kEmpty) holds(rank, uint64_t{p} << 32 | page.range);
                set = slice.sets.with(set, p);
            }
        }
    }

    // The first holder is the least process number: a slice's first find of a page stays unless
    // an earlier slice finds it too, whichever thread gets there first.
    void holds(uint32_t rank, uint64_t holder) {
        std::atomic_ref<uint64_t> first(firstHolder_[rank]);
        uint64_t seen = first.load(std::memory_order_relaxed);
        while (holder < seen && !first.compare_exchange_weak(seen, holder, std::memory_order_relaxed)) {
        }
    }

    // In ascending page order: each page that two measured processes or more hold gets its
    // object (by set and name) and its index there. One measured process alone: its private memory.
    // The slices' sets join into sets of the first slice's trie.
    void makeObjects() {
        objectOf_.assign(ranks_.size(), kNoObject);
        indexOf_.resize(ranks_.size());
        RKProcessSetTrie& sets = slices_.front().sets;
        std::vector<RKProcessSetTrie::Joiner> joiners;
        for (size_t s = 1; s < slices_.size(); s++) joiners.emplace_back(sets, slices_[s].sets);
        for (size_t rank = 0; rank < ranks_.size(); rank++) {
            uint32_t set = slices_.front().setOf[rank];
            for (size_t s = 1; s < slices_.size(); s++) set = joiners[s - 1].join(set, slices_[s].setOf[rank]);
            if (sets.size(set) < 2) continue;
            summary_.sharedPages++;
            // Named after the region the first member holds it in, so every member counts it alike.
            const uint64_t holder = firstHolder_[rank];
            const RKMemoryRegion& namedAfter =
                *processes_[holder >> 32]->sharedAnonymousRegions()[static_cast<uint32_t>(holder)];
            objectOf_[rank] = objectFor(sets, set, namedAfter);
            indexOf_[rank] = objects_[objectOf_[rank]].nextIndex++;
        }
        joiners.clear();
        std::vector<Slice>().swap(slices_);
        std::vector<uint64_t>().swap(firstHolder_);
    }

    // Each holder's page moves from the region it was found in to its member region of the
    // page's object, at the page's index there. A process writes its own regions and member
    // regions only: the processes run side by side.
    void attributePages() {
        RKParallelApplyOnEveryCpu(processes_.size(), [this](size_t p) { attributePagesOf(static_cast<uint32_t>(p)); });
    }

    void attributePagesOf(uint32_t p) {
        RKUserProcess& process = *processes_[p];
        const uint64_t pageSize = process.pageSize();
        RKPageKeyRanks::Reader ranks(ranks_);
        uint32_t previous = UINT32_MAX, lastObject = kNoObject;
        MemberRegion* region = nullptr;
        for (const RKSharedAnonymousPage& page : process.sharedAnonymousPages()) {
            const uint32_t rank = ranks.rank(page.page());
            const uint32_t object = objectOf_[rank];
            if (object == kNoObject) continue;
            RKMemoryRegion& origin = *process.sharedAnonymousRegions()[page.range];
            uint64_t& from = page.swapped() ? origin.swappedSize : origin.dirtySize;
            from -= std::min(from, pageSize);
            if (rank == previous) continue;  // mapped twice by one process: one page of the object
            previous = rank;
            if (object != lastObject) {
                SharedObject& shared = objects_[object];
                auto member = std::lower_bound(shared.members.begin(), shared.members.end(), p);
                region = &shared.regions[static_cast<size_t>(member - shared.members.begin())];
                lastObject = object;
            }
            region->add(indexOf_[rank], page.swapped(), pageSize);
        }
        process.releaseSharedAnonymousPages();  // read for the last time
    }

    uint32_t objectFor(const RKProcessSetTrie& sets, uint32_t set, const RKMemoryRegion& namedAfter) {
        auto [name, added] = names_.try_emplace(namedAfter.name + '\0' + namedAfter.detailedName,
                                                static_cast<uint32_t>(names_.size()));
        const uint64_t key = static_cast<uint64_t>(set) << 32 | name->second;
        auto [slot, made] = objectIndex_.try_emplace(key, static_cast<uint32_t>(objects_.size()));
        if (made) {
            SharedObject object;
            object.members = sets.members(set);
            const uint64_t objectId = RKSharedAnonymousObjectIdBase | (objects_.size() + 1);
            for (size_t m = 0; m < object.members.size(); m++) object.regions.emplace_back(namedAfter, objectId);
            objects_.push_back(std::move(object));
        }
        return slot->second;
    }

    // Each member's region of each object joins that member's regions, in object order; the
    // processes run side by side, as each finishes and copies only its own.
    void attach() {
        std::vector<std::vector<MemberRegion*>> added(processes_.size());
        for (SharedObject& object : objects_)
            for (size_t m = 0; m < object.members.size(); m++) added[object.members[m]].push_back(&object.regions[m]);
        RKParallelApplyOnEveryCpu(processes_.size(), [&](size_t p) {
            if (added[p].empty()) return;
            RKUserProcess& process = *processes_[p];
            // Sized exactly: a list grown by insertion would keep up to twice its regions' room.
            static const RKRegionList kNone;
            const RKRegionList& had = process.memoryRegions() ? *process.memoryRegions() : kNone;
            RKRegionList regions;
            regions.reserve(had.size() + added[p].size());
            regions.insert(regions.end(), had.begin(), had.end());
            for (MemberRegion* region : added[p]) regions.push_back(region->finish(process.pageSize()));
            process.setMemoryRegions(std::move(regions));
        });
    }

    std::vector<RKUserProcess*> processes_;
    std::vector<Slice> slices_;
    RKPageKeyRanks ranks_;
    // By page rank.
    std::vector<uint64_t> firstHolder_;
    std::vector<uint32_t> objectOf_;
    std::vector<uint64_t> indexOf_;
    std::unordered_map<std::string, uint32_t> names_;
    std::unordered_map<uint64_t, uint32_t> objectIndex_;
    std::vector<SharedObject> objects_;
    RKSharedAnonymousSummary summary_;
};

}  // namespace

RKSharedAnonymousSummary RKAttributeSharedAnonymousPages(const std::vector<std::shared_ptr<RKProcess>>& processes) {
    return Pass(processes).run();
}

void RKMemspread::_attributeSharedAnonymousPages() {
    const RKSharedAnonymousSummary summary = RKAttributeSharedAnonymousPages(processes_);
    RKReturnFreedHeap();  // the page records, freed in the arenas of the workers that read them
    if (summary.unattributedBytes == 0) return;
    // Once per measurement: how far the summary may over-count, and what makes it exact.
    std::fprintf(stderr,
                 "memspread: %llu bytes of anonymous memory are shared between processes (after fork or by KSM) "
                 "and %s; the summary may count them more than once\n",
                 static_cast<unsigned long long>(summary.unattributedBytes),
                 RKAnalysisSettings::isForkSharingDisabled() ? "are not attributed (MEMSPREAD_FORK_SHARING=off)"
                                                             : "cannot be attributed without root");
}
