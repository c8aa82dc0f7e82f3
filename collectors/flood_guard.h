// The option against a flooding app: any app can write its logger device as
// fast as it likes, and within seconds every other writer's entries would be
// rotated out of the run's files. With a budget set, each writer (pid) may log
// that many bytes per second, sustained; what it writes beyond is dropped and
// counted, and once a second one line per such writer says how many entries
// and bytes of which pid and tag were dropped. Other writers are never dropped
// for it. Off by default: every entry is kept.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include "common/control_protocol.h"


// A writer may use this many seconds of its budget at once (a burst).
constexpr int FLOOD_BURST_SECONDS = 2;
// Writers followed at once; past that, the one idle longest is forgotten
// (unless it has drops not yet reported; then a new writer is let through).
constexpr int FLOOD_WRITERS = 64;
constexpr int FLOOD_TAG_LEN = 32;
constexpr int64_t FLOOD_SUMMARY_US = 1000000;

// What one writer had dropped since its last summary.
struct FloodDrops {
    int32_t pid;
    char tag[FLOOD_TAG_LEN];  // of its latest dropped entry
    long entries;
    long bytes;
};

class FloodGuard {
  public:
    // Bytes per second per pid; 0 turns it off.
    void set_budget(long bytes_per_second);
    long budget() const { return budget_; }

    // Whether an entry of `bytes` from pid may be kept at now_us (a
    // monotonic clock). A dropped one is counted under its tag.
    bool admit(int32_t pid, const char* tag, size_t bytes, int64_t now_us);

    // Once a second after the first drop: the drops of one writer at a time,
    // true while there is one to report at now_us.
    bool next_summary(int64_t now_us, FloodDrops* out);
    // Every drop not reported yet, whatever the time (the collector ends).
    bool next_summary_now(FloodDrops* out);

    // Milliseconds until a summary is due, -1 when no drop waits.
    int summary_due_ms(int64_t now_us) const;

  private:
    struct Writer {
        int32_t pid;
        bool used;
        int64_t tokens;   // budget left, in bytes * 1,000,000
        int64_t last_us;  // tokens counted up to here
        FloodDrops drops;
    };
    Writer* find_or_take(int32_t pid, int64_t now_us);
    bool take_drops(FloodDrops* out);

    long budget_ = 0;
    Writer writers_[FLOOD_WRITERS] = {};
    int64_t summary_at_us_ = -1;  // -1 while nothing was dropped
};
