// Sharing groups: every memory object sorted by the exact set of processes that map it.
#include <span>
#include <unordered_map>
#include <unordered_set>

#include "analysis/RKBatchEnumeration.h"
#include "analysis/RKMemspread.h"
#include "analysis/RKPointerSet.h"
#include "analysis/RKProcessSetTrie.h"
#include "model/RKMemoryObject.h"
#include "model/RKMemoryRegion.h"
#include "model/RKProcessGroup.h"

namespace {

constexpr size_t kRegionBatchSize = 256;

// A hidden process joins a group only as a mapper of memory that a shown process owns without
// mapping it (owned objects reached through a fake region).
bool hiddenProcessCounts(const RKMemoryObject& object, const std::unordered_set<pid_t>& shownPids) {
    return object.ownerPid() != -1 && shownPids.contains(object.ownerPid()) && object.containsFakeRegion();
}

}  // namespace

RKProcessToGroupsMap RKMemspread::_generateProcessToProcessGroups() {
    std::unordered_set<pid_t> shownPids;
    size_t regionCount = 0;
    for (const auto& process : processes_) {
        if (!process->hiddenFromDisplay()) shownPids.insert(process->pid());
        if (process->memoryRegions()) regionCount += process->memoryRegions()->size();
    }

    // Each object's mappers as a set of process numbers, objects in the order they are first
    // met, so that the groups and their contents come out in the same order on every run. The
    // identity maps hold the objects until the groups do: the walk keeps plain pointers.
    RKProcessSetTrie sets;
    std::vector<RKMemoryObject*> objects;
    std::vector<uint32_t> mappersOf;
    std::unordered_map<const RKMemoryObject*, uint32_t> indexOf;
    objects.reserve(regionCount), mappersOf.reserve(regionCount);
    for (uint32_t p = 0; p < processes_.size(); p++) {
        const RKProcess& process = *processes_[p];
        if (!process.memoryRegions()) continue;
        const bool hidden = process.hiddenFromDisplay();
        std::span<const std::shared_ptr<RKMemoryRegion>> regions(*process.memoryRegions());
        rk_enumerateObjectsWithBatchSize(regions, kRegionBatchSize, [&](const auto* batch, size_t count) {
            for (size_t i = 0; i < count; i++) {
                RKMemoryObject* object = batch[i]->memoryObjectPointer();
                if (!object) continue;  // never analyzed, or released after a previous report
                if (hidden && !hiddenProcessCounts(*object, shownPids)) continue;
                // Met once (one region), it needs no entry in indexOf: most objects.
                if (RKMetOnce(*object)) {
                    objects.push_back(object), mappersOf.push_back(sets.with(RKProcessSetTrie::kEmpty, p));
                    continue;
                }
                auto [slot, added] = indexOf.try_emplace(object, static_cast<uint32_t>(objects.size()));
                if (added) objects.push_back(object), mappersOf.push_back(RKProcessSetTrie::kEmpty);
                mappersOf[slot->second] = sets.with(mappersOf[slot->second], p);
            }
        });
    }
    decltype(indexOf)().swap(indexOf);  // its memory, before the groups are made

    // One group a distinct set of mappers, made when its first object is met.
    std::vector<uint32_t> objectsOf(sets.count());
    for (uint32_t set : mappersOf) objectsOf[set]++;
    std::vector<std::shared_ptr<RKProcessGroup>> groupOf(sets.count());
    RKProcessGroupList groupsInOrder;
    for (size_t i = 0; i < objects.size(); i++) {
        std::shared_ptr<RKProcessGroup>& group = groupOf[mappersOf[i]];
        if (!group) {
            RKProcessGroupMinimal mappers;
            for (uint32_t p : sets.members(mappersOf[i])) mappers.addProcess(processes_[p]);
            group = mappers.immutableCopy();
            group->reserveObjects(objectsOf[mappersOf[i]]);
            groupsInOrder.push_back(group);
        }
        group->addObject(objects[i]->shared_from_this());
    }
    // From here on the groups hold the memory objects.
    decltype(objects)().swap(objects);
    identityMaps_.reset();

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
