// Legacy logger entries into the platform library's header.
#include "collectors/logger_entry.h"

#include <stdlib.h>
#include <string.h>

static uint16_t le16(const char* p) {
    const unsigned char* b = reinterpret_cast<const unsigned char*>(p);
    return static_cast<uint16_t>(b[0] | (b[1] << 8));
}

static uint32_t le32(const char* p) {
    const unsigned char* b = reinterpret_cast<const unsigned char*>(p);
    return static_cast<uint32_t>(b[0]) | (static_cast<uint32_t>(b[1]) << 8) |
           (static_cast<uint32_t>(b[2]) << 16) | (static_cast<uint32_t>(b[3]) << 24);
}

static void put_le16(char* p, uint16_t v) {
    p[0] = static_cast<char>(v & 0xff);
    p[1] = static_cast<char>(v >> 8);
}

static void put_le32(char* p, uint32_t v) {
    for (int i = 0; i < 4; i++) p[i] = static_cast<char>((v >> (8 * i)) & 0xff);
}

// Freed blocks of ENTRY_BLOCK_SIZE bytes, linked through next. A collector
// process is single-threaded.
static QueuedEntry* pool = nullptr;
static int pool_count = 0;

static QueuedEntry* take_block() {
    QueuedEntry* block = pool;
    if (block == nullptr) return static_cast<QueuedEntry*>(malloc(ENTRY_BLOCK_SIZE));
    pool = block->next;
    pool_count--;
    return block;
}

void trim_entry_pool(int keep) {
    while (pool_count > keep) {
        QueuedEntry* block = pool;
        pool = block->next;
        pool_count--;
        free(block);
    }
}

QueuedEntry* adapt_legacy_entry(const char* raw, size_t n, log_id_t log_id) {
    if (n < LEGACY_HEADER_SIZE) return nullptr;
    size_t len = le16(raw);
    if (len > n - LEGACY_HEADER_SIZE) return nullptr;
    size_t size = offsetof(QueuedEntry, entry) + sizeof(logger_entry) + len + 1;
    QueuedEntry* queued = size <= ENTRY_BLOCK_SIZE ? take_block() : static_cast<QueuedEntry*>(malloc(size));
    if (queued == nullptr) return nullptr;
    queued->prev = nullptr;
    queued->next = nullptr;
    logger_entry& e = queued->entry;
    e.len = static_cast<uint16_t>(len);
    e.hdr_size = sizeof(logger_entry);
    e.pid = static_cast<int32_t>(le32(raw + 4));
    e.tid = le32(raw + 8);
    e.sec = le32(raw + 12);
    e.nsec = le32(raw + 16);
    e.lid = log_id;
    e.uid = 0;  // the legacy devices do not say
    memcpy(entry_payload(queued), raw + LEGACY_HEADER_SIZE, len);
    entry_payload(queued)[len] = '\0';
    return queued;
}

void free_queued_entry(QueuedEntry* queued) {
    if (queued != nullptr && queued_entry_size(queued) <= ENTRY_BLOCK_SIZE && pool_count < ENTRY_POOL_MAX) {
        queued->next = pool;
        pool = queued;
        pool_count++;
        return;
    }
    free(queued);
}

size_t make_legacy_text_entry(char* out, int32_t pid, int32_t tid, uint32_t sec, uint32_t nsec,
                              int priority, const char* tag, const char* message) {
    size_t tag_len = strlen(tag) + 1;
    size_t message_len = strlen(message) + 1;
    size_t len = 1 + tag_len + message_len;
    if (LEGACY_HEADER_SIZE + len > LOGGER_READ_MAX) return 0;
    put_le16(out, static_cast<uint16_t>(len));
    put_le16(out + 2, 0);
    put_le32(out + 4, static_cast<uint32_t>(pid));
    put_le32(out + 8, static_cast<uint32_t>(tid));
    put_le32(out + 12, sec);
    put_le32(out + 16, nsec);
    char* payload = out + LEGACY_HEADER_SIZE;
    payload[0] = static_cast<char>(priority);
    memcpy(payload + 1, tag, tag_len);
    memcpy(payload + 1 + tag_len, message, message_len);
    return LEGACY_HEADER_SIZE + len;
}

int compare_entry_time(const logger_entry& a, const logger_entry& b) {
    int32_t seconds = static_cast<int32_t>(a.sec - b.sec);
    if (seconds != 0) return seconds < 0 ? -1 : 1;
    int32_t nanos = static_cast<int32_t>(a.nsec - b.nsec);
    return nanos < 0 ? -1 : (nanos > 0 ? 1 : 0);
}
