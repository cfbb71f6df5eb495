// A process opened through a directory descriptor of /proc/PID. Every later read of the
// process goes through openat() below it, so a pid reused by another process is never read.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/RKDescriptorBudget.h"
#include "platform/RKLinuxPageReader.h"
#include "platform/RKLinuxVmaClassifier.h"
#include "platform/RKPlatform.h"
#include "platform/RKProcStatusFigures.h"
#include "platform/RKReadBuffer.h"
#include "platform/RKSmapsParser.h"
#include "platform/RKUniqueFd.h"

// One VMA of the walk, classified.
struct RKLinuxRegion {
    RKSmapsVma vma;            // as smaps gave it (its path points into the snapshot's text)
    RKVmaKind kind = RKVmaKind::Anonymous;
    RKRegionSubmapInfo info;   // what the region walk answers
    std::string_view detail;   // what regionFileName answers; empty for none
};

// The address space as one read of smaps saw it. The walk answers every region from it, so
// smaps is read once per walk however many regions there are.
struct RKLinuxWalkSnapshot {
    RKReadBuffer text;  // the smaps text the regions point into
    std::vector<RKLinuxRegion> regions;  // ascending, non-overlapping
    // What follows the last region: KERN_INVALID_ADDRESS, or MACH_SEND_INVALID_DEST when the
    // process went away while it was read (the regions may then be only a prefix).
    kern_return_t end = KERN_INVALID_ADDRESS;
    // Read for the image lister just before a walk: the walk that starts next uses it instead
    // of reading smaps again.
    bool readyForWalk = false;
    // Where the last lookup by address found its region: a walk asks in ascending order, mostly
    // for that region or the next.
    mutable size_t lastFound = 0;
};

class RKLinuxTask : public RKTask {
public:
    // `ticket`: the slot of the descriptor budget this task holds until it is destroyed.
    RKLinuxTask(pid_t pid, RKUniqueFd directory, RKDescriptorTicket ticket = {})
        : pid_(pid), ticket_(std::move(ticket)), directory_(std::move(directory)) {}

    pid_t pid() const override { return pid_; }
    int directoryFd() const { return directory_.get(); }

    // Set while a walk is under way (RKLinuxRegions.cpp); dropped when it reaches the end.
    std::unique_ptr<RKLinuxWalkSnapshot> snapshot;
    // Page data read ahead for the page queries that follow (RKLinuxPages.cpp).
    std::unique_ptr<RKLinuxPageData> pageData;
    // Start and shared anonymous bytes (from smaps, RKLinuxRegions.cpp) of every private VMA
    // with such pages, as the latest walk saw them; kept after the walk, for the bound of what
    // cannot be attributed where frames are hidden.
    std::vector<std::pair<uint64_t, uint64_t>> sharedAnonymousBytes;
    // The figures of status, from the first read that succeeded through this task
    // (RKLinuxFigures.cpp).
    std::optional<RKStatusFigures> statusFigures;

private:
    pid_t pid_;
    RKDescriptorTicket ticket_;  // declared first: given back after the directory is closed
    RKUniqueFd directory_;
};
