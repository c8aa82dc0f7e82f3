// The boot-mode paths: whether a run starts before any client has spoken, and
// where it writes while the card is not usable yet.
#include "core/boot_start.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "common/wlog.h"
#include "config/config_store.h"
#include "core/boot_copy.h"
#include "core/control_socket.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "platform/properties.h"
#include "storage/history_log.h"
#include "storage/safe_file.h"
#include "storage/storage_check.h"

namespace {

// Run sizes at boot, in MB; the configured logsize is for runs of commands.
constexpr int BOOT_RUN_MB = 60;
constexpr int OTHER_BOOT_RUN_MB = BOOT_RUN_MB / 3;
constexpr char KELM_LOG_PATH[] = "/data/ext_sdcard_tool";
// The room a boot's holding folder needs on /data: its whole run, and the
// reserve below which /data counts as low and the run stops.
constexpr uint64_t HOLDING_ROOM_BYTES = (static_cast<uint64_t>(BOOT_RUN_MB) << 20) + LOW_STORAGE_BYTES;

bool exists(const char* path) {
    struct stat st;
    return lstat(path, &st) == 0;
}

// Set by the first daemon of a boot once its folder is made; gone at reboot.
bool restarted_in_this_boot() {
    char booted[PROPERTY_VALUE_MAX];
    property_get(PROP_BOOTED, booted, "0");
    return strcmp(booted, "1") == 0;
}

// A file or a link where a holding folder of /data belongs would keep every
// later boot from recording: it goes, a link itself, never what it points to.
void remove_stray(const char* name) {
    UniqueFd data(safe_open_dir("/data", "/data", false, 0));
    struct stat st;
    if (!data.ok() || fstatat(data.get(), name, &st, AT_SYMLINK_NOFOLLOW) != 0 || S_ISDIR(st.st_mode)) return;
    HLOG(TAG_MAIN, WLOG_ERROR, "/data/%s is not a folder, will delete it", name);
    if (safe_remove_file(data.get(), name) != 0) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "rm /data/%s failed(%s)", name, strerror(err));
    }
}

void remove_held(int data, const char* name) {
    if (safe_remove_tree(data, name) != 0 && errno != ENOENT) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "rm -r /data/%s failed(%s)", name, strerror(err));
    }
}

int note_log(void* found, const char* name, int) {
    if (name[0] == '.') return 0;  // never copied
    *static_cast<bool*>(found) = true;
    return 1;
}

// The first daemon of a boot finds in /data/log_temp what the boot before
// held. Still there, it was never copied: that boot ended before any client or
// the boot-copy wait came (a boot loop, an early crash), and those are the logs
// wanted most. They are kept aside for the next copy: the one boot before
// only, and only while this boot's holding folder keeps its room.
void keep_previous_boot() {
    UniqueFd data(safe_open_dir("/data", "/data", false, 0));
    struct stat st;
    if (!data.ok()) return;
    if (fstatat(data.get(), "log_temp_prev", &st, AT_SYMLINK_NOFOLLOW) == 0) {
        HLOG(TAG_MAIN, WLOG_WARN, "held logs of an earlier boot in %s dropped", PREV_BOOT_FOLDER);
        remove_held(data.get(), "log_temp_prev");
    }
    if (fstatat(data.get(), "log_temp", &st, AT_SYMLINK_NOFOLLOW) != 0) return;
    bool found = false;
    UniqueFd held(safe_open_dir("/data", TEMP_FOLDER, false, 0));
    if (held.ok()) safe_list_dir(held.get(), note_log, &found);
    if (found) {
        uint64_t free_bytes = get_free_space("/data", 0);
        if (free_bytes < HOLDING_ROOM_BYTES) {
            HLOG(TAG_MAIN, WLOG_WARN, "held logs of the previous boot dropped, /data has %lluMB free",
                 static_cast<unsigned long long>(free_bytes >> 20));
        } else if (renameat(data.get(), "log_temp", data.get(), "log_temp_prev") == 0) {
            HLOG(TAG_MAIN, WLOG_INFO, "held logs of the previous boot kept in %s", PREV_BOOT_FOLDER);
            return;
        } else {
            int err = errno;
            HLOG(TAG_MAIN, WLOG_ERROR, "mv %s %s failed(%s)", TEMP_FOLDER, PREV_BOOT_FOLDER, strerror(err));
        }
    }
    remove_held(data.get(), "log_temp");
}

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
    if (!controller->bt_log) return;
    controller->bt_log = 0;
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
        if (data_storage_low == 1) {
            HLOG(TAG_MAIN, WLOG_ERROR, "/data is low, dont start children process(2)");
            controller->log_path_state = 1;
            return;
        }
    } else {
        compose_run_folder(controller);
        if (create_run_folder(controller, controller->logpath, controller->run_folder) < 0) return;
        controller->log_path_state = 1;
    }
    start_boot_run(controller, BOOT_RUN_MB);
}

void kelm_boot(LogController* controller, ConfigCache* config) {
    // The built-in defaults decide; the kelm boot always records.
    controller->load_boot_options(*config);
    copy_str(controller->logpath, sizeof(controller->logpath), KELM_LOG_PATH);
    controller->boot_copy_timer = 0;
    if (!start_in_temp_folder(controller)) return;
    if (data_storage_low == 1) {
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

// A gap of numbers no folder holds (a folder made by hand) is not worth more.
constexpr int PRUNE_RECORDS_MAX = 64;

int collect_boot_number(void* arg, const char* name, int) {
    BootNumbers* numbers = static_cast<BootNumbers*>(arg);
    int n = other_mode_number(name);
    if (n == 0) return 0;
    if (n > numbers->max) numbers->max = n;
    if (numbers->count < 256) numbers->values[numbers->count++] = n;
    return 0;
}

int by_number(const void* a, const void* b) {
    int x = *static_cast<const int*>(a), y = *static_cast<const int*>(b);
    return x < y ? -1 : x > y ? 1 : 0;
}

// Every number from the lowest to max - 2 goes, in ascending order, each with
// its record, whether a folder holds it or not.
void prune_other_modes(int dir, BootNumbers* numbers) {
    if (numbers->count == 0) return;
    qsort(numbers->values, static_cast<size_t>(numbers->count), sizeof(int), by_number);
    int next = 0, recorded = 0, unrecorded = 0;
    for (int n = numbers->values[0]; n <= numbers->max - 2; n++) {
        bool present = false;
        for (; next < numbers->count && numbers->values[next] <= n; next++) present |= numbers->values[next] == n;
        if (!present && recorded >= PRUNE_RECORDS_MAX) {
            unrecorded++;
            continue;
        }
        recorded++;
        HLOG(TAG_MAIN, WLOG_ERROR, "rm -r %s%d", OTHER_MODE_FOLDER, n);
        char name[16];
        snprintf(name, sizeof(name), "%d", n);
        if (present && safe_remove_tree(dir, name) != 0 && errno != ENOENT) {
            int err = errno;
            HLOG(TAG_MAIN, WLOG_ERROR, "rm -r %s%d failed(%s)", OTHER_MODE_FOLDER, n, strerror(err));
        }
    }
    if (unrecorded > 0)
        HLOG(TAG_MAIN, WLOG_ERROR, "%d more numbers up to %d held no folder", unrecorded, numbers->max - 2);
}

// The number of this boot's folder: one past the highest of the earlier
// boots, whose two newest folders are kept. A daemon restarted within the boot
// goes on in its boot's folder and removes nothing. -1 when they cannot be listed.
int next_other_mode_number(bool restarted) {
    if (!exists(OTHER_MODE_FOLDER)) return 1;
    BootNumbers numbers;
    UniqueFd dir(safe_open_dir("/data", OTHER_MODE_FOLDER, false, 0));
    if (!dir.ok() || safe_list_dir(dir.get(), collect_boot_number, &numbers) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "opendir /data/log_otherboot failed");
        return -1;
    }
    if (restarted && numbers.max > 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "restarted within this boot, %s%d/ kept", OTHER_MODE_FOLDER, numbers.max);
        return numbers.max;
    }
    prune_other_modes(dir.get(), &numbers);
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
    remove_stray("log_other_mode");
    int number = next_other_mode_number(restarted_in_this_boot());
    if (number < 0) return;
    snprintf(controller->run_folder, sizeof(controller->run_folder), "%s%d/", OTHER_MODE_FOLDER, number);
    if (create_run_folder(controller, "/data", controller->run_folder) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %s failed", controller->run_folder);
        return;
    }
    property_set(PROP_BOOTED, "1");
    HLOG(TAG_MAIN, WLOG_ERROR, "%s", controller->run_folder);
    bluetooth_off(controller);
    controller->boot_copy_timer = 0;
    start_boot_run(controller, OTHER_BOOT_RUN_MB);
}

}  // namespace

int start_in_temp_folder(LogController* controller) {
    controller->log_path_state = 0;
    if (controller->boot_mode == 0) controller->boot_copy_timer = 1;
    copy_str(controller->run_folder, sizeof(controller->run_folder), TEMP_FOLDER);
    WLOG(TAG_MAIN, WLOG_DEBUG, "save log to temp file %s", TEMP_FOLDER);
    if (is_storage_low("/data")) {
        data_storage_low = 1;
        return 1;
    }
    data_storage_low = 0;
    remove_stray("log_temp");
    // What this boot's earlier daemon held there is appended to.
    if (restarted_in_this_boot()) {
        if (exists(TEMP_FOLDER)) HLOG(TAG_MAIN, WLOG_ERROR, "restarted within this boot, %s kept", TEMP_FOLDER);
    } else {
        keep_previous_boot();
    }
    if (create_run_folder(controller, "/data", TEMP_FOLDER) < 0) {
        int err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "mkdir %s faild,errno=%d", TEMP_FOLDER, err);
        // With nothing held the boot-copy wait would only make an empty folder on the card.
        if (!exists(PREV_BOOT_FOLDER)) controller->boot_copy_timer = 0;
        return 0;
    }
    property_set(PROP_BOOTED, "1");
    return 1;
}

void boot_start(LogController* controller, int boot_mode) {
    controller->boot_mode = boot_mode;
    history_log(0, "boot mode: %d", boot_mode);
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
