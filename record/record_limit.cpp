#include "record/record_limit.h"

#include "common/clock.h"

// Opens a new window when the current one has passed; the caller that wins
// the exchange writes the summary (and its own record).
static bool take_window(RecordLimit* limit, long long now) {
    long long next = limit->next_ms.load();
    if (now < next) return false;
    return limit->next_ms.compare_exchange_strong(next, now + limit->window_ms);
}

static void write_summary(RecordLimit* limit) {
    int held = limit->held.exchange(0);
    if (held > 0) hlog_emit(&limit->summary, held);
}

bool record_limit_pass(RecordLimit* limit) {
    if (!take_window(limit, monotonic_ms())) {
        limit->held.fetch_add(1);
        return false;
    }
    write_summary(limit);
    return true;
}

int record_limit_flush(RecordLimit* limit) {
    if (limit->held.load() == 0) return -1;
    long long now = monotonic_ms();
    long long left = limit->next_ms.load() - now;
    if (left > 0) return static_cast<int>(left);
    if (take_window(limit, now)) write_summary(limit);
    return limit->held.load() == 0 ? -1 : limit->window_ms;
}
