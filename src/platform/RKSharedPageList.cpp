#include "platform/RKSharedPageList.h"

#include <algorithm>

namespace {

size_t varintSize(uint64_t value) {
    size_t bytes = 1;
    while (value >= 0x80) value >>= 7, bytes++;
    return bytes;
}

uint8_t* putVarint(uint8_t* out, uint64_t value) {
    while (value >= 0x80) {
        *out++ = static_cast<uint8_t>(value | 0x80);
        value >>= 7;
    }
    *out++ = static_cast<uint8_t>(value);
    return out;
}

uint64_t getVarint(const uint8_t*& in) {
    uint64_t value = 0;
    for (unsigned shift = 0;; shift += 7) {
        const uint8_t byte = *in++;
        value |= static_cast<uint64_t>(byte & 0x7F) << shift;
        if (!(byte & 0x80)) return value;
    }
}

bool byKey(const RKSharedAnonymousPage& a, const RKSharedAnonymousPage& b) { return a.page() < b.page(); }

}  // namespace

void RKSharedPageList::iterator::decode() {
    // Only lists this class packed are read, so every record is whole.
    if (at_ == end_) return;
    const uint8_t* in = at_;
    key_ += getVarint(in);
    const uint64_t range = getVarint(in);
    current_ = RKSharedAnonymousPage(key_, static_cast<uint32_t>(range));
    next_ = in;
}

RKSharedPageList::RKSharedPageList(std::vector<RKSharedAnonymousPage> pages) {
    if (!std::is_sorted(pages.begin(), pages.end(), byKey)) std::sort(pages.begin(), pages.end(), byKey);
    // Sized exactly in a first walk: the list lives until the pass, with no spare capacity.
    size_t bytes = 0;
    uint64_t previous = 0;
    for (const RKSharedAnonymousPage& page : pages) {
        bytes += varintSize(page.page() - previous) + varintSize(page.range);
        previous = page.page();
    }
    bytes_.resize(bytes);
    uint8_t* out = bytes_.data();
    previous = 0;
    for (const RKSharedAnonymousPage& page : pages) {
        out = putVarint(out, page.page() - previous);
        out = putVarint(out, page.range);
        previous = page.page();
    }
    count_ = pages.size();
}

void RKSharedPageList::release() {
    std::vector<uint8_t>().swap(bytes_);
    count_ = 0;
}
