#include "storage/folder_records.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "common/wlog.h"
#include "storage/history_log.h"
#include "storage/safe_file.h"

namespace {

constexpr size_t LINE_MAX_CHARS = RECORD_NAME_LEN - 1;
// One line per run folder ever made: far below this on any phone.
constexpr size_t RECORDS_CAP = 4 << 20;

// The records file of a location, or nullptr (recorded).
const char* records_name(int location) {
    if (location == 1) return INTER_SD_RECORDS;
    if (location == 2) return OUTER_SD_RECORDS;
    HLOG(TAG_SIZE, WLOG_ERROR, "log path wrong when read folder file");
    return nullptr;
}

// A record name is one folder name: anything else would measure some other folder.
bool plain_name(const char* name) {
    return name[0] != '\0' && strchr(name, '/') == nullptr && strcmp(name, ".") != 0 &&
           strcmp(name, "..") != 0;
}

FolderRecord* new_record(const char* name, int size_kb) {
    FolderRecord* record = static_cast<FolderRecord*>(calloc(1, sizeof(FolderRecord)));
    if (record == nullptr) {
        int err = errno;
        HLOG(TAG_SIZE, WLOG_ERROR, "malloc new_fu fail %s", strerror(err));
        return nullptr;
    }
    copy_str(record->name, sizeof(record->name), name);
    record->size_kb = size_kb;
    return record;
}

// The list kept in order with a pointer to its last link.
struct ListTail {
    FolderRecord* head = nullptr;
    FolderRecord** tail = &head;
    void add(FolderRecord* record) {
        if (record == nullptr) return;
        *tail = record;
        tail = &record->next;
    }
};

int add_entry(void* arg, const char* name, int) {
    static_cast<ListTail*>(arg)->add(new_record(name, 0));
    return 0;
}

struct SizeSum {
    int dirfd;
    int64_t bytes;
};

int add_size(void* arg, const char* name, int) {
    SizeSum* sum = static_cast<SizeSum*>(arg);
    struct stat st;
    if (fstatat(sum->dirfd, name, &st, AT_SYMLINK_NOFOLLOW) == 0) sum->bytes += st.st_size;
    return 0;
}

// Removes the records for which drop says so.
template <typename Drop>
void drop_records(FolderRecord** list, Drop drop) {
    while (*list != nullptr) {
        FolderRecord* record = *list;
        if (!drop(record)) {
            list = &record->next;
            continue;
        }
        *list = record->next;
        free(record);
    }
}

}  // namespace

FolderRecord* parse_folder_records(const char* text, size_t len) {
    ListTail list;
    for (size_t pos = 0; pos < len;) {
        const char* start = text + pos;
        const char* end = static_cast<const char*>(memchr(start, '\n', len - pos));
        size_t line_len = end != nullptr ? static_cast<size_t>(end - start) + 1 : len - pos;
        pos += line_len;
        // A line longer than the daemon ever writes is shown cut and dropped.
        size_t take = line_len > LINE_MAX_CHARS ? LINE_MAX_CHARS : line_len;
        char line[RECORD_NAME_LEN];
        memcpy(line, start, take);
        line[take] = '\0';
        char* space = strchr(line, ' ');
        if (space != nullptr) *space = '\0';
        if (line_len > LINE_MAX_CHARS || space == nullptr || !plain_name(line)) {
            if (space != nullptr) *space = ' ';
            char* newline = strchr(line, '\n');
            if (newline != nullptr) *newline = '\0';  // one record, one line
            HLOG(TAG_SIZE, WLOG_ERROR, "wrong format %s", line);
            continue;
        }
        // A size that is no count of KiB is measured again.
        long size = strtol(space + 1, nullptr, 10);
        list.add(new_record(line, size < 0 ? 0 : size > INT_MAX ? INT_MAX : static_cast<int>(size)));
    }
    return list.head;
}

// "/data/misc/tqlog/<name>" for records.
const char* records_path(const char* name, char* out, size_t n) {
    snprintf(out, n, "%s/%s", DAEMON_DIR, name);
    return out;
}

FolderRecord* read_folder_records(int location) {
    const char* name = records_name(location);
    if (name == nullptr) return nullptr;
    UniqueFd dir(open_daemon_dir(0700));
    UniqueFd fd(dir.ok() ? safe_open_file(dir.get(), name, SAFE_READ, 0) : -1);
    size_t len = 0;
    bool cut = false;
    char* text = fd.ok() ? read_all(fd.get(), RECORDS_CAP, &len, &cut) : nullptr;
    if (text == nullptr) {
        int err = errno;
        char path[PATH_LEN];
        HLOG(TAG_SIZE, WLOG_ERROR, "open %s faild %s", records_path(name, path, sizeof(path)),
             strerror(err));
        return nullptr;
    }
    if (cut) {
        while (len > 0 && text[len - 1] != '\n') len--;  // not the piece of a line
    }
    FolderRecord* list = parse_folder_records(text, len);
    free(text);
    return list;
}

int write_folder_records(const FolderRecord* list, const char* new_name, int location) {
    const char* name = records_name(location);
    if (name == nullptr) return 0;
    size_t lines = 1;
    for (const FolderRecord* r = list; r != nullptr; r = r->next) lines++;
    // Each line is at most a name, a space, 10 digits and a line feed.
    size_t cap = lines * (RECORD_NAME_LEN + 13);
    char* text = static_cast<char*>(malloc(cap));
    if (text == nullptr) {
        HLOG(TAG_SIZE, WLOG_ERROR, "malloc new_fu fail %s", strerror(ENOMEM));
        return 0;
    }
    size_t len = 0;
    for (const FolderRecord* r = list; r != nullptr; r = r->next)
        len += static_cast<size_t>(snprintf(text + len, cap - len, "%s %d\n", r->name, r->size_kb));
    len += static_cast<size_t>(snprintf(text + len, cap - len, "%s 0\n", new_name));

    // Replaced whole: a crash while writing must leave the old record, not half of one.
    UniqueFd dir(open_daemon_dir(0700));
    int rc = dir.ok() ? safe_replace_file(dir.get(), name, text, len, 0664) : -1;
    free(text);
    if (rc < 0) {
        int err = errno;
        char path[PATH_LEN];
        HLOG(TAG_SIZE, WLOG_ERROR, "open %s faild %s", records_path(name, path, sizeof(path)),
             strerror(err));
        return 0;
    }
    return 1;
}

FolderRecord* list_folder_entries(int dirfd, const char* path, bool* failed) {
    ListTail list;
    *failed = safe_list_dir(dirfd, add_entry, &list) < 0;
    if (*failed) {
        int err = errno;
        HLOG(TAG_SIZE, WLOG_ERROR, "open %s fail %s", path, strerror(err));
        free_folder_records(list.head);
        return nullptr;
    }
    return list.head;
}

int folder_size_kb(const char* root, const char* parent, const char* name) {
    char path[PATH_LEN];
    snprintf(path, sizeof(path), "%s%s/", parent, name);
    UniqueFd dir(safe_open_dir(root, path, false, 0));
    SizeSum sum = {dir.get(), 0};
    if (!dir.ok() || safe_list_dir(dir.get(), add_size, &sum) < 0) {
        int err = errno;
        HLOG(TAG_SIZE, WLOG_ERROR, "open dir %s fail %s", path, strerror(err));
        return 0;
    }
    // In 64 bits: a run folder can hold more than 2 GiB.
    int64_t kb = sum.bytes / 1024;
    return kb > INT_MAX ? INT_MAX : static_cast<int>(kb);
}

void drop_missing_records(FolderRecord** list) {
    drop_records(list, [](const FolderRecord* r) {
        if (r->size_kb != -1) return false;
        HLOG(TAG_SIZE, WLOG_ERROR, "delete %s (no exist)", r->name);
        return true;
    });
}

void drop_oldest_records(FolderRecord** list, uint64_t used_kb, uint64_t budget_kb) {
    HLOG(TAG_SIZE, WLOG_ERROR, "log folder total size overflow  ");
    while (*list != nullptr && used_kb > budget_kb) {
        FolderRecord* oldest = *list;
        HLOG(TAG_SIZE, WLOG_ERROR, "delete %s ", oldest->name);
        uint64_t size = oldest->size_kb > 0 ? static_cast<uint64_t>(oldest->size_kb) : 0;
        used_kb = size > used_kb ? 0 : used_kb - size;
        *list = oldest->next;
        free(oldest);
    }
}

void free_folder_records(FolderRecord* list) {
    while (list != nullptr) {
        FolderRecord* next = list->next;
        free(list);
        list = next;
    }
}

int update_folder_records(const char* root, const char* run_folder, int location, int total_size,
                          int log_size) {
    // name: the last component; parent: the rest, ending in '/'. Doubled
    // slashes name the same folders and are dropped.
    char parent[PATH_LEN];
    size_t len = 0;
    for (const char* p = run_folder; *p != '\0' && len < sizeof(parent) - 1; p++) {
        if (*p == '/' && len > 0 && parent[len - 1] == '/') continue;
        parent[len++] = *p;
    }
    while (len > 1 && parent[len - 1] == '/') len--;
    parent[len] = '\0';
    char* slash = strrchr(parent, '/');
    if (slash == nullptr || slash[1] == '\0') return 0;
    char name[RECORD_NAME_LEN];
    copy_str(name, sizeof(name), slash + 1);
    slash[1] = '\0';
    WLOG(TAG_SIZE, WLOG_DEBUG, "update folder:%s,%s,%d,%d,%d", name, parent, location, total_size,
         log_size);

    FolderRecord* records = read_folder_records(location);
    UniqueFd dir(safe_open_dir(root, parent, false, 0));
    bool failed = !dir.ok();
    if (failed) {
        int err = errno;
        HLOG(TAG_SIZE, WLOG_ERROR, "open %s fail %s", parent, strerror(err));
    }
    FolderRecord* entries = failed ? nullptr : list_folder_entries(dir.get(), parent, &failed);
    if (failed) {
        HLOG(TAG_SIZE, WLOG_ERROR, "read cur path folder info fail");
        free_folder_records(records);
        return 0;
    }

    uint64_t used = 0;
    bool missing = false;
    for (FolderRecord* r = records; r != nullptr; r = r->next) {
        bool present = false;
        for (const FolderRecord* e = entries; e != nullptr && !present; e = e->next)
            present = strcmp(e->name, r->name) == 0;
        if (!present) {
            HLOG(TAG_SIZE, WLOG_ERROR, "%s not in sd anymore", r->name);
            r->size_kb = -1;
            missing = true;
            continue;
        }
        // The new folder is recorded once, last (a start within the same second names it again).
        if (strcmp(r->name, name) == 0) continue;
        if (r->size_kb == 0) r->size_kb = folder_size_kb(root, parent, r->name);
        if (r->size_kb > 0) used += static_cast<uint64_t>(r->size_kb);
    }
    if (missing) drop_missing_records(&records);
    drop_records(&records, [&](const FolderRecord* r) { return strcmp(r->name, name) == 0; });

    if (total_size <= log_size) {
        HLOG(TAG_SIZE, WLOG_INFO, "log_sz bigger than total_sz(%d:%d)", log_size, total_size);
    } else {
        uint64_t budget = static_cast<uint64_t>(static_cast<int64_t>(total_size) - log_size) * 1024;
        if (used > budget) drop_oldest_records(&records, used, budget);
    }
    write_folder_records(records, name, location);
    free_folder_records(records);
    free_folder_records(entries);
    return 1;
}
