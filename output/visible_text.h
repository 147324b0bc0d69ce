#pragma once

// Names in the text report come from other users: executable names, mapped
// paths, shared-memory names. On a terminal their control characters would
// act (clear the screen, retitle the window, forge report lines), so the
// text report shows every byte that is not printable text as an escape:
// "\n", "\t", "\r", "\xNN" for other control bytes, C1 controls and bytes
// that are not UTF-8, and a backslash as "\\" so that no escape is
// ambiguous. Printable UTF-8 passes as it is. The JSON document keeps the
// exact text (its own escaping is lossless).

#include <string>
#include <string_view>

namespace vs {

// True when `text` shows as it is.
bool isVisibleText(std::string_view text);

// `text` with everything that is not printable escaped.
std::string visibleText(std::string_view text);

} // namespace vs
