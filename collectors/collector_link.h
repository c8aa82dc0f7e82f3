// What every collector process shares: its link to the transist over
// "log_socket", its view of the run's control block, the stop signal and the
// exit routine that records why it ended.
#pragma once

#include <semaphore.h>
#include <signal.h>
#include <stddef.h>
#include <sys/types.h>

struct ControlBlock;

// Which family a collector belongs to: each writes its messages with its own
// tag and, for a few of them, its own wording.
enum CollectorKind { KIND_KERNEL = 0, KIND_ANDROID = 1, KIND_BT = 2 };

// The link fields of a collector object. Built on the child's stack by its fork
// wrapper and never destroyed: the process ends through _exit.
class CollectorLink {
  public:
    CollectorLink(CollectorKind kind, char type) : kind(kind), log_type(type) {}
    virtual ~CollectorLink() {}

    const CollectorKind kind;
    ControlBlock* shm = nullptr;  // mapped block, null until mapped
    int shm_fd = -1;              // the region's descriptor, handed over by the controller
    sem_t* sem = nullptr;         // the block's semaphore, null until mapped
    const char log_type;          // stream letter: "M", "R", "E", "K" or "B"
    int transist_fd = -1;         // connection to "log_socket"
    // Set by a collector that holds data it must still send when asked to
    // stop: the stop signal then only sets stop_signalled, and the collector
    // ends itself once it has sent what it holds.
    bool defer_stop_signal = false;
};

// The stop signal arrived while defer_stop_signal was set.
extern volatile sig_atomic_t stop_signalled;

// The running collector of this process, for the stop-signal handler.
extern CollectorLink* volatile current_collector;

// The daemon that forked this collector: the only process a collector accepts
// as the server of "log_socket". Set right after fork; 0 means the parent.
extern pid_t collector_daemon_pid;

// Pause between connection attempts; 1 s on the phone, shortened by tests.
extern unsigned int connect_retry_us;
// Pause after a failed wait; 1 s on the phone, shortened by tests.
extern unsigned int failed_wait_pause_us;

// Sets current_collector and installs on_stop_signal for SIGUSR1. Returns 0,
// or -1 (errno set) when the handler cannot be installed.
int install_stop_signal(CollectorLink* collector);

// Maps the block of collector->shm_fd, with its semaphore. Returns 1, or 0
// (errno set) when it cannot be mapped.
int attach_control_block(CollectorLink* collector);

// Connects to "log_socket" served by the daemon and sends log_type first.
// Returns 1; after five failed attempts the collector ends with status 1.
int connect_transist(CollectorLink* collector);

// Writes all len bytes to fd. Returns len, or -1 (recorded) when the connection
// failed before everything was written.
int send_to_transist(const char* buf, size_t len, int fd);

// True when the run asked its collectors to stop (the block's stop word).
bool stop_asked(CollectorLink* collector);

// Ends the collector (status 0, reason kept) when the run asked it to stop.
void check_stop(CollectorLink* collector);

// Marks the collector's slot as exited, stores reason when it is >= 0, and ends
// the process with status.
[[noreturn]] void exit_collector(CollectorLink* collector, int status, int reason);

// SIGUSR1: end with status 0 and REASON_SIGNAL (or, deferred, only note it).
void on_stop_signal(int sig);

// After a wait (select) failed with err, not EINTR: such a failure comes back
// at once, so rather than spin the collector records it (once per process)
// and pauses (failed_wait_pause_us) before it waits again, as the daemon's
// control loop does. The pause takes the stop signal as the wait does.
void back_off_after_failed_wait(CollectorLink* collector, int err, const sigset_t* wait_mask);

// Keeps SIGUSR1 blocked from now on and stores in wait_mask the mask to wait
// with (pselect), so the stop signal is only taken while the collector is
// parked in its wait and holds no lock of its own.
void hold_stop_signal(sigset_t* wait_mask);

// The block's semaphore, with a bounded wait: a process killed while holding
// it must not hang the others. Returns 1 when taken, 0 when the wait gave up
// (the caller then goes on without it; every shared word is a single int32).
int control_block_lock(sem_t* sem);
void control_block_unlock(sem_t* sem);
