// Paths as the text report shows them: shortened unless the report is wide. Escaping is
// model/RKEscapedText.h, shared with every message on standard error.
#pragma once

#include <string>
#include <string_view>

// Unless `wide`, a path is shortened to ".../" and its last component (trailing "/" ignored)
// when that component is shorter than the whole. A string without "/" and a string made only of
// "/" stay as they are.
std::string RKTextTruncatedName(std::string_view name, bool wide);
