#include "config/config_store.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "common/wlog.h"
#include "config/log_path.h"
#include "platform/properties.h"
#include "storage/history_log.h"
#include "storage/safe_file.h"

namespace {

// A line of a configuration file is read in pieces of at most this many
// characters; a longer line is parsed piece by piece.
constexpr size_t READ_PIECE_LEN = 1022;
// config_parse_line looks at no more than this many characters of a line.
constexpr size_t PARSE_LINE_LEN = 254;

#define CONFIG_NAME "tqlog_config"
constexpr mode_t CONFIG_DIR_MODE = 0700;
constexpr mode_t CONFIG_FILE_MODE = 0600;

const char* const DEFAULT_KEYS[CONFIG_ITEM_COUNT] = {
    "autostart", "logpath", "logsize", "AndroidLog", "KernelLog", "BTLog", "totallogsize",
};
// autostart's default depends on the build type and is filled in at run time.
const char* const DEFAULT_VALUES[CONFIG_ITEM_COUNT] = {
    "0", "internal_sd", "300", "1", "1", "1", "600",
};

// Splits a file into lines of at most READ_PIECE_LEN characters. Reads are
// buffered and retried on EINTR; a NUL byte is kept and reported by length.
class LineReader {
  public:
    explicit LineReader(int fd) : fd_(fd) {}

    // Copies the next piece (line feed included) into out, which must hold
    // READ_PIECE_LEN + 1 bytes. Returns its length, 0 at end of file, or -1
    // when the file cannot be read any further.
    ssize_t next(char* out) {
        size_t n = 0;
        while (n < READ_PIECE_LEN) {
            if (pos_ == len_) {
                ssize_t r = RETRY_EINTR(read(fd_, buf_, sizeof(buf_)));
                if (r < 0 && n == 0) return -1;
                if (r <= 0) break;
                pos_ = 0;
                len_ = static_cast<size_t>(r);
            }
            char c = buf_[pos_++];
            out[n++] = c;
            if (c == '\n') break;
        }
        out[n] = '\0';
        return static_cast<ssize_t>(n);
    }

  private:
    int fd_;
    char buf_[4096];
    size_t pos_ = 0;
    size_t len_ = 0;
};

ConfigItem* find_item(ConfigCache* cache, const char* key) {
    for (ConfigItem& item : cache->items) {
        if (strcmp(item.key, key) == 0) return &item;
    }
    return nullptr;
}

// Files below /data are opened without following links: the folder of the
// configuration belongs to the shell user. The system image is read-only.
int open_for_reading(const char* path) {
    const char* root = trusted_root_of(path, nullptr);
    if (root != nullptr) return safe_open_path_file(root, path, SAFE_READ, 0);
    return RETRY_EINTR(open(path, O_RDONLY | O_CLOEXEC));
}

}  // namespace

void config_init(ConfigCache* cache) {
    config_make_dir();
    config_set_defaults(cache);
}

void config_make_dir() {
    if (access(CONFIG_DIR, F_OK) == 0) return;
    WLOG(TAG_CONFIG, WLOG_DEBUG, "create %s", CONFIG_DIR);
    // A fresh /data may lack /data/misc; the folder itself stays private.
    if (access("/data/misc", F_OK) != 0) make_dir_recursive("/data/misc");
    UniqueFd dir(open_daemon_dir(CONFIG_DIR_MODE));
    if (!dir.ok()) {
        int err = errno;
        HLOG(TAG_CONFIG, WLOG_ERROR, "create %s failed, error:%s(%d)", CONFIG_DIR, strerror(err), err);
    }
}

void config_set_defaults(ConfigCache* cache) {
    WLOG(TAG_CONFIG, WLOG_DEBUG, "init cache configure items....");
    memset(cache, 0, sizeof(*cache));
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) {
        copy_str(cache->items[i].key, CONFIG_FIELD_LEN, DEFAULT_KEYS[i]);
        copy_str(cache->items[i].value, CONFIG_FIELD_LEN, DEFAULT_VALUES[i]);
    }
    char build_type[PROPERTY_VALUE_MAX];
    property_get("ro.build.type", build_type, "user");
    if (strcmp(build_type, "eng") == 0) {
        copy_str(cache->items[0].value, CONFIG_FIELD_LEN, "1");
    } else {
        WLOG(TAG_CONFIG, WLOG_DEBUG, "value of %s:%s.", "ro.build.type", build_type);
    }
}

int config_read_file(ConfigCache* cache, const char* path) {
    if (strcmp(path, CONFIG_FILE) == 0) {
        cache->source = 0;
    } else if (strcmp(path, SYSTEM_DEFAULTS_FILE) == 0) {
        cache->source = 1;
    }
    UniqueFd fd(open_for_reading(path));
    if (!fd.ok()) {
        int err = errno;
        HLOG(TAG_CONFIG, WLOG_ERROR, "open %s error (%s)", path, strerror(err));
        return 0;
    }
    LineReader reader(fd.get());
    char piece[READ_PIECE_LEN + 1];
    ssize_t len;
    // A damaged file gets one record per kind of damage, not one per line.
    int cut_lines = 0;
    int nul_lines = 0;
    while ((len = reader.next(piece)) > 0) {
        // The parser sees C strings: a NUL byte would silently turn the line
        // into something other than what the file says.
        if (strlen(piece) != static_cast<size_t>(len)) {
            nul_lines++;
            continue;
        }
        if (static_cast<size_t>(len) > PARSE_LINE_LEN) cut_lines++;
        config_parse_line(cache, piece);
    }
    if (len < 0) {
        int err = errno;
        HLOG(TAG_CONFIG, WLOG_ERROR, "read %s error (%s)", path, strerror(err));
    }
    if (cut_lines > 0) {
        HLOG(TAG_CONFIG, WLOG_ERROR, "%d lines of %s too long, cut at %d characters", cut_lines, path,
             static_cast<int>(PARSE_LINE_LEN));
    }
    if (nul_lines > 0) {
        HLOG(TAG_CONFIG, WLOG_ERROR, "%d lines of %s hold a NUL byte, ignored", nul_lines, path);
    }
    return 1;
}

int config_read_system_defaults(ConfigCache* cache) {
    return config_read_file(cache, SYSTEM_DEFAULTS_FILE);
}

int config_load(ConfigCache* cache) {
    int rc = 0;
    if (config_read_file(cache, CONFIG_FILE) == 0) {
        HLOG(TAG_CONFIG, WLOG_ERROR, "some thing wrong when read %s,recreate a new one", CONFIG_FILE);
        if (config_write(cache) < 0) rc = -1;
    }
    apply_log_path_override(cache);
    return rc;
}

int config_write(const ConfigCache* cache) {
    // The new file is written aside and renamed over the old one, so a crash or
    // a full disk never leaves a half-written configuration behind.
    UniqueFd dir(open_daemon_dir(CONFIG_DIR_MODE));
    int fd = dir.ok() ? safe_replace_begin(dir.get(), CONFIG_NAME, CONFIG_FILE_MODE) : -1;
    if (fd < 0) {
        int err = errno;
        HLOG(TAG_CONFIG, WLOG_ERROR, "cant open the config file,errno=%d,%s", err, strerror(err));
        return -1;
    }
    int count = 0;
    for (const ConfigItem& item : cache->items) {
        // Key and value are at most 91 characters each, so the line always fits.
        char line[2 * CONFIG_FIELD_LEN + 2];
        int len = snprintf(line, sizeof(line), "%s=%s\n", item.key, item.value);
        if (len < 0 || len >= static_cast<int>(sizeof(line)) ||
            write_fully(fd, line, static_cast<size_t>(len)) != len) {
            int err = errno;
            // The record names the item without its line feed: one record, one line.
            if (len > 0 && len < static_cast<int>(sizeof(line))) line[len - 1] = '\0';
            HLOG(TAG_CONFIG, WLOG_ERROR, "write %s to configure file failed,erron:%d", line, err);
            // The old file stays in place rather than be replaced by an incomplete one.
            safe_replace_abort(dir.get(), CONFIG_NAME, fd);
            return -1;
        }
        count++;
    }
    if (safe_replace_commit(dir.get(), CONFIG_NAME, fd) != 0) {
        int err = errno;
        HLOG(TAG_CONFIG, WLOG_ERROR, "write %s to configure file failed,erron:%d", CONFIG_FILE, err);
        return -1;
    }
    WLOG(TAG_CONFIG, WLOG_DEBUG, "write %d config item to file", count);
    return count;
}

int config_update_item(ConfigCache* cache, const char* key, const char* value) {
    if (key == nullptr || value == nullptr) return 0;
    ConfigItem* item = find_item(cache, key);
    if (item == nullptr) {
        HLOG(TAG_CONFIG, WLOG_ERROR, "update item %s=%s to cache failed", key, value);
        return 0;
    }
    if (strcmp(item->value, value) == 0) return 0;
    // Refused rather than cut: a cut path or size would be a different setting.
    if (strlen(value) >= CONFIG_FIELD_LEN) {
        HLOG(TAG_CONFIG, WLOG_ERROR, "value of %s too long, ignored", key);
        return 0;
    }
    memset(item->value, 0, sizeof(item->value));
    copy_str(item->value, sizeof(item->value), value);
    return 1;
}

int config_change(ConfigCache* cache, const char* key, const char* value) {
    // Without a file the cache holds defaults: an "unchanged" value is not stored.
    bool stored = config_load(cache) == 0;
    if (config_update_item(cache, key, value) == 1) {
        WLOG(TAG_CONFIG, WLOG_DEBUG, "change config,key:%s,value:%s", key, value);
        stored = config_write(cache) >= 0;
    }
    return stored ? 1 : 0;
}

const char* config_get(ConfigCache* cache, const char* key) {
    if (key == nullptr) return nullptr;
    ConfigItem* item = find_item(cache, key);
    if (item == nullptr) return nullptr;
    if (strcmp(item->key, "logpath") == 0) return resolve_log_path(item->value, cache->resolved_path);
    return item->value;
}

void config_parse_line(ConfigCache* cache, const char* line) {
    char buf[PARSE_LINE_LEN + 1];
    // Only the start of an overlong line is parsed; config_read_file records the cut.
    size_t len = strnlen(line, PARSE_LINE_LEN);
    memcpy(buf, line, len);
    buf[len] = '\0';

    char* eq = strchr(buf, '=');
    if (eq == nullptr) return;
    *eq = '\0';
    char* key = buf;
    char* value = eq + 1;
    // Emptiness is judged before trimming: "key= \n" yields an empty value.
    if (*key == '\0' || *value == '\0') return;
    key = trim(key);
    value = trim(value);
    if (cache->source == 0) {
        config_update_item(cache, key, value);
    } else if (cache->source == 1) {
        config_map_system_key(cache, key, value);
    }
}

void config_map_system_key(ConfigCache* cache, const char* key, const char* value) {
    if (strcmp(key, "com.quorvex.log.tavlo.enabled") == 0) {
        config_update_item(cache, "autostart", strcmp(value, "true") == 0 ? "1" : "0");
    } else if (strcmp(key, "com.quorvex.log.tavlo.maxsize") == 0) {
        config_update_item(cache, "logsize", value);
    } else if (strcmp(key, "qrvlog_path") == 0) {
        config_update_item(cache, "logpath", value);
    }
}

char* trim(char* s) {
    size_t len = strlen(s);
    // The first character always stays, so a lone line feed survives.
    while (len > 1 && (s[len - 1] == ' ' || s[len - 1] == '\n')) s[--len] = '\0';
    while (*s == ' ') s++;
    return s;
}
