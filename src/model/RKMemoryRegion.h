// One mapped range of one process's address space, or one piece of memory that a process owns
// without mapping it. The process sources create and fill regions; the analysis points each at
// its memory object, which merges the region's sizes by object offset.
//
// The plain fields are public: a region is a record that its source fills field by field. The
// four page-state sizes are disjoint parts of the range and need not reach `size` (untouched
// pages count nowhere); wired is not a page state but counts the whole `size` on top of them.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "model/RKInternedString.h"
#include "model/RKMemoryTotal.h"

class RKMemoryObject;
class RKRangeList;

// How a region relates to the images of its process.
enum RKSegment : uint8_t {
    RKSegmentUnset = 0,     // synthesized regions; shared-cache areas that adjoin no image
    RKSegmentNoImage = 1,   // an ordinary region in no known image segment
    RKSegmentText = 2,      // executable or read-only image text
    RKSegmentData = 3,      // any other image segment
    RKSegmentLinkedit = 4,  // image link-edit (on Linux: read-only image data)
};

// `start` of memory that has no address (owned but unmapped, page tables, kernel zones).
inline constexpr uint64_t RKRegionNoAddress = 0xFFFFFFFFFFFFFFFFull;
// `user_tag` of a fake region: memory the process owns without a mapping.
inline constexpr uint32_t RKFakeRegionTag = 0xFFFFFFFFu;

class RKMemoryRegion {
public:
    RKMemoryRegion();  // every field zero or empty
    ~RKMemoryRegion();
    RKMemoryRegion(const RKMemoryRegion&) = delete;
    RKMemoryRegion& operator=(const RKMemoryRegion&) = delete;

    // Widest fields first, so that the record has no padding: there is one per mapping.
    uint64_t offset = 0;  // of `start` inside the VM object; range lists use this space
    uint64_t start = 0;
    uint64_t size = 0;
    uint64_t dirtySize = 0;
    uint64_t reclaimableSize = 0;
    uint64_t swappedSize = 0;
    uint64_t cleanNonSpecSize = 0;
    uint64_t object_id = 0;  // 0: no VM object behind the range
    RKInternedString name;
    RKInternedString detailedName;  // empty when there is no detail
    uint32_t user_tag = 0;
    uint8_t segment = RKSegmentUnset;
    uint8_t share_mode = 0;  // the kernel's SM_* code of the mapping
    bool wired : 1 = false;
    bool inSharedCache : 1 = false;
    bool unusedSharedCacheRegion : 1 = false;
    bool ownedExclusivelyByParentProcess : 1 = false;
    bool verbose : 1 = false;  // listed only in verbose output (reserved ranges)

    // ---- Derived values ----
    // start + size; memory without an address ends at RKRegionNoAddress too (no wrap-around).
    uint64_t end() const { return start == RKRegionNoAddress ? RKRegionNoAddress : start + size; }
    uint64_t wiredSize() const { return wired ? size : 0; }
    // "name detail", or the name alone when there is no detail.
    std::string fullName() const;
    bool isFake() const { return user_tag == RKFakeRegionTag; }
    // May this region's view of its memory object differ from the object as a whole?
    bool eligibleForProcessView() const;
    // Is the region worth splitting into per-page-state runs?
    bool eligibleForSubrangesUsingPageSize(uint64_t pageSize) const;

    // Sets size to end - start; an end below start stops the program.
    void setEnd(uint64_t end);
    // -1, 0 or 1: lower start first; at equal start the larger size first.
    int compare(const RKMemoryRegion& other) const;

    // ---- The memory object (set by the analysis; not owned) ----
    std::shared_ptr<RKMemoryObject> memoryObject() const;
    // The same without taking a reference: for walks over every region while something else
    // holds the objects.
    RKMemoryObject* memoryObjectPointer() const { return memoryObject_; }
    void setMemoryObject(const std::shared_ptr<RKMemoryObject>& object) { memoryObject_ = object.get(); }
    // Called by an object that goes away, for each region it holds.
    void forgetMemoryObject(const RKMemoryObject* object) {
        if (memoryObject_ == object) memoryObject_ = nullptr;
    }

    // ---- Per-page-state runs, in object-offset space ----
    // Adds [location, location + length) with the five sizes of `total` (its `regions` is
    // ignored), creating the list on first use.
    void addSubrange(uint64_t location, uint64_t length, const RKMemoryTotal& total, uint64_t pageSize);
    const RKRangeList* subrangeList() const { return subrangeList_.get(); }
    void freeSubrangeList();

    // ---- Names of tags ----
    // The display name of a VM user tag; never empty.
    static std::string categoryNameForTag(uint32_t tag);
    // The name of a VM ledger tag, or nothing for tags 0 and 1.
    static std::optional<std::string> vmLedgerNameForTag(uint64_t tag);

private:
    // Not owned: the object holds its regions, and as it goes clears this in each of them, so a
    // region whose object was released (after a report) answers null, which the analysis relies
    // on. A plain pointer rather than a weak one: 8 bytes a region less (one per mapping; the
    // walk makes them in blocks, RKRegionBlocks).
    RKMemoryObject* memoryObject_ = nullptr;
    std::unique_ptr<RKRangeList> subrangeList_;
};
