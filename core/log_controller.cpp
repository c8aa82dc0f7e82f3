#include "core/log_controller.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <sys/eventfd.h>

#include "common/wlog.h"
#include "platform/properties.h"
#include "storage/history_log.h"

int efd_chld = -1;
int efd_thread = -1;
int shm_fd = -1;
int data_storage_low = 0;

LogController::LogController() {
    listen_fd = 0;
    klog_pid = mlog_pid = rlog_pid = elog_pid = blog_pid = 0;
    data_storage_low = 0;
    log_path_state = -1;
    boot_copy_timer = 0;
    for (ClientSlot& slot : clients) {
        slot.fd = -1;
        memset(slot.addr, 0, sizeof(slot.addr));
    }
    pthread_mutex_init(&client_lock, nullptr);
    pthread_mutex_init(&reply_lock, nullptr);
    property_set(PROP_RUNNING, "0");
    property_set(PROP_COLLECTORS, "");
    // EFD_CLOEXEC keeps the counters out of the shell commands the daemon runs.
    efd_chld = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (efd_chld < 0) HLOG(TAG_MAIN, WLOG_ERROR, "create efd_chld failed(%s)", strerror(errno));
    efd_thread = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (efd_thread < 0) HLOG(TAG_MAIN, WLOG_ERROR, "create efd_thread failed(%s)", strerror(errno));
}

// The controller lives as long as the process; nothing to release.
LogController::~LogController() {}

const char* LogController::current_log_root() const {
    return log_path_state != 0 ? logpath : "/data";
}

bool is_running() {
    char value[PROPERTY_VALUE_MAX];
    property_get(PROP_RUNNING, value, "0");
    return atoi(value) != 0;
}

bool run_live(const LogController* controller) {
    return controller->run_active || is_running();
}
