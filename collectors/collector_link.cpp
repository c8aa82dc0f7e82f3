// The collector side of "log_socket" and of the run's control block.
#include "collectors/collector_link.h"

#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <cutils/sockets.h>

#include "collectors/control_block.h"
#include "common/io_util.h"
#include "common/log_types.h"
#include "common/wlog.h"
#include "storage/history_log.h"
#include "transist/transist.h"

CollectorLink* volatile current_collector = nullptr;
volatile sig_atomic_t stop_signalled = 0;
pid_t collector_daemon_pid = 0;
unsigned int connect_retry_us = 1000000;
unsigned int failed_wait_pause_us = 1000000;

constexpr int CONNECT_ATTEMPTS = 5;
// The holders keep the semaphore for a few instructions; far longer means the
// holder died with it.
constexpr long SEM_WAIT_LIMIT_NS = 500L * 1000 * 1000;

// Each collector family writes with its own tag. WLOG needs the tag at compile
// time, so every site exists once per family.
#define COLLECTOR_WLOG(kind, prio, fmt, ...)                                  \
    do {                                                                      \
        if ((kind) == KIND_KERNEL)                                            \
            WLOG(TAG_KERNEL, prio, fmt, ##__VA_ARGS__);                       \
        else if ((kind) == KIND_ANDROID)                                      \
            WLOG(TAG_ANDROID, prio, fmt, ##__VA_ARGS__);                      \
        else                                                                  \
            WLOG(TAG_BT, prio, fmt, ##__VA_ARGS__);                           \
    } while (0)

#define COLLECTOR_HLOG(kind, prio, fmt, ...)                                  \
    do {                                                                      \
        history_log(2, fmt, ##__VA_ARGS__);                                   \
        COLLECTOR_WLOG(kind, prio, fmt, ##__VA_ARGS__);                       \
    } while (0)

static void block_stop_signal(sigset_t* old) {
    sigset_t block;
    sigemptyset(&block);
    sigaddset(&block, SIGUSR1);
    pthread_sigmask(SIG_BLOCK, &block, old);
}

int control_block_lock(sem_t* sem) {
    struct timespec deadline;
    clock_gettime(CLOCK_REALTIME, &deadline);
    deadline.tv_nsec += SEM_WAIT_LIMIT_NS;
    if (deadline.tv_nsec >= 1000000000L) {
        deadline.tv_sec += 1;
        deadline.tv_nsec -= 1000000000L;
    }
    if (RETRY_EINTR(sem_timedwait(sem, &deadline)) == 0) return 1;
    // Platform log only: this may run in the stop handler, and the platform
    // writer takes no lock.
    WLOG(TAG_MAIN, WLOG_WARN, "semaphore %s busy for %ld ms, going on without it", CONTROL_SEM_NAME,
         SEM_WAIT_LIMIT_NS / 1000000);
    return 0;
}

void control_block_unlock(sem_t* sem) { sem_post(sem); }

int install_stop_signal(CollectorLink* collector) {
    current_collector = collector;
    // BSD semantics, as bsd_signal: restart interrupted calls, handler stays.
    struct sigaction sa;
    memset(&sa, 0, sizeof(sa));
    sa.sa_handler = on_stop_signal;
    sa.sa_flags = SA_RESTART;
    sigemptyset(&sa.sa_mask);
    return sigaction(SIGUSR1, &sa, nullptr);
}

int attach_control_block(CollectorLink* collector) {
    void* map = mmap(nullptr, CONTROL_BLOCK_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED,
                     collector->shm_fd, 0);
    if (map == MAP_FAILED) return 0;
    ControlBlock* block = static_cast<ControlBlock*>(map);
    // The stop handler may read these at any moment: set the semaphore first,
    // the block last, so it never sees a block without its lock.
    collector->sem = control_sem(block);
    collector->shm = block;
    return 1;
}

static void pause_before_retry() {
    struct timespec left = {static_cast<time_t>(connect_retry_us / 1000000),
                            static_cast<long>(connect_retry_us % 1000000) * 1000};
    while (nanosleep(&left, &left) == -1 && errno == EINTR) {
    }
}

// A connection counts only when the daemon itself serves the name: any process
// of the phone can bind an abstract socket, and a squatter would otherwise
// receive this collector's log.
static int served_by_daemon(int fd, pid_t* server) {
    struct ucred cred;
    socklen_t len = sizeof(cred);
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
        *server = -1;
        return 0;
    }
    *server = cred.pid;
    pid_t daemon = collector_daemon_pid > 0 ? collector_daemon_pid : getppid();
    return cred.pid == daemon;
}

int connect_transist(CollectorLink* collector) {
    const CollectorKind kind = collector->kind;
    COLLECTOR_WLOG(kind, WLOG_DEBUG, "begin to connect to server");
    int fd = -1;
    for (int attempt = 0; attempt < CONNECT_ATTEMPTS && fd < 0; attempt++) {
        fd = socket_local_client(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
        if (fd >= 0) {
            pid_t server;
            if (served_by_daemon(fd, &server)) break;
            COLLECTOR_HLOG(kind, WLOG_ERROR, "log_socket is served by pid %d, not the daemon",
                           server);
            close(fd);
            fd = -1;
            errno = ECONNREFUSED;
        } else {
            int err = errno;
            COLLECTOR_HLOG(kind, WLOG_ERROR, "socket fd < 0(%s), errno = %d.", strerror(err), err);
            errno = err;
        }
        int err = errno;
        pause_before_retry();
        errno = err;
    }
    if (fd < 0) {
        int err = errno;
        if (kind == KIND_BT) {
            COLLECTOR_HLOG(kind, WLOG_ERROR, "socket fd < 0(%s), errno = %d. Has retry 5s..",
                           strerror(err), err);
        } else {
            COLLECTOR_HLOG(kind, WLOG_ERROR, "socket fd < 0(%s), errno = %d. Has been retry 5s..",
                           strerror(err), err);
        }
        // Nothing this collector reads could reach a file; ending now lets the
        // supervision notice at once instead of after a failed send.
        exit_collector(collector, 1, REASON_NONE);
    }
    collector->transist_fd = fd;
    const char type = collector->log_type;
    if (kind == KIND_ANDROID) {
        WLOG(TAG_ANDROID, WLOG_DEBUG, "(%cLog) socket fd = %d", type, fd);
        WLOG(TAG_ANDROID, WLOG_DEBUG, "(%cLog): sucessfully setup the socket", type);
    } else {
        COLLECTOR_WLOG(kind, WLOG_DEBUG, "%c: socket fd = %d", type, fd);
        COLLECTOR_WLOG(kind, WLOG_DEBUG, "%c: sucessfully setup the socket", type);
    }
    // The stream letter is the whole header; a failure shows at the first send.
    write_fully(fd, &type, 1);
    if (kind == KIND_ANDROID) {
        WLOG(TAG_ANDROID, WLOG_DEBUG, "(%cLog): has sent log_type to socket", type);
    } else {
        COLLECTOR_WLOG(kind, WLOG_DEBUG, "%c: has sent log_type to socket", type);
    }
    return 1;
}

// A collector is a process of its own: blocking until the transist has taken
// every byte is fine, losing the tail of a chunk is not.
int send_to_transist(const char* buf, size_t len, int fd) {
    ssize_t n = write_fully(fd, buf, len);
    if (n < 0 || static_cast<size_t>(n) < len) {
        int err = errno != 0 ? errno : EIO;
        HLOG(TAG_TRANSIST, WLOG_ERROR, "%d send fail(%s)%d", fd, strerror(err), err);
        errno = err;
        return -1;
    }
    return static_cast<int>(len);
}

bool stop_asked(CollectorLink* collector) {
    if (collector->shm == nullptr) return false;
    // The stop handler takes the semaphore too: it must not run while this
    // process holds it.
    sigset_t old;
    block_stop_signal(&old);
    int locked = control_block_lock(collector->sem);
    int stop = __atomic_load_n(&control_stop(collector->shm), __ATOMIC_SEQ_CST);
    if (locked) control_block_unlock(collector->sem);
    pthread_sigmask(SIG_SETMASK, &old, nullptr);
    return stop != 0;
}

void check_stop(CollectorLink* collector) {
    if (stop_asked(collector)) exit_collector(collector, 0, REASON_NONE);
}

// A collector ends with _exit, never exit: it is a forked copy of the
// multithreaded daemon, and exit would run the daemon's exit-time work in it
// (static destructors, atexit handlers, a sanitizer's leak check), which can
// wait for ever on a lock another daemon thread held at the fork. _exit is
// also safe from the stop signal's handler.
void exit_collector(CollectorLink* collector, int status, int reason) {
    // From here on a stop signal must not re-enter: the process is ending anyway.
    block_stop_signal(nullptr);
    if (collector == nullptr || collector->shm == nullptr || collector->sem == nullptr) {
        // Stopped before the block was mapped: nothing to mark.
        _exit(status);
    }
    int slot = log_type_from_letter(collector->log_type) + 1;
    if (slot < SLOT_MAIN) {
        COLLECTOR_HLOG(collector->kind, WLOG_ERROR, "unknow log type %c", collector->log_type);
        _exit(status);
    }
    ControlSlot& own = collector->shm->slots[slot];
    int locked = control_block_lock(collector->sem);
    if (reason >= 0) __atomic_store_n(&own.reason, reason, __ATOMIC_SEQ_CST);
    // exited last: the controller reads reason without the lock once it sees exited.
    __atomic_store_n(&own.exited, 1, __ATOMIC_SEQ_CST);
    if (locked) control_block_unlock(collector->sem);
    COLLECTOR_WLOG(collector->kind, WLOG_DEBUG, "%c has been set.", collector->log_type);
    _exit(status);
}

void on_stop_signal(int) {
    CollectorLink* collector = current_collector;
    if (collector != nullptr && collector->defer_stop_signal) {
        stop_signalled = 1;
        return;
    }
    exit_collector(collector, 0, REASON_SIGNAL);
}

void back_off_after_failed_wait(CollectorLink* collector, int err, const sigset_t* wait_mask) {
    static bool recorded = false;
    if (!recorded) {
        recorded = true;
        COLLECTOR_HLOG(collector->kind, WLOG_ERROR, "%c: select failed: %s(%d)", collector->log_type,
                       strerror(err), err);
    }
    struct timespec pause = {static_cast<time_t>(failed_wait_pause_us / 1000000),
                             static_cast<long>(failed_wait_pause_us % 1000000) * 1000};
    pselect(0, nullptr, nullptr, nullptr, &pause, wait_mask);
}

void hold_stop_signal(sigset_t* wait_mask) {
    sigset_t old;
    block_stop_signal(&old);
    *wait_mask = old;
    sigdelset(wait_mask, SIGUSR1);
}
