// The writer side of the transist: periodic role rotation, flushing queues to
// the log files, and the storage-low and folder-lost notifications.
#pragma once

#include <stdint.h>

class LogController;
struct TransistQueue;

// Values added to efd_thread for the controller.
constexpr uint64_t EVENT_STORAGE_LOW = 1001;
constexpr uint64_t EVENT_FOLDER_LOST = 1002;

// The storage gate of each cycle: 1 when is_low says the controller's current
// log root is short of space (recorded; with notify, "storage_full" goes to
// every control client and 1001 to efd_thread), 0 when writing may go on.
int writer_storage_blocked(LogController* controller, int (*is_low)(const char*), bool notify);

// Writes q's nodes to the open files in type order, rotating as they grow.
// Caller holds file_table_lock. Returns the bytes written; FLUSH_FOLDER_LOST
// when a file had disappeared (recorded; with notify, "log_folder_lost" to the
// clients and 1002 to efd_thread), FLUSH_REOPEN_FAILED when a rotated file
// could not be reopened, FLUSH_STORAGE_LOW when the files' file system came
// down to the 10 MiB reserve (recorded; with notify, "storage_full" and
// 1001). Unwritten nodes stay in q.
constexpr int FLUSH_FOLDER_LOST = -1;
constexpr int FLUSH_REOPEN_FAILED = -2;
constexpr int FLUSH_STORAGE_LOW = -3;
int flush_one_queue(TransistQueue* q, bool notify);

// Free bytes of the file system of a log file (get_free_space); tests put a
// model of a small card here.
extern uint64_t (*writer_free_space)(const char* path);

// flush_one_queue of the drain queue under file_table_lock.
int flush_queue();
