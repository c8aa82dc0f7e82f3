// Resolution of the logpath setting into a directory, and its override by
// persist.qrvlog.log2sd.path.
#pragma once

struct ConfigCache;

// Writes the directory for a logpath value into out (CONFIG_FIELD_LEN bytes) and returns out.
const char* resolve_log_path(const char* value, char* out);

// Replaces the stored logpath with persist.qrvlog.log2sd.path when that is set
// and differs; rewrites the configuration file then. Part of config_load.
void apply_log_path_override(ConfigCache* cache);
