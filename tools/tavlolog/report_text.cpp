#include "tools/tavlolog/report_text.h"

#include <cstdint>

namespace tavlolog {
namespace {

constexpr char REPLACEMENT[] = "\xEF\xBF\xBD";  // U+FFFD

// Length of the valid UTF-8 sequence at s[i], 0 when the byte there starts
// none (stray continuation, overlong form, surrogate, beyond U+10FFFF, cut).
size_t utf8_length(std::string_view s, size_t i) {
    const auto b = [&](size_t k) { return static_cast<uint8_t>(s[i + k]); };
    const size_t left = s.size() - i;
    const uint8_t c = b(0);
    if (c < 0x80) return 1;
    size_t n;
    uint8_t lo = 0x80, hi = 0xBF;  // the range of the second byte
    if (c >= 0xC2 && c <= 0xDF) {
        n = 2;
    } else if (c >= 0xE0 && c <= 0xEF) {
        n = 3;
        if (c == 0xE0) lo = 0xA0;
        if (c == 0xED) hi = 0x9F;
    } else if (c >= 0xF0 && c <= 0xF4) {
        n = 4;
        if (c == 0xF0) lo = 0x90;
        if (c == 0xF4) hi = 0x8F;
    } else {
        return 0;
    }
    if (left < n || b(1) < lo || b(1) > hi) return 0;
    for (size_t k = 2; k < n; k++) {
        if ((b(k) & 0xC0) != 0x80) return 0;
    }
    return n;
}

// A control character as its Control Picture: U+2400 + c, U+2421 for DEL.
void append_picture(std::string& out, uint8_t c) {
    const unsigned cp = c == 0x7F ? 0x2421 : 0x2400 + c;
    out += static_cast<char>(0xE0 | (cp >> 12));
    out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (cp & 0x3F));
}

// The one HTML or script escape of an ASCII character, null when it has none.
const char* escape_of(uint8_t c, bool js) {
    if (js) {
        switch (c) {
        case '<': return "\\x3c";  // no "</script" nor "<!--" in the script
        case '"': return "\\\"";
        case '\\': return "\\\\";
        case '\t': return "\\t";
        default: return nullptr;
        }
    }
    switch (c) {
    case '<': return "&lt;";
    case '>': return "&gt;";
    case '&': return "&amp;";
    case '"': return "&quot;";
    case '\'': return "&#39;";
    default: return nullptr;
    }
}

void append_repaired(std::string& out, std::string_view text, bool js) {
    out.reserve(out.size() + text.size());
    for (size_t i = 0; i < text.size();) {
        const size_t n = utf8_length(text, i);
        if (n == 0) {
            out += REPLACEMENT;
            i++;
            continue;
        }
        const uint8_t c = static_cast<uint8_t>(text[i]);
        if (n == 1) {
            const char* escaped = escape_of(c, js);
            if (escaped) {
                out += escaped;
            } else if ((c < 0x20 && c != '\t') || c == 0x7F) {
                append_picture(out, c);
            } else {
                out += static_cast<char>(c);
            }
        } else if (js && n == 3 && c == 0xE2 && text[i + 1] == '\x80' &&
                   (text[i + 2] == '\xA8' || text[i + 2] == '\xA9')) {
            // LINE and PARAGRAPH SEPARATOR end a line in older script engines.
            out += text[i + 2] == '\xA8' ? "\\u2028" : "\\u2029";
        } else {
            out.append(text.data() + i, n);
        }
        i += n;
    }
}

}  // namespace

void append_js_text(std::string& out, std::string_view text) { append_repaired(out, text, true); }

void append_html_text(std::string& out, std::string_view text) { append_repaired(out, text, false); }

}  // namespace tavlolog
