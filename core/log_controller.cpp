#include "core/log_controller.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <sys/eventfd.h>

#include "core/child_supervision.h"
#include "platform/properties.h"
#include "record/record.h"

LogController::LogController() {
    listen_fd = 0;
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
    set_sigchld_notice(efd_chld);
    efd_thread = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (efd_thread < 0) HLOG(TAG_MAIN, WLOG_ERROR, "create efd_thread failed(%s)", strerror(errno));
}

// The controller lives as long as the process; nothing to release.
LogController::~LogController() {}

const char* LogController::current_log_root() const {
    return log_path_state.load() != LOG_PATH_HELD_IN_DATA ? logpath : "/data";
}

bool is_running() {
    char value[PROPERTY_VALUE_MAX];
    property_get(PROP_RUNNING, value, "0");
    return atoi(value) != 0;
}

bool run_live(const LogController* controller) {
    return controller->run_active || is_running();
}
