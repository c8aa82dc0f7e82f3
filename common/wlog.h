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

#define TAG_MAIN "TavloLogD"
#define TAG_DEBUG "TavloLogD/DEBUG"
#define TAG_KERNEL "TavloLogD/Kernel"
#define TAG_ANDROID "TavloLogD/Android"
#define TAG_BT "TavloLogD/BT"
#define TAG_UTIL "TavloLogD/Util"
#define TAG_CONFIG "TavloLogD/CONFIG"
#define TAG_TRANSIST "TavloLogD/Transist"
#define TAG_MLOG "TavloLogD/mlog"
#define TAG_DUPM "TavloLogD/dupm"
#define TAG_SIZE "TavloLogD/size"

// Lets the compiler check each site's arguments against its format; never runs.
static inline void __attribute__((format(printf, 1, 2))) wlog_check_format(const char*, ...) {}

// Platform log only.
#define WLOG(tag, prio, fmt, ...)                                         \
    do {                                                                  \
        static const struct wlog_record wlog_rec_ = {tag, fmt, prio};     \
        if (0) wlog_check_format(fmt, ##__VA_ARGS__);                     \
        __wlog_buf_printf(0, &wlog_rec_, ##__VA_ARGS__);                  \
    } while (0)

// Declared in storage/history_log.h; repeated so HLOG sites need only this header.
void history_log(int level, const char* format, ...) __attribute__((format(printf, 2, 3)));

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#pragma GCC diagnostic ignored "-Wformat-security"
// Takes the arguments by value so that each is evaluated once, even though the
// record goes to two places.
template <typename... Args>
inline void hlog_emit(const struct wlog_record* record, Args... args) {
    history_log(2, record->format, args...);
    __wlog_buf_printf(0, record, args...);
}
#pragma GCC diagnostic pop

// A notable event: the history log at level 2 and the platform log, same text.
#define HLOG(tag, prio, fmt, ...)                                         \
    do {                                                                  \
        static const struct wlog_record wlog_rec_ = {tag, fmt, prio};     \
        if (0) wlog_check_format(fmt, ##__VA_ARGS__);                     \
        hlog_emit(&wlog_rec_, ##__VA_ARGS__);                             \
    } while (0)
