#include "storage/history_log.h"

#include <atomic>
#include <errno.h>
#include <fcntl.h>
#include <libgen.h>
#include <pthread.h>
#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include "common/civil_time.h"
#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "common/wlog.h"
#include "platform/properties.h"

namespace {

#define HISTORY_DIR "/data/misc/tqlog"
#define HISTORY_FILE "/data/misc/tqlog/tqlog_history"
#define HISTORY_NAME "tqlog_history"

// Timestamp, message and joined line are each cut at this many characters.
constexpr size_t RECORD_LEN = 254;

// Serialises the records of this process, so they reach each file whole and in
// the order the lock was taken. Non-recursive; taken last by every thread.
pthread_mutex_t history_lock = PTHREAD_MUTEX_INITIALIZER;
// 1 once the central file's mode has been set. Guarded by history_lock.
int history_mode_set = 0;
// True while this thread holds history_lock: a record written from inside a
// record (make_dir_recursive failing under the lock) must not take it again.
thread_local bool holding_history_lock = false;

// The C library's local-time conversion takes a process-wide lock that a fork
// can leave held by a thread that no longer exists. A forked child therefore
// converts by hand, with the offset from UTC that the parent saw last.
std::atomic<long> utc_offset{0};
std::atomic<bool> forked_child{false};

// Appends one record with a single write: O_APPEND places it at the end at the
// moment of the write, so records of different processes never interleave.
// A file that cannot be opened loses this record silently.
void append_record(const char* path, const char* line, size_t len) {
    UniqueFd fd(RETRY_EINTR(open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0666)));
    if (fd.ok()) write_fully(fd.get(), line, len);
}

// A record is one line: line breaks and other control bytes in a message
// (a client's command text, a damaged configuration line) would forge or
// garble lines, so they are shown as '?'. Tabs are harmless and stay.
void make_printable(char* s) {
    for (; *s != '\0'; s++) {
        unsigned char c = static_cast<unsigned char>(*s);
        if ((c < 0x20 && c != '\t') || c == 0x7f) *s = '?';
    }
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
    if (level < 0 || level > 2) return;
    if (holding_history_lock) return;

    char stamp[RECORD_LEN + 1];
    format_stamp(stamp, sizeof(stamp));

    char message[RECORD_LEN + 1];
    va_list args;
    va_start(args, format);
    if (vsnprintf(message, sizeof(message), format, args) < 0) message[0] = '\0';
    va_end(args);
    make_printable(message);

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
        char path[PATH_LEN];
        if (get_run_folder(path) != nullptr) {
            have_run_folder = true;
            if (strlen(path) + strlen(HISTORY_NAME) < sizeof(path)) {
                strcat(path, HISTORY_NAME);
                append_record(path, line, n);
            }
        }
    }

    // Level 1 belongs to the run; only without a run folder does it go to the
    // central file, even if the run file could not be written.
    bool central = level == 0 || level == 2 || (level == 1 && !have_run_folder);
    if (central) {
        bool dir_ok = true;
        if (access(HISTORY_DIR, F_OK) != 0) {
            history_mode_set = 0;
            // Another process may create it at the same moment; that is success too.
            if (make_dir_recursive(HISTORY_DIR) == 0 && access(HISTORY_DIR, F_OK) != 0) {
                int err = errno;
                WLOG(TAG_MLOG, WLOG_ERROR, "create dir %s failed(%s)", HISTORY_DIR, strerror(err));
                dir_ok = false;
            }
        }
        if (dir_ok) {
            append_record(HISTORY_FILE, line, n);
            // Once per process and after each re-creation of the folder.
            if (history_mode_set == 0) {
                chmod(HISTORY_FILE, 0664);
                history_mode_set = 1;
            }
        }
    }

    holding_history_lock = false;
    pthread_mutex_unlock(&history_lock);
}

char* get_run_folder(char* out) {
    char folder[PROPERTY_VALUE_MAX];
    property_get("debug.TQ.realpath", folder, "");
    if (folder[0] == '\0') return nullptr;
    memcpy(out, folder, strlen(folder) + 1);
    return out;
}

int make_dir_recursive(const char* path) {
    WLOG(TAG_UTIL, WLOG_INFO, "create dir %s", path);

    char buf[RECORD_LEN + 1];
    int ok = copy_str(buf, sizeof(buf), path);
    if (ok) {
        char parent[RECORD_LEN + 1];
        copy_str(parent, sizeof(parent), dirname(buf));
        // A failure of the parent shows in the mkdir below.
        if (access(parent, F_OK) != 0) make_dir_recursive(parent);
        if (mkdir(path, 0775) == 0) return 1;
    } else {
        // A cut path would create some other directory.
        errno = ENAMETOOLONG;
    }
    int err = errno;
    HLOG(TAG_UTIL, WLOG_ERROR, "mkdir fail(%s)", strerror(err));
    errno = err;
    return 0;
}
