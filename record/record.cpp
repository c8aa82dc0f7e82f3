#include "record/record.h"

#include <atomic>

// Set once before the daemon's threads start; read by every record.
static std::atomic<HistorySink> history_sink{nullptr};

void record_set_history_sink(HistorySink sink) { history_sink.store(sink); }

void record_history(int level, const char* format, ...) {
    HistorySink sink = history_sink.load();
    if (sink == nullptr) return;
    va_list args;
    va_start(args, format);
    sink(level, format, args);
    va_end(args);
}
