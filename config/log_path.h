// Resolution of the logpath setting into a directory, and its override by
// persist.qrvlog.log2sd.path.
#pragma once

// A logpath value or directory: at most 91 characters, as a configuration value.
constexpr int LOG_PATH_VALUE_MAX = 92;

// 1 for a logpath value the daemon may use: "internal_sd", "external_sd", or
// an absolute path of at most 91 characters without "." or ".." components
// (a relative one would be taken from the daemon's working folder).
int log_path_value_valid(const char* value);

// Writes the directory for a logpath value into out (LOG_PATH_VALUE_MAX bytes)
// and returns out. A value that is not valid is recorded and resolved as
// "internal_sd"; a storage property that is not an absolute path counts as unset.
const char* resolve_log_path(const char* value, char* out);
