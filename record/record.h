// The daemon's records: a notable event goes to the history (through the sink
// core installs) and to the platform log, with the same text.
#pragma once

#include <stdarg.h>

#include "platform/wlog.h"

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

// The daemon's history, installed by core at start-up; until then records go
// to the platform log only. Inherited by every forked collector.
using HistorySink = void (*)(int level, const char* format, va_list args);
void record_set_history_sink(HistorySink sink);

// A record for the history alone, at a level the history knows (0 central
// file, 1 the run's, 2 both).
void record_history(int level, const char* format, ...) __attribute__((format(printf, 2, 3)));

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#pragma GCC diagnostic ignored "-Wformat-security"
// Takes the arguments by value so that each is evaluated once, even though the
// record goes to two places.
template <typename... Args>
inline void hlog_emit(const struct wlog_record* record, Args... args) {
    record_history(2, record->format, args...);
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
