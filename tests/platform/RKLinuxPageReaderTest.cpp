// A live process's page data kept sparse: stretches answer, what lies between them is a known
// hole, and a terabyte reserved and barely touched is read in the time and memory of its pages.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include "platform/RKLinuxPageReader.h"
#include "platform/RKUniqueFd.h"

namespace {

constexpr uint64_t P = 4096;
constexpr uint32_t kDirty = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
constexpr uint32_t kPagedOut = VM_PAGE_QUERY_PAGE_PAGED_OUT;

TEST(RKLinuxPageData, StretchesAnswerAndTheRestIsAHole) {
    RKLinuxPageData data;
    data.ranges = {{0x10000, 16 * P, false, 0}, {0x40000, 4 * P, false, 0}};
    data.rangesRead = 1;
    data.append(0x10, 2, kDirty);
    data.append(0x12, 1, kPagedOut);
    data.append(0x18, 1, 0);
    data.append(0x1A, 1, kDirty);
    ASSERT_EQ(data.stretches.size(), 2u) << "adjacent pages join; nothing there keeps nothing";
    EXPECT_EQ(data.packed.size(), 4u);

    std::vector<uint32_t> out(4, 0xFF);
    EXPECT_TRUE(data.answer(0x11000, P, out));
    EXPECT_EQ(out, (std::vector<uint32_t>{kDirty, kPagedOut, 0, 0}));
    EXPECT_FALSE(data.answer(0x1E000, P, out)) << "past the end of its range";
    EXPECT_FALSE(data.answer(0x40000, P, out)) << "the read stopped before this range";

    auto populated = [&](uint64_t address, uint64_t end) {
        uint64_t from = 0, to = 0;
        if (!data.populated(address, end, P, from, to)) return std::pair<uint64_t, uint64_t>{1, 1};
        return std::pair{from, to};
    };
    EXPECT_EQ(populated(0x10000, 0x20000), (std::pair<uint64_t, uint64_t>{0x10000, 0x1B000}))
        << "a small hole is asked about with its neighbours";
    EXPECT_EQ(populated(0x13000, 0x20000), (std::pair<uint64_t, uint64_t>{0x1A000, 0x1B000}));
    EXPECT_EQ(populated(0x11000, 0x12000), (std::pair<uint64_t, uint64_t>{0x11000, 0x12000})) << "clipped";
    EXPECT_EQ(populated(0x1B000, 0x30000), (std::pair<uint64_t, uint64_t>{0x20000, 0x20000})) << "known to its range's end";
    EXPECT_EQ(populated(0x40000, 0x44000), (std::pair<uint64_t, uint64_t>{1, 1})) << "unread: nothing known";
}

TEST(RKLinuxPageData, TerabyteReservedCostsItsPages) {
    if (!RKProbePageReading("/proc").pagemapScan) GTEST_SKIP() << "without PAGEMAP_SCAN every entry is read";
    const uint64_t T = 1ull << 40, page = static_cast<uint64_t>(sysconf(_SC_PAGESIZE));
    void* reserved = mmap(nullptr, T, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (reserved == MAP_FAILED) GTEST_SKIP() << "cannot reserve a terabyte here";
    auto* base = static_cast<volatile char*>(reserved);
    for (uint64_t at : {uint64_t{0}, T / 2, T / 2 + page, T - page}) base[at] = 1;
    EXPECT_EQ(base[T / 4], 0) << "a read maps the zero page, which is no memory";
    RKUniqueFd self(::open("/proc/self", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const uint64_t start = reinterpret_cast<uintptr_t>(reserved);
    // Anonymous; then lazily freed pages possible, which reads pagemap (and flags) for the pages found.
    for (uint64_t reusable : {0, 1}) {
        RKLinuxPageData data;
        ASSERT_EQ(RKReadPageData(self.get(), "/proc", page, {{start, T, false, reusable}}, data), KERN_SUCCESS);
        EXPECT_EQ(data.packed.size(), 4u) << reusable;
        EXPECT_EQ(data.stretches.size(), 3u) << reusable;
        std::vector<uint32_t> out(2);
        EXPECT_TRUE(data.answer(start + T / 2 + page, page, out));
        EXPECT_EQ(out, (std::vector<uint32_t>{kDirty, 0}));
    }
    munmap(reserved, T);
}

}  // namespace
