// Records that other processes can trigger at will (a refused connection, a
// planted link) must not let them fill /data through the history. Each such
// record site owns a RecordLimit: the first record is written; later ones
// within the window are only counted, and one summary with that count is
// written when the window has passed (by the next record, or by
// record_limit_flush from a loop that waits anyway).
//
//   static RecordLimit refused = RECORD_LIMIT(TAG_MAIN, "refused clients");
//   HLOG_LIMITED(refused, TAG_MAIN, WLOG_WARN, "refuse client uid %d", uid);
//
// Lock-free, so usable from any thread and in a forked child.
#pragma once

#include <atomic>

#include "record/record.h"

constexpr int RECORD_LIMIT_MS = 5000;

struct RecordLimit {
    wlog_record summary;  // one %d: the count of records not written
    int window_ms;
    std::atomic<long long> next_ms;  // monotonic time before which records are only counted
    std::atomic<int> held;           // records counted and not written since the last summary
};

#define RECORD_LIMIT(tag, what) \
    {{tag, "%d more " what " not recorded", WLOG_WARN}, RECORD_LIMIT_MS, {0}, {0}}

// True when the caller may write its record now. Writes the summary of the
// records held back before, if any.
bool record_limit_pass(RecordLimit* limit);

// Writes the summary once the window has passed. Returns the milliseconds
// until it should be called again while records are held back, else -1.
int record_limit_flush(RecordLimit* limit);

// HLOG, within the limit.
#define HLOG_LIMITED(limit, tag, prio, fmt, ...)                             \
    do {                                                                     \
        if (record_limit_pass(&(limit))) HLOG(tag, prio, fmt, ##__VA_ARGS__); \
    } while (0)
