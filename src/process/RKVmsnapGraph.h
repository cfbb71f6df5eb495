// A saved process (a vmsnap file) as plain records: what the snapshot source reads in place of a
// live task. docs/vmsnap.md describes the file; RKVmsnapParse and RKVmsnapSerialize are its only
// readers and writers, functions between bytes and these records with no I/O of their own.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "model/RKError.h"

// The file version this program writes and the newest it reads. Version 2 added the shared
// anonymous pages; version 1 files are still read (they have none).
inline constexpr int64_t RKVmsnapVersion = 2;

// One run of pages in one state, in the region's object-offset space.
struct RKVmsnapSubrange {
    uint64_t offset = 0;
    uint64_t length = 0;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;
};

// What a Linux snapshot adds to a region record, so that the analysis sees the region exactly as
// the live run built it (its name, detail, exact sizes, subranges and flags).
struct RKVmsnapRegionDetails {
    std::string name;
    std::string detail;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    bool wired = false;
    bool ownedExclusivelyByParentProcess = false;
    std::vector<RKVmsnapSubrange> subranges;
};

// One mapped region, with the counters a region query answers (sizes in bytes).
struct RKVmsnapRegion {
    uint64_t address = 0;
    uint64_t length = 0;
    int32_t prot = 0;
    int32_t maxProt = 0;
    uint64_t offset = 0;
    uint32_t user_tag = 0;
    uint64_t resident_size = 0;
    uint64_t shared_now_private_size = 0;
    uint64_t swapped_out_size = 0;
    uint64_t dirty_size = 0;
    uint64_t reusable_size = 0;
    uint16_t ref_count = 0;
    bool external_pager = false;
    uint8_t share_mode = 0;
    bool is_submap = false;
    uint64_t object_id = 0;
    int32_t purgeable = 3;  // VM_PURGABLE_DENY: not purgeable
    std::string path;
    std::string type;       // a segment name, a reserved area's name, or empty
    uint8_t segment = 0;    // the segment code of an image segment whose name is not a "__" name
    std::optional<RKVmsnapRegionDetails> details;
};

// Memory the process holds without an address (owned objects, page tables), as the live run
// built it.
struct RKVmsnapUnaddressedRegion {
    uint64_t size = 0;
    uint32_t user_tag = 0;
    uint64_t object_id = 0;
    uint8_t share_mode = 0;
    uint64_t offset = 0;
    RKVmsnapRegionDetails details;
};

// The shared anonymous pages of one saved region, as the platform's shared-page query answered
// them: their keys (a frame number, or a swap entry with RKSwappedPageKey set), ascending; a key
// repeats where the region maps one page twice (KSM). `region` indexes the graph's regions.
struct RKVmsnapSharedPages {
    uint32_t region = 0;
    std::vector<uint64_t> keys;
};

// A key bit no frame number or swap entry uses: a snapshot's pages carry it once read, so they
// match the pages of other snapshots but never a live process's.
inline constexpr uint64_t RKVmsnapPageKeyMark = 1ull << 62;

struct RKVmsnapGraph {
    int64_t version = RKVmsnapVersion;
    bool is64bit = true;
    int32_t pid = 0;
    std::string processName;
    std::string processDescriptionString;
    std::string binaryImagesDescription;
    uint64_t vmPageSize = 0;
    uint64_t physicalMemspread = 0;
    uint64_t physicalMemspreadPeak = 0;
    bool showsPhysMemspread = false;
    std::vector<RKVmsnapRegion> regions;  // ascending by address
    std::vector<RKVmsnapUnaddressedRegion> unaddressedRegions;
    // The input of the pass that counts fork-shared anonymous pages once, so that snapshots
    // analysed together share them as the live processes do.
    std::vector<RKVmsnapSharedPages> sharedAnonymousPages;
    uint64_t unattributedSharedAnonymousBytes = 0;  // frames were hidden: bytes shared, unattributed
};

inline constexpr const char* RKVmsnapErrorDomain = "MemspreadErrorDomain";

// The graph of a file's bytes (compressed or plain JSON), or nothing with an error of the
// snapshot domain saying what is wrong. Never throws.
std::optional<RKVmsnapGraph> RKVmsnapParse(std::string_view bytes, RKError* error);

// The file's bytes for a graph: JSON, compressed.
std::string RKVmsnapSerialize(const RKVmsnapGraph& graph);
