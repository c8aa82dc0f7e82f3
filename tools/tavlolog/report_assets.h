// The report's page and script, built into the program from report.html and
// report.js. The page holds three markers: <!--TITLE-->, <!--SCRIPT-->, <!--DATA-->.
#pragma once

namespace tavlolog {

extern const char REPORT_HTML[];
extern const char REPORT_JS[];

}  // namespace tavlolog
