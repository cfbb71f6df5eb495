#include "platform/RKVmallocinfoParser.h"

#include <charconv>

namespace {

std::string_view nextWord(std::string_view& line) {
    size_t start = line.find_first_not_of(' ');
    if (start == std::string_view::npos) {
        line = {};
        return {};
    }
    line.remove_prefix(start);
    size_t end = line.find(' ');
    std::string_view word = line.substr(0, end);
    line.remove_prefix(end == std::string_view::npos ? line.size() : end);
    return word;
}

bool number(std::string_view word, uint64_t& value) {
    auto [end, ec] = std::from_chars(word.data(), word.data() + word.size(), value);
    return ec == std::errc() && end == word.data() + word.size();
}

uint32_t flagFor(std::string_view word) {
    if (word == "ioremap") return RKVmallocIoremap;
    if (word == "vmap") return RKVmallocVmap;
    if (word == "vmalloc") return RKVmallocVmalloc;
    if (word == "user") return RKVmallocUser;
    if (word == "vpages") return RKVmallocVpages;
    return 0;
}

bool parseLine(std::string_view line, RKVmallocArea& area) {
    std::string_view range = nextWord(line);
    if (range.size() < 3 || range.substr(0, 2) != "0x" || range.find('-') == std::string_view::npos) return false;
    if (!number(nextWord(line), area.size)) return false;
    // A caller is "function+0xoff/0xlen"; a word without '+' is already a flag or a note.
    std::string_view rest = line;
    std::string_view word = nextWord(rest);
    size_t plus = word.find('+');
    if (plus != std::string_view::npos && plus > 0) {
        area.caller = word.substr(0, plus);
        line = rest;
    }
    for (word = nextWord(line); !word.empty(); word = nextWord(line)) {
        if (word.substr(0, 6) == "pages=") {
            if (!number(word.substr(6), area.pages)) return false;
        } else {
            area.flags |= flagFor(word);
        }
    }
    return true;
}

}  // namespace

size_t RKParseVmallocinfo(std::string_view text, std::vector<RKVmallocArea>& areas) {
    size_t malformed = 0;
    while (!text.empty()) {
        size_t newline = text.find('\n');
        std::string_view line = text.substr(0, newline);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
        if (line.empty()) continue;
        RKVmallocArea area;
        if (parseLine(line, area)) {
            areas.push_back(area);
        } else {
            ++malformed;
        }
    }
    return malformed;
}
