// Sets of process numbers as a trie: a set is its largest member added to the set of the
// others. Where processes are met in ascending order (one process's memory after another's),
// each distinct set has one node, a set grows by one lookup a member, mostly answered by the
// last one again, and a set costs 12 bytes however many members it has.
#pragma once

#include <cstdint>
#include <unordered_map>
#include <vector>

class RKProcessSetTrie {
public:
    static constexpr uint32_t kEmpty = 0;

    RKProcessSetTrie() { nodes_.push_back({kEmpty, UINT32_MAX, 0}); }
    uint32_t size(uint32_t set) const { return nodes_[set].size; }
    uint32_t count() const { return static_cast<uint32_t>(nodes_.size()); }
    // The set with `process` added; `process` is at least every member's number.
    uint32_t with(uint32_t set, uint32_t process) {
        if (nodes_[set].last == process) return set;  // met again
        if (set == lastFrom_ && process == lastProcess_) return lastTo_;
        auto [slot, added] = children_.try_emplace(uint64_t{set} << 32 | process, count());
        if (added) nodes_.push_back({set, process, nodes_[set].size + 1});
        lastFrom_ = set, lastProcess_ = process, lastTo_ = slot->second;
        return slot->second;
    }
    // Ascending.
    std::vector<uint32_t> members(uint32_t set) const {
        std::vector<uint32_t> result(nodes_[set].size);
        for (size_t i = result.size(); i > 0; set = nodes_[set].parent) result[--i] = nodes_[set].last;
        return result;
    }

    // Unions of this trie's sets with sets of `later`, a trie of processes that all come after
    // this one's (a later slice of the processes, met on another thread), as sets of this trie.
    // Every (set, prefix of a later set) joined is remembered, so each node this trie gains is
    // made once, as if the later processes had been met here.
    class Joiner {
    public:
        Joiner(RKProcessSetTrie& into, const RKProcessSetTrie& later) : into_(into), later_(later) {}
        uint32_t join(uint32_t set, uint32_t laterSet) {
            if (laterSet == kEmpty) return set;
            const uint64_t key = uint64_t{set} << 32 | laterSet;
            if (key == lastKey_) return lastTo_;  // neighbouring pages mostly share their holders
            // Up the later set's prefixes to one joined before, or to none; then down, adding.
            uint32_t to = set;
            for (uint32_t prefix = laterSet; prefix != kEmpty; prefix = later_.nodes_[prefix].parent) {
                auto found = made_.find(uint64_t{set} << 32 | prefix);
                if (found != made_.end()) {
                    to = found->second;
                    break;
                }
                path_.push_back(prefix);
            }
            for (; !path_.empty(); path_.pop_back()) {
                to = into_.with(to, later_.nodes_[path_.back()].last);
                made_.emplace(uint64_t{set} << 32 | path_.back(), to);
            }
            lastKey_ = key, lastTo_ = to;
            return to;
        }

    private:
        RKProcessSetTrie& into_;
        const RKProcessSetTrie& later_;
        std::unordered_map<uint64_t, uint32_t> made_;
        std::vector<uint32_t> path_;
        uint64_t lastKey_ = UINT64_MAX;
        uint32_t lastTo_ = kEmpty;
    };

private:
    struct Node {
        uint32_t parent;
        uint32_t last;
        uint32_t size;
    };
    std::vector<Node> nodes_;
    std::unordered_map<uint64_t, uint32_t> children_;
    uint32_t lastFrom_ = UINT32_MAX, lastProcess_ = UINT32_MAX, lastTo_ = 0;
};
