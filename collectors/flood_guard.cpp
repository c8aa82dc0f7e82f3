// Per-writer byte budgets for the Android collectors.
#include "collectors/flood_guard.h"

#include <string.h>

void FloodGuard::set_budget(long bytes_per_second) {
    budget_ = bytes_per_second > 0 ? bytes_per_second : 0;
}

FloodGuard::Writer* FloodGuard::find_or_take(int32_t pid, int64_t now_us) {
    Writer* idle = nullptr;
    for (Writer& w : writers_) {
        if (w.used && w.pid == pid) return &w;
        if (w.used && w.drops.entries != 0) continue;  // its drops must still be told
        if (idle == nullptr || !w.used || (idle->used && w.last_us < idle->last_us)) idle = &w;
    }
    if (idle == nullptr) return nullptr;
    *idle = {};
    idle->used = true;
    idle->pid = pid;
    idle->tokens = static_cast<int64_t>(budget_) * FLOOD_BURST_SECONDS * 1000000;
    idle->last_us = now_us;
    return idle;
}

bool FloodGuard::admit(int32_t pid, const char* tag, size_t bytes, int64_t now_us) {
    if (budget_ == 0) return true;
    Writer* w = find_or_take(pid, now_us);
    if (w == nullptr) return true;  // every slot holds untold drops: keep rather than lose silently
    const int64_t full = static_cast<int64_t>(budget_) * FLOOD_BURST_SECONDS * 1000000;
    int64_t elapsed = now_us - w->last_us;
    if (elapsed > 0) {
        // Past a full bucket's refill time the product could only overflow.
        w->tokens = elapsed >= FLOOD_BURST_SECONDS * 1000000LL ? full : w->tokens + elapsed * budget_;
        if (w->tokens > full) w->tokens = full;
        w->last_us = now_us;
    }
    int64_t cost = static_cast<int64_t>(bytes) * 1000000;
    if (w->tokens >= cost) {
        w->tokens -= cost;
        return true;
    }
    w->drops.pid = pid;
    w->drops.entries++;
    w->drops.bytes += static_cast<long>(bytes);
    size_t n = strnlen(tag, FLOOD_TAG_LEN - 1);
    memcpy(w->drops.tag, tag, n);
    w->drops.tag[n] = '\0';
    if (summary_at_us_ < 0) summary_at_us_ = now_us + FLOOD_SUMMARY_US;
    return false;
}

bool FloodGuard::take_drops(FloodDrops* out) {
    for (Writer& w : writers_) {
        if (!w.used || w.drops.entries == 0) continue;
        *out = w.drops;
        w.drops = {};
        return true;
    }
    summary_at_us_ = -1;
    return false;
}

bool FloodGuard::next_summary(int64_t now_us, FloodDrops* out) {
    if (summary_at_us_ < 0 || now_us < summary_at_us_) return false;
    if (take_drops(out)) return true;
    return false;
}

bool FloodGuard::next_summary_now(FloodDrops* out) { return take_drops(out); }

int FloodGuard::summary_due_ms(int64_t now_us) const {
    if (summary_at_us_ < 0) return -1;
    if (now_us >= summary_at_us_) return 0;
    return static_cast<int>((summary_at_us_ - now_us + 999) / 1000);
}
