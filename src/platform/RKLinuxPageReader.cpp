#include "platform/RKLinuxPageReader.h"

#include <fcntl.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
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
    uint64_t page;  // index in the whole read
    bool fileMapping;
    uint64_t entry;
};

class PageReader {
public:
    PageReader(int pagemap, uint64_t pageSize, const RKLinuxPageProbe& probe)
        : pagemap_(pagemap), pageSize_(pageSize), probe_(probe) {}

    kern_return_t readRange(const RKPageQueryRange& range, uint64_t firstPage, std::span<uint32_t> out) {
        // PAGEMAP_SCAN skips holes and tells the zero page; frames are worth reading only where
        // a page's flags change its disposition (dirty file pages, lazily freed ones).
        const bool needFlags = probe_.kpageflags && (range.fileBacked || range.reusablePages > 0);
        if (probe_.pagemapScan && !needFlags) return scanRange(range, out);
        std::vector<uint64_t>& entries = entries_;
        const uint64_t startPage = range.start / pageSize_;
        for (uint64_t done = 0; done < out.size(); done += kChunkPages) {
            uint64_t count = std::min<uint64_t>(kChunkPages, out.size() - done);
            entries.resize(count);
            if (!RKPreadAll(pagemap_, entries.data(), count * 8, (startPage + done) * 8)) return KERN_INVALID_ARGUMENT;
            for (uint64_t i = 0; i < count; i++) {
                out[done + i] = RKDispositionForPagemapEntry(entries[i], range.fileBacked, std::nullopt);
                if (needFlags && RKPagemapEntryNeedsFlags(entries[i], range.fileBacked))
                    lookups_.push_back({entries[i] & RKPagemapFrameMask, firstPage + done + i, range.fileBacked, entries[i]});
            }
        }
        return KERN_SUCCESS;
    }

    // Applies kpageflags to every page that needs it, reading the frames in ascending runs.
    void applyFlags(int kpageflags, std::span<uint32_t> all) {
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
                if (read) all[lookup.page] = RKDispositionForPagemapEntry(lookup.entry, lookup.fileMapping,
                                                                           words[lookup.frame - run.first]);
            }
        }
        lookups_.clear();
    }

private:
    kern_return_t scanRange(const RKPageQueryRange& range, std::span<uint32_t> out) {
        std::vector<RKPageScanRun>& runs = runs_;
        std::vector<RKPageScanRun>& buffer = scanBuffer_;
        runs.clear();
        buffer.resize(kScanRunsPerCall);
        const uint64_t end = range.start + out.size() * pageSize_;
        for (uint64_t start = range.start; start < end;) {
            RKPmScanArg arg{sizeof(RKPmScanArg), 0, start, end, 0, reinterpret_cast<uintptr_t>(buffer.data()),
                            buffer.size(), 0, 0, 0, RKPageIsPresent | RKPageIsSwapped,
                            RKPageIsPresent | RKPageIsSwapped | RKPageIsFile | RKPageIsPfnZero};
            int n = ::ioctl(pagemap_, kPagemapScan, &arg);
            if (n < 0) {
                if (errno == EINTR) continue;
                return failureFor(errno);
            }
            runs.insert(runs.end(), buffer.begin(), buffer.begin() + n);
            if (arg.walk_end <= start) return KERN_INVALID_ARGUMENT;  // no progress: the process went away
            start = arg.walk_end;
        }
        RKDispositionsFromScanRuns(range.start, pageSize_, runs, range.fileBacked, out);
        return KERN_SUCCESS;
    }

    int pagemap_;
    uint64_t pageSize_;
    const RKLinuxPageProbe& probe_;
    std::vector<uint64_t> entries_;
    std::vector<FlagLookup> lookups_;
    std::vector<RKPageScanRun> runs_;
    std::vector<RKPageScanRun> scanBuffer_;
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

bool RKLinuxPageData::answer(uint64_t address, uint64_t pageSize, std::span<uint32_t> dispositions) const {
    auto it = std::upper_bound(ranges.begin(), ranges.end(), address,
                               [](uint64_t a, const RKPageQueryRange& r) { return a < r.start + r.size; });
    if (it == ranges.end() || it->start > address) return false;
    const size_t index = static_cast<size_t>(it - ranges.begin());
    const uint64_t first = (address - it->start) / pageSize;
    const uint64_t pages = (it->size + pageSize - 1) / pageSize;
    if (first + dispositions.size() > pages || index >= firstPage.size()) return false;
    const uint64_t base = firstPage[index] + first;
    if (base + dispositions.size() > packed.size()) return false;  // the read stopped before it
    for (size_t i = 0; i < dispositions.size(); i++) dispositions[i] = RKUnpackDisposition(packed[base + i]);
    return true;
}

kern_return_t RKReadPageData(int directoryFd, const std::string& procRoot, uint64_t pageSize,
                             const std::vector<RKPageQueryRange>& ranges, RKLinuxPageData& data) {
    data = RKLinuxPageData{};
    data.ranges = ranges;
    uint64_t total = 0;
    for (const RKPageQueryRange& range : ranges) {
        data.firstPage.push_back(total);
        total += (range.start % pageSize + range.size + pageSize - 1) / pageSize;
    }
    const RKLinuxPageProbe& probe = RKProbePageReading(procRoot);
    RKUniqueFd pagemap(::openat(directoryFd, "pagemap", O_RDONLY | O_CLOEXEC));
    if (!pagemap.valid()) return data.result = failureFor(errno);
    std::vector<uint32_t> all(total);
    PageReader reader(pagemap.get(), pageSize, probe);
    uint64_t readPages = 0;
    for (size_t i = 0; i < ranges.size() && data.result == KERN_SUCCESS; i++) {
        RKPageQueryRange aligned = ranges[i];
        aligned.start -= aligned.start % pageSize;
        const uint64_t pages = (i + 1 < ranges.size() ? data.firstPage[i + 1] : total) - data.firstPage[i];
        data.result = reader.readRange(aligned, data.firstPage[i], std::span(all).subspan(data.firstPage[i], pages));
        if (data.result == KERN_SUCCESS) readPages = data.firstPage[i] + pages;
    }
    if (probe.kpageflags) {
        RKUniqueFd kpageflags(::open((procRoot + "/kpageflags").c_str(), O_RDONLY | O_CLOEXEC));
        if (kpageflags.valid()) reader.applyFlags(kpageflags.get(), all);
    }
    for (size_t i = 0; i < ranges.size(); i++) {
        const uint64_t end = i + 1 < ranges.size() ? data.firstPage[i + 1] : total;
        if (end > readPages) break;
        RKLimitReusablePages(std::span(all).subspan(data.firstPage[i], end - data.firstPage[i]), ranges[i].reusablePages);
    }
    data.packed.resize(readPages);
    for (uint64_t i = 0; i < readPages; i++) data.packed[i] = RKPackDisposition(all[i]);
    return data.result;
}
