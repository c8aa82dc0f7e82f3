// One entry of a run's merged timeline, as the reader hands it to every output
// (terminal, JSON Lines, HTML report, summary). Views point into the reader's
// buffers and are valid only until the next entry is read.
#pragma once

#include <cstdint>
#include <string_view>

namespace tavlolog {

// Lanes, in the order the run's files are merged on equal instants.
enum Source : uint8_t { SRC_KERNEL, SRC_MAIN, SRC_SYSTEM, SRC_RADIO, SRC_EVENTS, SRC_BT, SRC_COUNT };
constexpr char SOURCE_LETTER[SRC_COUNT + 1] = "KMSREB";

// One scale for the kernel's levels and Android's letters: 0 emerg .. 7 debug
// as the kernel has them, Android F=2, E=3, W=4, I=6, D=7, V=8.
constexpr int PRIO_VERBOSE = 8;
constexpr int PRIO_NONE = -1;  // Bluetooth bytes, markers and notes carry none

// Nanoseconds since the epoch (or since boot) fit 64 bits up to the year 2262:
// a time of more seconds, from a damaged file or folder name, gives no instant.
constexpr int64_t MAX_TIME_S = 9000000000;

enum Kind : uint8_t {
    KIND_LINE,       // a parsed log line
    KIND_MARKER,     // "--------- beginning of ..."
    KIND_NOTE,       // a held boot's note line ("TavloLog in Normal" and its kin)
    KIND_HEX,        // non-printable Bluetooth bytes, shown as a counted hex chunk
    KIND_MALFORMED,  // a line that did not parse, shown as it is with its file and offset
};

struct Entry {
    int64_t instant_ns;     // nanoseconds since the epoch (UTC) when has_instant
    // false: a kernel line of a run that lacks its boot's wall-clock time (then
    // uptime_ns holds its time since boot), Bluetooth bytes, and a marker or
    // note before its file's first timed line
    bool has_instant;
    int32_t utc_offset_s;   // the zone offset of the line's local time (RFC 3339 output)
    Source source;
    Kind kind;
    int8_t priority;        // see above
    int32_t pid, tid;       // -1 where the line has none
    std::string_view tag;
    std::string_view message;
    std::string_view file;  // the file's name within the run folder
    uint64_t offset;        // byte offset of the line in that file
    int boot;               // boot section: 0 the run itself, -1 the held boot before it, -2 ...
    std::string_view boot_name;  // the held piece's suffix ("boot", "hbr", ...), empty for the run
    // A marker, note or malformed line has no instant of its own: it takes that
    // of the line before it in its file, so that it stays in place.
    bool inherited = false;
    int64_t uptime_ns = -1;      // a kernel line's own time since boot, -1 when it has none
    std::string_view run;        // the run folder's name
};

// "emerg" .. "verbose", or "" for PRIO_NONE.
const char* priority_name(int priority);
// The Android letter of a priority (F E W I D V), '-' for none.
char priority_letter(int priority);

}  // namespace tavlolog
