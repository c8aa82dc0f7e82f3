#include "tools/tavlolog/line_parse.h"

#include <cstring>

namespace tavlolog {

namespace {

constexpr std::string_view kBeginning = "--------- beginning of ";
constexpr std::string_view kHeader = "-----timezone: ";
constexpr std::string_view kNotePrefix = "TavloLog in ";
// The notes the copy writes; a longer line ending in one was cut before it.
constexpr std::string_view kNotes[] = {
    "TavloLog in Normal",
    "TavloLog in Low Nand Storage, some or all boot(hbr) logs are NOT saved!!!",
};

bool digit(char c) { return c >= '0' && c <= '9'; }

// n digits at p as a number, or -1.
int digits(const char* p, int n) {
    int v = 0;
    for (int i = 0; i < n; i++) {
        if (!digit(p[i])) return -1;
        v = v * 10 + (p[i] - '0');
    }
    return v;
}

int priority_of_letter(char c) {
    switch (c) {
        case 'F': return 2;
        case 'E': return 3;
        case 'W': return 4;
        case 'I': return 6;
        case 'D': return 7;
        case 'V': return PRIO_VERBOSE;
        default: return PRIO_NONE;
    }
}

}  // namespace

int64_t days_from_civil(int y, int m, int d) {
    y -= m <= 2;
    const int64_t era = (y >= 0 ? y : y - 399) / 400;
    const int64_t yoe = y - era * 400;
    const int64_t doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
    const int64_t doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + doe - 719468;
}

void civil_from_days(int64_t z, int* year, int* month, int* day) {
    z += 719468;
    const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
    const int64_t doe = z - era * 146097;
    const int64_t yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    const int64_t doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    const int64_t mp = (5 * doy + 2) / 153;
    *day = static_cast<int>(doy - (153 * mp + 2) / 5 + 1);
    *month = static_cast<int>(mp < 10 ? mp + 3 : mp - 9);
    *year = static_cast<int>(yoe + era * 400 + (*month <= 2));
}

bool parse_threadtime(std::string_view line, ParsedLine* out) {
    *out = ParsedLine();
    if (!line.empty() && line[0] == '-' && line.substr(0, kBeginning.size()) == kBeginning) {
        out->kind = KIND_MARKER;
        out->message = line;
        return true;
    }
    const char* p = line.data();
    const char* end = p + line.size();
    // The shortest line: "MM-DD HH:MM:SS.mmm 1 1 I : ".
    if (line.size() >= 5 && p[4] == '-' && digits(p, 4) >= 0) {
        out->year = digits(p, 4);
        p += 5;
    }
    if (end - p < 27 || p[2] != '-' || p[5] != ' ' || p[8] != ':' || p[11] != ':' || p[14] != '.') return false;
    out->month = digits(p, 2);
    out->day = digits(p + 3, 2);
    out->hour = digits(p + 6, 2);
    out->minute = digits(p + 9, 2);
    out->second = digits(p + 12, 2);
    if (out->month < 1 || out->month > 12 || out->day < 1 || out->day > 31 || out->hour < 0 || out->hour > 23 ||
        out->minute < 0 || out->minute > 59 || out->second < 0 || out->second > 60)
        return false;
    p += 15;
    int frac = 0, n = 0;
    for (; p < end && digit(*p) && n < 9; p++, n++) frac = frac * 10 + (*p - '0');
    if (n != 3 && n != 6 && n != 9) return false;
    for (; n < 9; n++) frac *= 10;
    out->nanos = frac;
    int32_t ids[2];
    for (int32_t& id : ids) {
        if (p >= end || *p != ' ') return false;
        while (p < end && *p == ' ') p++;
        int64_t v = 0;
        const char* start = p;
        for (; p < end && digit(*p) && p - start < 10; p++) v = v * 10 + (*p - '0');
        if (p == start || v > INT32_MAX) return false;
        id = static_cast<int32_t>(v);
    }
    if (end - p < 4 || p[0] != ' ' || p[2] != ' ') return false;
    char letter = p[1];
    if (letter < 'A' || letter > 'Z') return false;
    p += 3;
    // The tag is padded to 8 and followed by ": "; a tag may hold spaces.
    const char* colon = p;
    while ((colon = static_cast<const char*>(memchr(colon, ':', static_cast<size_t>(end - colon)))) != nullptr &&
           (colon + 1 == end || colon[1] != ' '))
        colon++;
    const char* tag_end;
    if (colon != nullptr) {
        tag_end = colon;
        out->message = std::string_view(tag_end + 2, static_cast<size_t>(end - tag_end - 2));
    } else if (end - p >= 1 && end[-1] == ':') {
        tag_end = end - 1;  // an empty message
    } else {
        return false;
    }
    const char* tag_last = tag_end;
    while (tag_last > p && tag_last[-1] == ' ') tag_last--;
    out->tag = std::string_view(p, static_cast<size_t>(tag_last - p));
    out->priority = static_cast<int8_t>(priority_of_letter(letter));
    out->pid = ids[0];
    out->tid = ids[1];
    out->has_local = true;
    out->kind = KIND_LINE;
    return true;
}

bool parse_kernel(std::string_view line, ParsedLine* out) {
    *out = ParsedLine();
    const char* p = line.data();
    const char* end = p + line.size();
    if (p >= end || *p != '<') return false;
    int level = 0, n = 0;
    for (p++; p < end && digit(*p) && n < 4; p++, n++) level = level * 10 + (*p - '0');
    if (n == 0 || p >= end || *p != '>') return false;
    p++;
    out->priority = static_cast<int8_t>(level & 7);  // facility * 8 + level
    if (p < end && *p == '[') {
        const char* q = p + 1;
        while (q < end && *q == ' ') q++;
        int64_t secs = 0;
        int sd = 0;
        for (; q < end && digit(*q) && sd < 12; q++, sd++) secs = secs * 10 + (*q - '0');
        int64_t frac = 0;
        int fd = 0;
        if (sd > 0 && q < end && *q == '.') {
            for (q++; q < end && digit(*q) && fd < 9; q++, fd++) frac = frac * 10 + (*q - '0');
        }
        if (sd > 0 && fd > 0 && q < end && *q == ']' && secs < MAX_TIME_S) {
            for (int i = fd; i < 9; i++) frac *= 10;
            out->uptime_ns = secs * 1000000000 + frac;
            p = q + 1;
            if (p < end && *p == ' ') p++;
        }
    }
    out->message = std::string_view(p, static_cast<size_t>(end - p));
    out->kind = KIND_LINE;
    return true;
}

bool parse_header(std::string_view line, std::string_view* zone) {
    if (line.empty() || line[0] != '-' || line.substr(0, kHeader.size()) != kHeader) return false;
    *zone = line.substr(kHeader.size());
    return true;
}

size_t note_start(std::string_view line) {
    if (line.substr(0, kNotePrefix.size()) == kNotePrefix) return 0;
    for (std::string_view note : kNotes) {
        if (line.size() > note.size() && line.substr(line.size() - note.size()) == note)
            return line.size() - note.size();
    }
    return std::string_view::npos;
}

const char* priority_name(int priority) {
    static const char* const names[] = {"emerg", "alert", "crit", "err", "warning",
                                        "notice", "info", "debug", "verbose"};
    return priority >= 0 && priority <= PRIO_VERBOSE ? names[priority] : "";
}

char priority_letter(int priority) {
    static const char letters[] = "FFFEWIIDV";
    return priority >= 0 && priority <= PRIO_VERBOSE ? letters[priority] : '-';
}

}  // namespace tavlolog
