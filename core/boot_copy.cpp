#include "core/boot_copy.h"

#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "common/wlog.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "storage/history_log.h"
#include "storage/log_copy.h"
#include "storage/safe_file.h"

namespace {

constexpr long long KELM_WAIT_US = 29999999;
constexpr int KELM_RUN_MB = 300;

bool exists(const char* path) {
    struct stat st;
    return lstat(path, &st) == 0;
}

// Removes the folder name of /data (or of parent below it) if it is empty: a
// file whose copy failed keeps it for the next copy.
void remove_if_empty(const char* parent, const char* name) {
    UniqueFd dir(safe_open_dir("/data", parent, false, 0));
    if (dir.ok()) safe_remove_dir(dir.get(), name);
}

long long monotonic_us() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000000 + ts.tv_nsec / 1000;
}

// The folders of the other boots, oldest boot first: their logs are appended
// to the same files, and a later boot's must not come before an earlier one's.
constexpr int OTHER_MODE_MAX = 64;

struct OtherModeFolder {
    int number;
    char name[NAME_MAX + 1];
};

struct OtherModeFolders {
    OtherModeFolder entries[OTHER_MODE_MAX];
    int count = 0;
};

int collect_folder(void* arg, const char* name, int) {
    OtherModeFolders* folders = static_cast<OtherModeFolders*>(arg);
    // Beyond the table the rest waits for the next copy.
    if (name[0] == '.' || folders->count == OTHER_MODE_MAX) return 0;
    folders->entries[folders->count].number = other_mode_number(name);
    copy_str(folders->entries[folders->count].name, NAME_MAX + 1, name);
    folders->count++;
    return 0;
}

int by_boot(const void* a, const void* b) {
    const OtherModeFolder* x = static_cast<const OtherModeFolder*>(a);
    const OtherModeFolder* y = static_cast<const OtherModeFolder*>(b);
    if (x->number != y->number) return x->number < y->number ? -1 : 1;
    return strcmp(x->name, y->name);
}

// Returns false when the card failed and copying should end.
bool copy_other_modes(LogController* controller) {
    OtherModeFolders folders;
    UniqueFd dir(safe_open_dir("/data", OTHER_MODE_FOLDER, false, 0));
    if (!dir.ok() || safe_list_dir(dir.get(), collect_folder, &folders) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "open other boot failed when copy");
        return true;
    }
    qsort(folders.entries, static_cast<size_t>(folders.count), sizeof(folders.entries[0]), by_boot);
    for (int i = 0; i < folders.count; i++) {
        char folder[PATH_LEN];
        snprintf(folder, sizeof(folder), "%s%s/", OTHER_MODE_FOLDER, folders.entries[i].name);
        CopyResult rc = copy_log_folder(controller, folder, controller->run_folder, ".otherboot");
        remove_if_empty(OTHER_MODE_FOLDER, folders.entries[i].name);
        if (rc == COPY_ABORT) return false;
    }
    remove_if_empty("/data/", "log_other_mode");
    return true;
}

}  // namespace

int other_mode_number(const char* name) {
    char* end = nullptr;
    errno = 0;
    long n = strtol(name, &end, 10);
    // As atoi reads it; a number that leaves no room for the next is none.
    if (errno != 0 || n <= 0 || n >= OTHER_MODE_NUMBER_LIMIT) return 0;
    return static_cast<int>(n);
}

void copy_saved_logs(LogController* controller) {
    const struct {
        const char* folder;
        const char* name;
        const char* suffix;
    } held[] = {{PREV_BOOT_FOLDER, "log_temp_prev", ".prev_boot"},
                {TEMP_FOLDER, "log_temp", ".boot"},
                {HBR_FOLDER, "log_hbr", ".hbr"}};
    for (const auto& h : held) {
        if (!exists(h.folder)) continue;
        CopyResult rc = copy_log_folder(controller, h.folder, controller->run_folder, h.suffix);
        remove_if_empty("/data/", h.name);
        if (rc == COPY_ABORT) return;
        sleep(1);
    }
    if (exists(OTHER_MODE_FOLDER)) copy_other_modes(controller);
}

int boot_fail_copy(LogController* controller) {
    stop_logging(controller);
    char stamp[50];
    time_t now = time(nullptr);
    struct tm local;
    localtime_r(&now, &local);
    strftime(stamp, sizeof(stamp), "/BOOTFAIL_%Y_%m%d_%H%M%S/", &local);
    char folder[PATH_LEN + sizeof(stamp) + 32];
    snprintf(folder, sizeof(folder), "%s/qrvlog/tavlolog/%s", controller->logpath, stamp);
    // A cut name would be some other folder.
    bool fits = copy_str(controller->run_folder, sizeof(controller->run_folder), folder);
    HLOG(TAG_MAIN, WLOG_INFO, "copy to %s", folder);
    if (!fits || create_run_folder(controller, controller->logpath, controller->run_folder) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "create %s failed", folder);
        return -1;
    }
    CopyResult rc = COPY_DONE;
    if (exists(PREV_BOOT_FOLDER)) {
        rc = copy_log_folder(controller, PREV_BOOT_FOLDER, controller->run_folder, ".prev_boot");
        remove_if_empty("/data/", "log_temp_prev");
    }
    if (rc != COPY_ABORT) rc = copy_log_folder(controller, TEMP_FOLDER, controller->run_folder, ".boot");
    WLOG(TAG_MAIN, WLOG_DEBUG, "Delete '%s'.", TEMP_FOLDER);
    remove_if_empty("/data/", "log_temp");
    // A card that failed during the copy is no complete copy.
    return rc == COPY_ABORT ? -1 : 0;
}

void kelm_mode_copy(LogController* controller) {
    char held[PATH_LEN];
    copy_str(held, sizeof(held), controller->run_folder);
    compose_run_folder(controller);
    // Monotonic: the clock may be set while the phone boots.
    long long start = monotonic_us();
    for (;; sleep(1)) {
        if (monotonic_us() - start > KELM_WAIT_US) {
            HLOG(TAG_MAIN, WLOG_ERROR, "kelm wait sd timeout! stop!");
            stop_logging(controller);
            return;
        }
        struct stat st;
        if (lstat(controller->logpath, &st) != 0) continue;
        if (!S_ISLNK(st.st_mode)) {
            // A plain folder there would take the logs onto /data.
            HLOG(TAG_MAIN, WLOG_ERROR, "%s is not a link, will delete it", controller->logpath);
            const char* name = strrchr(controller->logpath, '/') + 1;
            char parent[PATH_LEN];
            copy_str(parent, static_cast<size_t>(name - controller->logpath) + 1, controller->logpath);
            UniqueFd dir(safe_open_dir("/data", parent, false, 0));
            if (!dir.ok() || safe_remove_tree(dir.get(), name) != 0) {
                int err = errno;
                HLOG(TAG_MAIN, WLOG_ERROR, "rm -r %s failed(%s)", controller->logpath, strerror(err));
            }
            continue;
        }
        if (create_run_folder(controller, controller->logpath, controller->run_folder) < 0) continue;
        HLOG(TAG_MAIN, WLOG_INFO, "SDcard mounted! kelm copy!");
        controller->rotate_size_kb = calc_rotate_size(controller, KELM_RUN_MB);
        switch_run_folder(controller, controller->run_folder);
        // On the card now: the writer checks the card's free space, not /data's.
        controller->log_path_state = 1;
        copy_log_folder(controller, held, controller->run_folder, ".kelm_boot");
        return;
    }
}
