// Log text made safe for the HTML report. The lines come from apps on the
// phone, which may be hostile: nothing they wrote may end a script, open a
// comment or break a string literal, and bytes that are not UTF-8 or are
// control characters must still show as something visible.
#pragma once

#include <string>
#include <string_view>

namespace tavlolog {

// Appends TEXT as the body of a double-quoted JavaScript string literal
// inside an HTML <script>: no '<', quote, backslash or line terminator is
// written raw. Invalid UTF-8 bytes become U+FFFD each, control characters
// (except tab) their visible Control Pictures (NUL as U+2400), so a '\n'
// escape is free to separate entries.
void append_js_text(std::string& out, std::string_view text);

// Appends TEXT as HTML character data (element content or a quoted
// attribute value), with the same repairs.
void append_html_text(std::string& out, std::string_view text);

}  // namespace tavlolog
