#include "analysis/RKSharedAnonymousPass.h"

#include <cstdio>

#include <algorithm>
#include <cstdint>
#include <queue>
#include <string>
#include <unordered_map>
#include <vector>

#include "analysis/RKMemspread.h"
#include "model/RKMemoryRegion.h"
#include "model/RKMemoryTotal.h"
#include "process/RKUserProcess.h"

namespace {

struct VectorHash {
    size_t operator()(const std::vector<uint32_t>& members) const {
        size_t h = 1469598103934665603ull;
        for (uint32_t m : members) h = (h ^ m) * 1099511628211ull;
        return h;
    }
};

// One member's region of one shared object, built run by run in ascending page index.
class MemberRegion {
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
        if (processes_.size() >= 2) {
            merge();
            attach();
        }
        for (RKUserProcess* process : processes_) process->releaseSharedAnonymousPages();
        return summary_;
    }

private:
    using Entry = std::pair<uint64_t, uint32_t>;  // page, process number

    // One page at a time, in ascending order, across all processes' sorted lists.
    void merge() {
        std::vector<size_t> cursor(processes_.size(), 0);
        std::priority_queue<Entry, std::vector<Entry>, std::greater<Entry>> heads;
        for (uint32_t p = 0; p < processes_.size(); p++) heads.push({processes_[p]->sharedAnonymousPages()[0].page, p});
        std::vector<std::pair<uint32_t, size_t>> holders;  // process number, index of its entry
        while (!heads.empty()) {
            const uint64_t page = heads.top().first;
            holders.clear();
            while (!heads.empty() && heads.top().first == page) {
                const uint32_t p = heads.top().second;
                heads.pop();
                auto& pages = processes_[p]->sharedAnonymousPages();
                for (; cursor[p] < pages.size() && pages[cursor[p]].page == page; cursor[p]++) holders.push_back({p, cursor[p]});
                if (cursor[p] < pages.size()) heads.push({pages[cursor[p]].page, p});
            }
            attribute(holders);
        }
    }

    void attribute(std::vector<std::pair<uint32_t, size_t>>& holders) {
        std::sort(holders.begin(), holders.end());
        members_.clear();
        for (const auto& holder : holders)
            if (members_.empty() || members_.back() != holder.first) members_.push_back(holder.first);
        if (members_.size() < 2) return;  // one measured process alone: its private memory
        summary_.sharedPages++;
        const uint32_t setId = intern(members_);
        // Named after the region the first member holds it in, so every member counts it alike.
        const RKSharedAnonymousPage& first = processes_[holders[0].first]->sharedAnonymousPages()[holders[0].second];
        const RKMemoryRegion& namedAfter = *processes_[holders[0].first]->sharedAnonymousRegions()[first.range];
        SharedObject& object = objectFor(setId, namedAfter);
        const uint64_t index = object.nextIndex++;
        size_t member = 0;
        uint32_t previous = UINT32_MAX;
        for (const auto& [p, at] : holders) {
            RKUserProcess& process = *processes_[p];
            const RKSharedAnonymousPage& entry = process.sharedAnonymousPages()[at];
            RKMemoryRegion& origin = *process.sharedAnonymousRegions()[entry.range];
            const uint64_t pageSize = process.pageSize();
            uint64_t& from = entry.swapped ? origin.swappedSize : origin.dirtySize;
            from -= std::min(from, pageSize);
            if (p == previous) continue;  // mapped twice by one process: one page of the object
            previous = p;
            while (object.members[member] != p) member++;
            object.regions[member].add(index, entry.swapped != 0, pageSize);
        }
    }

    uint32_t intern(const std::vector<uint32_t>& members) {
        auto [it, added] = sets_.try_emplace(members, static_cast<uint32_t>(sets_.size()));
        return it->second;
    }

    SharedObject& objectFor(uint32_t setId, const RKMemoryRegion& namedAfter) {
        auto [name, added] = names_.try_emplace(namedAfter.name + '\0' + namedAfter.detailedName,
                                                static_cast<uint32_t>(names_.size()));
        const uint64_t key = static_cast<uint64_t>(setId) << 32 | name->second;
        auto [slot, made] = objectIndex_.try_emplace(key, objects_.size());
        if (made) {
            SharedObject object;
            object.members = members_;
            const uint64_t objectId = RKSharedAnonymousObjectIdBase | (objects_.size() + 1);
            for (size_t m = 0; m < members_.size(); m++) object.regions.emplace_back(namedAfter, objectId);
            objects_.push_back(std::move(object));
        }
        return objects_[slot->second];
    }

    // Each member's region of each object joins that member's regions.
    void attach() {
        std::vector<RKRegionList> added(processes_.size());
        for (SharedObject& object : objects_)
            for (size_t m = 0; m < object.members.size(); m++)
                added[object.members[m]].push_back(object.regions[m].finish(processes_[object.members[m]]->pageSize()));
        for (size_t p = 0; p < processes_.size(); p++) {
            if (added[p].empty()) continue;
            RKRegionList regions = processes_[p]->memoryRegions().value_or(RKRegionList{});
            regions.insert(regions.end(), added[p].begin(), added[p].end());
            processes_[p]->setMemoryRegions(std::move(regions));
        }
    }

    std::vector<RKUserProcess*> processes_;
    std::vector<uint32_t> members_;
    std::unordered_map<std::vector<uint32_t>, uint32_t, VectorHash> sets_;
    std::unordered_map<std::string, uint32_t> names_;
    std::unordered_map<uint64_t, size_t> objectIndex_;
    std::vector<SharedObject> objects_;
    RKSharedAnonymousSummary summary_;
};

}  // namespace

RKSharedAnonymousSummary RKAttributeSharedAnonymousPages(const std::vector<std::shared_ptr<RKProcess>>& processes) {
    return Pass(processes).run();
}

void RKMemspread::_attributeSharedAnonymousPages() {
    const RKSharedAnonymousSummary summary = RKAttributeSharedAnonymousPages(processes_);
    if (summary.unattributedBytes == 0) return;
    // Once per measurement: how far the summary may over-count, and what makes it exact.
    std::fprintf(stderr,
                 "memspread: %llu bytes of anonymous memory are shared between processes (after fork or by KSM) "
                 "and cannot be attributed without root; the summary may count them more than once\n",
                 static_cast<unsigned long long>(summary.unattributedBytes));
}
