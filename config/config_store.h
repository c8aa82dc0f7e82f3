// The seven settings in /data/misc/tqlog/tqlog_config, used through a
// short-lived ConfigCache: created, filled with defaults, loaded, read or
// changed, discarded.
#pragma once

constexpr int CONFIG_ITEM_COUNT = 7;
constexpr int CONFIG_FIELD_LEN = 92;  // key or value of at most 91 characters

#define CONFIG_DIR "/data/misc/tqlog"
#define CONFIG_FILE "/data/misc/tqlog/tqlog_config"
#define SYSTEM_DEFAULTS_FILE "/system/etc/qrvlog-config.prop"

struct ConfigItem {
    char key[CONFIG_FIELD_LEN];
    char value[CONFIG_FIELD_LEN];
};

struct ConfigCache {
    ConfigItem items[CONFIG_ITEM_COUNT];
    int source;  // 0: the daemon's own file, keys as they stand; 1: system defaults, keys translated
    char resolved_path[CONFIG_FIELD_LEN];  // the directory config_get returns for "logpath"
};

void config_init(ConfigCache* cache);
void config_make_dir();
void config_set_defaults(ConfigCache* cache);
int config_read_file(ConfigCache* cache, const char* path);
int config_read_system_defaults(ConfigCache* cache);
// Returns 0, or -1 when the file could be neither read nor made anew.
int config_load(ConfigCache* cache);
int config_write(const ConfigCache* cache);
int config_update_item(ConfigCache* cache, const char* key, const char* value);
// Returns 1 when the file holds the item's value afterwards (also when it was
// already that value or the key is unknown), 0 when the file could not be
// read or written.
int config_change(ConfigCache* cache, const char* key, const char* value);
const char* config_get(ConfigCache* cache, const char* key);
void config_parse_line(ConfigCache* cache, const char* line);
void config_map_system_key(ConfigCache* cache, const char* key, const char* value);

// Cuts trailing spaces and line feeds in place (never the first character) and
// returns a pointer past the leading spaces.
char* trim(char* s);
