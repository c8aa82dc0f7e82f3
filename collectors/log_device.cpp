// Per-device queues ordered by time.
#include "collectors/log_device.h"

void enqueue_entry(LogDevice* device, QueuedEntry* entry) {
    entry->prev = entry->next = nullptr;
    if (device->queue == nullptr) {
        device->queue = device->tail = entry;
        return;
    }
    for (QueuedEntry* e = device->tail; e != nullptr; e = e->prev) {
        if (compare_entry_time(entry->entry, e->entry) < 0) continue;
        entry->prev = e;
        entry->next = e->next;
        if (e->next != nullptr) {
            e->next->prev = entry;
        } else {
            device->tail = entry;
        }
        e->next = entry;
        return;
    }
    // Older than everything queued.
    entry->next = device->queue;
    device->queue->prev = entry;
    device->queue = entry;
}

QueuedEntry* dequeue_oldest(LogDevice* device) {
    QueuedEntry* oldest = device->queue;
    if (oldest == nullptr) return nullptr;
    device->queue = oldest->next;
    if (device->queue != nullptr) {
        device->queue->prev = nullptr;
    } else {
        device->tail = nullptr;
    }
    oldest->next = nullptr;
    return oldest;
}

LogDevice* choose_first_device(LogDevice* devices) {
    LogDevice* first = nullptr;
    for (LogDevice* d = devices; d != nullptr; d = d->next) {
        if (d->queue == nullptr) continue;
        if (first == nullptr || compare_entry_time(d->queue->entry, first->queue->entry) < 0) first = d;
    }
    return first;
}
