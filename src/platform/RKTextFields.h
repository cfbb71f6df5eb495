// Lines, words and numbers of /proc text, as views into it (no copies).
#pragma once

#include <charconv>
#include <cstdint>
#include <string_view>

// The next line of `text` without its newline; `text` moves past it.
inline std::string_view RKNextLine(std::string_view& text) {
    size_t newline = text.find('\n');
    std::string_view line = text.substr(0, newline);
    text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
    return line;
}

// The next blank-separated word of `line` (empty at its end); `line` moves past it.
inline std::string_view RKNextWord(std::string_view& line) {
    size_t start = line.find_first_not_of(" \t");
    if (start == std::string_view::npos) {
        line = {};
        return {};
    }
    line.remove_prefix(start);
    size_t end = line.find_first_of(" \t");
    std::string_view word = line.substr(0, end);
    line.remove_prefix(end == std::string_view::npos ? line.size() : end);
    return word;
}

// Whether `word` is a decimal number and nothing else.
template <typename Number>
bool RKParseDecimal(std::string_view word, Number& value) {
    auto [end, ec] = std::from_chars(word.data(), word.data() + word.size(), value);
    return ec == std::errc() && end == word.data() + word.size() && !word.empty();
}
