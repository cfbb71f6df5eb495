#include "platform/RKSmapsParser.h"

#include <charconv>

namespace {

bool isHeaderStart(char c) { return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'); }

void skipSpaces(std::string_view& s) {
    size_t i = 0;
    while (i < s.size() && s[i] == ' ') i++;
    s.remove_prefix(i);
}

// Reads an unsigned number in `base` from the front of `s` and removes it.
bool takeNumber(std::string_view& s, uint64_t& value, int base) {
    auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), value, base);
    if (ec != std::errc() || end == s.data()) return false;
    s.remove_prefix(static_cast<size_t>(end - s.data()));
    return true;
}

bool takeChar(std::string_view& s, char c) {
    if (s.empty() || s.front() != c) return false;
    s.remove_prefix(1);
    return true;
}

uint8_t parsePerms(std::string_view p) {
    uint8_t perms = 0;
    if (p[0] == 'r') perms |= RKSmapsRead;
    if (p[1] == 'w') perms |= RKSmapsWrite;
    if (p[2] == 'x') perms |= RKSmapsExecute;
    if (p[3] == 's') perms |= RKSmapsShared;
    return perms;
}

// "start-end perms offset MAJ:MIN inode [path]"
bool parseHeader(std::string_view line, RKSmapsVma& vma) {
    uint64_t major = 0, minor = 0;
    if (!takeNumber(line, vma.start, 16) || !takeChar(line, '-') || !takeNumber(line, vma.end, 16) ||
        !takeChar(line, ' ') || line.size() < 5 || line[4] != ' ')
        return false;
    vma.perms = parsePerms(line.substr(0, 4));
    line.remove_prefix(5);
    if (!takeNumber(line, vma.offset, 16) || !takeChar(line, ' ') || !takeNumber(line, major, 16) ||
        !takeChar(line, ':') || !takeNumber(line, minor, 16) || !takeChar(line, ' ') ||
        !takeNumber(line, vma.inode, 10))
        return false;
    if (vma.end < vma.start) return false;
    vma.devMajor = static_cast<uint32_t>(major);
    vma.devMinor = static_cast<uint32_t>(minor);
    skipSpaces(line);
    vma.path = line;
    return true;
}

uint32_t vmFlagBit(std::string_view mnemonic) {
    if (mnemonic.size() != 2) return 0;
    switch (mnemonic[0] << 8 | mnemonic[1]) {
        case 'm' << 8 | 'r': return RKVmMayRead;
        case 'm' << 8 | 'w': return RKVmMayWrite;
        case 'm' << 8 | 'e': return RKVmMayExec;
        case 'p' << 8 | 'f': return RKVmPfnMap;
        case 'i' << 8 | 'o': return RKVmIo;
        case 'l' << 8 | 'o': return RKVmLocked;
        case 'l' << 8 | 'f': return RKVmLockOnFault;
        case 'h' << 8 | 't': return RKVmHugetlb;
        case 'd' << 8 | 'c': return RKVmDontCopy;
        default: return 0;
    }
}

uint32_t parseVmFlags(std::string_view s) {
    uint32_t flags = 0;
    while (!s.empty()) {
        skipSpaces(s);
        size_t space = s.find(' ');
        flags |= vmFlagBit(s.substr(0, space));
        if (space == std::string_view::npos) break;
        s.remove_prefix(space);
    }
    return flags;
}

// The kB field called `name`, or nullptr for a field memspread does not read.
uint64_t* fieldFor(std::string_view name, RKSmapsVma& vma) {
    switch (name.size()) {
        case 3:
            if (name == "Rss") return &vma.rss;
            break;
        case 4:
            if (name == "Swap") return &vma.swap;
            break;
        case 8:
            if (name == "LazyFree") return &vma.lazyFree;
            break;
        case 9:
            if (name == "Anonymous") return &vma.anonymous;
            break;
        case 12:
            if (name == "Shared_Clean") return &vma.sharedClean;
            if (name == "Shared_Dirty") return &vma.sharedDirty;
            break;
        case 13:
            if (name == "Private_Clean") return &vma.privateClean;
            if (name == "Private_Dirty") return &vma.privateDirty;
            break;
        case 14:
            if (name == "Shared_Hugetlb") return &vma.sharedHugetlb;
            break;
        case 15:
            if (name == "Private_Hugetlb") return &vma.privateHugetlb;
            break;
        default:
            break;
    }
    return nullptr;
}

void parseField(std::string_view line, RKSmapsVma& vma) {
    size_t colon = line.find(':');
    if (colon == std::string_view::npos) return;
    std::string_view name = line.substr(0, colon);
    std::string_view value = line.substr(colon + 1);
    if (name == "VmFlags") {
        vma.vmFlags = parseVmFlags(value);
        return;
    }
    if (uint64_t* field = fieldFor(name, vma)) {
        skipSpaces(value);
        uint64_t kB = 0;
        if (takeNumber(value, kB, 10)) *field = kB;
    }
}

}  // namespace

RKSmapsParseResult RKParseSmaps(std::string_view text, std::vector<RKSmapsVma>& vmas) {
    RKSmapsParseResult result;
    RKSmapsVma* current = nullptr;
    while (!text.empty()) {
        size_t newline = text.find('\n');
        std::string_view line = text.substr(0, newline);
        text.remove_prefix(newline == std::string_view::npos ? text.size() : newline + 1);
        if (line.empty()) continue;
        if (isHeaderStart(line.front())) {
            RKSmapsVma vma;
            if (parseHeader(line, vma)) {
                vmas.push_back(vma);
                current = &vmas.back();
            } else {
                result.malformedHeaders++;
                current = nullptr;
            }
        } else if (current) {
            parseField(line, *current);
        }
    }
    return result;
}
