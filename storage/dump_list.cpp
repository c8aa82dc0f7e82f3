// The dump list: the built-in one, or the device's own file of lines
// "source [output name [kind]]".
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/unique_fd.h"
#include "platform/kernel_files.h"
#include "record/record.h"
#include "storage/debug_dump.h"

namespace {

constexpr size_t LINE_MAX_CHARS = DUMP_FIELD_LEN - 1;
// A dump list is a few lines of the system image; more than this is no list.
constexpr size_t DUMP_LIST_CAP = 1 << 20;

const struct {
    const char* name;
    DumpFn dumper;
} kDumpKinds[] = {{"default", dump_file}, {"sys_prop", dump_properties}};

// Built-in list in the order it is dumped: the daemon's own files first, the
// system properties last, all of them framed in "properties".
const struct {
    const char* source;
    const char* output;
    bool properties;
} kBuiltin[] = {
    {DUMP_LIST_FILE, "properties", false},
    {"/data/misc/tqlog/outer_sd_folder", "properties", false},
    {"/data/misc/tqlog/inter_sd_folder", "properties", false},
    {"/data/misc/tqlog/tqlog_config", "properties", false},
    {"/data/misc/tqlog/tqlog_history", "properties", false},
    {"/system/data/misc/DeviceRecipe.mk", "DeviceRecipe.mk", false},
    {LAST_KMSG2_PATH, "last_kmsg2", false},
    {LAST_KMSG_PATH, "last_kmsg", false},
    {"property", "properties", true},
};

// A new entry writing to run_folder + name, or nullptr (recorded) when name is
// not one plain file name or the path would not fit: a cut or climbing name
// would write some other file.
DumpEntry* new_entry(const char* source, const char* name, const char* root, const char* run_folder,
                     const char* line) {
    if (strchr(name, '/') != nullptr || strcmp(name, ".") == 0 || strcmp(name, "..") == 0) {
        HLOG(TAG_DUPM, WLOG_ERROR, "dump output %s is not a file name, ignored", name);
        return nullptr;
    }
    size_t folder_len = strlen(run_folder);
    if (folder_len + strlen(name) >= static_cast<size_t>(DUMP_FIELD_LEN)) {
        HLOG(TAG_DUPM, WLOG_ERROR, "dump output %s%s is too long, ignored", run_folder, name);
        return nullptr;
    }
    DumpEntry* entry = static_cast<DumpEntry*>(calloc(1, sizeof(DumpEntry)));
    if (entry == nullptr) {
        HLOG(TAG_DUPM, WLOG_ERROR, "malloc() fail for %s", line);
        return nullptr;
    }
    copy_str(entry->source, sizeof(entry->source), source);
    snprintf(entry->output, sizeof(entry->output), "%s%s", run_folder, name);
    entry->root = root;
    entry->name_at = folder_len;
    return entry;
}

}  // namespace

void select_dumper(DumpEntry* entry, const char* kind) {
    entry->dumper = dump_file;
    if (kind == nullptr) return;
    for (const auto& k : kDumpKinds) {
        if (strcmp(kind, k.name) == 0) {
            entry->dumper = k.dumper;
            return;
        }
    }
}

DumpEntry* parse_dump_list_text(const char* text, size_t len, const char* root,
                                const char* run_folder) {
    DumpEntry* head = nullptr;
    int line_no = 0;
    for (size_t pos = 0; pos < len;) {
        const char* start = text + pos;
        const char* end = static_cast<const char*>(memchr(start, '\n', len - pos));
        size_t line_len = end != nullptr ? static_cast<size_t>(end - start) : len - pos;
        pos += line_len + (end != nullptr ? 1 : 0);
        line_no++;
        // Read in pieces, a long line would become two entries of which neither
        // names what the line meant.
        if (line_len > LINE_MAX_CHARS) {
            HLOG(TAG_DUPM, WLOG_ERROR, "dump list line %d is longer than %d characters, ignored",
                 line_no, static_cast<int>(LINE_MAX_CHARS));
            continue;
        }
        char line[DUMP_FIELD_LEN];
        memcpy(line, start, line_len);
        line[line_len] = '\0';
        if (line[0] == '#') continue;

        char copy[DUMP_FIELD_LEN];
        memcpy(copy, line, line_len + 1);
        char* fields[3] = {};
        char* save = nullptr;
        int n = 0;
        for (char* f = strtok_r(copy, " ", &save); f != nullptr && n < 3; f = strtok_r(nullptr, " ", &save))
            fields[n++] = f;
        if (n == 0) continue;
        DumpEntry* entry = new_entry(fields[0], fields[1] != nullptr ? fields[1] : "properties", root,
                                     run_folder, line);
        if (entry == nullptr) continue;
        select_dumper(entry, fields[2]);
        entry->next = head;
        head = entry;
    }
    return head;
}

DumpEntry* parse_dump_list(const char* path, const char* root, const char* run_folder) {
    UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK)));
    size_t len = 0;
    bool cut = false;
    char* text = fd.ok() ? read_all(fd.get(), DUMP_LIST_CAP, &len, &cut) : nullptr;
    if (text == nullptr) {
        int err = errno;
        HLOG(TAG_DUPM, WLOG_ERROR, "open %s fail,%s", path, strerror(err));
        return nullptr;
    }
    if (cut) {
        HLOG(TAG_DUPM, WLOG_ERROR, "%s is longer than %d bytes, the rest ignored", path,
             static_cast<int>(DUMP_LIST_CAP));
        while (len > 0 && text[len - 1] != '\n') len--;  // not the piece of a line
    }
    DumpEntry* list = parse_dump_list_text(text, len, root, run_folder);
    free(text);
    return list;
}

DumpEntry* builtin_dump_list(const char* root, const char* run_folder) {
    DumpEntry* head = nullptr;
    for (int i = static_cast<int>(sizeof(kBuiltin) / sizeof(kBuiltin[0])) - 1; i >= 0; i--) {
        DumpEntry* entry = new_entry(kBuiltin[i].source, kBuiltin[i].output, root, run_folder,
                                     kBuiltin[i].source);
        if (entry == nullptr) continue;
        entry->dumper = kBuiltin[i].properties ? dump_properties : dump_file;
        entry->next = head;
        head = entry;
    }
    return head;
}

DumpEntry* build_dump_list(const char* root, const char* run_folder) {
    if (access(DUMP_LIST_FILE, F_OK) == 0) return parse_dump_list(DUMP_LIST_FILE, root, run_folder);
    return builtin_dump_list(root, run_folder);
}

void free_dump_list(DumpEntry* list) {
    while (list != nullptr) {
        DumpEntry* next = list->next;
        free(list);
        list = next;
    }
}
