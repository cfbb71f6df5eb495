// Names and paths of other processes as memspread writes them anywhere: in the text report and
// in every message on standard error. They may hold any bytes, so nothing a terminal would act
// on is ever written raw.
#pragma once

#include <string>
#include <string_view>

// `text` with every byte that is not part of printable UTF-8 shown as "\xNN": the C0 controls,
// DEL, the C1 controls (U+0080 to U+009F) and bytes that do not form valid UTF-8. Printable
// text, multi-byte characters included, passes unchanged.
std::string RKEscapedText(std::string_view text);
