#include "output/visible_text.h"

#include <cstdint>

#include "model/utf8.h"

namespace vs {

namespace {

// Length of the printable UTF-8 sequence at text[i], or 0: controls, the
// C1 controls (which terminals act on like ESC sequences), the backslash
// and bytes that are not UTF-8 are not printable.
size_t printableSequence(std::string_view text, size_t i) {
    uint32_t point = 0;
    const size_t length = utf8SequenceAt(text, i, point);
    if (length == 0 || point < 0x20 || point == '\\' || (point >= 0x7F && point <= 0x9F)) {
        return 0;
    }
    return length;
}

} // namespace

bool isVisibleText(std::string_view text) {
    for (size_t i = 0; i < text.size();) {
        const size_t length = printableSequence(text, i);
        if (length == 0) {
            return false;
        }
        i += length;
    }
    return true;
}

std::string visibleText(std::string_view text) {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string out;
    out.reserve(text.size() + 8);
    for (size_t i = 0; i < text.size();) {
        const size_t length = printableSequence(text, i);
        if (length != 0) {
            out.append(text.substr(i, length));
            i += length;
            continue;
        }
        const auto c = static_cast<unsigned char>(text[i++]);
        switch (c) {
        case '\\':
            out += "\\\\";
            break;
        case '\n':
            out += "\\n";
            break;
        case '\t':
            out += "\\t";
            break;
        case '\r':
            out += "\\r";
            break;
        default:
            out += "\\x";
            out += kHex[c >> 4];
            out += kHex[c & 0xF];
            break;
        }
    }
    return out;
}

} // namespace vs
