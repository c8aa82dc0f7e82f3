// The platform log: every log site has one static record of tag, format and
// priority, handed to the platform writer __wlog_buf_printf.
#pragma once

#ifdef __cplusplus
extern "C" {
#endif

struct wlog_record {
    const char* tag;
    const char* format;
    int priority;
};

// Android log priorities.
enum { WLOG_DEBUG = 3, WLOG_INFO = 4, WLOG_WARN = 5, WLOG_ERROR = 6 };

// Writes one line to the platform log. Never blocks for long, is safe from any
// thread and after fork, and never calls back into the daemon. The result is
// never used by callers.
int __wlog_buf_printf(int buffer, const struct wlog_record* record, ...);

#ifdef __cplusplus
}
#endif

// Lets the compiler check each site's arguments against its format; never runs.
static inline void __attribute__((format(printf, 1, 2))) wlog_check_format(const char*, ...) {}

// Platform log only.
#define WLOG(tag, prio, fmt, ...)                                         \
    do {                                                                  \
        static const struct wlog_record wlog_rec_ = {tag, fmt, prio};     \
        if (0) wlog_check_format(fmt, ##__VA_ARGS__);                     \
        __wlog_buf_printf(0, &wlog_rec_, ##__VA_ARGS__);                  \
    } while (0)
