// Resolution of the logpath setting into a directory, and its override by
// persist.qrvlog.log2sd.path.
#pragma once

struct ConfigCache;

// 1 for a logpath value the daemon may use: "internal_sd", "external_sd", or
// an absolute path of at most 91 characters without "." or ".." components
// (a relative one would be taken from the daemon's working folder).
int log_path_value_valid(const char* value);

// Writes the directory for a logpath value into out (CONFIG_FIELD_LEN bytes)
// and returns out. A value that is not valid is recorded and resolved as
// "internal_sd"; a storage property that is not an absolute path counts as unset.
const char* resolve_log_path(const char* value, char* out);

// Replaces the stored logpath with persist.qrvlog.log2sd.path when that is set
// and differs; rewrites the configuration file then. Part of config_load.
void apply_log_path_override(ConfigCache* cache);
