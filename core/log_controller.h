// The daemon's one controller: run options, paths, collector pids, the control
// clients and the flags that tie the boot paths, commands and supervision together.
#pragma once

#include <netinet/in.h>
#include <pthread.h>
#include <semaphore.h>
#include <stdint.h>
#include <sys/types.h>

#include "common/limits.h"

struct ConfigCache;
struct ControlBlock;

constexpr int MAX_CLIENTS = 10;

struct ClientSlot {
    int fd;                 // -1 when the slot is free
    unsigned char addr[16];  // peer address from accept, kept and cleared with the slot
};

class LogController {
  public:
    LogController();
    virtual ~LogController();

    void load_boot_options(ConfigCache& config);
    // The path whose file system the transist's writer checks for free space.
    const char* current_log_root() const;

    ControlBlock* shm = nullptr;
    sem_t* sem = nullptr;
    uint8_t boot_copy_timer = 0;
    int android_log = 0;
    int kernel_log = 0;
    int bt_log = 0;
    int listen_fd = 0;
    int warned = 0;
    // -1 nothing known, 0 a temporary folder in /data, 1 a folder under the log path.
    int log_path_state = -1;
    // The daemon's own record of a live run, from start_logging to the end of
    // stop_logging. debug.TQ.running publishes it, but the shell can set that.
    bool run_active = false;
    pthread_mutex_t client_lock;  // guards clients; taken before reply_lock
    pthread_mutex_t reply_lock;   // serialises every write to clients
    pid_t klog_pid = 0;
    pid_t mlog_pid = 0;
    pid_t rlog_pid = 0;
    pid_t elog_pid = 0;
    pid_t blog_pid = 0;
    int autostart = 0;
    int logsize = 0;
    int totallogsize = 0;
    int sd_log_path = 1;
    int rotate_size_kb = 0;
    int log_file_num = 0;
    char logpath[PATH_LEN] = {};
    char run_folder[PATH_LEN] = {};
    int boot_mode = 0;
    ClientSlot clients[MAX_CLIENTS];
};

// Non-blocking event counters: a collector ended (SIGCHLD), and the transist's
// writer gave up (1001 storage low, 1002 log folder lost).
extern int efd_chld;
extern int efd_thread;
// Descriptor of the current run's shared control block; closed at stop.
extern int shm_fd;
// 1 when the temporary-folder start found /data too full.
extern int data_storage_low;

// "1" while a logging run is active; the one record of the running state.
#define PROP_RUNNING "debug.TQ.running"
#define PROP_REALPATH "debug.TQ.realpath"
#define PROP_LOGSIZE "debug.TQ.logsize"
// Which collectors of the run are alive, in the fixed order of the log types:
// "main=up,radio=up,events=up,kernel=down,bt=off" (up: running; down: enabled
// but ended, or never started; off: not enabled for this run); "" while no run
// is active. Updated at run start, at each death and at stop.
#define PROP_COLLECTORS "debug.TQ.collectors"
// "SECONDS.NANOS": the wall-clock time at which the boot clock read zero, set at
// every run start and folder switch, so that the run's properties dump lets a
// reader give the kernel's lines (timed since boot) their wall-clock time.
#define PROP_BOOT_WALLCLOCK "debug.TQ.boot_wallclock"
// Set once a daemon of this boot has made /data/log_temp: a daemon restarted
// by init finds the same boot's held logs there and keeps them.
#define PROP_BOOTED "debug.TQ.booted"

// The size of a run in MB from a logsize value; one that is not a positive
// number is recorded and gives the default.
constexpr int DEFAULT_LOGSIZE_MB = 300;
int logsize_from(const char* value);

// atoi of debug.TQ.running (default "0") is not 0.
bool is_running();

// A run is live by the controller's own record, or as debug.TQ.running says.
bool run_live(const LogController* controller);
