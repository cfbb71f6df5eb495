// Names and paths as the text report shows them. They come from other processes and may hold
// any bytes, so nothing a terminal would act on is ever written raw.
#pragma once

#include <string>
#include <string_view>

// `text` with every byte that is not part of printable UTF-8 shown as "\xNN": the C0 controls,
// DEL, the C1 controls (U+0080 to U+009F) and bytes that do not form valid UTF-8. Printable
// text, multi-byte characters included, passes unchanged.
std::string RKTextEscaped(std::string_view text);

// Unless `wide`, a path is shortened to ".../" and its last component (trailing "/" ignored)
// when that component is shorter than the whole. A string without "/" and a string made only of
// "/" stay as they are.
std::string RKTextTruncatedName(std::string_view name, bool wide);
