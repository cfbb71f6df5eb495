#include "process/RKImage.h"

#include <string_view>

void RKImage::setName(RKSharedString name) {
    name_ = std::move(name);
    std::string_view text = *name_;
    if (text.starts_with("__TEXT") || text.starts_with("__OBJC_RO"))
        segment = RKSegmentText;
    else if (text.starts_with("__LINKEDIT"))
        segment = RKSegmentLinkedit;
    else if (text.starts_with("__"))
        segment = RKSegmentData;
}

std::shared_ptr<RKImage> RKImageEnumerator::nextImageForStart(uint64_t start, uint64_t end) {
    while (index_ < images_.size()) {
        const auto& image = images_[index_];
        const uint64_t a = image->start;
        const uint64_t b = image->end();
        if ((start >= a && start < b) || (end > a && end <= b) || (start <= a && b <= end)) return image;
        if (a >= start) return nullptr;  // the image lies after the range
        index_++;                        // wholly before the range: never needed again
    }
    return nullptr;
}
