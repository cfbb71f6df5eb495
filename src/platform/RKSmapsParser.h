// /proc/PID/smaps as plain records. The parser takes the file's text and never reads the
// kernel, so it is tested on captured files; the walk reads the file and hands the text over.
//
// The format, per VMA: a header line as in maps ("start-end perms offset MAJ:MIN inode  path",
// numbers in hex except the inode), then "Name: value kB" lines, ending with "VmFlags: ..".
// A field this parser does not know is skipped, so newer kernels' additions are harmless.
#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

// Permission column bits.
enum RKSmapsPerm : uint8_t {
    RKSmapsRead = 0x1,
    RKSmapsWrite = 0x2,
    RKSmapsExecute = 0x4,
    RKSmapsShared = 0x8,  // 's' in the fourth column; 'p' is private
};

// The VmFlags mnemonics memspread acts on.
enum RKSmapsVmFlag : uint32_t {
    RKVmMayRead = 1u << 0,      // mr
    RKVmMayWrite = 1u << 1,     // mw
    RKVmMayExec = 1u << 2,      // me
    RKVmPfnMap = 1u << 3,       // pf: pure PFN range, no struct page
    RKVmIo = 1u << 4,           // io: memory-mapped I/O
    RKVmLocked = 1u << 5,       // lo: mlocked
    RKVmLockOnFault = 1u << 6,  // lf: mlock2(MLOCK_ONFAULT): only faulted pages are locked
    RKVmHugetlb = 1u << 7,      // ht
    RKVmDontCopy = 1u << 8,     // dc: not inherited across fork
};

// One VMA. Sizes are in kB as the kernel prints them; `path` points into the parsed text.
struct RKSmapsVma {
    uint64_t start = 0;
    uint64_t end = 0;
    uint64_t offset = 0;  // file offset (pgoff × page size)
    uint32_t devMajor = 0;
    uint32_t devMinor = 0;
    uint64_t inode = 0;
    uint8_t perms = 0;          // RKSmapsPerm bits
    std::string_view path;      // as the kernel shows it (a newline appears as "\012"); may be empty
    uint64_t rss = 0;
    uint64_t sharedClean = 0;
    uint64_t sharedDirty = 0;
    uint64_t privateClean = 0;
    uint64_t privateDirty = 0;
    uint64_t anonymous = 0;     // copied-on-write and anonymous pages
    uint64_t lazyFree = 0;      // MADV_FREE'd pages not yet reclaimed or rewritten
    uint64_t swap = 0;
    uint64_t sharedHugetlb = 0;
    uint64_t privateHugetlb = 0;
    uint32_t vmFlags = 0;       // RKSmapsVmFlag bits
};

struct RKSmapsParseResult {
    // Header lines that could not be read; their field lines are skipped with them.
    size_t malformedHeaders = 0;
};

// Appends the VMAs of `text` to `vmas` in file order (ascending addresses).
RKSmapsParseResult RKParseSmaps(std::string_view text, std::vector<RKSmapsVma>& vmas);
