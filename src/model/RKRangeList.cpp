#include "model/RKRangeList.h"

#include <algorithm>
#include <iterator>
#include <limits>
#include <map>

#include "model/RKMemoryRegion.h"

namespace {

constexpr uint64_t kMax = std::numeric_limits<uint64_t>::max();

// Offsets near the top of the 64-bit space must not wrap to small numbers.
uint64_t addSaturating(uint64_t a, uint64_t b) {
    uint64_t result;
    return __builtin_add_overflow(a, b, &result) ? kMax : result;
}

uint64_t endOf(const RKRangeListNode& node) { return addSaturating(node.location, node.length); }

// Page rounding. A page size that is not a power of two (a corrupt snapshot, say) would make
// the mask meaningless; such a size rounds nothing and merges at byte granularity.
class Rounding {
public:
    explicit Rounding(uint64_t pageSize) {
        bool powerOfTwo = pageSize != 0 && (pageSize & (pageSize - 1)) == 0;
        mask_ = powerOfTwo ? ~(pageSize - 1) : kMax;
    }
    uint64_t down(uint64_t value) const { return value & mask_; }
    uint64_t up(uint64_t value) const {
        uint64_t raised;
        if (__builtin_add_overflow(value, ~mask_, &raised)) return kMax;
        return raised & mask_;
    }
    uint64_t start(const RKRangeListNode& node) const { return down(node.location); }
    uint64_t end(const RKRangeListNode& node) const { return up(endOf(node)); }

private:
    uint64_t mask_;
};

// Never below either input, never above their sum: bytes seen through both ranges (the
// overlap) are not counted twice, but no merge can lose what one side alone reported.
uint64_t mergedSize(uint64_t ours, uint64_t theirs, uint64_t overlap) {
    uint64_t sum = addSaturating(ours, theirs);
    uint64_t withoutOverlap = sum > overlap ? sum - overlap : 0;
    return std::max(withoutOverlap, std::max(ours, theirs));
}

// Merges `node` into `merged`. The overlap is always measured against the page-rounded range
// being inserted, [lo, hi), not against `merged` as it grows.
void mergeInto(RKRangeListNode& merged, const RKRangeListNode& node, uint64_t lo, uint64_t hi, const Rounding& round) {
    uint64_t from = std::max(lo, round.start(node));
    uint64_t to = std::min(hi, round.end(node));
    uint64_t overlap = to > from ? to - from : 0;

    merged.clean = mergedSize(merged.clean, node.clean, overlap);
    merged.dirty = mergedSize(merged.dirty, node.dirty, overlap);
    merged.swapped = mergedSize(merged.swapped, node.swapped, overlap);
    merged.reclaimable = mergedSize(merged.reclaimable, node.reclaimable, overlap);
    merged.wired = mergedSize(merged.wired, node.wired, overlap);

    uint64_t end = std::max(endOf(merged), endOf(node));
    merged.location = std::min(merged.location, node.location);
    merged.length = end - merged.location;
}

// One insertion anywhere, on nodes ordered by location: O(log n) plus the nodes merged.
using NodeMap = std::map<uint64_t, RKRangeListNode>;

void insertInto(NodeMap& nodes, RKRangeListNode fresh, const Rounding& round) {
    const uint64_t lo = round.start(fresh), hi = round.end(fresh);
    // Nodes at or above lo never lie wholly before the range; below it, walk back while they
    // reach lo (one step, unless nodes were built with a smaller page size).
    auto first = nodes.lower_bound(lo);
    while (first != nodes.begin() && round.end(std::prev(first)->second) >= lo) --first;
    auto after = first;
    for (; after != nodes.end() && round.start(after->second) <= hi; ++after) {
        mergeInto(fresh, after->second, lo, hi, round);
    }
    if (first == after) {
        nodes.emplace_hint(after, fresh.location, fresh);
        return;
    }
    // The merged node takes the place, and the allocation, of the first node it absorbed.
    nodes.erase(std::next(first), after);
    auto handle = nodes.extract(first);
    handle.key() = fresh.location;
    handle.mapped() = fresh;
    nodes.insert(after, std::move(handle));
}

RKMemoryTotal totalOf(const RKRangeListNode& node) {
    return RKMemoryTotal{.dirty = node.dirty,
                         .swapped = node.swapped,
                         .clean = node.clean,
                         .reclaimable = node.reclaimable,
                         .wired = node.wired};
}

}  // namespace

void RKRangeList::addRange(uint64_t location, uint64_t length, uint64_t pageSize, const RKMemoryTotal& total) {
    RKRangeListNode fresh{location, length, total.clean, total.dirty, total.swapped, total.reclaimable, total.wired};
    if (queuedCount_ != 0) {
        if (pageSize == queuedPageSize_) {
            entries_.push_back({fresh, ++queuedCount_});
            return;
        }
        _placeQueued();  // one page size per queue
    }
    // Placed at once when the range reaches the last node or lies beyond it: every node it
    // touches is then at the tail. Queued when it lies further down.
    const Rounding round(pageSize);
    const uint64_t lo = round.start(fresh), hi = round.end(fresh);
    if (!entries_.empty() && round.start(entries_.back().node) > hi) {
        queuedPageSize_ = pageSize;
        entries_.push_back({fresh, ++queuedCount_});
        return;
    }
    size_t first = entries_.size();
    while (first > 0 && round.end(entries_[first - 1].node) >= lo) --first;
    for (size_t i = first; i < entries_.size(); ++i) mergeInto(fresh, entries_[i].node, lo, hi, round);
    entries_.resize(first);
    entries_.push_back({fresh, 0});
}

// Ranges that do not touch, directly or through a chain of touching ranges, cannot influence
// one another, whatever their order. So: sort everything by rounded start, sweep it into groups
// of touching extents, keep single pieces and groups of placed nodes as they are, and replay
// the rest (placed nodes first, then queued insertions in insertion order). Groups never grow
// in the replay, so the result is written back over the entries already read.
void RKRangeList::_placeQueued() const {
    if (queuedCount_ == 0) return;
    const Rounding round(queuedPageSize_);
    std::sort(entries_.begin(), entries_.end(), [&round](const Entry& a, const Entry& b) {
        uint64_t startA = round.start(a.node), startB = round.start(b.node);
        if (startA != startB) return startA < startB;
        if (a.sequence != b.sequence) return a.sequence < b.sequence;
        return a.node.location < b.node.location;
    });

    std::vector<const Entry*> queued;
    size_t read = 0, write = 0;
    while (read < entries_.size()) {
        const size_t groupStart = read;
        uint64_t reach = round.end(entries_[read++].node);
        while (read < entries_.size() && round.start(entries_[read].node) <= reach) {
            reach = std::max(reach, round.end(entries_[read++].node));
        }
        NodeMap replayed;
        queued.clear();
        for (size_t i = groupStart; i < read && read - groupStart > 1; ++i) {
            if (entries_[i].sequence == 0) replayed.emplace(entries_[i].node.location, entries_[i].node);
            else queued.push_back(&entries_[i]);
        }
        if (queued.empty()) {  // one piece, or placed nodes only
            for (size_t i = groupStart; i < read; ++i) entries_[write++] = {entries_[i].node, 0};
            continue;
        }
        std::sort(queued.begin(), queued.end(), [](const Entry* a, const Entry* b) { return a->sequence < b->sequence; });
        for (const Entry* insertion : queued) insertInto(replayed, insertion->node, round);
        for (const auto& [location, node] : replayed) entries_[write++] = {node, 0};
    }
    entries_.resize(write);
    queuedCount_ = 0;
}

void RKRangeList::addRegion(const RKMemoryRegion& region, uint64_t pageSize) {
    if (const RKRangeList* subranges = region.subrangeList()) {
        _addRangeList(*subranges, pageSize);
        return;
    }
    RKMemoryTotal sizes{.dirty = region.dirtySize,
                        .swapped = region.swappedSize,
                        .clean = region.cleanNonSpecSize,
                        .reclaimable = region.reclaimableSize,
                        .wired = region.wiredSize()};
    addRange(region.offset, region.size, pageSize, sizes);
}

void RKRangeList::_addRangeList(const RKRangeList& other, uint64_t pageSize) {
    if (&other == this) {  // its nodes would move while being walked
        for (const RKRangeListNode& node : nodes()) addRange(node.location, node.length, pageSize, totalOf(node));
        return;
    }
    other._placeQueued();
    for (const Entry& entry : other.entries_) {
        const RKRangeListNode& node = entry.node;
        addRange(node.location, node.length, pageSize, totalOf(node));
    }
}

RKMemoryTotal RKRangeList::sum() const {
    _placeQueued();
    RKMemoryTotal total;
    for (const auto& [node, sequence] : entries_) {
        total.clean += node.clean;
        total.dirty += node.dirty;
        total.swapped += node.swapped;
        total.reclaimable += node.reclaimable;
        total.wired += node.wired;
    }
    return total;
}

size_t RKRangeList::nodeCount() const {
    _placeQueued();
    return entries_.size();
}

std::vector<RKRangeListNode> RKRangeList::nodes() const {
    _placeQueued();
    std::vector<RKRangeListNode> result;
    result.reserve(entries_.size());
    for (const auto& [node, sequence] : entries_) result.push_back(node);
    return result;
}
