// Output files of a logging run.
#include "transist/log_files.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/text.h"
#include "common/unique_fd.h"
#include "platform/properties.h"
#include "record/record.h"
#include "storage/safe_file.h"
#include "transist/transist_queue.h"
#include "transist/transist_state.h"

LogFile log_files[LOG_TYPE_COUNT];
pthread_mutex_t file_table_lock = PTHREAD_MUTEX_INITIALIZER;
std::atomic<int> rotate_limit_kb{1024};

static const char HEADER_PREFIX[] = "-----timezone: ";

// One record per file for failed data writes: a full disk fails every node.
static bool write_failure_recorded[LOG_TYPE_COUNT];

// The run's log path when the files were opened: a folder below it is
// trusted from there on, one in /data from "/data" (trusted_root_for); below
// that nothing is opened through a link. file_table_lock.
static char log_root[PATH_LEN];

static void take_log_root(const char* trusted_root) {
    copy_str(log_root, sizeof(log_root), trusted_root ? trusted_root : "");
}

// Opens the folder of path (which ends in a file name) and puts the file
// name's offset into *name_at.
static int open_folder_of(const char* path, size_t* name_at) {
    const char* slash = strrchr(path, '/');
    if (slash == nullptr) {
        errno = EINVAL;
        return -1;
    }
    char folder[PATH_LEN];
    *name_at = static_cast<size_t>(slash - path) + 1;
    memcpy(folder, path, *name_at);
    folder[*name_at] = '\0';
    char parent[PATH_LEN];
    const char* root = trusted_root_for(folder, log_root, parent);
    if (root == nullptr) {
        errno = EINVAL;
        return -1;
    }
    return safe_open_dir(root, folder, false, 0);
}

// Forgets a file's recorded write failure; entries outside the table have none.
static void reset_write_failure(const LogFile* entry) {
    if (entry >= log_files && entry < log_files + LOG_TYPE_COUNT) {
        write_failure_recorded[entry - log_files] = false;
    }
}

int format_header(char* out, size_t n, const char* timezone) {
    static std::atomic<bool> cut_recorded{false};
    const int prefix_len = static_cast<int>(sizeof(HEADER_PREFIX)) - 1;
    const int zone_max = HEADER_MAX - prefix_len - 1;  // room left for the line feed
    int zone_len = static_cast<int>(strnlen(timezone, PROPERTY_VALUE_MAX));
    if (zone_len > zone_max) {
        if (!cut_recorded.exchange(true)) {
            char shown[PROPERTY_VALUE_MAX];
            printable_copy(shown, sizeof(shown), timezone);
            HLOG(TAG_TRANSIST, WLOG_WARN, "timezone %s too long, cut to %d characters", shown,
                 zone_max);
        }
        zone_len = zone_max;
    }
    char zone[HEADER_MAX];
    memcpy(zone, timezone, static_cast<size_t>(zone_len));
    zone[zone_len] = '\0';
    // A line feed inside the zone would split the header line.
    printable_header(zone, static_cast<size_t>(zone_len));
    int len = snprintf(out, n, "%s%s\n", HEADER_PREFIX, zone);
    if (len < 0) return 0;
    return len < static_cast<int>(n) ? len : static_cast<int>(n) - 1;
}

// Opens name in the folder dirfd for appending and writes the header.
static int open_in_folder(int dirfd, const char* name, const char* path) {
    // O_CLOEXEC (the helper's) keeps the files out of the shell commands the
    // daemon runs; the forked collectors close their copies themselves.
    int fd = safe_open_file(dirfd, name, SAFE_APPEND, 0600);
    if (fd < 0) return fd;
    if (fd == 0) {
        // Descriptor 0 counts as "no file" in the table; move it out of the way.
        int moved = fcntl(fd, F_DUPFD_CLOEXEC, 3);
        int saved = errno;
        close(fd);
        if (moved < 0) {
            errno = saved;
            return -1;
        }
        fd = moved;
    }
    char zone[PROPERTY_VALUE_MAX];
    property_get("persist.sys.timezone", zone, "GMT");
    char header[HEADER_MAX + 1];
    int len = format_header(header, sizeof(header), zone);
    if (write_fully(fd, header, static_cast<size_t>(len)) != len) {
        int err = errno;
        HLOG(TAG_TRANSIST, WLOG_ERROR, "write %s fail,%s(%d)", path, strerror(err), err);
    }
    TEMP_FAILURE_RETRY(fsync(fd));
    return fd;
}

int open_log_file(const char* path) {
    size_t name_at = 0;
    UniqueFd dir(open_folder_of(path, &name_at));
    if (!dir.ok()) return -1;
    return open_in_folder(dir.get(), path + name_at, path);
}

int compose_log_name(char* out, const char* folder, int type) {
    int len = snprintf(out, PATH_LEN, "%s%s", folder, log_type_name(type));
    if (len < 0 || len >= PATH_LEN) {
        out[0] = '\0';
        return 0;
    }
    return 1;
}

void open_output_files(const TransistRun& run) {
    const char* run_folder = run.folder;
    pthread_mutex_lock(&file_table_lock);
    take_log_root(run.trusted_root);
    for (int type = 0; type < LOG_TYPE_COUNT; type++) {
        log_files[type].fd = -1;
        log_files[type].size = 0;
        log_files[type].name[0] = '\0';
        write_failure_recorded[type] = false;
    }
    for (int type = 0; type < LOG_TYPE_COUNT; type++) {
        if (!run.enabled[type]) continue;
        LogFile* entry = &log_files[type];
        if (!compose_log_name(entry->name, run_folder, type)) {
            HLOG(TAG_TRANSIST, WLOG_ERROR, "log file path too long: %.200s... + %s", run_folder,
                 log_type_name(type));
            continue;
        }
        entry->fd = open_log_file(entry->name);
        if (entry->fd < 0) {
            int err = errno;
            if (type == LOG_BT) {
                HLOG(TAG_TRANSIST, WLOG_ERROR, "Create %s fail, %s", entry->name, strerror(err));
            } else {
                HLOG(TAG_TRANSIST, WLOG_ERROR, "Create %s fail %s", entry->name, strerror(err));
            }
        }
        HLOG(TAG_TRANSIST, WLOG_INFO, "open %s, fd = %d", entry->name, entry->fd);
    }
    pthread_mutex_unlock(&file_table_lock);
}

bool rotation_due(int64_t size, int limit_kb) {
    return size / 1024 > limit_kb || size > INT_MAX - MAX_CAPACITY;
}

int write_log_data(int type, const char* buf, int len) {
    LogFile* entry = &log_files[type];
    ssize_t done = write_fully(entry->fd, buf, static_cast<size_t>(len));
    if (done < len) {
        int err = errno;
        if (!write_failure_recorded[type]) {
            write_failure_recorded[type] = true;
            HLOG(TAG_TRANSIST, WLOG_ERROR, "write log data to %s fail,%s(%d), %d of %d bytes lost",
                 entry->name, strerror(err), err, len - static_cast<int>(done > 0 ? done : 0), len);
        }
        if (done < 0) done = 0;
    }
    entry->size += static_cast<int>(done);
    return static_cast<int>(done);
}

void close_log_file(LogFile* entry) {
    if (entry->fd > 0) {
        // Closed for good: what the collectors sent must survive a power cut.
        TEMP_FAILURE_RETRY(fsync(entry->fd));
        close(entry->fd);
    }
    entry->fd = -1;
}

// Rotated-out files wait here for their sync, which the writer does after it
// has let go of the file table: a sync can take many milliseconds, and the
// reader needs the table to go on taking the collectors' data meanwhile.
static int retired_fds[16];  // file_table_lock
static int retired_count = 0;  // file_table_lock

static void retire_log_file(LogFile* entry) {
    if (entry->fd > 0 && retired_count < static_cast<int>(sizeof(retired_fds) / sizeof(int))) {
        retired_fds[retired_count++] = entry->fd;
        entry->fd = -1;
        return;
    }
    close_log_file(entry);
}

void sync_retired_files() {
    int fds[sizeof(retired_fds) / sizeof(int)];
    pthread_mutex_lock(&file_table_lock);
    int count = retired_count;
    memcpy(fds, retired_fds, sizeof(int) * static_cast<size_t>(count));
    retired_count = 0;
    pthread_mutex_unlock(&file_table_lock);
    for (int i = 0; i < count; i++) {
        TEMP_FAILURE_RETRY(fsync(fds[i]));
        close(fds[i]);
    }
}

int rotate_log_files(LogFile* entry) {
    retire_log_file(entry);
    // Renamed and reopened from the folder's descriptor: a link planted in
    // the folder's path since it was opened is not followed.
    size_t name_at = 0;
    UniqueFd dir(open_folder_of(entry->name, &name_at));
    const char* name = entry->name + name_at;
    char from[PATH_LEN + 8];
    char to[PATH_LEN + 8];
    for (int i = 4; dir.ok() && i >= 1; i--) {
        if (i == 1) {
            snprintf(from, sizeof(from), "%s", name);
        } else {
            snprintf(from, sizeof(from), "%s.%d", name, i - 1);
        }
        snprintf(to, sizeof(to), "%s.%d", name, i);
        // A generation that does not exist yet is normal.
        if (renameat(dir.get(), from, dir.get(), to) != 0 && errno != ENOENT) {
            perror("while rotating log files");
        }
    }
    entry->fd = dir.ok() ? open_in_folder(dir.get(), name, entry->name) : -1;
    entry->size = 0;
    reset_write_failure(entry);
    if (entry->fd < 0) {
        int err = errno;
        HLOG(TAG_TRANSIST, WLOG_ERROR, "couldn't open output file %s,(%d)%s", entry->name, err,
             strerror(err));
        entry->fd = -1;
        return -1;
    }
    return 0;
}

void close_all_log_files() {
    for (LogFile& entry : log_files) {
        close_log_file(&entry);
        if (entry.sock >= 0) close(entry.sock);
        entry.sock = -1;
        entry.name[0] = '\0';
    }
}

void change_log_folder(const char* new_folder, const char* trusted_root, int new_rotate_kb) {
    pthread_mutex_lock(&file_table_lock);
    take_log_root(trusted_root);
    for (int type = 0; type < LOG_TYPE_COUNT; type++) {
        LogFile* entry = &log_files[type];
        if (entry->fd <= 0) continue;
        char name[PATH_LEN];
        if (new_folder == nullptr || !compose_log_name(name, new_folder, type)) {
            // Keep writing where we are rather than lose the type's logs.
            HLOG(TAG_TRANSIST, WLOG_ERROR, "new log folder path too long, %s stays in %s",
                 log_type_name(type), entry->name);
            continue;
        }
        close_log_file(entry);
        memcpy(entry->name, name, sizeof(name));
        entry->fd = open_log_file(entry->name);
        entry->size = 0;
        write_failure_recorded[type] = false;
        if (entry->fd < 0) {
            int err = errno;
            HLOG(TAG_TRANSIST, WLOG_ERROR, "Change filename %s fail, errno = %d: %s", entry->name,
                 err, strerror(err));
            entry->fd = -1;
        }
    }
    pthread_mutex_unlock(&file_table_lock);
    HLOG(TAG_TRANSIST, WLOG_INFO, "rotates size change from %dK to %dK", rotate_limit_kb.load(),
         new_rotate_kb);
    rotate_limit_kb = new_rotate_kb;
}
