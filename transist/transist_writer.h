// The writer side of the transist: periodic role rotation, flushing queues to
// the log files, and the storage-low and folder-lost notifications.
#pragma once

#include <stdint.h>

class TransistHost;
struct TransistQueue;

// The storage gate of each cycle: 1 when is_low says the host's space root is
// short of space (recorded; with notify, the host hears "storage_full" and
// EVENT_STORAGE_LOW), 0 when writing may go on.
int writer_storage_blocked(TransistHost* host, int (*is_low)(const char*), bool notify);

// Writes q's nodes to the open files in type order, rotating as they grow.
// Caller holds file_table_lock. Returns the bytes written; FLUSH_FOLDER_LOST
// when a file had disappeared (recorded; with notify, "log_folder_lost" and
// EVENT_FOLDER_LOST to the host), FLUSH_REOPEN_FAILED when a rotated file
// could not be reopened, FLUSH_STORAGE_LOW when the files' file system came
// down to the 10 MiB reserve (recorded; with notify, "storage_full" and
// EVENT_STORAGE_LOW). Unwritten nodes stay in q.
constexpr int FLUSH_FOLDER_LOST = -1;
constexpr int FLUSH_REOPEN_FAILED = -2;
constexpr int FLUSH_STORAGE_LOW = -3;
int flush_one_queue(TransistQueue* q, bool notify);

// Free bytes of the file system of a log file (get_free_space); tests put a
// model of a small card here.
extern uint64_t (*writer_free_space)(const char* path);

// flush_one_queue of the drain queue under file_table_lock.
int flush_queue();
