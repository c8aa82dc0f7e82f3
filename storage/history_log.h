// The daemon's diary: timestamped one-line records in /data/misc/tqlog/tqlog_history
// and in the current run folder's tqlog_history.
#pragma once

#include <stdarg.h>

// level 0: central file only; 1: run file, or the central file when no run
// folder is set; 2: both; any other level: nothing. A file past 1 MiB becomes
// "tqlog_history.1" (replacing the previous one) and a new file is started.
void history_log(int level, const char* format, ...) __attribute__((format(printf, 2, 3)));
// The same, for the record sink: core installs it with record_set_history_sink.
void history_vlog(int level, const char* format, va_list args);

// The trusted leading part of the run folders that debug.TQ.realpath names
// (the log path; "/data" is always trusted): below it every folder and the
// run's file are opened without following links.
void set_run_folder_root(const char* root);

// Copies debug.TQ.realpath into out (at least 255 bytes) and returns out, or
// returns nullptr when the property is empty.
char* get_run_folder(char* out);

// Called in a freshly forked child: the history lock may have been held by
// another thread of the parent at the fork.
void history_log_after_fork();
