// The boot-mode paths: whether a run starts before any client has spoken, and
// where it writes while the card is not usable yet.
#include "core/boot_start.h"

#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "config/config_store.h"
#include "core/boot_copy.h"
#include "core/control_socket.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "platform/properties.h"
#include "record/record.h"
#include "storage/safe_file.h"
#include "storage/storage_check.h"

namespace {

// Run sizes at boot, in MB; the configured logsize is for runs of commands.
constexpr int BOOT_RUN_MB = 60;
constexpr int OTHER_BOOT_RUN_MB = BOOT_RUN_MB / 3;
constexpr char KELM_LOG_PATH[] = "/data/ext_sdcard_tool";

// The first boot seeds the configuration from the system image's defaults.
void load_config(ConfigCache* config) {
    if (access(CONFIG_FILE, F_OK) == 0) {
        config_load(config);
    } else {
        config_read_system_defaults(config);
        config_write(config);
    }
}

// The kelm and other boots record without the Bluetooth stack's log.
void bluetooth_off(LogController* controller) {
    if (!controller->log_on[LOG_BT]) return;
    controller->log_on[LOG_BT] = 0;
    controller->log_file_num -= 5;
}

void start_boot_run(LogController* controller, int megabytes) {
    controller->rotate_size_kb = calc_rotate_size(controller, megabytes);
    start_logging(controller);
}

// Failures below leave the daemon serving clients without a run: a restart
// would only fail the same way, and a client can still start one on the card.

void normal_boot(LogController* controller, ConfigCache* config) {
    load_config(config);
    controller->load_boot_options(*config);
    if (controller->autostart == 0) {
        property_set(PROP_RUNNING, "0");
        return;
    }
    if (controller->sd_log_path) {
        if (!start_in_temp_folder(controller)) return;
        if (controller->data_storage_low == 1) {
            // "dont" as stored histories and tools have it.
            HLOG(TAG_MAIN, WLOG_ERROR, "/data is low, dont start children process(2)");
            controller->log_path_state = LOG_PATH_UNDER_LOGPATH;
            return;
        }
    } else {
        compose_run_folder(controller);
        if (create_run_folder(controller, controller->logpath, controller->run_folder) < 0) return;
        controller->log_path_state = LOG_PATH_UNDER_LOGPATH;
    }
    start_boot_run(controller, BOOT_RUN_MB);
}

void kelm_boot(LogController* controller, ConfigCache* config) {
    // The built-in defaults decide; the kelm boot always records.
    controller->load_boot_options(*config);
    copy_str(controller->logpath, sizeof(controller->logpath), KELM_LOG_PATH);
    controller->boot_copy_timer = 0;
    if (!start_in_temp_folder(controller)) return;
    if (controller->data_storage_low == 1) {
        // "dont" as stored histories and tools have it.
        HLOG(TAG_MAIN, WLOG_ERROR, "/data is low, dont start tqlog");
        return;
    }
    bluetooth_off(controller);
    start_boot_run(controller, BOOT_RUN_MB);
    kelm_mode_copy(controller);
}

struct BootNumbers {
    int max = 0;
    int count = 0;
    int values[256];
};

int collect_boot_number(void* arg, const char* name, int) {
    BootNumbers* numbers = static_cast<BootNumbers*>(arg);
    int n = other_mode_number(name);
    if (n == 0) return 0;
    if (n > numbers->max) numbers->max = n;
    if (numbers->count < 256) numbers->values[numbers->count++] = n;
    return 0;
}

// The number of this boot's folder: one past the highest of the earlier
// boots, whose two newest folders are kept. -1 when they cannot be listed.
int next_other_mode_number() {
    if (!path_exists(OTHER_MODE_FOLDER)) return 1;
    BootNumbers numbers;
    UniqueFd dir(safe_open_dir("/data", OTHER_MODE_FOLDER, false, 0));
    if (!dir.ok() || safe_list_dir(dir.get(), collect_boot_number, &numbers) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "opendir /data/log_otherboot failed");
        return -1;
    }
    for (int i = 0; i < numbers.count; i++) {
        int n = numbers.values[i];
        if (n > numbers.max - 2) continue;
        char name[16];
        snprintf(name, sizeof(name), "%d", n);
        HLOG(TAG_MAIN, WLOG_ERROR, "rm -r %s%d", OTHER_MODE_FOLDER, n);
        if (safe_remove_tree(dir.get(), name) != 0 && errno != ENOENT) {
            int err = errno;
            HLOG(TAG_MAIN, WLOG_ERROR, "rm -r %s%d failed(%s)", OTHER_MODE_FOLDER, n, strerror(err));
        }
    }
    return numbers.max + 1;
}

void other_boot(LogController* controller, ConfigCache* config) {
    load_config(config);
    controller->load_boot_options(*config);
    if (controller->autostart == 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "not start log in this mode");
        return;
    }
    copy_str(controller->logpath, sizeof(controller->logpath), "/data");
    int number = next_other_mode_number();
    if (number < 0) return;
    snprintf(controller->run_folder, sizeof(controller->run_folder), "%s%d/", OTHER_MODE_FOLDER, number);
    if (create_run_folder(controller, "/data", controller->run_folder) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %s failed", controller->run_folder);
        return;
    }
    HLOG(TAG_MAIN, WLOG_ERROR, "%s", controller->run_folder);
    bluetooth_off(controller);
    controller->boot_copy_timer = 0;
    start_boot_run(controller, OTHER_BOOT_RUN_MB);
}

}  // namespace

int start_in_temp_folder(LogController* controller) {
    controller->log_path_state = LOG_PATH_HELD_IN_DATA;
    if (controller->boot_mode == 0) controller->boot_copy_timer = 1;
    copy_str(controller->run_folder, sizeof(controller->run_folder), TEMP_FOLDER);
    WLOG(TAG_MAIN, WLOG_DEBUG, "save log to temp file %s", TEMP_FOLDER);
    if (is_storage_low("/data")) {
        controller->data_storage_low = 1;
        return 1;
    }
    controller->data_storage_low = 0;
    // What an earlier boot left there was not wanted on the card; what this
    // boot's earlier daemon held there is, and is appended to.
    char booted[PROPERTY_VALUE_MAX];
    property_get(PROP_BOOTED, booted, "0");
    if (strcmp(booted, "1") == 0) {
        if (path_exists(TEMP_FOLDER)) HLOG(TAG_MAIN, WLOG_ERROR, "restarted within this boot, %s kept", TEMP_FOLDER);
    } else if (path_exists(TEMP_FOLDER)) {
        UniqueFd data(safe_open_dir("/data", "/data", false, 0));
        if (!data.ok() || safe_remove_tree(data.get(), "log_temp") != 0) {
            int err = errno;
            HLOG(TAG_MAIN, WLOG_ERROR, "rm -r /data/log_temp failed(%s)", strerror(err));
        }
    }
    if (create_run_folder(controller, "/data", TEMP_FOLDER) < 0) {
        // "faild" as stored histories and tools have it.
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %s faild,errno=%d", TEMP_FOLDER, errno);
        return 0;
    }
    property_set(PROP_BOOTED, "1");
    return 1;
}

void boot_start(LogController* controller, int boot_mode) {
    controller->boot_mode = boot_mode;
    record_history(0, "boot mode: %d", boot_mode);
    WLOG(TAG_MAIN, WLOG_INFO, "boot mode: %d", boot_mode);
    {
        ConfigCache config;
        config_init(&config);
        if (boot_mode == 0) {
            normal_boot(controller, &config);
        } else if (boot_mode == 1) {
            kelm_boot(controller, &config);
        } else {
            other_boot(controller, &config);
        }
    }
    start_control_socket(controller);
}
