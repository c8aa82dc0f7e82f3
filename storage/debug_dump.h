// A snapshot of the device's state in each new run folder: system properties,
// the previous boot's kernel logs, the build's device configuration and the
// daemon's own files, as a dump list names them.
#pragma once

#include <stddef.h>

#define DUMP_LIST_FILE "/system/etc/tqlog-dump-file"

constexpr int DUMP_FIELD_LEN = 255;  // source or output path of at most 254 characters

struct DumpEntry;
typedef void (*DumpFn)(DumpEntry* entry);

struct DumpEntry {
    char source[DUMP_FIELD_LEN];
    char output[DUMP_FIELD_LEN];  // run folder followed by the output name
    DumpFn dumper;
    DumpEntry* next;
    const char* root;  // trusted leading part of output (the log path); not owned
    size_t name_at;    // where the output name begins in output
};

// Dumps into run_folder (ending in '/'), which lies below the log path root.
void run_debug_dump(const char* root, const char* run_folder);

// The dump-list file when it exists, else the built-in list; nullptr when
// the list is empty or cannot be built.
DumpEntry* build_dump_list(const char* root, const char* run_folder);
DumpEntry* parse_dump_list(const char* path, const char* root, const char* run_folder);
// The lines of a dump-list file's bytes, last line first.
DumpEntry* parse_dump_list_text(const char* text, size_t len, const char* root,
                                 const char* run_folder);
DumpEntry* builtin_dump_list(const char* root, const char* run_folder);
void free_dump_list(DumpEntry* list);

// "sys_prop" dumps the system properties; any other kind (or none) a file.
void select_dumper(DumpEntry* entry, const char* kind);
void dump_file(DumpEntry* entry);
void dump_properties(DumpEntry* entry);
