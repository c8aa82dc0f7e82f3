// The run's output files: names, opening with the timezone header, data
// writes, rotation in five generations and the move to another folder.
// Everything here runs under file_table_lock unless it says otherwise.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include "common/limits.h"
#include "common/log_types.h"
#include "transist/transist.h"

struct LogFile {
    int fd;              // open output file, -1 when none; > 0 means open
    int sock;            // collector connection registered for the type, -1 when none
    int size;            // collector bytes written to the current file since it was opened
    char name[PATH_LEN];  // full path of the output file
};

// Process-wide table of output files, one entry per log type (file_table_lock).
extern LogFile log_files[LOG_TYPE_COUNT];

// Longest header line, line feed included ("-----timezone: " + 83 characters).
constexpr int HEADER_MAX = 99;

// Resets the table and opens the files of the types the run enables in its
// folder; keeps its trusted root for later opens. Takes file_table_lock itself.
void open_output_files(const TransistRun& run);

// Opens path for appending (mode 0600), writes the header and syncs it.
// Returns the descriptor, or the failed open's -1 with errno set.
int open_log_file(const char* path);

// Formats "-----timezone: %s\n" into out (n bytes, n > HEADER_MAX). Returns the
// length; a zone too long for the line is cut, control bytes become '?'.
int format_header(char* out, size_t n, const char* timezone);

// out (PATH_LEN bytes) = folder + the type's file name. Returns 1, or 0 when
// the result would not fit (out is then empty).
int compose_log_name(char* out, const char* folder, int type);

// The rotation test after each written node: size / 1024 > limit_kb. A file
// also rotates before its byte count could overflow.
bool rotation_due(int64_t size, int limit_kb);

// Writes len bytes to the type's file, completing short writes. Counts what
// was written into size and returns it; a failure is recorded once per file.
int write_log_data(int type, const char* buf, int len);

// Renames X.3 -> X.4 ... X -> X.1 and opens a fresh X. Returns 0, or -1 when X
// could not be reopened (recorded; the entry then has no file). The old X is
// synced and closed by the next sync_retired_files.
int rotate_log_files(LogFile* entry);

// Syncs and closes the files rotation has set aside. Takes file_table_lock
// only to pick them up; call it without holding it.
void sync_retired_files();

// Syncs and closes the type's file for good and marks it closed.
void close_log_file(LogFile* entry);

// At the writer's end: closes every file (synced) and connection, clears names.
void close_all_log_files();
