# Turns the report's page and script into C++ strings (cmake -P, with OUT,
# HTML and JS set). The script goes into a <script> element as it is, so it
# must hold nothing that ends or escapes one.
file(READ ${HTML} html)
file(READ ${JS} js)
string(TOLOWER "${js}" js_lower)
foreach(bad "</script" "<!--" "<script")
  string(FIND "${js_lower}" "${bad}" at)
  if(NOT at EQUAL -1)
    message(FATAL_ERROR "${JS}: \"${bad}\" would break the report's <script> element")
  endif()
endforeach()
foreach(text html js)
  string(FIND "${${text}}" ")tavlo_asset\"" at)
  if(NOT at EQUAL -1)
    message(FATAL_ERROR "the report's ${text} holds the raw string's delimiter")
  endif()
endforeach()
file(WRITE ${OUT}.tmp "// Generated from report.html and report.js; do not edit.
#include \"tools/tavlolog/report_assets.h\"
namespace tavlolog {
const char REPORT_HTML[] = R\"tavlo_asset(${html})tavlo_asset\";
const char REPORT_JS[] = R\"tavlo_asset(${js})tavlo_asset\";
}  // namespace tavlolog
")
file(COPY_FILE ${OUT}.tmp ${OUT} ONLY_IF_DIFFERENT)
file(REMOVE ${OUT}.tmp)
