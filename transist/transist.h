// The transist: collectors' streams on "log_socket" -> per-type queues (reader
// thread) -> rotated log files in the run folder (writer thread).
#pragma once

#include <pthread.h>
#include <stdint.h>

#include <atomic>

#include "common/log_types.h"

// What a run's transist is given when it starts.
struct TransistRun {
    const char* folder;        // the run folder, ending in '/'
    const char* trusted_root;  // the log path: below it nothing is opened through a link
    bool enabled[LOG_TYPE_COUNT];
    int rotate_kb;
};

// Values the writer hands to TransistHost::writer_gave_up.
constexpr uint64_t EVENT_STORAGE_LOW = 1001;
constexpr uint64_t EVENT_FOLDER_LOST = 1002;

// What the transist asks of, and tells, whoever runs it. Called from its threads.
class TransistHost {
  public:
    virtual ~TransistHost() = default;
    // The path whose file system must keep its reserve; it changes when a run moves.
    virtual const char* space_root() const = 0;
    // The writer stopped writing: every control client hears broadcast, then
    // the control loop is woken with event (EVENT_STORAGE_LOW or EVENT_FOLDER_LOST).
    virtual void writer_gave_up(const char* broadcast, uint64_t event) = 0;
    // Writes the refusal summaries held back (transist_records_flush and the
    // host's own); the reader calls it between polls. Returns the ms until it
    // should be called again, or -1 when nothing is held back.
    virtual int flush_records() = 0;
};

// The run's stop flag, polled by both transist threads. The controller sets it
// once the collectors have ended and clears it after joining both threads.
extern std::atomic<bool> stop_requested;

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
// starts the reader and writer threads. host lives as long as the run.
void transist_create(TransistHost* host, const TransistRun& run);

// Wakes both threads after stop_requested was set, so that the stop does not wait
// for a select time-out or a writer interval. Before they end, the reader reads
// what the collectors left in their connections and the writer writes every
// queued byte and syncs the files.
void transist_wake();

// In a freshly forked collector: closes the run's files, the collectors'
// connections and "log_socket", which the child must not keep alive.
void transist_close_in_child();

// Reopens the open output files in new_folder (below trusted_root) and sets the
// rotation limit.
void change_log_folder(const char* new_folder, const char* trusted_root, int new_rotate_kb);

// Writes the summary of refused "log_socket" clients held back. Returns the ms
// until it should be called again, or -1 when nothing is held back.
int transist_records_flush();
