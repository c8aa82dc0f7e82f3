// Fork wrappers: one collector process each.
#include "collectors/fork_collectors.h"

#include <errno.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "collectors/collector_link.h"
#include "collectors/kmsg_cat.h"
#include "common/log_types.h"
#include "common/wlog.h"
#include "core/log_controller.h"
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

    // The tables may be mid-update by the daemon's threads at the fork; the
    // child only reads its own copy and owns no lock.
    for (LogFile& file : log_files) {
        close_if_open(&file.fd);
        close_if_open(&file.sock);
    }
    close_if_open(&transist_listen_fd);
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

int fork_kernel_log(LogController* controller, int block_fd) {
    pid_t pid = fork();
    if (pid < 0) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "fork kLog failed");
        HLOG(TAG_MAIN, WLOG_ERROR, "fork kernelLog failed %s", strerror(err));
        return -1;
    }
    if (pid == 0) {
        collector_child_setup(controller);
        KmsgCat collector;
        collector.run(log_type_name(LOG_KERNEL), block_fd);
        WLOG(TAG_MAIN, WLOG_DEBUG, "kernel log exits");
        _exit(0);  // see exit_collector
    }
    controller->klog_pid = pid;
    WLOG(TAG_MAIN, WLOG_DEBUG, "kmsgcat pid = %d", pid);
    return 0;
}
