// Resolution of the logpath setting into a directory, and its override by
// persist.qrvlog.log2sd.path.
#pragma once

// A logpath value or directory: at most 91 characters, as a configuration value.
constexpr int LOG_PATH_VALUE_MAX = 92;

// The longest directory usable as log path: a run folder below it adds 40
// characters ("/qrvlog/tavlolog/APLog_YYYY_MMDD_HHMMSS/") and is published in
// debug.TQ.realpath, a property value of at most 91 characters.
constexpr int LOG_PATH_MAX_LEN = 51;

// Why a logpath value cannot be used, or nullptr when it can: "internal_sd",
// "external_sd", or an absolute path of at most LOG_PATH_MAX_LEN characters
// without "." or ".." components (a relative one would be taken from the
// daemon's working folder) and outside the daemon's own folder.
const char* log_path_value_fault(const char* value);
// 1 when log_path_value_fault finds nothing.
int log_path_value_valid(const char* value);

// Writes the directory for a logpath value into out (LOG_PATH_VALUE_MAX bytes)
// and returns out. A value that is not valid is recorded and resolved as
// "internal_sd"; a storage property that is no usable directory counts as unset.
const char* resolve_log_path(const char* value, char* out);
