// The logger devices an Android collector reads, each with its queue of
// entries ordered by time, and the choice of which entry goes out next.
#pragma once

#include "collectors/logger_entry.h"

struct LogDevice {
    char* device = nullptr;  // path, owned ("/dev/log/main", ...)
    bool binary = false;     // entries are binary events
    log_id_t log_id = LOG_ID_MAIN;
    int fd = -1;
    bool printed = false;           // its first entry was printed or dropped
    int single_reads = 0;           // passes left that read one entry only: it had no backlog
    QueuedEntry* queue = nullptr;   // oldest entry, null when empty
    QueuedEntry* tail = nullptr;    // newest entry (valid while queue is set)
    LogDevice* next = nullptr;      // next device of the collector, or null
};

// Puts entry into the device's queue after every entry that is not later than
// it: arrival order is kept among equal times. The walk starts at the newest
// entry, so entries arriving in time order cost one comparison.
void enqueue_entry(LogDevice* device, QueuedEntry* entry);

// Unlinks and returns the device's oldest entry (null when empty).
QueuedEntry* dequeue_oldest(LogDevice* device);

// Among the devices of the list, the one whose oldest entry is oldest; on
// equal times the earlier device of the list. Null when every queue is empty.
LogDevice* choose_first_device(LogDevice* devices);

inline bool holds_single_entry(const LogDevice* device) {
    return device->queue != nullptr && device->queue == device->tail;
}
