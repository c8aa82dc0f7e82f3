// The platform log writer of the emulated phone: each message becomes one line
// in logcat's threadtime shape, appended to /dev/emu/wlog with a single write.
// O_APPEND and one write per call keep lines of concurrent writers (threads
// and collector processes) whole without any lock, and no lock means nothing
// a fork could leave held. The time is computed by hand for the same reason:
// glibc's localtime_r and gmtime_r take a process-wide lock.
#include "platform/wlog.h"

#include <atomic>
#include <errno.h>
#include <fcntl.h>
#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include "common/civil_time.h"
#include "common/io_util.h"

#define WLOG_PATH "/dev/emu/wlog"

// Longest line handed over, newline included; longer messages are cut.
static const size_t kLineMax = 1024;

static char priority_letter(int priority) {
    switch (priority) {
        case WLOG_DEBUG: return 'D';
        case WLOG_INFO: return 'I';
        case WLOG_WARN: return 'W';
        case WLOG_ERROR: return 'E';
        default: return 'V';
    }
}

// Offset of local time from UTC in seconds, learnt once per process image:
// the daemon logs before it forks, so collectors inherit it and never need to
// ask the C library in a forked child.
static std::atomic<long> g_utc_offset{0};
static std::atomic<bool> g_utc_offset_known{false};

static long utc_offset() {
    if (!g_utc_offset_known.load(std::memory_order_acquire)) {
        time_t now = time(nullptr);
        struct tm tm;
        long offset = 0;
        if (localtime_r(&now, &tm) != nullptr) offset = tm.tm_gmtoff;
        g_utc_offset.store(offset, std::memory_order_relaxed);
        g_utc_offset_known.store(true, std::memory_order_release);
    }
    return g_utc_offset.load(std::memory_order_relaxed);
}

// "MM-DD HH:MM:SS.mmm" of the local time.
static void format_time(char* out, size_t n) {
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    struct tm local;
    civil_time(static_cast<long long>(ts.tv_sec) + utc_offset(), &local);
    snprintf(out, n, "%02d-%02d %02d:%02d:%02d.%03d", local.tm_mon + 1, local.tm_mday,
             local.tm_hour, local.tm_min, local.tm_sec, static_cast<int>(ts.tv_nsec / 1000000));
}

// Appends the message bytes [p, end) to line (which holds len bytes), each
// text line behind its own prefix, leaving room for the final newline of
// every line. Control bytes other than tab are shown as \xNN so that one
// message can never fake or garble other lines. Returns the new length.
static size_t append_message(char* line, size_t len, const char* prefix, size_t prefix_len,
                             const char* p, const char* end) {
    const size_t cap = kLineMax - 1;  // the last byte is kept for the newline
    bool line_open = false;
    for (;;) {
        if (!line_open) {
            if (len + prefix_len > cap) break;
            memcpy(line + len, prefix, prefix_len);
            len += prefix_len;
            line_open = true;
        }
        if (p == end) break;
        unsigned char c = static_cast<unsigned char>(*p);
        if (c == '\n') {
            line[len++] = '\n';
            line_open = false;
            p++;
            if (len >= cap) break;
            continue;
        }
        if ((c < 0x20 && c != '\t') || c == 0x7f) {
            if (len + 4 > cap) break;
            snprintf(line + len, 5, "\\x%02x", c);
            len += 4;
        } else {
            if (len + 1 > cap) break;
            line[len++] = static_cast<char>(c);
        }
        p++;
    }
    if (p != end && line_open) {
        // Cut: do not leave half of a UTF-8 sequence before the newline.
        size_t keep = len;
        size_t continuations = 0;
        while (keep > 0 && (static_cast<unsigned char>(line[keep - 1]) & 0xC0) == 0x80) {
            keep--;
            continuations++;
        }
        unsigned char lead = keep > 0 ? static_cast<unsigned char>(line[keep - 1]) : 0;
        size_t needed = lead >= 0xF0 ? 3 : lead >= 0xE0 ? 2 : lead >= 0xC0 ? 1 : 0;
        if (continuations < needed) len = keep - 1;
    }
    if (line_open) line[len++] = '\n';
    return len;
}

extern "C" int __wlog_buf_printf(int buffer, const struct wlog_record* record, ...) {
    (void)buffer;  // the phone has one log
    if (record == nullptr || record->format == nullptr) return -1;
    int saved_errno = errno;  // callers log strerror(errno) and may use errno after

    char message[kLineMax];
    va_list ap;
    va_start(ap, record);
    int n = vsnprintf(message, sizeof(message), record->format, ap);
    va_end(ap);
    size_t msg_len = n < 0 ? 0 : static_cast<size_t>(n);
    if (msg_len >= sizeof(message)) msg_len = sizeof(message) - 1;
    // A trailing newline ends the message; it must not add an empty line.
    while (msg_len > 0 && message[msg_len - 1] == '\n') msg_len--;

    char stamp[32];
    format_time(stamp, sizeof(stamp));
    char prefix[160];
    int plen = snprintf(prefix, sizeof(prefix), "%s %5d %5d %c %-8.96s: ", stamp,
                        static_cast<int>(getpid()), static_cast<int>(gettid()),
                        priority_letter(record->priority), record->tag ? record->tag : "");
    size_t prefix_len =
        plen < 0 ? 0 : (static_cast<size_t>(plen) < sizeof(prefix) ? plen : sizeof(prefix) - 1);

    char line[kLineMax];
    size_t len = append_message(line, 0, prefix, prefix_len, message, message + msg_len);

    int rc = -1;
    // O_NONBLOCK: should the log ever be a pipe, a stalled reader must not stall the daemon.
    int fd = TEMP_FAILURE_RETRY(open(WLOG_PATH, O_WRONLY | O_APPEND | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (fd >= 0) {
        // One write, never completed by a second one: a second write could land
        // after another writer's line and split this one.
        rc = static_cast<int>(TEMP_FAILURE_RETRY(write(fd, line, len)));
        close(fd);
    }
    errno = saved_errno;
    return rc;
}
