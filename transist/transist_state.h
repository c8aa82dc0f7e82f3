// State shared by the transist's own files: tuning, the run's host, the
// file-table lock and the wake-ups between the controller, reader and writer.
// Not for use outside transist/ (and its tests).
#pragma once

#include <pthread.h>
#include <stdint.h>

#include <atomic>

#include "common/clock.h"

class TransistHost;

// Guards log_files (log_files.cpp). Taken before queue_lock, never after it.
extern pthread_mutex_t file_table_lock;

// Rotation limit in KB: written by the controller's thread, read by the writer.
extern std::atomic<int> rotate_limit_kb;
// Read once per run by transist_create, before the threads start.
extern int transist_capacity;    // node block size in bytes
extern int transist_interval;    // writer period in seconds
extern int transist_throughput;  // MB/s, only reported
extern TransistHost* transist_host;

// Cleared when the writer ends early (a file could not be reopened): the
// reader then drops data instead of queueing it for nobody.
extern std::atomic<bool> writer_running;

// A fill queue this large makes the reader stop taking data (collectors then
// wait in their socket writes) and asks the writer for a cycle at once, so a
// burst faster than the disk cannot grow the daemon's memory without bound.
constexpr int QUEUE_HIGH_WATER = 8 << 20;
// Set under queue_lock by the reader when it pauses; the writer's rotation
// sees it under the same lock and wakes the reader.
extern bool reader_paused;

// Readable when the reader should look at its flags again (stop, resume).
// Only the reader consumes it.
extern int reader_wake_fd;
void wake_reader();

// The writer's interruptible sleep: returns early on stop or on a kick.
void writer_sleep_us(int64_t usec);

// While nothing flows the writer keeps no clock: it sets writer_idle (under
// queue_lock, having seen the fill queue empty) and waits in writer_idle_wait
// until the reader queues data (the reader clears the flag under the same
// lock and calls wake_idle_writer), a kick or the stop. Returns true when it
// was kicked.
extern bool writer_idle;
bool writer_idle_wait();
void wake_idle_writer();
// Asks the writer for a cycle now (the reader paused on a full queue).
void kick_writer();
// Called once by the reader as it ends; the writer waits for it at stop.
void mark_reader_done();
// Waits up to ms for mark_reader_done; returns true when the reader is done.
bool wait_reader_done(int ms);

int64_t monotonic_us();

void* read_thread(void*);
void* write_thread(void*);

// Sanitised tuning values; each records what it replaced.
int choose_capacity(const char* value);
int choose_interval(const char* value);
