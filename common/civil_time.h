// Calendar time without the C library: localtime_r and strftime take a
// process-wide time-zone lock that a fork can leave held, so code that may run
// in a forked collector converts by hand.
#pragma once

#include <time.h>

// Broken-down time (tm_year, tm_mon, tm_mday, tm_hour, tm_min, tm_sec) of t
// seconds since the epoch, with the offset already added for local time.
void civil_time(long long t, struct tm* out);
