// Starting, stopping and moving a logging run.
#include "core/logging_run.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <pthread.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cutils/ashmem.h>

#include "collectors/collector_link.h"
#include "collectors/control_block.h"
#include "collectors/fork_collectors.h"
#include "common/io_util.h"
#include "common/unique_fd.h"
#include "common/wlog.h"
#include "config/log_path.h"
#include "core/child_supervision.h"
#include "core/log_controller.h"
#include "platform/properties.h"
#include "storage/folder_records.h"
#include "storage/history_log.h"
#include "storage/record_limit.h"
#include "storage/safe_file.h"
#include "transist/transist.h"

#define RUN_FOLDER_ROOT "/qrvlog/tavlolog/"
#define RUN_FOLDER_PATTERN "APLog_%Y_%m%d_%H%M%S/"

// Every run folder below a usable log path can be published in a property.
static_assert(LOG_PATH_MAX_LEN + sizeof(RUN_FOLDER_ROOT "APLog_2026_0304_070649/") - 1 == PROP_VALUE_LEN - 1,
              "log path limit and run folder name disagree");

constexpr useconds_t STOP_STEP_US = 100000;
// Polls of `exited` after SIGUSR1: the collectors get at most 0.9 s.
constexpr int STOP_POLLS = 9;
// How long a killed collector may take to be gone, polled every 5 ms.
constexpr int KILL_WAIT_POLLS = 20;
constexpr useconds_t KILL_WAIT_STEP_US = 5000;

void compose_run_folder(LogController* controller) {
    char name[PATH_LEN - 1] = {};
    time_t now = time(nullptr);
    struct tm local;
    localtime_r(&now, &local);
    strftime(name, sizeof(name), RUN_FOLDER_PATTERN, &local);
    int len = snprintf(controller->run_folder, sizeof(controller->run_folder), "%s" RUN_FOLDER_ROOT "%s",
                       controller->logpath, name);
    if (len < 0 || len >= PATH_LEN) {
        // A cut name would be some other folder; an empty one is refused by
        // create_run_folder.
        HLOG(TAG_MAIN, WLOG_ERROR, "run folder under %.64s... does not fit %d characters",
             controller->logpath, PATH_LEN - 1);
        controller->run_folder[0] = '\0';
        return;
    }
    HLOG(TAG_MAIN, WLOG_INFO, "full path is:%s", controller->run_folder);
}

// Any app that can write the card can plant links there, as often as it likes.
static RecordLimit removed_links = RECORD_LIMIT(TAG_MAIN, "removed links");

// A link where the daemon's own folders ("qrvlog", "tavlolog") belong would be
// refused, and so block every run until someone removed it: the link itself
// goes (never what it points to), and the folder is made in its place.
static void remove_planted_links(const char* base, const char* folder) {
    size_t base_len = strlen(base);
    while (base_len > 0 && base[base_len - 1] == '/') base_len--;
    char own[PATH_LEN];
    int own_len = snprintf(own, sizeof(own), "%.*s" RUN_FOLDER_ROOT, static_cast<int>(base_len), base);
    if (own_len < 0 || own_len >= PATH_LEN || strncmp(folder, own, static_cast<size_t>(own_len)) != 0) return;
    // The base is trusted as it stands, links and all.
    UniqueFd dir(RETRY_EINTR(open(base_len == 0 ? "/" : base, O_PATH | O_DIRECTORY | O_CLOEXEC)));
    size_t shown_len = base_len;
    static const char* const OWN_FOLDERS[] = {"qrvlog", "tavlolog"};
    for (const char* name : OWN_FOLDERS) {
        shown_len += 1 + strlen(name);
        struct stat st;
        if (!dir.ok() || fstatat(dir.get(), name, &st, AT_SYMLINK_NOFOLLOW) != 0) return;
        if (S_ISLNK(st.st_mode)) {
            if (safe_remove_file(dir.get(), name) == 0) {
                HLOG_LIMITED(removed_links, TAG_MAIN, WLOG_WARN, "%.*s is a symbolic link, removed",
                             static_cast<int>(shown_len), own);
            } else {
                int err = errno;
                HLOG_LIMITED(removed_links, TAG_MAIN, WLOG_ERROR, "remove link %.*s failed(%s)",
                             static_cast<int>(shown_len), own, strerror(err));
            }
            return;
        }
        dir.reset(RETRY_EINTR(openat(dir.get(), name, O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC)));
    }
}

int create_run_folder(LogController* controller, const char* base, const char* path) {
    char folder[PATH_LEN];
    size_t len = strnlen(path, PATH_LEN);
    bool needs_slash = len == 0 || path[len - 1] != '/';
    if (len + (needs_slash ? 1 : 0) >= static_cast<size_t>(PATH_LEN)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %.64s... refused: longer than %d characters", path,
             PATH_LEN - 1);
        errno = ENAMETOOLONG;
        return -1;
    }
    memcpy(folder, path, len);
    if (needs_slash) folder[len++] = '/';
    folder[len] = '\0';

    remove_planted_links(base, folder);
    // base is trusted as it stands (a log path may be a link); below it an
    // app that can write the card may have planted links: none is followed.
    char failed_at[PATH_LEN];
    UniqueFd dir(path[0] == '\0' ? -1 : safe_open_dir(base, folder, true, 0770, failed_at));
    if (!dir.ok()) {
        int err = path[0] == '\0' ? EINVAL : errno;
        if (err == EINVAL && failed_at[0] == '\0') {
            HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %s refused: not under %s", folder, base);
            errno = EINVAL;
            return -1;
        }
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %s fails, errno:%s(%d)", failed_at, strerror(err), err);
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %s fails at last", folder);
        errno = err;  // the records may have changed it; the caller reports it
        return -1;
    }
    HLOG(TAG_MAIN, WLOG_INFO, "mkdir %s success", folder);
    if (strcmp(base, "/data") != 0) {
        update_folder_records(base, folder, controller->sd_log_path, controller->totallogsize,
                              controller->logsize);
    }
    return 1;
}

int calc_rotate_size(LogController* controller, int megabytes) {
    if (controller->log_file_num <= 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "Invalid log file num:%d", controller->log_file_num);
        return 0;
    }
    if (megabytes < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "Invalid log size:%d", megabytes);
        return 0;
    }
    // 64-bit: a large configured size must not wrap into a negative limit.
    int64_t kb = static_cast<int64_t>(megabytes) * 1024 / controller->log_file_num;
    return kb > INT_MAX ? INT_MAX : static_cast<int>(kb);
}

// The kernel stamps its lines with its clock since boot, which stops while the
// phone sleeps as CLOCK_MONOTONIC does; taken again at each run start and
// folder switch, the value follows a changed wall clock or a sleep from then on.
static void publish_boot_wallclock() {
    struct timespec real, boot;
    clock_gettime(CLOCK_REALTIME, &real);
    clock_gettime(CLOCK_MONOTONIC, &boot);
    int64_t ns = (static_cast<int64_t>(real.tv_sec) - boot.tv_sec) * 1000000000 + (real.tv_nsec - boot.tv_nsec);
    char value[32];
    snprintf(value, sizeof(value), "%lld.%09lld", static_cast<long long>(ns / 1000000000),
             static_cast<long long>(ns % 1000000000));
    property_set(PROP_BOOT_WALLCLOCK, value);
}

static void set_logsize_property(int rotate_kb) {
    char value[10];
    snprintf(value, sizeof(value), "%d", rotate_kb);
    property_set(PROP_LOGSIZE, value);
}

// Unmaps what the previous run left of its block. The semaphore inside needs no
// removal: it goes with the region once the last collector has let go of it.
static void release_control_block(LogController* controller) {
    if (controller->shm != nullptr) {
        munmap(controller->shm, CONTROL_BLOCK_SIZE);
        controller->shm = nullptr;
    }
    controller->sem = nullptr;
}

static void create_control_block(LogController* controller) {
    release_control_block(controller);
    shm_fd = ashmem_create_region(CONTROL_BLOCK_NAME, CONTROL_BLOCK_SIZE);
    if (shm_fd < 0) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "ashmem create failed!errno:%s(%d)", strerror(err), err);
        exit(1);
    }
    void* map = mmap(nullptr, CONTROL_BLOCK_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, shm_fd, 0);
    if (map == MAP_FAILED) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "mmap shared memory failed!errno:%s(%d)", strerror(err), err);
        exit(1);
    }
    // Each run has a fresh region, so a collector of an earlier run that died
    // holding the semaphore cannot hold this one.
    ControlBlock* block = static_cast<ControlBlock*>(map);
    if (control_block_init(block) != 0) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "sem_init %s failed!errno:%s(%d)", CONTROL_SEM_NAME, strerror(err),
             err);
        exit(1);
    }
    controller->shm = block;
    controller->sem = control_sem(block);
    WLOG(TAG_MAIN, WLOG_DEBUG, "create shared memory ok!");
}

void publish_collectors(const LogController* controller) {
    const struct {
        const char* name;
        int enabled;
        pid_t pid;
    } collectors[LOG_TYPE_COUNT] = {
        {"main", controller->android_log, controller->mlog_pid},
        {"radio", controller->android_log, controller->rlog_pid},
        {"events", controller->android_log, controller->elog_pid},
        {"kernel", controller->kernel_log, controller->klog_pid},
        {"bt", controller->bt_log, controller->blog_pid},
    };
    char value[PROPERTY_VALUE_MAX] = {};  // at most 52 characters
    size_t used = 0;
    for (const auto& c : collectors) {
        const char* state = !c.enabled ? "off" : c.pid != 0 ? "up" : "down";
        int n = snprintf(value + used, sizeof(value) - used, "%s%s=%s", used ? "," : "", c.name, state);
        if (n > 0) used += static_cast<size_t>(n);
    }
    property_set(PROP_COLLECTORS, value);
}

static void mark_not_started(LogController* controller, int slot) {
    controller->shm->slots[slot].exited = 1;
}

void start_logging(LogController* controller) {
    struct sigaction sa;
    memset(&sa, 0, sizeof(sa));
    sa.sa_handler = sigchld_handler;
    sa.sa_flags = SA_RESTART | SA_NOCLDSTOP;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGCHLD, &sa, nullptr);

    if (controller->boot_mode == 0) oru_mode_on();
    publish_boot_wallclock();
    set_logsize_property(controller->rotate_size_kb);
    property_set(PROP_RUNNING, "1");
    controller->run_active = true;

    transist_create(controller, controller->run_folder, controller->rotate_size_kb);
    create_control_block(controller);

    if (controller->android_log) {
        fork_main_log(controller, shm_fd);
        fork_radio_log(controller, shm_fd);
        fork_events_log(controller, shm_fd);
    } else {
        mark_not_started(controller, SLOT_MAIN);
        mark_not_started(controller, SLOT_RADIO);
        mark_not_started(controller, SLOT_EVENTS);
    }
    if (controller->kernel_log) {
        fork_kernel_log(controller, shm_fd);
    } else {
        mark_not_started(controller, SLOT_KERNEL);
    }
    if (controller->bt_log) {
        fork_bt_log(controller, shm_fd);
    } else {
        mark_not_started(controller, SLOT_BT);
    }

    HLOG(TAG_MAIN, WLOG_INFO, "M(%d),R(%d),E(%d),K(%d),B(%d)", controller->mlog_pid,
         controller->rlog_pid, controller->elog_pid, controller->klog_pid, controller->blog_pid);
    publish_collectors(controller);
}

static bool all_collectors_exited(const LogController* controller) {
    for (int slot = SLOT_MAIN; slot <= SLOT_BT; slot++) {
        if (__atomic_load_n(&controller->shm->slots[slot].exited, __ATOMIC_SEQ_CST) == 0) return false;
    }
    return true;
}

// True once pid has ended (reaped now, or already gone). A zombie has closed
// its descriptors, which is what the stop waits for.
static bool child_gone(pid_t pid) {
    pid_t rc = waitpid(pid, nullptr, WNOHANG);
    return rc != 0;
}

// SIGKILL to every collector still running, then wait (bounded) until they are
// gone, so that their connections are closed before the transist drains them.
static void kill_collectors(LogController* controller) {
    pid_t pids[LOG_TYPE_COUNT] = {controller->mlog_pid, controller->rlog_pid, controller->elog_pid,
                                  controller->klog_pid, controller->blog_pid};
    signal_children(controller, SIGKILL);
    for (int poll = 0; poll < KILL_WAIT_POLLS; poll++) {
        bool all_gone = true;
        for (pid_t& pid : pids) {
            if (pid > 0 && child_gone(pid)) pid = 0;
            if (pid > 0) all_gone = false;
        }
        if (all_gone) return;
        usleep(KILL_WAIT_STEP_US);
    }
}

static void join_transist_thread(pthread_t* thread, const char* which) {
    void* result = nullptr;
    // A thread the transist could not create has the zero handle; joining it
    // (or joining one twice) would crash the daemon.
    int rc = pthread_equal(*thread, pthread_t()) ? ESRCH : pthread_join(*thread, &result);
    *thread = pthread_t();
    if (rc != 0) {
        if (strcmp(which, "read") == 0) {
            HLOG(TAG_MAIN, WLOG_ERROR, "cannot join with read thread (%s)%d", strerror(rc), rc);
        } else {
            HLOG(TAG_MAIN, WLOG_ERROR, "cannot join with write thread (%s)%d", strerror(rc), rc);
        }
        return;
    }
    int value = static_cast<int>(reinterpret_cast<intptr_t>(result));
    if (strcmp(which, "read") == 0) {
        HLOG(TAG_MAIN, WLOG_INFO, "read thread exit %d", value);
    } else {
        HLOG(TAG_MAIN, WLOG_INFO, "write thread exit %d", value);
    }
}

// A notice the writer sent while the run was stopping belongs to that run;
// left in the counter it would stop the next run as soon as it starts.
static void discard_stale_notices() {
    uint64_t stale;
    while (efd_thread >= 0 && RETRY_EINTR(read(efd_thread, &stale, sizeof(stale))) > 0) {
    }
}

void stop_logging(LogController* controller) {
    // The collectors ended below are reaped by the system and start no check.
    // One that died before (its notice not handled yet) is still a zombie,
    // which the system leaves: it is reaped here with its record, not
    // silently by the signalling below.
    signal(SIGCHLD, SIG_IGN);
    reap_children();
    // The daemon's own record decides: the property may have been set by hand.
    if (!controller->run_active) {
        controller->log_path_state = -1;
        HLOG(TAG_MAIN, WLOG_ERROR, "tavlolog already stopped, ignore this stop");
        if (is_running()) property_set(PROP_RUNNING, "0");
        return;
    }
    property_set(PROP_RUNNING, "0");
    property_set(PROP_COLLECTORS, "");

    if (controller->shm != nullptr) {
        int locked = control_block_lock(controller->sem);
        __atomic_store_n(&control_stop(controller->shm), 1, __ATOMIC_SEQ_CST);
        if (locked) control_block_unlock(controller->sem);
    }
    usleep(STOP_STEP_US);
    signal_children(controller, SIGUSR1);
    for (int poll = 0; poll < STOP_POLLS; poll++) {
        usleep(STOP_STEP_US);
        if (controller->shm == nullptr || all_collectors_exited(controller)) break;
    }
    kill_collectors(controller);
    controller->warned = 0;
    if (shm_fd > 0) close(shm_fd);
    shm_fd = -1;
    release_control_block(controller);

    // Only now that no collector can write any more may the transist finish:
    // it reads the connections to their end and writes every queued byte.
    stop_requested = true;
    transist_wake();
    join_transist_thread(&read_thread_id, "read");
    join_transist_thread(&write_thread_id, "write");
    stop_requested = false;
    controller->run_active = false;
    // Only now: until the writer has ended it must check the free space of
    // the run's own root (/data for a run held there), not the card's.
    controller->log_path_state = -1;
    discard_stale_notices();
    HLOG(TAG_MAIN, WLOG_INFO, "tavlolog stop done");
}

void publish_run_folder(LogController* controller, const char* path) {
    // The history opens the run's file below the part of the path trusted as it stands.
    set_run_folder_root(controller->logpath);
    if (property_set(PROP_REALPATH, path) == 0) return;
    // A folder longer than a property value can hold: the run's history records
    // must not go on landing in the previous run's folder.
    property_set(PROP_REALPATH, "");
    HLOG(TAG_MAIN, WLOG_ERROR, "set %s to %s failed", PROP_REALPATH, path);
}

void switch_run_folder(LogController* controller, const char* path) {
    publish_run_folder(controller, path);
    publish_boot_wallclock();
    set_logsize_property(controller->rotate_size_kb);
    change_log_folder(path, controller->rotate_size_kb);
    sleep(1);
}

void signal_child(int pid, int sig) {
    // 0 or a negative pid would reach the daemon's own process group.
    if (pid <= 0) return;
    if (waitpid(pid, nullptr, WNOHANG) != 0) return;
    HLOG(TAG_MAIN, WLOG_INFO, "send %d to %d", sig, pid);
    kill(pid, sig);
}

void signal_children(LogController* controller, int sig) {
    pid_t* pids[LOG_TYPE_COUNT] = {&controller->mlog_pid, &controller->rlog_pid,
                                   &controller->elog_pid, &controller->klog_pid,
                                   &controller->blog_pid};
    for (pid_t* pid : pids) {
        if (*pid != 0) signal_child(*pid, sig);
    }
    if (sig == SIGKILL) {
        for (pid_t* pid : pids) *pid = 0;
    }
}

// Build flags of the exception engine, loaded on first use.
static bool oru_flags_loaded = false;
static bool oru_eng_build = false;
static bool oru_customer_build = false;

static void load_oru_flags() {
    if (oru_flags_loaded) return;
    char value[PROPERTY_VALUE_MAX];
    property_get("ro.build.type", value, "user");
    oru_eng_build = strcmp(value, "eng") == 0;
    property_get("ro.oru.build.info", value, "customer");
    oru_customer_build = strcmp(value, "customer") == 0;
    oru_flags_loaded = true;
}

// The engine's tool reports nothing the daemon acts on.
static void run_oru(const char* command) {
    int rc = system(command);
    (void)rc;
}

void oru_mode_on() {
    load_oru_flags();
    if (oru_eng_build) return;
    HLOG(TAG_DEBUG, WLOG_INFO, "init oru mode:%d(1=>3,0=>1)", oru_customer_build ? 1 : 0);
    run_oru(oru_customer_build ? "oru -m 3" : "oru -m 1");
}

void oru_mode_off() {
    load_oru_flags();
    if (oru_eng_build) return;
    HLOG(TAG_DEBUG, WLOG_INFO, "deinit oru mode:%d(1=>4,0=>2)", oru_customer_build ? 1 : 0);
    run_oru(oru_customer_build ? "oru -m 4" : "oru -m 2");
}
