#include "platform/RKSmapsParser.h"

#include <array>
#include <bit>
#include <charconv>
#include <cstring>

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

// The kB fields memspread reads.
struct KbField {
    std::string_view name;
    uint64_t RKSmapsVma::*member;
};

constexpr KbField kKbFields[] = {
    {"Rss", &RKSmapsVma::rss},
    {"Swap", &RKSmapsVma::swap},
    {"LazyFree", &RKSmapsVma::lazyFree},
    {"Anonymous", &RKSmapsVma::anonymous},
    {"Shared_Clean", &RKSmapsVma::sharedClean},
    {"Shared_Dirty", &RKSmapsVma::sharedDirty},
    {"Private_Clean", &RKSmapsVma::privateClean},
    {"Private_Dirty", &RKSmapsVma::privateDirty},
    {"Shared_Hugetlb", &RKSmapsVma::sharedHugetlb},
    {"Private_Hugetlb", &RKSmapsVma::privateHugetlb},
};

// The kB field called `name`, or nullptr for a field memspread does not read.
uint64_t* fieldFor(std::string_view name, RKSmapsVma& vma) {
    for (const KbField& field : kKbFields)
        if (field.name == name) return &(vma.*field.member);
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

// The kernel prints a kB field as its name and colon padded to 16 columns, the value right-aligned
// in 8, and " kB": 28 bytes with the newline while the value fits. Nearly every line of smaps is
// such a line. They are taken by position, with no search for the colon or the newline: the 16
// columns before the value, as two words, find the field read in a table, the 8 columns of the
// value convert as one word.
constexpr size_t kFixedLineLength = 28;
constexpr size_t kValueColumn = 16;
constexpr size_t kUnitColumn = 24;

struct FixedField {
    uint64_t head = 0, tail = 0;  // columns 0-7 and 8-15, first column in the low byte
    uint64_t RKSmapsVma::*member = nullptr;
};

constexpr FixedField fixedField(const KbField& field) {
    FixedField fixed{0, 0, field.member};
    for (size_t i = 0; i < kValueColumn; i++) {
        const char c = i < field.name.size() ? field.name[i] : i == field.name.size() ? ':' : ' ';
        (i < 8 ? fixed.head : fixed.tail) |= uint64_t{static_cast<unsigned char>(c)} << (8 * (i % 8));
    }
    return fixed;
}

// The fields read, by a hash of their columns, each in a slot of its own: a line is one lookup
// and one comparison.
constexpr size_t kFixedSlotBits = 5;

constexpr size_t fixedSlot(uint64_t head, uint64_t tail) {
    return static_cast<size_t>(((head ^ (tail * 7)) * 0x9E3779B97F4A7C15ull) >> (64 - kFixedSlotBits));
}

constexpr std::array<FixedField, size_t{1} << kFixedSlotBits> kFixedSlots = [] {
    std::array<FixedField, size_t{1} << kFixedSlotBits> slots{};
    for (const KbField& field : kKbFields) {
        const FixedField fixed = fixedField(field);
        slots[fixedSlot(fixed.head, fixed.tail)] = fixed;
    }
    return slots;
}();

// Every field read has a name that leaves room for its colon, and a slot of its own.
constexpr bool eachFieldFitsAndHasItsSlot() {
    for (const KbField& field : kKbFields) {
        const FixedField fixed = fixedField(field);
        if (field.name.size() >= kValueColumn || kFixedSlots[fixedSlot(fixed.head, fixed.tail)].member != field.member)
            return false;
    }
    return true;
}
static_assert(eachFieldFitsAndHasItsSlot(), "a field's name is too long, or two fields share a slot: change the hash");

uint64_t loadWord(const char* at) {
    uint64_t word;
    std::memcpy(&word, at, sizeof word);
    return word;
}

bool isFixedKbLine(std::string_view text) {
    return std::endian::native == std::endian::little && text.size() >= kFixedLineLength &&
           text[kFixedLineLength - 1] == '\n' && text.compare(kUnitColumn, 3, " kB") == 0 &&
           !isHeaderStart(text.front());
}

// The 8 columns of a value: spaces, then digits to the last column. False for anything else.
bool fixedValue(uint64_t columns, uint64_t& value) {
    constexpr uint64_t kOnes = 0x0101010101010101;
    const uint64_t spacesZeroed = columns ^ (0x20 * kOnes);
    // The high bit of each column that is not a space.
    const uint64_t nonSpace = (((spacesZeroed & (0x7F * kOnes)) + 0x7F * kOnes) | spacesZeroed) & (0x80 * kOnes);
    if (nonSpace == 0) return false;
    // From the first column that is not a space on, the columns as they are; before it, '0'.
    const uint64_t number = ~uint64_t{0} << (std::countr_zero(nonSpace) - 7);
    const uint64_t digits = (columns & number) | ((0x30 * kOnes) & ~number);
    if ((digits & (0xF0 * kOnes)) != 0x30 * kOnes || ((digits + 0x06 * kOnes) & (0xF0 * kOnes)) != 0x30 * kOnes)
        return false;
    // Eight digits, the first in the low byte, as one number (pairs, then fours, then all).
    uint64_t v = digits - 0x30 * kOnes;
    v = v * 10 + (v >> 8);
    v = ((v & 0x000000FF000000FF) * (100 + (1000000ull << 32)) +
         ((v >> 16) & 0x000000FF000000FF) * (1 + (10000ull << 32))) >> 32;
    value = v;
    return true;
}

// A fixed kB line at the front of `text` (isFixedKbLine), into its field of `vma` if it is one.
void parseFixedKbLine(std::string_view text, RKSmapsVma& vma) {
    const uint64_t head = loadWord(text.data()), tail = loadWord(text.data() + 8);
    const FixedField& field = kFixedSlots[fixedSlot(head, tail)];
    uint64_t kB = 0;
    if (field.member && field.head == head && field.tail == tail && fixedValue(loadWord(text.data() + kValueColumn), kB))
        vma.*field.member = kB;
}

}  // namespace

RKSmapsParseResult RKParseSmaps(std::string_view text, std::vector<RKSmapsVma>& vmas) {
    RKSmapsParseResult result;
    RKSmapsVma* current = nullptr;
    while (!text.empty()) {
        if (current && isFixedKbLine(text)) {
            parseFixedKbLine(text, *current);
            text.remove_prefix(kFixedLineLength);
            continue;
        }
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
