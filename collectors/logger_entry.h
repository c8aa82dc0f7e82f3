// One entry of a logger device as the Android collector holds it while it
// waits to be merged in time order.
//
// The phone's logger devices hand out entries with the legacy 20-byte header
// (payload length, padding, pid, tid, seconds, nanoseconds). The platform log
// library decodes only its own, longer header, so each entry is moved into that
// header once, here, when it is queued; everything after this sees only the
// library's form.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <android/log.h>
#include <log/log_read.h>

// The legacy header, little-endian, as it lies at the start of each read.
constexpr size_t LEGACY_HEADER_SIZE = 20;
// One read from a logger device returns at most this many bytes.
constexpr size_t LOGGER_READ_MAX = 5 * 1024;

struct QueuedEntry {
    QueuedEntry* prev;  // next older entry of the same device, or null
    QueuedEntry* next;  // next newer entry of the same device, or null
    // In the library's header; the payload follows it in the same block,
    // then one zero byte.
    logger_entry entry;
};

// The entry's payload (right after its header).
inline char* entry_payload(QueuedEntry* queued) {
    return reinterpret_cast<char*>(&queued->entry) + sizeof(logger_entry);
}

// Makes a queued entry from one entry's bytes as read from a legacy device, in
// a block sized to its payload. Returns null when the bytes are not a whole
// entry (shorter than the header, or than the payload length it states) or
// when memory is short; bytes beyond the stated length are ignored.
QueuedEntry* adapt_legacy_entry(const char* raw, size_t n, log_id_t log_id);

void free_queued_entry(QueuedEntry* queued);

// Entries of up to this many bytes (queued_entry_size; nearly all of them)
// take a block of this size from a pool of freed blocks instead of the
// allocator: most entries live a few milliseconds, and the pool is bounded
// by the most that are held at once (the overload's count), so it is
// allocated once, not per entry.
constexpr size_t ENTRY_BLOCK_SIZE = 192;
constexpr int ENTRY_POOL_MAX = 10000;
// Once the collector is quiet, the pool keeps this many blocks: a burst's
// memory goes back.
constexpr int ENTRY_POOL_QUIET = 256;

// Frees pooled blocks beyond keep.
void trim_entry_pool(int keep);

// Bytes of the entry's block: what holding it costs.
inline size_t queued_entry_size(const QueuedEntry* queued) {
    return offsetof(QueuedEntry, entry) + sizeof(logger_entry) + queued->entry.len + 1;
}

// Writes the legacy bytes of a text entry (priority, tag, message) into out,
// which has room for LOGGER_READ_MAX bytes; returns their count, or 0 when the
// text does not fit.
size_t make_legacy_text_entry(char* out, int32_t pid, int32_t tid, uint32_t sec, uint32_t nsec,
                              int priority, const char* tag, const char* message);

// Order of two entries by time: seconds, then nanoseconds, each compared as
// the signed difference of the two 32-bit values. Negative when a is older.
int compare_entry_time(const logger_entry& a, const logger_entry& b);
