#include "platform/RKVmallocinfoParser.h"

#include "platform/RKTextFields.h"

namespace {

uint32_t flagFor(std::string_view word) {
    if (word == "ioremap") return RKVmallocIoremap;
    if (word == "vmap") return RKVmallocVmap;
    if (word == "vmalloc") return RKVmallocVmalloc;
    if (word == "user") return RKVmallocUser;
    if (word == "vpages") return RKVmallocVpages;
    return 0;
}

bool parseLine(std::string_view line, RKVmallocArea& area) {
    std::string_view range = RKNextWord(line);
    if (range.size() < 3 || range.substr(0, 2) != "0x" || range.find('-') == std::string_view::npos) return false;
    if (!RKParseDecimal(RKNextWord(line), area.size)) return false;
    // A caller is "function+0xoff/0xlen"; a word without '+' is already a flag or a note.
    std::string_view rest = line;
    std::string_view word = RKNextWord(rest);
    size_t plus = word.find('+');
    if (plus != std::string_view::npos && plus > 0) {
        area.caller = word.substr(0, plus);
        line = rest;
    }
    for (word = RKNextWord(line); !word.empty(); word = RKNextWord(line)) {
        if (word.substr(0, 6) == "pages=") {
            if (!RKParseDecimal(word.substr(6), area.pages)) return false;
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
        std::string_view line = RKNextLine(text);
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
