// Sizes as the text report writes them: bytes, a short human form, or pages.
#pragma once

#include <cstdint>
#include <string>

// Whole pages needed for `bytes` (rounded up); 0 when the page size is unknown (0).
uint64_t RKTextPagesForBytes(uint64_t bytes, uint64_t pageSize);

// `bytes` in the given RKSummaryFormat: "4096 B", "10 KB" (at most seven characters) or
// "2 pages" (the count taken as unsigned, in pages of `pageSize`).
std::string RKTextFormattedSize(int64_t bytes, int64_t summaryFormat, uint64_t pageSize);
