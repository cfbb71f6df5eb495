#include "platform/RKLinuxVmaClassifier.h"

#include <algorithm>
#include <limits>

#include "platform/RKLinuxTags.h"
#include "platform/RKProcStatParser.h"

namespace {

bool startsWith(std::string_view s, std::string_view prefix) { return s.substr(0, prefix.size()) == prefix; }

bool isBracketed(std::string_view path) { return !path.empty() && path.front() == '['; }

// "[prefixNAME]" -> NAME, or nothing when `path` is not of that form.
std::optional<std::string_view> bracketedName(std::string_view path, std::string_view prefix) {
    if (!startsWith(path, prefix) || path.size() < prefix.size() + 1 || path.back() != ']') return std::nullopt;
    return path.substr(prefix.size(), path.size() - prefix.size() - 1);
}

bool isAnonymousName(std::string_view path) {
    return path.empty() || path == "[heap]" || startsWith(path, "[stack") || startsWith(path, "[anon:");
}

bool isSpecialName(std::string_view path) {
    return path == "[vdso]" || path == "[vvar]" || path == "[vvar_vclock]" || path == "[vsyscall]" ||
           path == "[uprobes]";
}

bool isSysV(std::string_view path) { return startsWith(path, "/SYSV"); }

uint64_t deviceOf(const RKSmapsVma& vma) { return RKDeviceKey(vma.devMajor, vma.devMinor); }

// The internal shmem mount's files, recognised by name when its device could not be learnt.
bool looksLikeInternalShmem(const RKSmapsVma& vma) {
    return vma.devMajor == 0 &&
           (startsWith(vma.path, "/memfd:") || isSysV(vma.path) || vma.path == "/dev/zero (deleted)");
}

bool isShmemDevice(const RKSmapsVma& vma, const RKVmaContext& context) {
    if (context.shmemDevice) return deviceOf(vma) == *context.shmemDevice;
    return looksLikeInternalShmem(vma);
}

std::optional<RKMountKind> mountKind(const RKSmapsVma& vma, const RKVmaContext& context) {
    if (!context.mounts) return std::nullopt;
    auto it = context.mounts->find(deviceOf(vma));
    if (it == context.mounts->end()) return std::nullopt;
    return it->second;
}

uint32_t pages(uint64_t kB, uint64_t pageSize) {
    uint64_t count = kB * 1024 / pageSize;
    return static_cast<uint32_t>(std::min<uint64_t>(count, std::numeric_limits<uint32_t>::max()));
}

uint64_t mix64(uint64_t x) {
    x ^= x >> 30;
    x *= 0xbf58476d1ce4e5b9ull;
    x ^= x >> 27;
    x *= 0x94d049bb133111ebull;
    x ^= x >> 31;
    return x;
}

bool isShared(const RKSmapsVma& vma) { return (vma.perms & RKSmapsShared) != 0; }

// Private anonymous: empty when nothing is there, copy-on-write when some pages are mapped by
// another process too (inherited across fork, or merged by KSM), else private.
uint8_t anonymousShareMode(const RKSmapsVma& vma) {
    if (vma.rss == 0 && vma.swap == 0) return SM_EMPTY;
    if (vma.sharedClean + vma.sharedDirty > 0) return SM_COW;
    return SM_PRIVATE;
}

uint8_t shareModeFor(const RKSmapsVma& vma, RKVmaKind kind) {
    switch (kind) {
        case RKVmaKind::Hugetlb: return SM_LARGE_PAGE;
        case RKVmaKind::Device:
        case RKVmaKind::Special: return SM_EMPTY;
        case RKVmaKind::Anonymous: return isShared(vma) ? SM_SHARED : anonymousShareMode(vma);
        case RKVmaKind::Shmem:
        case RKVmaKind::File: return isShared(vma) ? SM_SHARED : SM_COW;
    }
    return SM_EMPTY;
}

uint32_t dirtiedPages(const RKSmapsVma& vma, RKVmaKind kind, uint64_t pageSize) {
    switch (kind) {
        case RKVmaKind::Hugetlb: return pages(vma.privateHugetlb + vma.sharedHugetlb, pageSize);
        case RKVmaKind::Anonymous: return pages(vma.rss - std::min(vma.rss, vma.lazyFree), pageSize);
        case RKVmaKind::Shmem:
            // Privately mapped too, every resident page is memory: the object's own pages (shmem,
            // never page cache) and the copies written through the mapping.
            return pages(vma.rss - std::min(vma.rss, vma.lazyFree), pageSize);
        case RKVmaKind::File:
            if (!isShared(vma)) return pages(vma.anonymous, pageSize);
            return pages(vma.privateDirty + vma.sharedDirty, pageSize);
        case RKVmaKind::Device:
        case RKVmaKind::Special: return 0;
    }
    return 0;
}

uint16_t wiredCount(const RKSmapsVma& vma, RKVmaKind kind) {
    if (kind == RKVmaKind::Hugetlb) return 1;  // huge pages are never reclaimed
    if (!(vma.vmFlags & RKVmLocked)) return 0;
    // Lock-on-fault locks only the pages that are there: wired once all of them are.
    if (vma.vmFlags & RKVmLockOnFault) return vma.rss * 1024 == vma.end - vma.start ? 1 : 0;
    return 1;
}

uint8_t objectKindTag(const RKSmapsVma& vma, RKVmaKind kind) {
    if (isSysV(vma.path)) return RKObjectKindSysV;
    switch (kind) {
        case RKVmaKind::Shmem: return RKObjectKindShmem;
        case RKVmaKind::Hugetlb: return RKObjectKindHugetlb;
        default: return RKObjectKindFile;
    }
}

// Whether the mapping reaches a shared object (rather than memory of its own).
bool mapsSharedObject(const RKSmapsVma& vma, RKVmaKind kind) {
    switch (kind) {
        case RKVmaKind::File:
            return isShared(vma) || (!(vma.perms & RKSmapsWrite) && vma.anonymous == 0);
        // Until a page is copied, a private mapping of shmem shows the object's pages only:
        // writable or not, it reaches the object (its regions then meet the object's holders).
        case RKVmaKind::Shmem: return isShared(vma) || vma.anonymous == 0;
        case RKVmaKind::Hugetlb: return isShared(vma);
        default: return false;
    }
}

uint64_t objectIdFor(const RKSmapsVma& vma, RKVmaKind kind, const RKVmaContext& context,
                     const std::optional<RKFileIdentity>& identity) {
    if (kind == RKVmaKind::Device || kind == RKVmaKind::Special) return 0;
    if (!mapsSharedObject(vma, kind)) return RKPrivateObjectId(context.pid, vma.start, context.pageSize);
    uint8_t tag = objectKindTag(vma, kind);
    // A SysV segment is known by its id (the inode column) within its IPC namespace.
    if (tag == RKObjectKindSysV) return RKObjectIdForFile(tag, context.ipcNamespace, vma.inode);
    if (identity && kind == RKVmaKind::File) return RKObjectIdForFile(tag, identity->device, identity->inode);
    return RKObjectIdForFile(tag, deviceOf(vma), vma.inode);
}

int32_t protectionOf(const RKSmapsVma& vma) {
    return ((vma.perms & RKSmapsRead) ? VM_PROT_READ : 0) | ((vma.perms & RKSmapsWrite) ? VM_PROT_WRITE : 0) |
           ((vma.perms & RKSmapsExecute) ? VM_PROT_EXECUTE : 0);
}

int32_t maxProtectionOf(const RKSmapsVma& vma) {
    return ((vma.vmFlags & RKVmMayRead) ? VM_PROT_READ : 0) | ((vma.vmFlags & RKVmMayWrite) ? VM_PROT_WRITE : 0) |
           ((vma.vmFlags & RKVmMayExec) ? VM_PROT_EXECUTE : 0);
}

uint32_t inheritanceOf(const RKSmapsVma& vma) {
    if (vma.vmFlags & RKVmDontCopy) return VM_INHERIT_NONE;
    return isShared(vma) ? VM_INHERIT_SHARE : VM_INHERIT_COPY;
}

uint32_t specialTag(std::string_view path) {
    if (path == "[vdso]") return RKTagVdso;
    if (path == "[vvar]" || path == "[vvar_vclock]") return RKTagVvar;
    if (path == "[vsyscall]") return RKTagVsyscall;
    if (path == "[uprobes]") return RKTagUprobes;
    return RKTagKernelObject;
}

uint32_t shmemTag(const RKSmapsVma& vma, const RKVmaContext& context) {
    if (isSysV(vma.path)) return RKTagSysVShm;
    if (startsWith(vma.path, "/memfd:")) return RKTagMemfd;
    if (!isShmemDevice(vma, context) && !isBracketed(vma.path)) return RKTagPosixShm;  // a tmpfs file
    return RKTagSharedAnonymous;
}

}  // namespace

RKVmaKind RKClassifyVma(const RKSmapsVma& vma, const RKVmaContext& context) {
    if (vma.vmFlags & RKVmHugetlb) return RKVmaKind::Hugetlb;
    if (vma.vmFlags & (RKVmIo | RKVmPfnMap)) return RKVmaKind::Device;
    if (isSpecialName(vma.path)) return RKVmaKind::Special;
    if (startsWith(vma.path, "[anon_shmem:")) return RKVmaKind::Shmem;
    if (isAnonymousName(vma.path)) return RKVmaKind::Anonymous;
    if (isBracketed(vma.path)) return vma.devMajor == 0 && vma.inode == 0 ? RKVmaKind::Anonymous : RKVmaKind::Special;
    if (isShmemDevice(vma, context)) return RKVmaKind::Shmem;
    if (startsWith(vma.path, "/secretmem")) return RKVmaKind::Special;
    if (auto kind = mountKind(vma, context)) {
        if (*kind == RKMountKind::Tmpfs) return RKVmaKind::Shmem;
        if (*kind == RKMountKind::Hugetlbfs) return RKVmaKind::Hugetlb;
        return RKVmaKind::File;
    }
    // Not a mounted file system: a kernel object unless it sits on a real block device.
    return vma.devMajor == 0 ? RKVmaKind::Special : RKVmaKind::File;
}

bool RKVmaNeedsMountTable(const RKSmapsVma& vma, const RKVmaContext& context) {
    if (vma.vmFlags & (RKVmHugetlb | RKVmIo | RKVmPfnMap)) return false;
    if (vma.path.empty() || isBracketed(vma.path) || isShmemDevice(vma, context)) return false;
    return !startsWith(vma.path, "/secretmem");
}

RKRegionSubmapInfo RKRegionInfoForVma(const RKSmapsVma& vma, RKVmaKind kind, const RKVmaContext& context,
                                      const std::optional<RKFileIdentity>& identity) {
    RKRegionSubmapInfo info;
    const uint64_t P = context.pageSize;
    info.protection = protectionOf(vma);
    info.max_protection = maxProtectionOf(vma);
    info.inheritance = inheritanceOf(vma);
    info.user_tag = RKTagForVma(vma, kind, context);
    info.share_mode = shareModeFor(vma, kind);
    info.external_pager = kind == RKVmaKind::File ? 1 : 0;
    bool backed = kind == RKVmaKind::File || kind == RKVmaKind::Shmem || kind == RKVmaKind::Hugetlb;
    info.offset = backed ? vma.offset : 0;
    info.object_id_full = objectIdFor(vma, kind, context, identity);
    info.object_id = static_cast<uint32_t>(info.object_id_full);
    info.user_wired_count = wiredCount(vma, kind);
    if (kind == RKVmaKind::Device || kind == RKVmaKind::Special) return info;  // listed, costs nothing
    info.pages_resident = kind == RKVmaKind::Hugetlb ? pages(vma.privateHugetlb + vma.sharedHugetlb, P)
                                                     : pages(vma.rss, P);
    info.pages_dirtied = dirtiedPages(vma, kind, P);
    info.pages_swapped_out = pages(vma.swap, P);
    info.pages_reusable = pages(vma.lazyFree, P);
    return info;
}

uint32_t RKTagForVma(const RKSmapsVma& vma, RKVmaKind kind, const RKVmaContext& context) {
    switch (kind) {
        case RKVmaKind::Anonymous:
            if (vma.path == "[heap]") return RKTagHeap;
            if (startsWith(vma.path, "[stack")) return RKTagStack;
            return RKTagAnonymous;
        case RKVmaKind::Shmem: return shmemTag(vma, context);
        case RKVmaKind::Hugetlb: return RKTagHugetlb;
        case RKVmaKind::File: return RKTagAnonymous;
        case RKVmaKind::Device: return specialTag(vma.path) == RKTagVvar ? RKTagVvar : RKTagDevice;
        case RKVmaKind::Special: return specialTag(vma.path);
    }
    return RKTagAnonymous;
}

std::string_view RKDetailForVma(const RKSmapsVma& vma, RKVmaKind kind) {
    std::string_view path = vma.path;
    if (kind == RKVmaKind::File) return path;
    if (auto name = bracketedName(path, "[anon:")) return *name;
    if (auto name = bracketedName(path, "[anon_shmem:")) return *name;
    if (isBracketed(path)) return {};
    if (startsWith(path, "/memfd:")) return RKWithoutDeletedSuffix(path.substr(7));
    if (path == "/dev/zero (deleted)" || path == "/anon_hugepage (deleted)" || startsWith(path, "/secretmem"))
        return {};
    if (isSysV(path)) return RKWithoutDeletedSuffix(path);
    return path;
}

uint64_t RKObjectIdForFile(uint8_t kindTag, uint64_t first, uint64_t second) {
    uint64_t h = mix64(first ^ (static_cast<uint64_t>(kindTag) << 56));
    h = mix64(h ^ second) | (1ull << 63);
    return h == ~0ull ? h ^ 2 : h;
}

namespace {

constexpr uint64_t kPrivateFlag = 1ull << 62;
constexpr unsigned kPrivatePidShift = 40;

}  // namespace

uint32_t RKPrivateObjectIdPidBits(pid_t pid) { return static_cast<uint32_t>(pid) & 0x3FFFFF; }

bool RKIsPrivateObjectIdOf(uint64_t id, pid_t pid) {
    return id >> 62 == 1 && (id >> kPrivatePidShift & 0x3FFFFF) == RKPrivateObjectIdPidBits(pid);
}

uint64_t RKPrivateObjectId(pid_t pid, uint64_t start, uint64_t pageSize) {
    uint64_t page = start / (pageSize ? pageSize : 4096);
    uint64_t pidBits = RKPrivateObjectIdPidBits(pid);
    // Exact for every address below 2^52 with 4 KiB pages; beyond, mixed (still never an
    // object id, 0 or all ones).
    if (page < (1ull << kPrivatePidShift)) return kPrivateFlag | pidBits << kPrivatePidShift | page;
    return kPrivateFlag | (mix64(pidBits ^ mix64(page)) & (kPrivateFlag - 1));
}
