#include "platform/RKLinuxPageReader.h"

#include <fcntl.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <functional>
#include <map>
#include <mutex>

#include "platform/RKPageDispositions.h"
#include "platform/RKUniqueFd.h"

namespace {

// The PAGEMAP_SCAN ABI (include/uapi/linux/fs.h of kernel 6.7); older headers lack it.
struct RKPmScanArg {
    uint64_t size, flags, start, end, walk_end, vec, vec_len, max_pages, category_inverted, category_mask,
        category_anyof_mask, return_mask;
};
constexpr unsigned long kPagemapScan = _IOWR('f', 16, RKPmScanArg);

constexpr uint64_t kChunkPages = 4096;     // pagemap entries per pread (32 KiB)
constexpr uint64_t kFlagsPerRead = 4096;   // kpageflags words per pread at most
constexpr size_t kScanRunsPerCall = 1024;  // PAGEMAP_SCAN runs per ioctl
constexpr uint64_t kQueryPages = 4096;     // pages a page query asks for at most
constexpr uint64_t kSmallHolePages = 64;   // holes up to this long are asked about, longer ones skipped

kern_return_t failureFor(int error) {
    return error == EACCES || error == EPERM ? KERN_PROTECTION_FAILURE : KERN_INVALID_ARGUMENT;
}

RKLinuxPageProbe probe(const std::string& procRoot) {
    RKLinuxPageProbe result;
    RKUniqueFd pagemap(::open((procRoot + "/self/pagemap").c_str(), O_RDONLY | O_CLOEXEC));
    if (!pagemap.valid()) return result;
    static volatile uint64_t touched = 1;
    const uint64_t page = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
    const uint64_t address = reinterpret_cast<uintptr_t>(&touched) / page * page;
    touched = touched + 1;
    RKPageScanRun run;
    RKPmScanArg arg{sizeof(RKPmScanArg), 0, address, address + page, 0, reinterpret_cast<uintptr_t>(&run), 1, 0, 0, 0,
                    RKPageIsPresent, RKPageIsPresent};
    result.pagemapScan = ::ioctl(pagemap.get(), kPagemapScan, &arg) >= 0;
    uint64_t entry = 0;
    if (!RKPreadAll(pagemap.get(), &entry, sizeof entry, address / page * 8)) return result;
    const uint64_t frame = entry & RKPagemapFrameMask;
    // Root in a user namespace, or without CAP_SYS_ADMIN, reads frame 0 for every page.
    result.frames = (entry & RKPagemapPresent) && frame != 0;
    if (!result.frames) return result;
    RKUniqueFd flags(::open((procRoot + "/kpageflags").c_str(), O_RDONLY | O_CLOEXEC));
    uint64_t word = 0;
    result.kpageflags = flags.valid() && RKPreadAll(flags.get(), &word, sizeof word, frame * 8);
    return result;
}

// One page whose kpageflags word decides its disposition.
struct FlagLookup {
    uint64_t frame;
    uint64_t packed;  // its index in the data's packed bytes
    bool fileMapping;
    uint64_t entry;
};

class PageReader {
public:
    PageReader(int pagemap, uint64_t pageSize, const RKLinuxPageProbe& probe, RKLinuxPageData& data)
        : pagemap_(pagemap), pageSize_(pageSize), probe_(probe), data_(data) {}

    kern_return_t readRange(const RKPageQueryRange& range) {
        const uint64_t firstPage = range.start / pageSize_;
        const uint64_t endPage = (range.start + range.size + pageSize_ - 1) / pageSize_;
        // Frames are worth reading only where a page's flags change its disposition (dirty file
        // pages, lazily freed ones).
        const bool needFlags = probe_.kpageflags && (range.fileBacked || range.reusablePages > 0);
        if (!probe_.pagemapScan) return readEntries(firstPage, endPage - firstPage, range.fileBacked, needFlags);
        kern_return_t result = RKScanPresentPages(pagemap_, firstPage * pageSize_, endPage * pageSize_, runs_);
        if (result != KERN_SUCCESS) return result;
        for (size_t i = 0; i < runs_.size();) {
            const RKPageScanRun& run = runs_[i];
            if (!needFlags) {
                data_.append(run.start / pageSize_, (run.end - run.start) / pageSize_,
                             RKDispositionForScanRun(run.categories, range.fileBacked));
                i++;
                continue;
            }
            // The entries of adjacent runs in one read.
            uint64_t end = run.end;
            for (i++; i < runs_.size() && runs_[i].start == end; i++) end = runs_[i].end;
            result = readEntries(run.start / pageSize_, (end - run.start) / pageSize_, range.fileBacked, true);
            if (result != KERN_SUCCESS) return result;
        }
        return KERN_SUCCESS;
    }

    // Applies kpageflags to every page that needs it, reading the frames in ascending runs.
    void applyFlags(int kpageflags) {
        std::sort(lookups_.begin(), lookups_.end(), [](const FlagLookup& a, const FlagLookup& b) { return a.frame < b.frame; });
        std::vector<uint64_t> frames;
        frames.reserve(lookups_.size());
        for (const FlagLookup& lookup : lookups_) frames.push_back(lookup.frame);
        std::vector<uint64_t> words;
        size_t next = 0;
        for (const RKFrameRun& run : RKCoalesceFrames(frames, kFlagsPerRead)) {
            words.resize(run.count);
            bool read = RKPreadAll(kpageflags, words.data(), run.count * 8, run.first * 8);
            for (; next < lookups_.size() && lookups_[next].frame < run.first + run.count; next++) {
                const FlagLookup& lookup = lookups_[next];
                // A frame past the end of memory leaves the page as pagemap alone says.
                if (read && lookup.packed < data_.packed.size())
                    data_.packed[lookup.packed] = RKPackDisposition(
                        RKDispositionForPagemapEntry(lookup.entry, lookup.fileMapping, words[lookup.frame - run.first]));
            }
        }
        lookups_.clear();
    }

private:
    kern_return_t readEntries(uint64_t firstPage, uint64_t count, bool fileMapping, bool needFlags) {
        bool read = RKReadPagemap(pagemap_, firstPage, count, [&](uint64_t page, std::span<const uint64_t> entries) {
            for (uint64_t entry : entries) {
                const uint32_t disposition = RKDispositionForPagemapEntry(entry, fileMapping, std::nullopt);
                if (disposition != 0) {
                    if (needFlags && RKPagemapEntryNeedsFlags(entry, fileMapping))
                        lookups_.push_back({entry & RKPagemapFrameMask, data_.packed.size(), fileMapping, entry});
                    data_.append(page, 1, disposition);
                }
                page++;
            }
        });
        return read ? KERN_SUCCESS : KERN_INVALID_ARGUMENT;
    }

    int pagemap_;
    uint64_t pageSize_;
    const RKLinuxPageProbe& probe_;
    RKLinuxPageData& data_;
    std::vector<FlagLookup> lookups_;
    std::vector<RKPageScanRun> runs_;
};

}  // namespace

bool RKPreadAll(int fd, void* buffer, size_t bytes, uint64_t offset) {
    auto* p = static_cast<char*>(buffer);
    while (bytes > 0) {
        ssize_t n = ::pread(fd, p, bytes, static_cast<off_t>(offset));
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        p += n;
        bytes -= static_cast<size_t>(n);
        offset += static_cast<uint64_t>(n);
    }
    return true;
}

const RKLinuxPageProbe& RKProbePageReading(const std::string& procRoot) {
    static std::mutex mutex;
    static std::map<std::string, RKLinuxPageProbe> probes;
    std::lock_guard lock(mutex);
    auto it = probes.find(procRoot);
    if (it == probes.end()) it = probes.emplace(procRoot, probe(procRoot)).first;
    return it->second;
}

kern_return_t RKScanPresentPages(int pagemap, uint64_t start, uint64_t end, std::vector<RKPageScanRun>& runs) {
    runs.clear();
    std::vector<RKPageScanRun> buffer(kScanRunsPerCall);
    while (start < end) {
        // Present or swapped, and not the zero page: the kernel skips holes and zero pages.
        RKPmScanArg arg{sizeof(RKPmScanArg), 0, start, end, 0, reinterpret_cast<uintptr_t>(buffer.data()),
                        buffer.size(), 0, RKPageIsPfnZero, RKPageIsPfnZero, RKPageIsPresent | RKPageIsSwapped,
                        RKPageIsPresent | RKPageIsSwapped | RKPageIsFile | RKPageIsPfnZero};
        int n = ::ioctl(pagemap, kPagemapScan, &arg);
        if (n < 0) {
            if (errno == EINTR) continue;
            return failureFor(errno);
        }
        runs.insert(runs.end(), buffer.begin(), buffer.begin() + n);
        if (arg.walk_end <= start) return KERN_INVALID_ARGUMENT;  // no progress: the process went away
        start = arg.walk_end;
    }
    return KERN_SUCCESS;
}

bool RKReadPagemap(int pagemap, uint64_t firstPage, uint64_t count,
                   const std::function<void(uint64_t firstPage, std::span<const uint64_t> entries)>& chunk) {
    std::vector<uint64_t> entries(std::min(count, kChunkPages));
    for (uint64_t done = 0; done < count; done += kChunkPages) {
        const uint64_t n = std::min(kChunkPages, count - done);
        if (!RKPreadAll(pagemap, entries.data(), n * 8, (firstPage + done) * 8)) return false;
        chunk(firstPage + done, std::span<const uint64_t>(entries.data(), n));
    }
    return true;
}

void RKLinuxPageData::append(uint64_t first, uint64_t count, uint32_t disposition) {
    if (count == 0 || disposition == 0) return;
    if (stretches.empty() || stretches.back().first + stretches.back().count != first)
        stretches.push_back({first, 0, packed.size()});
    stretches.back().count += count;
    packed.insert(packed.end(), count, RKPackDisposition(disposition));
}

namespace {

// The range that was read whole and holds the page at `address`, or nothing.
const RKPageQueryRange* readRangeAt(const RKLinuxPageData& data, uint64_t address) {
    auto it = std::upper_bound(data.ranges.begin(), data.ranges.end(), address,
                               [](uint64_t a, const RKPageQueryRange& r) { return a < r.start + r.size; });
    if (it == data.ranges.end() || it->start > address) return nullptr;
    if (static_cast<size_t>(it - data.ranges.begin()) >= data.rangesRead) return nullptr;  // the read stopped before it
    return &*it;
}

// The first stretch that ends after `page`.
std::vector<RKPageStretch>::const_iterator stretchAtOrAfter(const RKLinuxPageData& data, uint64_t page) {
    return std::upper_bound(data.stretches.begin(), data.stretches.end(), page,
                            [](uint64_t p, const RKPageStretch& s) { return p < s.first + s.count; });
}

}  // namespace

bool RKLinuxPageData::answer(uint64_t address, uint64_t pageSize, std::span<uint32_t> dispositions) const {
    const RKPageQueryRange* range = readRangeAt(*this, address);
    if (!range) return false;
    const uint64_t first = address / pageSize, end = first + dispositions.size();
    if (end > (range->start + range->size + pageSize - 1) / pageSize) return false;
    std::fill(dispositions.begin(), dispositions.end(), 0u);
    for (auto it = stretchAtOrAfter(*this, first); it != stretches.end() && it->first < end; ++it) {
        const uint64_t from = std::max(first, it->first), to = std::min(end, it->first + it->count);
        for (uint64_t page = from; page < to; page++)
            dispositions[page - first] = RKUnpackDisposition(packed[it->offset + (page - it->first)]);
    }
    return true;
}

bool RKLinuxPageData::populated(uint64_t address, uint64_t end, uint64_t pageSize, uint64_t& from, uint64_t& to) const {
    const RKPageQueryRange* range = readRangeAt(*this, address);
    if (!range) return false;
    // Past the range nothing is known: it may be another range's, read or not.
    const uint64_t known = std::min(end, (range->start + range->size + pageSize - 1) / pageSize * pageSize);
    auto it = stretchAtOrAfter(*this, address / pageSize);
    from = it == stretches.end() ? known : std::clamp(it->first * pageSize, address, known);
    to = from == known ? from : std::min(known, (it->first + it->count) * pageSize);
    // Stretches a few pages apart are asked about together, up to a query's worth: one query
    // rather than one a stretch where pages alternate.
    for (++it; it != stretches.end() && to < known && to - from < kQueryPages * pageSize &&
               it->first * pageSize - to <= kSmallHolePages * pageSize;
         ++it)
        to = std::min(known, (it->first + it->count) * pageSize);
    return true;
}

kern_return_t RKReadPageData(int directoryFd, const std::string& procRoot, uint64_t pageSize,
                             const std::vector<RKPageQueryRange>& ranges, RKLinuxPageData& data) {
    data = RKLinuxPageData{};
    data.ranges = ranges;
    const RKLinuxPageProbe& probe = RKProbePageReading(procRoot);
    RKUniqueFd pagemap(::openat(directoryFd, "pagemap", O_RDONLY | O_CLOEXEC));
    if (!pagemap.valid()) return data.result = failureFor(errno);
    PageReader reader(pagemap.get(), pageSize, probe, data);
    // Where each range's packed bytes begin, and where the last one read ends.
    std::vector<uint64_t> packedStart;
    for (const RKPageQueryRange& range : ranges) {
        packedStart.push_back(data.packed.size());
        data.result = reader.readRange(range);
        if (data.result != KERN_SUCCESS) break;
        data.rangesRead++;
    }
    if (probe.kpageflags) {
        RKUniqueFd kpageflags(::open((procRoot + "/kpageflags").c_str(), O_RDONLY | O_CLOEXEC));
        if (kpageflags.valid()) reader.applyFlags(kpageflags.get());
    }
    for (size_t i = 0; i < data.rangesRead; i++) {
        const uint64_t end = i + 1 < packedStart.size() ? packedStart[i + 1] : data.packed.size();
        RKLimitReusablePages(std::span(data.packed).subspan(packedStart[i], end - packedStart[i]), ranges[i].reusablePages);
    }
    data.packed.shrink_to_fit();
    data.stretches.shrink_to_fit();
    return data.result;
}
