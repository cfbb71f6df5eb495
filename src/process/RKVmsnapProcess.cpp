#include "process/RKVmsnapProcess.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <unordered_map>

#include "model/RKAssert.h"
#include "model/RKMemoryRegion.h"
#include "model/RKMemoryTotal.h"
#include "process/RKImage.h"
#include "process/RKStringInternTable.h"

namespace {

// Larger files are refused before they are read: no snapshot comes near it.
constexpr off_t kFileLimit = off_t{1} << 31;

bool readWholeFile(const std::string& path, std::string& bytes, RKError* error) {
    auto readError = [&](int code) {
        RKError::set(error, "POSIX", code, std::strerror(code));
        return false;
    };
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return readError(errno);
    struct stat info {};
    if (::fstat(fd, &info) != 0 || info.st_size > kFileLimit) {
        int code = errno;
        ::close(fd);
        if (info.st_size > kFileLimit) {
            RKError::set(error, RKVmsnapErrorDomain, 1, "vmsnap initialization failed: the file is larger than 2 GiB");
            return false;
        }
        return readError(code);
    }
    bytes.clear();
    char buffer[1 << 16];
    for (;;) {
        ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            int code = errno;
            ::close(fd);
            return readError(code);
        }
        if (n == 0) break;
        bytes.append(buffer, static_cast<size_t>(n));
        if (bytes.size() > static_cast<size_t>(kFileLimit)) break;  // grew while read
    }
    ::close(fd);
    return true;
}

bool contains(const std::string& text, const char* part) { return text.find(part) != std::string::npos; }

void applyDetails(RKMemoryRegion& region, const RKVmsnapRegionDetails& details, uint64_t pageSize) {
    region.name = details.name;
    region.detailedName = details.detail;
    region.dirtySize = details.dirty;
    region.swappedSize = details.swapped;
    region.cleanNonSpecSize = details.clean;
    region.reclaimableSize = details.reclaimable;
    region.wired = details.wired;
    region.ownedExclusivelyByParentProcess = details.ownedExclusivelyByParentProcess;
    for (const RKVmsnapSubrange& s : details.subranges) {
        RKMemoryTotal total;
        total.dirty = s.dirty;
        total.swapped = s.swapped;
        total.clean = s.clean;
        total.reclaimable = s.reclaimable;
        total.wired = s.wired;
        region.addSubrange(s.offset, s.length, total, pageSize);
    }
}

}  // namespace

std::shared_ptr<RKVmsnapProcess> RKVmsnapProcess::processWithVmsnap(const std::string& path, RKError* error) {
    auto process = std::make_shared<RKVmsnapProcess>();
    if (!process->initWithVmsnap(path, error)) return nullptr;
    return process;
}

bool RKVmsnapProcess::initWithVmsnap(const std::string& path, RKError* error) {
    std::string bytes;
    if (!readWholeFile(path, bytes, error)) return false;
    return initWithVmsnapData(bytes, error);
}

bool RKVmsnapProcess::initWithVmsnapData(std::string_view bytes, RKError* error) {
    auto graph = RKVmsnapParse(bytes, error);
    if (!graph) return false;
    graph_ = std::move(*graph);
    RKBsdInfo info;
    info.pbi_flags = graph_.is64bit ? PROC_FLAG_LP64 : 0;
    info.pbi_pid = graph_.pid;
    if (!initWithBsdInfo(info)) {
        RKError::set(error, RKVmsnapErrorDomain, 1, "vmsnap initialization failed with unknown error");
        return false;
    }
    // The base named it by the live system's rule; the snapshot knows its own name.
    setName(graph_.processName);
    setDisplayString(graph_.processName + " [" + std::to_string(graph_.pid) + "] (vmsnap)");
    return _choosePlatform(error);
}

bool RKVmsnapProcess::_choosePlatform(RKError* error) {
    const std::string& description = graph_.processDescriptionString;
    int32_t platform = RKPlatformUnknown;
    if (contains(description, "Linux"))
        platform = RKPlatformLinux;
    else if (contains(description, "X86-64"))
        platform = RKPlatformX86_64;
    else if (contains(description, "X86"))
        platform = RKPlatformI386;
    else if (contains(description, "ARM64_32"))
        platform = RKPlatformArm64_32;
    else if (contains(description, "ARM64"))
        platform = RKPlatformArm64;
    else if (contains(description, "ARM"))
        platform = contains(graph_.binaryImagesDescription, "arm64_32") ? RKPlatformArm64_32 : RKPlatformArm;
    if (!_setSharedRegionFromPlatform(platform)) {
        RKError::set(error, RKVmsnapErrorDomain, 2, "Unable to determine platform from memory graph process description");
        return false;
    }
    return true;
}

uint64_t RKVmsnapProcess::_gatherPageSize() { return graph_.vmPageSize & 0xFFFFFFFFu; }

void RKVmsnapProcess::_gatherIsTranslated() { setIsTranslated(contains(graph_.processDescriptionString, "(translated)")); }

void RKVmsnapProcess::_gatherPhysMemspread() {
    phys_memspread_ = graph_.physicalMemspread;
    phys_memspread_peak_ = graph_.physicalMemspreadPeak;
}

bool RKVmsnapProcess::_populateMemoryRegionWithPageQueries(RKMemoryRegion& region, const RKRegionSubmapInfo& info) {
    RKAssert(region.dirtySize == 0, "RKVmsnapProcess", "memoryRegion.dirtySize == 0");
    RKAssert(region.swappedSize == 0, "RKVmsnapProcess", "memoryRegion.swappedSize == 0");
    // Records of the shared region carry bytes, not pages.
    region.dirtySize = info.pages_dirtied;
    region.swappedSize = info.pages_swapped_out;
    return true;
}

void RKVmsnapProcess::enumerateRegions(const RKRegionCallback& callback) {
    const uint64_t page = pageSize();
    const uint64_t sharedEnd = sharedRegionBase_ + sharedRegionSize_;
    std::shared_ptr<RKImage> pending;
    for (const RKVmsnapRegion& g : graph_.regions) {
        const bool inShared = g.address >= sharedRegionBase_ && g.address < sharedEnd;
        // Outside the shared region the record counts pages; inside it keeps the bytes.
        auto count = [&](uint64_t bytes) {
            return static_cast<uint32_t>(inShared ? bytes : page == 0 ? 0 : bytes / page);
        };
        RKRegionSubmapInfo info;
        info.protection = g.prot;
        info.max_protection = g.maxProt;
        info.offset = g.offset;
        info.user_tag = g.user_tag;
        info.pages_resident = count(g.resident_size);
        info.pages_shared_now_private = count(g.shared_now_private_size);
        info.pages_swapped_out = count(g.swapped_out_size);
        info.pages_dirtied = count(g.dirty_size);
        info.pages_reusable = count(g.reusable_size);
        info.ref_count = g.ref_count;
        info.external_pager = g.external_pager;
        info.share_mode = g.share_mode;
        info.is_submap = g.is_submap & 1;
        info.object_id = static_cast<uint32_t>(g.object_id);
        info.user_wired_count = g.details && g.details->wired ? 1 : 0;
        info.object_id_full = g.object_id;

        // A region typed by a segment name is an image segment, found by the walk's enumerator.
        if (images_) {
            if (!pending) pending = std::make_shared<RKImage>();
            pending->setName(RKUnsharedString(g.type));
            if (g.segment != RKSegmentUnset) pending->segment = g.segment;
            if (pending->segment != RKSegmentUnset) {
                pending->start = g.address;
                pending->size = g.length;
                pending->setOwnerPath(RKUnsharedString(g.path));
                images_->push_back(std::move(pending));
                pending.reset();
            }
        }
        std::optional<std::string> name;
        bool verbose = false;
        if (g.type == "commpage (reserved)" || g.type == "GPU Carveout (reserved)") {
            name = g.type;
            verbose = true;
        }
        std::optional<std::string> path;
        if (g.external_pager) path = g.path;
        current_ = &g;
        bool stop = callback(g.address, g.length, info, g.purgeable, path, name, verbose);
        current_ = nullptr;
        if (stop) break;
    }
}

void RKVmsnapProcess::_completeRegion(RKMemoryRegion& region) {
    if (!current_) return;
    if (current_->details) applyDetails(region, *current_->details, pageSize());
    builtRegions_.resize(graph_.regions.size(), nullptr);
    builtRegions_[static_cast<size_t>(current_ - graph_.regions.data())] = &region;
}

void RKVmsnapProcess::_gatherSharedAnonymousPages(RKRegionWalkState& state) {
    std::vector<const RKMemoryRegion*> built = std::move(builtRegions_);
    builtRegions_.clear();
    // Where the live walk would note no region, the snapshot brings no pages either.
    if (state.hidden || state.sharingAnalysisDisabled) return;
    unattributedSharedAnonymousBytes_ = graph_.unattributedSharedAnonymousBytes;
    if (graph_.sharedAnonymousPages.empty()) return;
    std::unordered_map<const RKMemoryRegion*, std::shared_ptr<RKMemoryRegion>> owner;
    for (const auto& region : state.regions) owner.emplace(region.get(), region);
    std::vector<int64_t> rangeOfSaved(graph_.regions.size(), -1);  // saved region -> range, or -1
    std::vector<RKSharedAnonymousPage> pages;
    sharedAnonymousRegions_.clear();
    for (const RKVmsnapSharedPages& saved : graph_.sharedAnonymousPages) {
        int64_t& range = rangeOfSaved[saved.region];
        if (range < 0) {
            auto found = owner.find(saved.region < built.size() ? built[saved.region] : nullptr);
            if (found == owner.end()) continue;  // the walk made no region of it
            range = static_cast<int64_t>(sharedAnonymousRegions_.size());
            sharedAnonymousRegions_.push_back(found->second);
        }
        for (uint64_t key : saved.keys) pages.emplace_back(key | RKVmsnapPageKeyMark, static_cast<uint32_t>(range));
    }
    sharedAnonymousPages_ = RKSharedPageList(std::move(pages));  // sorted there, by key
}

void RKVmsnapProcess::_addUnconsumedOwnedObjectRegions(RKRegionWalkState& state) {
    for (const RKVmsnapUnaddressedRegion& saved : graph_.unaddressedRegions) {
        auto region = state.regionBlocks.make();
        region->start = RKRegionNoAddress;
        region->size = saved.size;
        region->user_tag = saved.user_tag;
        region->object_id = saved.object_id;
        region->share_mode = saved.share_mode;
        region->offset = saved.offset;
        applyDetails(*region, saved.details, pageSize());
        state.regions.push_back(std::move(region));
    }
}
