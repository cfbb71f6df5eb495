// An immutable string held once per distinct value, program-wide. Regions repeat a few dozen
// names and paths hundreds of thousands of times; each region keeps a pointer-sized handle
// instead of its own copy. Handles read as `const std::string&`, and are assigned from any
// string, so a region's name is used like a plain string.
//
// Entries are reference-counted and freed with their last handle (paths come and go while a
// sample runs for days). Handles may be made, copied and dropped on any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <iosfwd>
#include <string>
#include <string_view>

class RKInternedString {
public:
    RKInternedString() noexcept = default;  // the empty string: no entry
    RKInternedString(std::string_view text) : entry_(_acquire(text)) {}
    RKInternedString(const std::string& text) : RKInternedString(std::string_view(text)) {}
    RKInternedString(const char* text) : RKInternedString(std::string_view(text)) {}
    RKInternedString(const RKInternedString& other) noexcept : entry_(other.entry_) { _retain(entry_); }
    RKInternedString(RKInternedString&& other) noexcept : entry_(other.entry_) { other.entry_ = nullptr; }
    ~RKInternedString() { _release(entry_); }

    RKInternedString& operator=(const RKInternedString& other) noexcept {
        _retain(other.entry_);
        _release(entry_);
        entry_ = other.entry_;
        return *this;
    }
    RKInternedString& operator=(RKInternedString&& other) noexcept {
        if (this != &other) {
            _release(entry_);
            entry_ = other.entry_;
            other.entry_ = nullptr;
        }
        return *this;
    }
    RKInternedString& operator=(std::string_view text) { return *this = RKInternedString(text); }
    RKInternedString& operator=(const std::string& text) { return *this = RKInternedString(text); }
    RKInternedString& operator=(const char* text) { return *this = RKInternedString(text); }

    const std::string& str() const noexcept { return entry_ ? entry_->text : kEmpty; }
    operator const std::string&() const noexcept { return str(); }
    operator std::string_view() const noexcept { return str(); }
    bool empty() const noexcept { return !entry_; }
    size_t size() const noexcept { return str().size(); }
    const char* c_str() const noexcept { return str().c_str(); }
    const char* data() const noexcept { return str().data(); }
    bool starts_with(std::string_view prefix) const noexcept { return str().starts_with(prefix); }
    bool ends_with(std::string_view suffix) const noexcept { return str().ends_with(suffix); }

    // Equal strings share their entry.
    friend bool operator==(const RKInternedString& a, const RKInternedString& b) noexcept {
        return a.entry_ == b.entry_;
    }
    // Exact overloads, so that comparing with a literal or a string converts neither side.
    friend bool operator==(const RKInternedString& a, std::string_view b) noexcept { return a.str() == b; }
    friend bool operator==(const RKInternedString& a, const std::string& b) noexcept { return a.str() == b; }
    friend bool operator==(const RKInternedString& a, const char* b) noexcept { return a.str() == b; }
    friend std::string operator+(const RKInternedString& a, char b) { return a.str() + b; }
    friend std::string operator+(std::string a, const RKInternedString& b) { return std::move(a) + b.str(); }
    friend std::ostream& operator<<(std::ostream& out, const RKInternedString& text);

    // How many handles share this string's entry; 0 for the empty string (for tests).
    size_t useCount() const noexcept { return entry_ ? entry_->count.load(std::memory_order_relaxed) : 0; }
    // How many distinct strings are held now, program-wide (for tests).
    static size_t entryCount();

private:
    struct Entry {
        std::atomic<size_t> count;
        const std::string text;
    };
    struct Table;
    static Table& _table();

    static Entry* _acquire(std::string_view text);
    // Handles that exist hold the count at 1 or more, so a copy never starts from 0.
    static void _retain(Entry* entry) noexcept {
        if (entry) entry->count.fetch_add(1, std::memory_order_relaxed);
    }
    static void _release(Entry* entry) noexcept {
        if (!entry) return;
        size_t count = entry->count.load(std::memory_order_relaxed);
        // The last handle goes through the table's lock, so that a lookup cannot find the
        // entry at 0 and revive it while it is being freed.
        while (count > 1) {
            if (entry->count.compare_exchange_weak(count, count - 1, std::memory_order_release,
                                                   std::memory_order_relaxed))
                return;
        }
        _releaseLast(entry);
    }
    static void _releaseLast(Entry* entry) noexcept;

    static inline const std::string kEmpty;
    Entry* entry_ = nullptr;
};
