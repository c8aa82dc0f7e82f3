// Resolution of the logpath setting into a directory, and its override by
// persist.qrvlog.log2sd.path.
#pragma once

struct ConfigCache;

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

// Writes the directory for a logpath value into out (CONFIG_FIELD_LEN bytes)
// and returns out. A value that is not valid is recorded and resolved as
// "internal_sd"; a storage property that is no usable directory counts as unset.
const char* resolve_log_path(const char* value, char* out);

// Replaces the stored logpath with persist.qrvlog.log2sd.path when that is set
// and differs; rewrites the configuration file then. Part of config_load.
void apply_log_path_override(ConfigCache* cache);
