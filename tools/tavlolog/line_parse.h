// Parsers of the lines a run's files hold, from byte strings (the readers, the
// tests and the fuzzer call them alike). They never read past `line`.
#pragma once

#include <cstdint>
#include <string_view>

#include "tools/tavlolog/entry.h"

namespace tavlolog {

// What a line says of itself; the instant is made from it by the lane, which
// knows the year, the zone and the boot's start.
struct ParsedLine {
    Kind kind = KIND_MALFORMED;
    int8_t priority = PRIO_NONE;
    int32_t pid = -1, tid = -1;
    std::string_view tag, message;
    // A threadtime line's local time (year 0: the line has none).
    int year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0;
    int32_t nanos = 0;
    bool has_local = false;
    int64_t uptime_ns = -1;  // a kernel line's "[seconds.micro]"
};

// "MM-DD HH:MM:SS.mmm  pid  tid P tag: message" as the platform library renders
// it ("YYYY-" before the date and 6 or 9 fraction digits are taken too);
// "--------- beginning of ..." is a marker. false: the line is malformed.
bool parse_threadtime(std::string_view line, ParsedLine* out);
// "<p>[seconds.micro] text"; the time may be missing. false: malformed.
bool parse_kernel(std::string_view line, ParsedLine* out);

// The "-----timezone: ZONE" header at the top of every file: true with the zone.
bool parse_header(std::string_view line, std::string_view* zone);
// A held piece's note line ("TavloLog in Normal" and its kin) at the end of
// line: the position where it starts (0 for a whole note line), or npos. A note
// follows a piece cut in the middle of a line without a line feed.
size_t note_start(std::string_view line);

// Days since 1970-01-01 of a proleptic Gregorian date.
int64_t days_from_civil(int year, int month, int day);
// The date of a day number.
void civil_from_days(int64_t days, int* year, int* month, int* day);

}  // namespace tavlolog
