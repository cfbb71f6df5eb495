// A set of processes that map the same memory objects. The analysis builds one mutable
// RKProcessGroupMinimal per memory object, then interns them: one immutable RKProcessGroup per
// distinct member set, which receives the objects of that set.
//
// Interning: put RKProcessGroup instances in an unordered set with RKProcessGroupHash and
// RKProcessGroupEqual; a minimal group finds its interned twin by content (heterogeneous
// lookup), while two interned groups are equal only when they are the same instance.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "model/RKCategoryMap.h"
#include "process/RKProcess.h"

class RKMemoryObject;
class RKProcessGroup;

// Processes are equal when their pids are; the set iterates in ascending pid order.
struct RKProcessPidLess {
    bool operator()(const std::shared_ptr<RKProcess>& a, const std::shared_ptr<RKProcess>& b) const {
        return a->pid() < b->pid();
    }
};
using RKProcessSet = std::set<std::shared_ptr<RKProcess>, RKProcessPidLess>;

class RKProcessGroupMinimal {
public:
    RKProcessGroupMinimal();  // no members, hash 19
    virtual ~RKProcessGroupMinimal() = default;
    RKProcessGroupMinimal(const RKProcessGroupMinimal&) = delete;
    RKProcessGroupMinimal& operator=(const RKProcessGroupMinimal&) = delete;

    // Adds a member unless its pid is one already. The hash depends on the order of additions,
    // so groups must receive their processes in one agreed order to hash alike.
    virtual void addProcess(const std::shared_ptr<RKProcess>& process);

    uint64_t hash() const { return hashValue_; }
    uint64_t hashValue() const { return hashValue_; }
    // The member sets are equal.
    virtual bool isEqual(const RKProcessGroupMinimal& other) const;
    // "RKProcessGroup" and the member set.
    std::string description() const;

    // A new immutable group with this group's hash and this very member set (shared).
    std::shared_ptr<RKProcessGroup> immutableCopy() const;

    const RKProcessSet& processes() const { return *processes_; }
    size_t count() const { return processes_->size(); }

protected:
    // Only immutableCopy makes interned groups.
    struct InternKey {
        explicit InternKey() = default;
    };
    RKProcessGroupMinimal(std::shared_ptr<RKProcessSet> processes, uint64_t hashValue);
    bool _hasEqualMembers(const RKProcessGroupMinimal& other) const;

    std::shared_ptr<RKProcessSet> processes_;
    uint64_t hashValue_ = 19;
};

class RKProcessGroup : public RKProcessGroupMinimal, public std::enable_shared_from_this<RKProcessGroup> {
public:
    RKProcessGroup(InternKey, std::shared_ptr<RKProcessSet> processes, uint64_t hashValue)
        : RKProcessGroupMinimal(std::move(processes), hashValue) {}

    // Immutable: the group itself.
    std::shared_ptr<RKProcessGroup> copy() { return shared_from_this(); }
    // Stops the program: an interned group's members are fixed.
    void addProcess(const std::shared_ptr<RKProcess>& process) override;
    // By content against a minimal group, by identity against another interned group.
    bool isEqual(const RKProcessGroupMinimal& other) const override;

    // The memory objects mapped by exactly this set of processes.
    void addObject(const std::shared_ptr<RKMemoryObject>& object) { objects_.push_back(object); }
    // Room for `count` objects in all, when the caller knows: a list grown by adding keeps up
    // to twice its objects' room.
    void reserveObjects(size_t count) { objects_.reserve(count); }
    const std::vector<std::shared_ptr<RKMemoryObject>>& objects() const { return objects_; }

    // Caches categories for the other members of a large group; refcount > 0 or the program
    // stops. consumeCachedCategories hands the map out refcount times, then forgets it; null
    // when there is none.
    void attachCachedCategories(std::shared_ptr<RKCategoryMap> categories, uint32_t refcount);
    std::shared_ptr<RKCategoryMap> consumeCachedCategories();
    const std::shared_ptr<RKCategoryMap>& categories() const { return categories_; }
    uint32_t categoriesRefcount() const { return categoriesRefcount_; }

private:
    uint32_t categoriesRefcount_ = 0;
    std::vector<std::shared_ptr<RKMemoryObject>> objects_;
    std::shared_ptr<RKCategoryMap> categories_;
};

// Hash and equality for sets of groups; transparent, so a set of interned groups can be
// searched with a minimal group.
struct RKProcessGroupHash {
    using is_transparent = void;
    size_t operator()(const RKProcessGroupMinimal& group) const { return static_cast<size_t>(group.hash()); }
    template <class Group>
    size_t operator()(const std::shared_ptr<Group>& group) const {
        return (*this)(static_cast<const RKProcessGroupMinimal&>(*group));
    }
};

struct RKProcessGroupEqual {
    using is_transparent = void;
    template <class A, class B>
    bool operator()(const A& a, const B& b) const {
        return deref(a).isEqual(deref(b));
    }

private:
    static const RKProcessGroupMinimal& deref(const RKProcessGroupMinimal& group) { return group; }
    template <class Group>
    static const RKProcessGroupMinimal& deref(const std::shared_ptr<Group>& group) {
        return *group;
    }
};
