// The daemon's one controller: run options, paths, collector pids, the control
// clients and the flags that tie the boot paths, commands and supervision together.
#pragma once

#include <netinet/in.h>
#include <pthread.h>
#include <semaphore.h>
#include <stdint.h>
#include <sys/types.h>

#include <atomic>

#include "common/control_protocol.h"
#include "common/limits.h"
#include "common/log_types.h"

struct ConfigCache;
struct ControlBlock;

constexpr int MAX_CLIENTS = 10;

// Where the run's logs go, as far as the writer's free-space check is concerned.
enum LogPathState {
    LOG_PATH_UNKNOWN = -1,       // no run placed yet, or the run has ended
    LOG_PATH_HELD_IN_DATA = 0,   // a holding folder in /data
    LOG_PATH_UNDER_LOGPATH = 1,  // a run folder below the log path
};

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
    // The configured switch of each type's family (AndroidLog for main, radio
    // and events; KernelLog; BTLog), by log type.
    int log_on[LOG_TYPE_COUNT] = {};
    int listen_fd = 0;
    int warned = 0;
    // Written by the control thread during a copy or the kelm switch; read by
    // the transist's writer through current_log_root.
    std::atomic<LogPathState> log_path_state{LOG_PATH_UNKNOWN};
    // The daemon's own record of a live run, from start_logging to the end of
    // stop_logging. debug.TQ.running publishes it, but the shell can set that.
    bool run_active = false;
    pthread_mutex_t client_lock;  // guards clients; taken before reply_lock
    pthread_mutex_t reply_lock;   // serialises every write to clients
    // The run's collector of each log type, 0 when none runs.
    pid_t collector_pid[LOG_TYPE_COUNT] = {};
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
    // Non-blocking event counters: a collector ended (SIGCHLD), and the
    // transist's writer gave up (EVENT_STORAGE_LOW, EVENT_FOLDER_LOST).
    int efd_chld = -1;
    int efd_thread = -1;
    // Descriptor of the current run's shared control block; closed at stop.
    int shm_fd = -1;
    // 1 when the temporary-folder start found /data too full.
    int data_storage_low = 0;
};

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
