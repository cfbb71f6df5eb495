#include "platform/RKLinuxWalk.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <map>
#include <mutex>
#include <utility>

#include "platform/RKProcFile.h"
#include "platform/RKUniqueFd.h"

namespace {

// What the worker's last walk used, kept for its next one: the text buffer and the region and
// VMA arrays of an ordinary process, so that their pages are not faulted in again for each process.
thread_local std::unique_ptr<RKLinuxWalkSnapshot> tSpareSnapshot;
thread_local std::vector<RKSmapsVma> tSpareVmas;

// Larger ones are freed, not held for the rest of the run.
constexpr size_t kLargestSpareText = 4 << 20;
constexpr size_t kLargestSpareVmas = 8192;

// Mount tables by (proc root, mount namespace): processes of one namespace share one read of
// mountinfo. A device missing from a table makes the walk read the target's file again.
class RKMountTableCache {
public:
    std::shared_ptr<const RKMountTable> get(const std::string& procRoot, uint64_t ns) {
        std::lock_guard<std::mutex> lock(mutex_);
        auto it = tables_.find({procRoot, ns});
        return it == tables_.end() ? nullptr : it->second;
    }
    void put(const std::string& procRoot, uint64_t ns, std::shared_ptr<const RKMountTable> table) {
        std::lock_guard<std::mutex> lock(mutex_);
        tables_[{procRoot, ns}] = std::move(table);
    }

private:
    std::mutex mutex_;
    std::map<std::pair<std::string, uint64_t>, std::shared_ptr<const RKMountTable>> tables_;
};

RKMountTableCache& mountTableCache() {
    static RKMountTableCache cache;
    return cache;
}

// Inode of the namespace link `name` (e.g. "ns/mnt") of the process; 0 when it cannot be read.
uint64_t namespaceInode(int dirfd, const char* name) {
    struct stat st {};
    if (::fstatat(dirfd, name, &st, 0) != 0) return 0;
    return st.st_ino;
}

std::shared_ptr<const RKMountTable> readMountTable(int dirfd) {
    std::string text;
    if (RKReadFileAt(dirfd, "mountinfo", text) != 0) return std::make_shared<RKMountTable>();
    return std::make_shared<RKMountTable>(RKParseMountInfo(text));
}

std::shared_ptr<const RKMountTable> mountTableFor(int dirfd, const std::string& procRoot, uint64_t ns,
                                                  bool reread) {
    if (ns != 0 && !reread) {
        if (auto table = mountTableCache().get(procRoot, ns)) return table;
    }
    auto table = readMountTable(dirfd);
    if (ns != 0) mountTableCache().put(procRoot, ns, table);
    return table;
}

bool missingDevice(const std::vector<RKSmapsVma>& vmas, const RKVmaContext& context) {
    for (const auto& vma : vmas) {
        if (RKVmaNeedsMountTable(vma, context) && !context.mounts->count(RKDeviceKey(vma.devMajor, vma.devMinor)))
            return true;
    }
    return false;
}

bool anySysV(const std::vector<RKSmapsVma>& vmas) {
    for (const auto& vma : vmas)
        if (vma.path.substr(0, 5) == "/SYSV") return true;
    return false;
}

kern_return_t readErrorCode(int error) {
    if (error == ESRCH || error == ENOENT) return MACH_SEND_INVALID_DEST;
    if (error == EACCES || error == EPERM) return KERN_PROTECTION_FAILURE;
    return KERN_FAILURE;
}

// A process whose address space is gone: reaped (its files fail), or exiting or a zombie
// (statm reads all zeros once the mm is released).
bool processGone(int dirfd) {
    std::string statm;
    int error = RKReadFileAt(dirfd, "statm", statm);
    if (error != 0) return error == ESRCH || error == ENOENT;
    uint64_t size = 0;
    std::from_chars(statm.data(), statm.data() + statm.size(), size);
    return size == 0;
}

// stat of map_files/START-END: the file itself, as no maps line can be wrong about. Needs
// CAP_SYS_ADMIN; `allowed` turns false at the first refusal so the walk stops asking.
std::optional<RKFileIdentity> mappedFileIdentity(int dirfd, const RKSmapsVma& vma, bool& allowed) {
    if (!allowed) return std::nullopt;
    char name[64];
    char* p = name;
    std::memcpy(p, "map_files/", 10);
    p += 10;
    p = std::to_chars(p, name + sizeof(name) - 1, vma.start, 16).ptr;
    *p++ = '-';
    p = std::to_chars(p, name + sizeof(name) - 1, vma.end, 16).ptr;
    *p = '\0';
    struct stat st {};
    if (::fstatat(dirfd, name, &st, 0) != 0) {
        if (errno == EPERM || errno == EACCES) allowed = false;
        return std::nullopt;
    }
    return RKFileIdentity{RKDeviceKey(major(st.st_dev), minor(st.st_dev)), static_cast<uint64_t>(st.st_ino)};
}

bool sameFile(const RKSmapsVma& a, const RKSmapsVma& b) {
    return a.inode == b.inode && a.devMajor == b.devMajor && a.devMinor == b.devMinor && a.path == b.path;
}

void classifyAll(RKLinuxTask& task, const std::vector<RKSmapsVma>& vmas, const RKVmaContext& context,
                 RKLinuxWalkSnapshot& snapshot) {
    bool mapFilesAllowed = true;
    // A file is mapped in several adjacent VMAs (its text, data, read-only parts): its identity
    // is read for the first of them.
    const RKSmapsVma* lastFile = nullptr;
    std::optional<RKFileIdentity> lastIdentity;
    snapshot.regions.reserve(vmas.size());
    for (const auto& vma : vmas) {
        RKLinuxRegion& region = snapshot.regions.emplace_back();
        region.vma = vma;
        region.kind = RKClassifyVma(vma, context);
        std::optional<RKFileIdentity> identity;
        if (region.kind == RKVmaKind::File) {
            if (!lastFile || !sameFile(*lastFile, vma)) {
                lastIdentity = mappedFileIdentity(task.directoryFd(), vma, mapFilesAllowed);
                lastFile = &vma;
            }
            identity = lastIdentity;
        }
        region.info = RKRegionInfoForVma(vma, region.kind, context, identity);
        region.detail = RKDetailForVma(vma, region.kind);
    }
}

// The device of a memfd of our own made with `flags`.
std::optional<uint64_t> memfdDevice(unsigned flags) {
    RKUniqueFd fd(::memfd_create("memspread-device-probe", MFD_CLOEXEC | flags));
    struct stat st {};
    if (!fd.valid() || ::fstat(fd.get(), &st) != 0) return std::nullopt;
    return RKDeviceKey(major(st.st_dev), minor(st.st_dev));
}

}  // namespace

std::optional<uint64_t> RKShmemDevice() {
    static const std::optional<uint64_t> device = memfdDevice(0);
    return device;
}

std::optional<uint64_t> RKInternalHugetlbDevice() {
    static const std::optional<uint64_t> device = memfdDevice(MFD_HUGETLB);
    return device;
}

std::shared_ptr<const RKMountTable> RKMountTableForTask(RKLinuxTask& task, const std::string& procRoot,
                                                        bool reread) {
    return mountTableFor(task.directoryFd(), procRoot, namespaceInode(task.directoryFd(), "ns/mnt"), reread);
}

kern_return_t RKLoadWalkSnapshot(RKLinuxTask& task, const std::string& procRoot, uint64_t pageSize,
                                 std::unique_ptr<RKLinuxWalkSnapshot>& snapshot) {
    std::unique_ptr<RKLinuxWalkSnapshot> fresh = std::move(tSpareSnapshot);
    if (!fresh) fresh = std::make_unique<RKLinuxWalkSnapshot>();
    int error = fresh->text.readAt(task.directoryFd(), "smaps");
    if (error != 0) {
        RKRecycleWalkSnapshot(std::move(fresh));
        return readErrorCode(error);
    }
    if (fresh->text.empty()) {  // a zombie's address space reads as nothing
        RKRecycleWalkSnapshot(std::move(fresh));
        return MACH_SEND_INVALID_DEST;
    }
    std::vector<RKSmapsVma> vmas = std::move(tSpareVmas);
    vmas.clear();
    RKParseSmaps(fresh->text.view(), vmas);

    RKVmaContext context;
    context.pid = task.pid();
    context.pageSize = pageSize;
    context.shmemDevice = RKShmemDevice();
    uint64_t mountNamespace = namespaceInode(task.directoryFd(), "ns/mnt");
    auto mounts = mountTableFor(task.directoryFd(), procRoot, mountNamespace, false);
    context.mounts = mounts.get();
    if (missingDevice(vmas, context)) {
        mounts = mountTableFor(task.directoryFd(), procRoot, mountNamespace, true);
        context.mounts = mounts.get();
    }
    if (anySysV(vmas)) context.ipcNamespace = namespaceInode(task.directoryFd(), "ns/ipc");

    classifyAll(task, vmas, context, *fresh);
    if (vmas.capacity() <= kLargestSpareVmas) tSpareVmas = std::move(vmas);
    fresh->end = processGone(task.directoryFd()) ? MACH_SEND_INVALID_DEST : KERN_INVALID_ADDRESS;
    snapshot = std::move(fresh);
    return KERN_SUCCESS;
}

void RKRecycleWalkSnapshot(std::unique_ptr<RKLinuxWalkSnapshot> snapshot) {
    if (!snapshot || snapshot->text.capacity() > kLargestSpareText || snapshot->regions.capacity() > kLargestSpareVmas)
        return;
    if (tSpareSnapshot && tSpareSnapshot->text.capacity() >= snapshot->text.capacity()) return;
    snapshot->regions.clear();
    snapshot->lastFound = 0;
    snapshot->end = KERN_INVALID_ADDRESS;
    snapshot->readyForWalk = false;
    tSpareSnapshot = std::move(snapshot);
}
