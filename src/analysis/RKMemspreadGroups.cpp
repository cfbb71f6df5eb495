// Sharing groups: every memory object sorted by the exact set of processes that map it.
#include <deque>
#include <span>
#include <unordered_set>

#include "analysis/RKBatchEnumeration.h"
#include "analysis/RKMemspread.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "model/RKProcessGroup.h"

namespace {

constexpr size_t kRegionBatchSize = 256;
constexpr size_t kGroupsPerShownProcess = 6;

// The processes that map one object, collected before interning.
struct ObjectMappers {
    explicit ObjectMappers(std::shared_ptr<RKMemoryObject> mapped) : object(std::move(mapped)) {}
    std::shared_ptr<RKMemoryObject> object;
    RKProcessGroupMinimal mappers;
    std::shared_ptr<RKProcessGroup> group;  // the interned group of `mappers`
};

using InternSet = std::unordered_set<std::shared_ptr<RKProcessGroup>, RKProcessGroupHash, RKProcessGroupEqual>;

// Objects in the order they are first met, so that the groups and their contents come out in
// the same order on every run.
class MapperTable {
public:
    explicit MapperTable(size_t expectedObjects) { index_.reserve(expectedObjects); }

    ObjectMappers& entryFor(const std::shared_ptr<RKMemoryObject>& object) {
        auto [it, inserted] = index_.try_emplace(object.get(), nullptr);
        if (inserted) it->second = &entries_.emplace_back(object);
        return *it->second;
    }
    std::deque<ObjectMappers>& entries() { return entries_; }

private:
    std::deque<ObjectMappers> entries_;  // stable addresses
    std::unordered_map<const RKMemoryObject*, ObjectMappers*> index_;
};

// A hidden process joins a group only as a mapper of memory that a shown process owns without
// mapping it (owned objects reached through a fake region).
bool hiddenProcessCounts(const RKMemoryObject& object, const std::unordered_set<pid_t>& shownPids) {
    return object.ownerPid() != -1 && shownPids.contains(object.ownerPid()) && object.containsFakeRegion();
}

}  // namespace

RKProcessToGroupsMap RKMemspread::_generateProcessToProcessGroups() const {
    std::unordered_set<pid_t> shownPids;
    size_t regionCount = 0;
    for (const auto& process : processes_) {
        if (!process->hiddenFromDisplay()) shownPids.insert(process->pid());
        if (process->memoryRegions()) regionCount += process->memoryRegions()->size();
    }

    MapperTable table(regionCount);
    for (const auto& process : processes_) {
        if (!process->memoryRegions()) continue;
        const bool hidden = process->hiddenFromDisplay();
        std::span<const std::shared_ptr<RKMemoryRegion>> regions(*process->memoryRegions());
        rk_enumerateObjectsWithBatchSize(regions, kRegionBatchSize, [&](const auto* batch, size_t count) {
            for (size_t i = 0; i < count; i++) {
                std::shared_ptr<RKMemoryObject> object = batch[i]->memoryObject();
                if (!object) continue;  // never analyzed, or released after a previous report
                if (hidden && !hiddenProcessCounts(*object, shownPids)) continue;
                table.entryFor(object).mappers.addProcess(process);
            }
        });
    }

    InternSet interned;
    interned.reserve(kGroupsPerShownProcess * shownPids.size());
    RKProcessGroupList groupsInOrder;
    for (ObjectMappers& entry : table.entries()) {
        auto found = interned.find(entry.mappers);
        if (found == interned.end()) {
            found = interned.insert(entry.mappers.immutableCopy()).first;
            groupsInOrder.push_back(*found);
        }
        entry.group = *found;
    }
    for (ObjectMappers& entry : table.entries()) entry.group->addObject(entry.object);

    RKProcessToGroupsMap result;
    for (const auto& group : groupsInOrder) {
        for (const auto& member : group->processes()) {
            RKProcessGroupList& list = result[member->pid()];
            // A process's private group comes first.
            if (group->count() == 1) {
                list.insert(list.begin(), group);
            } else {
                list.push_back(group);
            }
        }
    }
    return result;
}
