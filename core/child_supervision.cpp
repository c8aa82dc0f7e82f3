// Noticing collectors that die during a run.
#include "core/child_supervision.h"

#include <errno.h>
#include <signal.h>
#include <stdint.h>
#include <sys/wait.h>
#include <unistd.h>

#include "collectors/control_block.h"
#include "common/wlog.h"
#include "core/control_socket.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "storage/history_log.h"
#include "storage/storage_check.h"

// May run on any thread, in the middle of anything: only the eventfd write,
// which wakes the control thread. The reaping and the records happen there.
void sigchld_handler(int) {
    int saved = errno;
    uint64_t one = 1;
    ssize_t rc = write(efd_chld, &one, sizeof(one));
    (void)rc;
    errno = saved;
}

static int32_t slot_reason(const LogController* controller, int slot) {
    if (controller->shm == nullptr) return REASON_NONE;
    return __atomic_load_n(&controller->shm->slots[slot].reason, __ATOMIC_SEQ_CST);
}

static bool all_pids_clear(const LogController* controller) {
    return controller->klog_pid == 0 && controller->mlog_pid == 0 && controller->rlog_pid == 0 &&
           controller->elog_pid == 0 && controller->blog_pid == 0;
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

    if (controller->kernel_log && controller->klog_pid != 0 && is_dead(controller->klog_pid)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "kLog dies unexpectly");
        note_death(controller, &controller->klog_pid, SLOT_KERNEL);
    }
    if (controller->android_log && controller->mlog_pid != 0 && is_dead(controller->mlog_pid)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "mLog dies unexpectly");
        note_death(controller, &controller->mlog_pid, SLOT_MAIN);
    }
    if (controller->android_log && controller->rlog_pid != 0 && is_dead(controller->rlog_pid)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "rLog dies unexpectly");
        note_death(controller, &controller->rlog_pid, SLOT_RADIO);
    }
    if (controller->android_log && controller->elog_pid != 0 && is_dead(controller->elog_pid)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "eLog dies unexpectly");
        note_death(controller, &controller->elog_pid, SLOT_EVENTS);
    }
    if (controller->bt_log && controller->blog_pid != 0 && is_dead(controller->blog_pid)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "bLog dies unexpectly");
        note_death(controller, &controller->blog_pid, SLOT_BT);
    }

    // A death is otherwise silent while the others go on: it shows in the property.
    publish_collectors(controller);
    if (all_pids_clear(controller)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "all chil processes die");
        reply_client(controller, -1, "tqlog_stopped");
        stop_logging(controller);
    }
}
