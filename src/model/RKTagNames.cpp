// The names of VM user tags and VM ledger tags. The tag numbers this platform gives its regions
// are in platform/RKLinuxTags.h; their display names are here, in one table.
#include <array>
#include <cinttypes>
#include <cstdio>

#include "model/RKMemoryRegion.h"
#include "platform/RKLinuxTags.h"

namespace {

// No default label: with -Wswitch (-Wall) a tag added to RKLinuxTag without a name here does
// not compile.
constexpr const char* linuxTagName(RKLinuxTag tag) {
    switch (tag) {
        case RKTagAnonymous: return "anonymous";
        case RKTagHeap: return "heap";
        case RKTagStack: return "stack";
        case RKTagSysVShm: return "SysV shared memory";
        case RKTagMemfd: return "memfd";
        case RKTagSharedAnonymous: return "shared anonymous";
        case RKTagPosixShm: return "POSIX shared memory";
        case RKTagHugetlb: return "hugetlb";
        case RKTagVdso: return "vdso";
        case RKTagVvar: return "vvar";
        case RKTagVsyscall: return "vsyscall";
        case RKTagUprobes: return "uprobes";
        case RKTagDevice: return "device";
        case RKTagKernelObject: return "kernel object";
    }
    return nullptr;
}

// Indexed by tag; null where this platform has no name (such tags read "tag %d").
constexpr std::array<const char*, 256> makeUserTagTable() {
    std::array<const char*, 256> table{};
    for (uint32_t tag = 0; tag < table.size(); ++tag) table[tag] = linuxTagName(static_cast<RKLinuxTag>(tag));
    return table;
}

constexpr std::array<const char*, 256> kUserTagNames = makeUserTagTable();

// Tags 240 to 255 are left to applications.
constexpr uint32_t kFirstApplicationTag = 240;

// Made once on first use; function-local statics are initialised once even when several
// gathering threads ask at the same time.
const std::array<std::string, 16>& applicationTagNames() {
    static const std::array<std::string, 16> names = [] {
        std::array<std::string, 16> made;
        for (int i = 0; i < 16; ++i) made[i] = "app-specific tag " + std::to_string(i + 1);
        return made;
    }();
    return names;
}

constexpr std::array<const char*, 6> kLedgerTagNames = {nullptr, nullptr, "network", "media", "graphics", "neural"};

}  // namespace

std::string RKMemoryRegion::categoryNameForTag(uint32_t tag) {
    if ((tag & ~0xFu) == kFirstApplicationTag) return applicationTagNames()[tag - kFirstApplicationTag];
    if (tag < kUserTagNames.size() && kUserTagNames[tag]) return kUserTagNames[tag];
    if (tag == RKFakeRegionTag) return "Owned physical memspread (unmapped)";
    char text[32];
    int length = std::snprintf(text, sizeof text, "tag %d", static_cast<int32_t>(tag));
    if (length <= 0) return "unknown";
    return std::string(text, static_cast<size_t>(length));
}

std::optional<std::string> RKMemoryRegion::vmLedgerNameForTag(uint64_t tag) {
    if (tag < kLedgerTagNames.size()) {
        if (!kLedgerTagNames[tag]) return std::nullopt;
        return std::string(kLedgerTagNames[tag]);
    }
    return "VM ledger tag " + std::to_string(tag);
}
