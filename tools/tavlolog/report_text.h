// Log text made safe for the HTML report. The lines come from apps on the
// phone, which may be hostile: nothing they wrote may become markup, and bytes
// that are not UTF-8 or are control characters must still show as something
// visible. (The entries reach the page compressed and base-64 encoded, which
// holds no '<', quote or backslash whatever the text.)
#pragma once

#include <string>
#include <string_view>

namespace tavlolog {

// Appends TEXT as the page shows it: invalid UTF-8 bytes become U+FFFD each,
// control characters (except tab) their visible Control Pictures (NUL as
// U+2400), so a line feed is free to separate entries.
void append_visible_text(std::string& out, std::string_view text);

// Appends TEXT as HTML character data (element content or a quoted
// attribute value), with the same repairs.
void append_html_text(std::string& out, std::string_view text);

}  // namespace tavlolog
