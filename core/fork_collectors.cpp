// Fork wrappers: one collector process each.
#include "core/fork_collectors.h"

#include <errno.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "collectors/bt_cat.h"
#include "collectors/collector_link.h"
#include "collectors/kmsg_cat.h"
#include "collectors/log_cat.h"
#include "common/log_types.h"
#include "core/log_controller.h"
#include "record/record.h"
#include "storage/history_log.h"
#include "transist/transist.h"

static void close_if_open(int* fd) {
    if (*fd > 0) close(*fd);
    *fd = -1;
}

// First steps of a collector child. The daemon's descriptors that the child
// inherited would keep the run's files, the listening names "log_socket" and
// "tavlologd" and the clients' connections alive after the daemon let go of
// them; the child gives them up before doing anything else.
static void collector_child_setup(LogController* controller) {
    // Another thread of the daemon may have held the history lock at the fork.
    history_log_after_fork();
    collector_daemon_pid = getppid();

    transist_close_in_child();
    if (controller != nullptr) {
        close_if_open(&controller->listen_fd);
        for (ClientSlot& slot : controller->clients) close_if_open(&slot.fd);
    }

    // The child has no children of its own to supervise, must see EPIPE rather
    // than die when the transist goes away, and must be able to take the stop
    // signal whatever mask the forking thread had.
    signal(SIGCHLD, SIG_DFL);
    signal(SIGPIPE, SIG_IGN);
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
}

// Forks a collector child that runs body; in the parent returns the child's
// pid, or -1 (errno set) when fork failed. The child never returns.
static pid_t fork_collector(LogController* controller, void (*body)(int shm_fd), int block_fd) {
    pid_t pid = fork();
    if (pid == 0) {
        collector_child_setup(controller);
        body(block_fd);
        _exit(0);  // see exit_collector
    }
    return pid;
}

static void run_kernel_log(int block_fd) {
    KmsgCat collector;
    collector.run(log_type_name(LOG_KERNEL), block_fd);
    WLOG(TAG_MAIN, WLOG_DEBUG, "kernel log exits");
}

static void run_main_log(int block_fd) {
    LogCat collector(log_type_name(LOG_MAIN));
    collector.run(log_type_name(LOG_MAIN), nullptr, block_fd);
}

static void run_radio_log(int block_fd) {
    LogCat collector(log_type_name(LOG_RADIO));
    collector.run(log_type_name(LOG_RADIO), "radio", block_fd);
}

static void run_events_log(int block_fd) {
    LogCat collector(log_type_name(LOG_EVENTS));
    collector.run(log_type_name(LOG_EVENTS), "events", block_fd);
}

static void run_bt_log(int block_fd) {
    BtCat collector;
    collector.run(log_type_name(LOG_BT), block_fd);
    WLOG(TAG_MAIN, WLOG_DEBUG, "BT log exits");
}

int fork_kernel_log(LogController* controller, int block_fd) {
    pid_t pid = fork_collector(controller, run_kernel_log, block_fd);
    if (pid < 0) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "fork kLog failed");
        HLOG(TAG_MAIN, WLOG_ERROR, "fork kernelLog failed %s", strerror(err));
        return -1;
    }
    controller->collector_pid[LOG_KERNEL] = pid;
    WLOG(TAG_MAIN, WLOG_DEBUG, "kmsgcat pid = %d", pid);
    return 0;
}

int fork_main_log(LogController* controller, int block_fd) {
    pid_t pid = fork_collector(controller, run_main_log, block_fd);
    if (pid < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "fork mainLog failed %s", strerror(errno));
        return -1;
    }
    controller->collector_pid[LOG_MAIN] = pid;
    WLOG(TAG_MAIN, WLOG_DEBUG, "logcat main pid = %d", pid);
    return 0;
}

int fork_radio_log(LogController* controller, int block_fd) {
    pid_t pid = fork_collector(controller, run_radio_log, block_fd);
    if (pid < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "fork radiolog failed %s", strerror(errno));
        return -1;
    }
    controller->collector_pid[LOG_RADIO] = pid;
    WLOG(TAG_MAIN, WLOG_DEBUG, "logcat radio pid = %d", pid);
    return 0;
}

int fork_events_log(LogController* controller, int block_fd) {
    pid_t pid = fork_collector(controller, run_events_log, block_fd);
    if (pid < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "fork eventsLog failed %s", strerror(errno));
        return -1;
    }
    controller->collector_pid[LOG_EVENTS] = pid;
    WLOG(TAG_MAIN, WLOG_DEBUG, "logcat events pid = %d", pid);
    return 0;
}

int fork_bt_log(LogController* controller, int block_fd) {
    pid_t pid = fork_collector(controller, run_bt_log, block_fd);
    if (pid < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "fork btLog failed %s", strerror(errno));
        return -1;
    }
    controller->collector_pid[LOG_BT] = pid;
    WLOG(TAG_MAIN, WLOG_DEBUG, "btcat pid = %d", pid);
    return 0;
}
