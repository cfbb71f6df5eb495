#include "process/RKStringInternTable.h"

RKSharedString RKUnsharedString(std::string_view text) { return std::make_shared<const std::string>(text); }

RKStringInternTable<RKPathInternSlots>& pathInternCache() {
    static RKStringInternTable<RKPathInternSlots> table;
    return table;
}

RKStringInternTable<RKSegmentNameInternSlots>& segmentNameInternCache() {
    static RKStringInternTable<RKSegmentNameInternSlots> table;
    return table;
}

size_t RKPathInternSlotForBase(uint64_t base) {
    return static_cast<size_t>((base ^ base >> 8 ^ base >> 16 ^ base >> 24) % RKPathInternSlots);
}
