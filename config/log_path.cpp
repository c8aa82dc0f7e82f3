#include "config/log_path.h"

#include <string.h>

#include "common/io_util.h"
#include "common/wlog.h"
#include "config/config_store.h"
#include "platform/properties.h"
#include "storage/history_log.h"
#include "storage/safe_file.h"

namespace {

bool is_symbolic_name(const char* value) {
    return strcmp(value, "internal_sd") == 0 || strcmp(value, "external_sd") == 0;
}

bool is_clean_absolute_path(const char* path) {
    if (path[0] != '/' || strlen(path) >= static_cast<size_t>(CONFIG_FIELD_LEN)) return false;
    for (const char* at = path; *at != '\0';) {
        while (*at == '/') at++;
        size_t len = strcspn(at, "/");
        if ((len == 1 && at[0] == '.') || (len == 2 && at[0] == '.' && at[1] == '.')) return false;
        at += len;
    }
    return true;
}

// DAEMON_DIR itself or anything below it, however its slashes are doubled.
bool in_daemon_dir(const char* path) {
    const char* own = DAEMON_DIR;
    while (*own != '\0') {
        while (*path == '/') path++;
        while (*own == '/') own++;
        size_t len = strcspn(own, "/");
        if (strncmp(path, own, len) != 0 || (path[len] != '/' && path[len] != '\0')) return false;
        path += len;
        own += len;
    }
    return true;
}

// Why a directory cannot take the run folders, or nullptr.
const char* dir_fault(const char* path) {
    if (!is_clean_absolute_path(path)) return "not an absolute path";
    // Runs there would mix the logs with the configuration and history.
    if (in_daemon_dir(path)) return "the daemon's own folder";
    if (strlen(path) > static_cast<size_t>(LOG_PATH_MAX_LEN)) return "too long for a run folder";
    return nullptr;
}

// Directory of a storage from its property, or the fixed fallback when the
// property is unset. Properties are read afresh: the storage may be remounted.
void storage_dir(const char* property, const char* fallback, char* out) {
    char dir[PROPERTY_VALUE_MAX];
    property_get(property, dir, "");
    if (dir_fault(dir) != nullptr) {
        HLOG(TAG_CONFIG, WLOG_ERROR, "cant get log path through property %s", property);
        copy_str(out, CONFIG_FIELD_LEN, fallback);
    } else {
        copy_str(out, CONFIG_FIELD_LEN, dir);
    }
}

}  // namespace

const char* log_path_value_fault(const char* value) {
    if (value == nullptr) return "not an absolute path";
    return is_symbolic_name(value) ? nullptr : dir_fault(value);
}

int log_path_value_valid(const char* value) { return log_path_value_fault(value) == nullptr; }

const char* resolve_log_path(const char* value, char* out) {
    if (value == nullptr) value = "";
    if (const char* fault = log_path_value_fault(value)) {
        // A file edited by hand, or an override property: "tmp" would put the
        // logs in the working folder, ".." components anywhere.
        HLOG(TAG_CONFIG, WLOG_ERROR, "log path %s is %s, internal_sd used", value, fault);
        value = "internal_sd";
    }
    if (strcmp(value, "internal_sd") == 0) {
        storage_dir("internal_sd_path", "/mnt/sdcard", out);
    } else if (strcmp(value, "external_sd") == 0) {
        storage_dir("external_sd_path", "/mnt/sdcard2", out);
    } else {
        copy_str(out, CONFIG_FIELD_LEN, value);
    }
    WLOG(TAG_CONFIG, WLOG_DEBUG, "correct log path is %s", out);
    return out;
}

void apply_log_path_override(ConfigCache* cache) {
    char override_path[PROPERTY_VALUE_MAX];
    property_get("persist.qrvlog.log2sd.path", override_path, "");
    if (override_path[0] == '\0') return;
    // config_update_item reports 0 when the value is already the stored one.
    if (config_update_item(cache, "logpath", override_path) == 0) return;
    WLOG(TAG_CONFIG, WLOG_DEBUG, "new log path is %s", override_path);
    config_write(cache);
}
