#include "storage/history_log.h"

#include <atomic>
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include "common/civil_time.h"
#include "common/io_util.h"
#include "common/limits.h"
#include "common/text.h"
#include "common/unique_fd.h"
#include "platform/properties.h"
#include "record/record.h"
#include "storage/safe_file.h"

namespace {

#define HISTORY_DIR DAEMON_DIR
#define HISTORY_NAME "tqlog_history"
#define HISTORY_PREVIOUS "tqlog_history.1"
constexpr mode_t HISTORY_DIR_MODE = 0775;
constexpr mode_t HISTORY_MODE = 0664;

// Timestamp, message and joined line are each cut at this many characters.
constexpr size_t RECORD_LEN = 254;

// Serialises the records of this process, so they reach each file whole and in
// the order the lock was taken. Non-recursive; taken last by every thread.
pthread_mutex_t history_lock = PTHREAD_MUTEX_INITIALIZER;
// 1 once the central file's mode has been set. Guarded by history_lock.
int history_mode_set = 0;
// Where the trusted part of a run folder ends (the log path, or "/data").
// Guarded by history_lock.
char run_folder_root[PATH_LEN];
// True while this thread holds history_lock: a record written from inside a
// record (a refusal the safe file helpers record under the lock) must not
// take it again.
thread_local bool holding_history_lock = false;

// The C library's local-time conversion takes a process-wide lock that a fork
// can leave held by a thread that no longer exists. A forked child therefore
// converts by hand, with the offset from UTC that the parent saw last.
std::atomic<long> utc_offset{0};
std::atomic<bool> forked_child{false};

// Past this size a history file becomes the previous generation and a new one
// is started: the diary keeps its recent past and can never fill /data.
constexpr off_t HISTORY_MAX_BYTES = 1 << 20;

// Renames the full file behind fd to the previous generation, unless another
// process (a collector, or a daemon restarted meanwhile) got there first, and
// opens the new file. The lock is only tried: nothing may hang a record.
int start_generation(int dirfd, int fd, const struct stat& full) {
    if (flock(fd, LOCK_EX | LOCK_NB) == 0) {
        struct stat now;
        if (fstatat(dirfd, HISTORY_NAME, &now, AT_SYMLINK_NOFOLLOW) == 0 && now.st_ino == full.st_ino &&
            now.st_dev == full.st_dev) {
            renameat(dirfd, HISTORY_NAME, dirfd, HISTORY_PREVIOUS);
        }
        flock(fd, LOCK_UN);
    }
    close(fd);
    return safe_open_file(dirfd, HISTORY_NAME, SAFE_APPEND, HISTORY_MODE);
}

// Appends one record with a single write: O_APPEND places it at the end at the
// moment of the write, so records of different processes never interleave.
// Returns the file's descriptor for the caller to close, or -1 when it could
// not be opened (the record is lost in this file, silently).
int append_record(int dirfd, const char* line, size_t len) {
    int fd = safe_open_file(dirfd, HISTORY_NAME, SAFE_APPEND, HISTORY_MODE);
    struct stat st;
    if (fd >= 0 && fstat(fd, &st) == 0 && st.st_size >= HISTORY_MAX_BYTES) {
        fd = start_generation(dirfd, fd, st);
    }
    if (fd >= 0) write_fully(fd, line, len);
    return fd;
}

// The run's own file: the folder is opened below the root the daemon trusts
// for it; a folder of unknown origin is trusted up to its parent only.
void append_run_record(const char* folder, const char* line, size_t len) {
    char parent[PATH_LEN];
    const char* root = trusted_root_for(folder, run_folder_root, parent);
    if (root == nullptr) return;
    UniqueFd dir(safe_open_dir(root, folder, false, 0));
    if (!dir.ok()) return;
    UniqueFd fd(append_record(dir.get(), line, len));
}

// Registered when the program loads, so every fork is covered, also those of
// code that does not know about the history log: in the child the parent's
// other threads are gone, and one of them may have held the lock.
__attribute__((constructor)) void register_history_fork_handler() {
    pthread_atfork(nullptr, nullptr, history_log_after_fork);
}

// "%Y:%m:%d %H:%M:%S " of the local time: 20 characters. Formatted by hand
// because strftime, too, takes the time-zone lock.
void format_stamp(char* out, size_t n) {
    time_t now = time(nullptr);
    struct tm local;
    bool ok = false;
    if (!forked_child.load(std::memory_order_relaxed)) {
        ok = localtime_r(&now, &local) != nullptr;
        if (ok) utc_offset.store(local.tm_gmtoff, std::memory_order_relaxed);
    }
    if (!ok) civil_time(static_cast<long long>(now) + utc_offset.load(std::memory_order_relaxed), &local);
    snprintf(out, n, "%04d:%02d:%02d %02d:%02d:%02d ", local.tm_year + 1900, local.tm_mon + 1,
             local.tm_mday, local.tm_hour, local.tm_min, local.tm_sec);
}

}  // namespace

void history_log_after_fork() {
    pthread_mutex_init(&history_lock, nullptr);
    holding_history_lock = false;
    forked_child.store(true, std::memory_order_relaxed);
}

void history_log(int level, const char* format, ...) {
    va_list args;
    va_start(args, format);
    history_vlog(level, format, args);
    va_end(args);
}

void history_vlog(int level, const char* format, va_list args) {
    if (level < 0 || level > 2) return;
    if (holding_history_lock) return;

    char stamp[RECORD_LEN + 1];
    format_stamp(stamp, sizeof(stamp));

    char message[RECORD_LEN + 1];
    if (vsnprintf(message, sizeof(message), format, args) < 0) message[0] = '\0';
    // A record is one line: line breaks and other control bytes in a message
    // (a client's command text, a damaged configuration line) would forge or
    // garble lines. Tabs are harmless and stay.
    printable_record(message);

    // The line keeps room for its newline so each file gets it in one write.
    char line[RECORD_LEN + 2];
    int len = snprintf(line, RECORD_LEN + 1, "%s%s", stamp, message);
    if (len < 0) return;
    size_t n = static_cast<size_t>(len) > RECORD_LEN ? RECORD_LEN : static_cast<size_t>(len);
    line[n++] = '\n';
    line[n] = '\0';

    pthread_mutex_lock(&history_lock);
    holding_history_lock = true;

    bool have_run_folder = false;
    if (level == 1 || level == 2) {
        char folder[PATH_LEN];
        if (get_run_folder(folder) != nullptr) {
            have_run_folder = true;
            append_run_record(folder, line, n);
        }
    }

    // Level 1 belongs to the run; only without a run folder does it go to the
    // central file, even if the run file could not be written.
    bool central = level == 0 || level == 2 || (level == 1 && !have_run_folder);
    if (central) {
        if (access(HISTORY_DIR, F_OK) != 0) history_mode_set = 0;
        UniqueFd dir(open_daemon_dir(HISTORY_DIR_MODE));
        if (!dir.ok()) {
            int err = errno;
            WLOG(TAG_MLOG, WLOG_ERROR, "create dir %s failed(%s)", HISTORY_DIR, strerror(err));
        } else {
            UniqueFd fd(append_record(dir.get(), line, n));
            // Once per process and after each re-creation of the folder; through
            // the descriptor, so never on what a link points to.
            if (history_mode_set == 0 && fd.ok()) {
                fchmod(fd.get(), HISTORY_MODE);
                history_mode_set = 1;
            }
        }
    }

    holding_history_lock = false;
    pthread_mutex_unlock(&history_lock);
}

void set_run_folder_root(const char* root) {
    pthread_mutex_lock(&history_lock);
    copy_str(run_folder_root, sizeof(run_folder_root), root ? root : "");
    pthread_mutex_unlock(&history_lock);
}

char* get_run_folder(char* out) {
    char folder[PROPERTY_VALUE_MAX];
    property_get("debug.TQ.realpath", folder, "");
    if (folder[0] == '\0') return nullptr;
    memcpy(out, folder, strlen(folder) + 1);
    return out;
}
