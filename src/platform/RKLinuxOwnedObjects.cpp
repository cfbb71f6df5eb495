#include "platform/RKLinuxOwnedObjects.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <memory>
#include <mutex>
#include <unordered_set>

#include "platform/RKLinuxVmaClassifier.h"
#include "platform/RKLinuxWalk.h"
#include "platform/RKOwnedObjectParsers.h"
#include "platform/RKProcFile.h"
#include "platform/RKProcStatParser.h"
#include "platform/RKUniqueFd.h"

namespace {

// cachestat(2), Linux 6.5; the C library and the kernel headers of older systems lack it. Its
// number is the same on every architecture.
constexpr long kCachestatSyscall = 451;
struct RKCachestatRange {
    uint64_t offset;
    uint64_t length;  // 0: to the end of the file
};
struct RKCachestat {
    uint64_t cache;  // pages in memory
    uint64_t dirty;
    uint64_t writeback;
    uint64_t evicted;  // for shmem: pages in swap
    uint64_t recentlyEvicted;
};
std::atomic<bool> gNoCachestat{false};

// The purge state word of a record: shmem is never purgeable.
constexpr uint32_t kNotPurgeable = static_cast<uint32_t>(VM_PURGABLE_DENY) << 4;

uint64_t namespaceInode(const std::string& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

uint64_t namespaceInode(int dirfd, const char* name) {
    struct stat st {};
    return ::fstatat(dirfd, name, &st, 0) == 0 ? st.st_ino : 0;
}

std::string linkTarget(int dirfd, const char* name) {
    char buffer[4096];
    ssize_t length = ::readlinkat(dirfd, name, buffer, sizeof buffer);
    return length > 0 ? std::string(buffer, static_cast<size_t>(length)) : std::string();
}

// What a descriptor's link tells apart: a memfd's name, a file's path.
std::string detailFromLink(const std::string& link) {
    std::string_view detail = RKWithoutDeletedSuffix(link);
    if (detail.starts_with("/memfd:")) detail.remove_prefix(7);
    return std::string(detail);
}

// A descriptor of our own on the file that `st` describes, for cachestat. The process may have
// closed the descriptor and opened a device or a FIFO under its number since it was stat'ed, so
// the link is first opened without opening the file (O_PATH) and the file checked, and only
// then opened for reading.
RKUniqueFd openSameFile(int fdDir, const char* name, const struct stat& st) {
    RKUniqueFd path(::openat(fdDir, name, O_PATH | O_CLOEXEC));
    struct stat now {};
    if (!path.valid() || ::fstat(path.get(), &now) != 0 || !S_ISREG(now.st_mode) || now.st_dev != st.st_dev ||
        now.st_ino != st.st_ino)
        return RKUniqueFd();
    char self[64];
    std::snprintf(self, sizeof self, "/proc/self/fd/%d", path.get());
    return RKUniqueFd(::open(self, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
}

enum class RKHeldKind { None, Shmem, Hugetlb };

// One process's descriptors, read through its /proc directory.
class RKDescriptorScan {
public:
    RKDescriptorScan(RKLinuxTask& task, const std::string& procRoot, uint64_t pageSize, RKSysVTableOfGather& sysV,
                     std::vector<RKOwnedVmObjectRecord>& records)
        : task_(task), procRoot_(procRoot), pageSize_(pageSize), sysV_(sysV), records_(records) {}

    int run();

private:
    void addDescriptor(int fdDir, const char* name);
    RKHeldKind kindOfDevice(uint64_t device);
    void addShmem(int fdDir, const char* name, const struct stat& st, RKHeldKind kind);
    void addDmaBuf(const char* name, const struct stat& st);
    void addSysVSegments();

    RKLinuxTask& task_;
    const std::string& procRoot_;
    uint64_t pageSize_;
    RKSysVTableOfGather& sysV_;
    std::vector<RKOwnedVmObjectRecord>& records_;
    std::unordered_set<uint64_t> seen_;  // object ids already recorded
    std::shared_ptr<const RKMountTable> mounts_;
    bool mountsReread_ = false;
};

int RKDescriptorScan::run() {
    int fdDir = ::openat(task_.directoryFd(), "fd", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fdDir < 0) return errno == ENOENT ? ESRCH : errno;
    std::unique_ptr<DIR, int (*)(DIR*)> directory(::fdopendir(fdDir), ::closedir);
    if (!directory) {
        int error = errno;
        ::close(fdDir);
        return error;
    }
    while (const dirent* entry = ::readdir(directory.get())) {
        if (entry->d_name[0] >= '0' && entry->d_name[0] <= '9') addDescriptor(fdDir, entry->d_name);
    }
    // A process that exits while its descriptors are listed ends the listing with ESRCH or
    // EACCES (its files are gone); what was read is still what it held.
    addSysVSegments();
    return 0;
}

void RKDescriptorScan::addDescriptor(int fdDir, const char* name) {
    struct stat st {};
    // stat through the descriptor's link is the file itself; a descriptor closed meanwhile fails.
    if (::fstatat(fdDir, name, &st, 0) != 0) return;
    if (S_ISREG(st.st_mode)) {
        RKHeldKind kind = kindOfDevice(RKDeviceKey(major(st.st_dev), minor(st.st_dev)));
        if (kind != RKHeldKind::None) addShmem(fdDir, name, st, kind);
    } else if ((st.st_mode & S_IFMT) == 0) {
        // Buffers of the dma-buf file system have inodes without a file type.
        if (linkTarget(fdDir, name).rfind("/dmabuf:", 0) == 0) addDmaBuf(name, st);
    }
}

RKHeldKind RKDescriptorScan::kindOfDevice(uint64_t device) {
    if (device == RKShmemDevice()) return RKHeldKind::Shmem;
    if (device == RKInternalHugetlbDevice()) return RKHeldKind::Hugetlb;
    if (!mounts_) mounts_ = RKMountTableForTask(task_, procRoot_);
    auto it = mounts_->find(device);
    if (it == mounts_->end() && !mountsReread_) {
        mountsReread_ = true;  // mounted since the table was read?
        mounts_ = RKMountTableForTask(task_, procRoot_, true);
        it = mounts_->find(device);
    }
    if (it == mounts_->end()) return RKHeldKind::None;
    if (it->second == RKMountKind::Tmpfs) return RKHeldKind::Shmem;
    if (it->second == RKMountKind::Hugetlbfs) return RKHeldKind::Hugetlb;
    return RKHeldKind::None;
}

void RKDescriptorScan::addShmem(int fdDir, const char* name, const struct stat& st, RKHeldKind kind) {
    const bool huge = kind == RKHeldKind::Hugetlb;
    uint64_t device = RKDeviceKey(major(st.st_dev), minor(st.st_dev));
    uint64_t id = RKObjectIdForFile(huge ? RKObjectKindHugetlb : RKObjectKindShmem, device, st.st_ino);
    if (!seen_.insert(id).second) return;
    RKOwnedVmObjectRecord record;
    record.object_id = id;
    record.virtual_size = static_cast<uint64_t>(st.st_size);
    record.flags = kNotPurgeable;
    record.detail = detailFromLink(linkTarget(fdDir, name));
    // st_blocks counts the object's pages in memory and in swap together.
    const uint64_t allocated = static_cast<uint64_t>(st.st_blocks) * 512;
    record.resident_size = allocated;
    if (huge) {
        record.wired_size = allocated;  // huge pages are never swapped or reclaimed
    } else if (allocated != 0 && !gNoCachestat.load(std::memory_order_relaxed)) {
        RKUniqueFd fd = openSameFile(fdDir, name, st);
        RKCachestatRange range{0, 0};
        RKCachestat stat{};
        if (fd.valid()) {
            if (::syscall(kCachestatSyscall, fd.get(), &range, &stat, 0) == 0) {
                record.resident_size = stat.cache * pageSize_;
                record.compressed_size = stat.evicted * pageSize_;
            } else if (errno == ENOSYS) {
                gNoCachestat.store(true, std::memory_order_relaxed);
            }
        }
    }
    records_.push_back(std::move(record));
}

void RKDescriptorScan::addDmaBuf(const char* name, const struct stat& st) {
    std::string path = std::string("fdinfo/") + name;
    std::string text;
    if (RKReadFileAt(task_.directoryFd(), path.c_str(), text) != 0) return;
    auto info = RKParseDmaBufFdinfo(text);
    if (!info) return;
    uint64_t id = RKObjectIdForFile(RKObjectKindDmaBuf, RKDeviceKey(major(st.st_dev), minor(st.st_dev)), info->inode);
    if (!seen_.insert(id).second) return;
    RKOwnedVmObjectRecord record;
    record.object_id = id;
    // A buffer's pages are pinned for the device as long as it exists.
    record.virtual_size = record.resident_size = record.wired_size = info->size;
    record.flags = kNotPurgeable | RKLedgerTagGraphics << 1;
    record.detail = info->exporter;
    records_.push_back(std::move(record));
}

// Segments that nobody maps are held by their creator. The table shows the segments of our own
// IPC namespace only, so a target in another namespace gets none from it.
void RKDescriptorScan::addSysVSegments() {
    static const uint64_t ownNamespace = namespaceInode("/proc/self/ns/ipc");
    uint64_t targetNamespace = namespaceInode(task_.directoryFd(), "ns/ipc");
    if (ownNamespace == 0 || targetNamespace != ownNamespace) return;
    std::shared_ptr<const std::vector<RKSysVSegment>> segments;
    sysV_.segments(segments);  // none when the table cannot be read
    for (const RKSysVSegment& segment : *segments) {
        if (segment.creator != task_.pid() || segment.attached != 0) continue;
        uint64_t id = RKObjectIdForFile(RKObjectKindSysV, targetNamespace, static_cast<uint64_t>(segment.shmid));
        if (!seen_.insert(id).second) continue;
        RKOwnedVmObjectRecord record;
        record.object_id = id;
        record.virtual_size = segment.size;
        record.resident_size = segment.resident;
        record.compressed_size = segment.swapped;
        record.flags = kNotPurgeable;
        record.detail = "shmid " + std::to_string(segment.shmid);
        records_.push_back(std::move(record));
    }
}

}  // namespace

int RKReadSysVSegments(const std::string& procRoot, std::vector<RKSysVSegment>& segments) {
    std::string text;
    if (int error = RKReadFileAt(AT_FDCWD, (procRoot + "/sysvipc/shm").c_str(), text)) return error;
    segments = RKParseSysVShm(text);
    return 0;
}

void RKSysVTableOfGather::begin() {
    std::lock_guard lock(mutex_);
    if (gathers_++ == 0) table_.reset();  // a new gather reads the table anew
}

void RKSysVTableOfGather::end() {
    std::lock_guard lock(mutex_);
    if (gathers_ > 0 && --gathers_ == 0) table_.reset();
}

int RKSysVTableOfGather::segments(std::shared_ptr<const std::vector<RKSysVSegment>>& table) {
    std::lock_guard lock(mutex_);
    if (gathers_ > 0 && table_) {
        table = table_;
        return error_;
    }
    std::vector<RKSysVSegment> read;
    const int error = RKReadSysVSegments(procRoot_, read);
    table = std::make_shared<const std::vector<RKSysVSegment>>(std::move(read));
    if (gathers_ > 0) table_ = table, error_ = error;
    return error;
}

int RKReadOwnedObjects(RKLinuxTask& task, const std::string& procRoot, uint64_t pageSize, RKSysVTableOfGather& sysV,
                       std::vector<RKOwnedVmObjectRecord>& records) {
    records.clear();
    return RKDescriptorScan(task, procRoot, pageSize, sysV, records).run();
}
