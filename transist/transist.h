// The transist: collectors' streams on "log_socket" -> per-type queues (reader
// thread) -> rotated log files in the run folder (writer thread).
#pragma once

#include <pthread.h>

#include <atomic>

#include "common/limits.h"
#include "common/log_types.h"

class LogController;

#define LOG_SOCKET_NAME "log_socket"

struct LogFile {
    int fd;              // open output file, -1 when none; > 0 means open
    int sock;            // collector connection registered for the type, -1 when none
    int size;            // collector bytes written to the current file since it was opened
    char name[PATH_LEN];  // full path of the output file
};

// The run's stop flag, polled by both transist threads. The controller sets it
// once the collectors have ended and clears it after joining both threads.
extern std::atomic<bool> stop_requested;

// Process-wide table of output files, one entry per log type (file-table lock).
extern LogFile log_files[LOG_TYPE_COUNT];
// Listening socket of "log_socket", -1 when none. Kept from the first bind to
// the end of the process; collectors close their inherited copy.
extern int transist_listen_fd;
extern pthread_t read_thread_id;
extern pthread_t write_thread_id;

// Binds and listens on "log_socket" unless that is done already. An abstract
// name has no permissions: whoever binds it first serves it, so the daemon
// binds it once as it starts, before any app runs, and keeps it for all its
// runs. Returns 1 when it is served, 0 (recorded) when it cannot be.
int transist_listen();

// Starts the transist of a run: discards leftovers, opens the output files,
// starts the reader and writer threads.
void transist_create(LogController* controller, const char* run_folder, int rotate_kb);

// Wakes both threads after stop_requested was set, so that the stop does not wait
// for a select time-out or a writer interval. Before they end, the reader reads
// what the collectors left in their connections and the writer writes every
// queued byte and syncs the files.
void transist_wake();

// Reopens the open output files in new_folder and sets the rotation limit.
void change_log_folder(const char* new_folder, int new_rotate_kb);
