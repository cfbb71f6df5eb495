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

bool byKey(const RKSharedAnonymousPage& a, const RKSharedAnonymousPage& b) { return a.page() < b.page(); }

}  // namespace

RKSharedPageList::RKSharedPageList(std::vector<RKSharedAnonymousPage> pages) {
    if (!std::is_sorted(pages.begin(), pages.end(), byKey)) std::sort(pages.begin(), pages.end(), byKey);
    // Sized exactly in a first walk: the list lives until the pass, with no spare capacity.
    uint64_t previous = 0;
    for (const RKSharedAnonymousPage& page : pages) {
        keyBytes_ += varintSize(page.page() - previous);
        previous = page.page();
        wide_ = wide_ || page.range > UINT16_MAX;
    }
    const size_t rangeBytes = wide_ ? 4 : 2;
    bytes_.resize(keyBytes_ + pages.size() * rangeBytes);
    uint8_t* key = bytes_.data();
    uint8_t* range = bytes_.data() + keyBytes_;
    previous = 0;
    for (const RKSharedAnonymousPage& page : pages) {
        key = putVarint(key, page.page() - previous);
        previous = page.page();
        if (wide_) {
            std::memcpy(range, &page.range, 4);
        } else {
            const auto narrow = static_cast<uint16_t>(page.range);
            std::memcpy(range, &narrow, 2);
        }
        range += rangeBytes;
    }
    count_ = pages.size();
}

void RKSharedPageList::release() {
    std::vector<uint8_t>().swap(bytes_);
    keyBytes_ = count_ = 0;
    wide_ = false;
}
