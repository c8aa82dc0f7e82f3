// Noticing collectors that die during a run.
#include "core/child_supervision.h"

#include <errno.h>
#include <signal.h>
#include <stdint.h>
#include <sys/wait.h>
#include <unistd.h>

#include "collectors/control_block.h"
#include "common/control_protocol.h"
#include "core/control_socket.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "core/reply_client.h"
#include "record/record.h"
#include "storage/storage_check.h"

// The controller's efd_chld: the handler cannot be told which controller runs.
static int sigchld_notice_fd = -1;

void set_sigchld_notice(int efd_chld) { sigchld_notice_fd = efd_chld; }

// May run on any thread, in the middle of anything: only the eventfd write,
// which wakes the control thread. The reaping and the records happen there.
void sigchld_handler(int) {
    int saved = errno;
    uint64_t one = 1;
    ssize_t rc = write(sigchld_notice_fd, &one, sizeof(one));
    (void)rc;
    errno = saved;
}

static int32_t slot_reason(const LogController* controller, int slot) {
    if (controller->shm == nullptr) return REASON_NONE;
    return __atomic_load_n(&controller->shm->slots[slot].reason, __ATOMIC_SEQ_CST);
}

static bool all_pids_clear(const LogController* controller) {
    for (pid_t pid : controller->collector_pid) {
        if (pid != 0) return false;
    }
    return true;
}

// One dead collector: its record, the check's one warning, its pid cleared.
static void note_death(LogController* controller, pid_t* pid, int slot) {
    if (controller->warned == 0) {
        report_system_warning(slot_reason(controller, slot));
        controller->warned = 1;
    }
    *pid = 0;
}

static bool is_dead(pid_t pid) { return kill(pid, 0) != 0; }

void reap_children() {
    pid_t pid;
    while ((pid = waitpid(-1, nullptr, WNOHANG)) > 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, " pid %d send sig_chld ", pid);
    }
}

void check_children(LogController* controller) {
    reap_children();

    if (all_pids_clear(controller)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "all processes die, no need to check");
        return;
    }
    controller->warned = 0;

    // Checked in this order, kernel first, as the history has always shown them.
    static const int order[LOG_TYPE_COUNT] = {LOG_KERNEL, LOG_MAIN, LOG_RADIO, LOG_EVENTS, LOG_BT};
    for (int type : order) {
        pid_t* pid = &controller->collector_pid[type];
        if (!controller->log_on[type] || *pid == 0 || !is_dead(*pid)) continue;
        // "dies unexpectly" as stored histories and tools have it.
        switch (type) {
            case LOG_KERNEL: HLOG(TAG_MAIN, WLOG_ERROR, "kLog dies unexpectly"); break;
            case LOG_MAIN: HLOG(TAG_MAIN, WLOG_ERROR, "mLog dies unexpectly"); break;
            case LOG_RADIO: HLOG(TAG_MAIN, WLOG_ERROR, "rLog dies unexpectly"); break;
            case LOG_EVENTS: HLOG(TAG_MAIN, WLOG_ERROR, "eLog dies unexpectly"); break;
            default: HLOG(TAG_MAIN, WLOG_ERROR, "bLog dies unexpectly"); break;
        }
        note_death(controller, pid, control_slot_of(type));
    }

    // A death is otherwise silent while the others go on: it shows in the property.
    publish_collectors(controller);
    if (all_pids_clear(controller)) {
        // "chil" as stored histories and tools have it.
        HLOG(TAG_MAIN, WLOG_ERROR, "all chil processes die");
        reply_client(controller, -1, BROADCAST_STOPPED);
        stop_logging(controller);
    }
}
