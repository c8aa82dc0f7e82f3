// Copying the run options of a configuration into the controller.
#include <errno.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>

#include "common/io_util.h"
#include "config/config_store.h"
#include "core/log_controller.h"
#include "record/record.h"

int logsize_from(const char* value) {
    // A number and nothing else (a stored value may end in "\r" or a tab).
    errno = 0;
    char* end = nullptr;
    long mb = strtol(value, &end, 10);
    while (end != value && (*end == ' ' || *end == '\t' || *end == '\r')) end++;
    if (end == value || *end != '\0' || errno == ERANGE || mb <= 0 || mb > INT_MAX) {
        // 0 would rotate every file after each node: a run would keep seconds of logs.
        HLOG(TAG_MAIN, WLOG_ERROR, "logsize %s is not a size in MB, %d used", value, DEFAULT_LOGSIZE_MB);
        return DEFAULT_LOGSIZE_MB;
    }
    return static_cast<int>(mb);
}

void LogController::load_boot_options(ConfigCache& config) {
    autostart = logsize = totallogsize = 0;
    sd_log_path = 1;
    log_file_num = 0;
    memset(logpath, 0, sizeof(logpath));
    // The log switches keep their value when the key is missing.

    const char* value;
    if ((value = config_get(&config, "autostart"))) autostart = atoi(value);
    if ((value = config_get(&config, "logpath"))) {
        copy_str(logpath, sizeof(logpath), value);
        if (strcmp(logpath, "/data") == 0) sd_log_path = 0;
    }
    if ((value = config_get(&config, "logsize"))) logsize = logsize_from(value);
    if ((value = config_get(&config, "totallogsize"))) totallogsize = atoi(value);
    if ((value = config_get(&config, "AndroidLog"))) {
        log_on[LOG_MAIN] = log_on[LOG_RADIO] = log_on[LOG_EVENTS] = atoi(value);
        if (log_on[LOG_MAIN]) log_file_num += 15;
    }
    if ((value = config_get(&config, "KernelLog"))) {
        log_on[LOG_KERNEL] = atoi(value);
        if (log_on[LOG_KERNEL]) log_file_num += 5;
    }
    WLOG(TAG_MAIN, WLOG_DEBUG, "have qrvbt");
    if ((value = config_get(&config, "BTLog"))) {
        log_on[LOG_BT] = atoi(value);
        if (log_on[LOG_BT]) log_file_num += 5;
    }
    HLOG(TAG_MAIN, WLOG_INFO, "boot:%d,path:%s,size:%d,Tsize:%d,A:%d,K:%d,B:%d", autostart, logpath,
         logsize, totallogsize, log_on[LOG_MAIN], log_on[LOG_KERNEL], log_on[LOG_BT]);
}
