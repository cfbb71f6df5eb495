#include "platform/RKProcStatParser.h"

#include <charconv>

#include "platform/RKKernelTypes.h"

namespace {

// BSD process states (sys/proc.h); SZOMB comes with the kernel types.
constexpr uint32_t SIDL = 1;
constexpr uint32_t SRUN = 2;
constexpr uint32_t SSLEEP = 3;
constexpr uint32_t SSTOP = 4;

// Reads one space-separated number starting at `pos` and moves `pos` past it and its separator.
template <typename T>
bool readField(std::string_view text, size_t& pos, T& value) {
    const char* begin = text.data() + pos;
    const char* end = text.data() + text.size();
    auto [next, ec] = std::from_chars(begin, end, value);
    if (ec != std::errc() || next == begin) return false;
    pos = static_cast<size_t>(next - text.data());
    if (pos < text.size() && text[pos] == ' ') pos++;
    return true;
}

bool skipField(std::string_view text, size_t& pos) {
    size_t space = text.find(' ', pos);
    if (space == std::string_view::npos) return false;
    pos = space + 1;
    return true;
}

}  // namespace

std::optional<RKProcStat> RKParseProcStat(std::string_view text) {
    RKProcStat stat;
    size_t pos = 0;
    if (!readField(text, pos, stat.pid)) return std::nullopt;
    size_t open = text.find('(');
    size_t close = text.rfind(')');
    if (open == std::string_view::npos || close == std::string_view::npos || close < open) return std::nullopt;
    stat.comm.assign(text.substr(open + 1, close - open - 1));

    // ") S ppid pgrp session tty_nr tpgid flags": fields 3 to 9.
    pos = close + 1;
    if (pos + 2 >= text.size() || text[pos] != ' ') return std::nullopt;
    stat.state = text[pos + 1];
    pos += 2;
    if (pos >= text.size() || text[pos] != ' ') return std::nullopt;
    pos++;
    if (!readField(text, pos, stat.ppid)) return std::nullopt;
    for (int field = 5; field <= 8; field++)
        if (!skipField(text, pos)) return std::nullopt;
    if (!readField(text, pos, stat.flags)) return std::nullopt;
    // Fields 10 to 21, then the start time.
    bool complete = true;
    for (int field = 10; field <= 21 && complete; field++) complete = skipField(text, pos);
    if (complete && !readField(text, pos, stat.startTime)) stat.startTime = 0;
    return stat;
}

uint32_t RKBsdStatusForProcState(char state) {
    switch (state) {
        case 'R': return SRUN;
        case 'T':
        case 't': return SSTOP;
        case 'Z':
        case 'X': return SZOMB;  // dead but not yet reaped
        case 'S':
        case 'D':
        case 'I':
        case 'W':
        case 'P': return SSLEEP;
        default: return SIDL;
    }
}

bool RKIsElf32Header(std::string_view header) {
    constexpr size_t EI_CLASS = 4;
    constexpr char ELFCLASS32 = 1;
    return header.size() > EI_CLASS && header.substr(0, 4) == "\x7f" "ELF" && header[EI_CLASS] == ELFCLASS32;
}

std::string_view RKExecutablePathFromLink(std::string_view link, bool unlinked) {
    if (unlinked && link.size() > RK_DELETED_SUFFIX.size() && link.ends_with(RK_DELETED_SUFFIX))
        link.remove_suffix(RK_DELETED_SUFFIX.size());
    return link;
}

std::string_view RKLastPathComponent(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
    if (path == "/") return path;
    size_t slash = path.rfind('/');
    return slash == std::string_view::npos ? path : path.substr(slash + 1);
}
