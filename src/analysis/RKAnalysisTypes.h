// The containers of one analysis: the identity maps that turn regions into memory objects, the
// per-process memspread numbers and the sharing groups of each process.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <unordered_map>
#include <unordered_set>
#include <vector>

class RKMemoryObject;
class RKProcessGroup;

// Identity keys are object ids or addresses; their low bits carry little, so the hash drops them.
// Private object ids within 1 MiB of each other share a hash value, which bounds a bucket chain
// at 256 entries: lookups stay constant-time.
struct RKIdentityKeyHash {
    size_t operator()(uint64_t key) const noexcept { return static_cast<size_t>(key >> 8); }
};

using RKIdentityMap = std::unordered_map<uint64_t, std::shared_ptr<RKMemoryObject>, RKIdentityKeyHash>;
using RKMemoryObjectList = std::vector<std::shared_ptr<RKMemoryObject>>;

// Keys that never identify a VM object: such a region gets an object of its own.
inline constexpr uint64_t RKNoIdentityKey = 0;
inline constexpr uint64_t RKInvalidIdentityKey = 0xFFFFFFFFFFFFFFFFull;

// What identity found in one process alone (RKMemspreadAnalysis.cpp).
struct RKProcessIdentity {
    // The objects of its private ids: no other process can map them, so they are found within
    // the process and need no entry in the maps below.
    RKMemoryObjectList privateObjects;
    std::vector<uint32_t> mappedRegions;  // indices of the regions whose objects the maps find
};

// The maps own the memory objects from analysis until the sharing groups are built.
struct RKIdentityMaps {
    explicit RKIdentityMaps(size_t processCount);

    RKIdentityMap memoryObjects;                       // ordinary regions, by object_id
    RKIdentityMap sharedCacheTranslatedMemoryObjects;  // shared cache of translated processes, by address
    RKIdentityMap sharedCacheMemoryObjects;            // shared cache of other processes, by address
    RKIdentityMap textMemoryObjects;                   // text segments, by object_id
    RKIdentityMap linkeditMemoryObjects;               // link-edit segments, by object_id
    RKMemoryObjectList uniqueMemoryObjects;            // objects of one region only
    // Objects that more than one process owns (a memfd whose descriptor several hold): no one
    // process owns them, so they are shared memory of their holders.
    std::unordered_set<RKMemoryObject*> ownedBySeveral;
    std::vector<RKProcessIdentity> byProcess;  // in the order of the analysis's processes
};

using RKPidToMemspreadMap = std::unordered_map<pid_t, uint64_t>;

// The groups of one process: its private group first (when it has one), then the shared ones.
using RKProcessGroupList = std::vector<std::shared_ptr<RKProcessGroup>>;
using RKProcessToGroupsMap = std::unordered_map<pid_t, RKProcessGroupList>;

// Whether a set of objects looks different to the processes that map it.
enum RKProcessView : uint8_t {
    RKProcessViewNone = 0,      // no object can ever differ between processes
    RKProcessViewPossible = 1,  // some object could differ, none did for this process
    RKProcessViewPresent = 2,   // at least one object looked different to this process
};
