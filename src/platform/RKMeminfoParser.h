// /proc/meminfo as plain numbers: "Name:   value kB" lines, a few without the unit (the
// HugePages_ page counts). The parser takes the text and never reads the kernel.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>

// Each line's value: bytes for kB lines, the bare number otherwise. Nothing when the text holds
// no line that parses (not a meminfo file). Unknown lines are kept: the caller picks.
std::optional<std::map<std::string, uint64_t, std::less<>>> RKParseMeminfo(std::string_view text);
