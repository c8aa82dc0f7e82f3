// The daemon's one way out when it cannot go on. Init sees the exit status and
// starts the daemon again; the status stays what it has always been, 1 for a
// run that cannot be set up and 255 (-1) for a control thread that cannot start.
#pragma once

#include <stdlib.h>

#include "record/record.h"

[[noreturn]] inline void daemon_exit(int status) { exit(status); }

// Records why (history and platform log, as an error), then ends the daemon.
#define DAEMON_FATAL(status, tag, fmt, ...)                 \
    do {                                                    \
        HLOG(tag, WLOG_ERROR, fmt, ##__VA_ARGS__);          \
        daemon_exit(status);                                \
    } while (0)
