#pragma once

// UTF-8 as the program meets it: names and paths on Linux are bytes, and
// only some of them are well-formed UTF-8.

#include <cstddef>
#include <cstdint>
#include <string_view>

namespace vs {

// Length of the well-formed UTF-8 sequence starting at text[i] (1 to 4),
// with its code point in `point`; 0 when the bytes there are not one
// (a stray continuation byte, an overlong form, a surrogate, a cut
// sequence, a code point past U+10FFFF).
size_t utf8SequenceAt(std::string_view text, size_t i, uint32_t &point);

// True when all of `text` is well-formed UTF-8.
bool isUtf8(std::string_view text);

} // namespace vs
