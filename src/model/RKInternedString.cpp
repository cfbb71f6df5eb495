#include "model/RKInternedString.h"

#include <mutex>
#include <ostream>
#include <unordered_map>

// Keys view the text of their own entry.
struct RKInternedString::Table {
    std::mutex lock;
    std::unordered_map<std::string_view, Entry*> entries;
};

// Never destroyed: handles in static objects may outlive any destruction order.
RKInternedString::Table& RKInternedString::_table() {
    static Table* shared = new Table;
    return *shared;
}

RKInternedString::Entry* RKInternedString::_acquire(std::string_view text) {
    if (text.empty()) return nullptr;
    Table& interned = _table();
    std::lock_guard guard(interned.lock);
    auto found = interned.entries.find(text);
    if (found != interned.entries.end()) {
        found->second->count.fetch_add(1, std::memory_order_relaxed);
        return found->second;
    }
    auto* entry = new Entry{{1}, std::string(text)};
    interned.entries.emplace(entry->text, entry);
    return entry;
}

void RKInternedString::_releaseLast(Entry* entry) noexcept {
    Table& interned = _table();
    std::lock_guard guard(interned.lock);
    // Another thread may have found the entry since the count was read: only 1 → 0 frees it.
    if (entry->count.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
    interned.entries.erase(entry->text);
    delete entry;
}

size_t RKInternedString::entryCount() {
    Table& interned = _table();
    std::lock_guard guard(interned.lock);
    return interned.entries.size();
}

std::ostream& operator<<(std::ostream& out, const RKInternedString& text) { return out << text.str(); }
