#include "storage/log_copy.h"

#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/log_types.h"
#include "common/unique_fd.h"
#include "common/wlog.h"
#include "core/log_controller.h"
#include "storage/history_log.h"
#include "storage/safe_file.h"
#include "storage/storage_check.h"

namespace {

constexpr size_t COPY_BUF = 1024;
constexpr useconds_t COPY_PAUSE_US = 100000;
constexpr mode_t COPY_MODE = 0666;  // as fopen "a+" makes it under the daemon's zero umask
constexpr int OLDEST_PIECE = 4;

const char kNoteNormal[] = "TavloLog in Normal\n";
const char kNoteLow[] = "TavloLog in Low Nand Storage, some or all boot(hbr) logs are NOT saved!!!\n";

void warn_once(LogController* controller) {
    if (controller->warned != 0) return;
    report_system_warning(4);
    controller->warned = 1;
}

// A copy that could not finish keeps its source; what it appended goes again,
// so that a later copy of that source does not hold its beginning twice.
CopyResult copy_failed(LogController* controller, const char* src, int out, off_t before,
                       bool destination) {
    int err = errno;
    HLOG(TAG_MAIN, WLOG_ERROR, "file %s copy error! err:%s(%d)", src, strerror(err), err);
    warn_once(controller);
    if (out >= 0 && ftruncate(out, before) != 0) {
        err = errno;
        HLOG(TAG_MAIN, WLOG_ERROR, "cannot take back the partial copy of %s(%s)", src, strerror(err));
    }
    return destination ? COPY_ABORT : COPY_KEPT;
}

// "<a><b><c>" into out; false (recorded) when it does not fit a path.
bool join(char* out, const char* a, const char* b, const char* c = "") {
    int len = snprintf(out, PATH_LEN, "%s%s%s", a, b, c);
    if (len >= 0 && len < PATH_LEN) return true;
    HLOG(TAG_MAIN, WLOG_ERROR, "%s%s%s is too long to copy", a, b, c);
    return false;
}

bool exists(const char* path) {
    struct stat st;
    return lstat(path, &st) == 0;
}

// "<type>" or "<type>.1" to "<type>.4": a name the run itself writes in its
// folder. A copy appended there would share a file with the writer.
bool named_like_run_output(const char* name) {
    for (int t = 0; t < LOG_TYPE_COUNT; t++) {
        const char* type = log_type_name(t);
        size_t len = strlen(type);
        if (strncmp(name, type, len) != 0) continue;
        const char* rest = name + len;
        if (rest[0] == '\0' || (rest[0] == '.' && rest[1] >= '1' && rest[1] <= '0' + OLDEST_PIECE && rest[2] == '\0'))
            return true;
    }
    return false;
}

// Whether src_dir holds the current file or an older piece of the log name.
bool holds_pieces(const char* src_dir, const char* name) {
    char piece[PATH_LEN + 8];
    for (int n = 0; n <= OLDEST_PIECE; n++) {
        int len = n == 0 ? snprintf(piece, sizeof(piece), "%s%s", src_dir, name)
                         : snprintf(piece, sizeof(piece), "%s%s.%d", src_dir, name, n);
        if (len >= 0 && static_cast<size_t>(len) < sizeof(piece) && exists(piece)) return true;
    }
    return false;
}

struct NameList {
    char (*names)[NAME_MAX + 1] = nullptr;
    int count = 0;
    int cap = 0;
    ~NameList() { free(names); }
};

// Names not beginning with '.', in listing order. A held piece of a log that
// stayed where it was is left for a later copy into its own suffixed file.
int collect_name(void* arg, const char* name, int) {
    NameList* list = static_cast<NameList*>(arg);
    if (name[0] == '.' || named_like_run_output(name)) return 0;
    if (list->count == list->cap) {
        int cap = list->cap == 0 ? 32 : list->cap * 2;
        void* bigger = realloc(list->names, static_cast<size_t>(cap) * sizeof(*list->names));
        if (bigger == nullptr) return 1;
        list->names = static_cast<char(*)[NAME_MAX + 1]>(bigger);
        list->cap = cap;
    }
    copy_str(list->names[list->count++], NAME_MAX + 1, name);
    return 0;
}

}  // namespace

CopyResult copy_log_file(LogController* controller, const char* src, const char* dst) {
    // The source first: one that is there but cannot be read (a folder, a
    // link) stays, and the destination is not touched for it.
    char folder[PATH_LEN];
    const char* slash = strrchr(src, '/');
    size_t folder_len = slash != nullptr ? static_cast<size_t>(slash - src) + 1 : sizeof(folder);
    UniqueFd dir, in;
    if (folder_len < sizeof(folder)) {
        memcpy(folder, src, folder_len);
        folder[folder_len] = '\0';
        dir.reset(safe_open_dir("/data", folder, false, 0));
        if (dir.ok()) in.reset(safe_open_file(dir.get(), slash + 1, SAFE_READ, 0));
    } else {
        errno = ENAMETOOLONG;
    }
    if (!in.ok() && errno != ENOENT) return copy_failed(controller, src, -1, 0, false);

    UniqueFd out(safe_open_path_file(controller->logpath, dst, SAFE_APPEND, COPY_MODE));
    struct stat st;
    if (!out.ok() || fstat(out.get(), &st) != 0) {
        printf("file open error!\n");
        fflush(stdout);
        warn_once(controller);
        return COPY_KEPT;
    }
    off_t before = st.st_size;
    const char* note = data_storage_low ? kNoteLow : kNoteNormal;
    if (write_fully(out.get(), note, strlen(note)) != static_cast<ssize_t>(strlen(note)))
        return copy_failed(controller, src, out.get(), before, true);
    if (in.ok()) {
        char buf[COPY_BUF];
        for (ssize_t n; (n = RETRY_EINTR(read(in.get(), buf, sizeof(buf)))) != 0;) {
            if (n < 0) return copy_failed(controller, src, out.get(), before, false);
            if (write_fully(out.get(), buf, static_cast<size_t>(n)) != n)
                return copy_failed(controller, src, out.get(), before, true);
        }
        // The source goes only once the copy is on storage: a power cut between
        // the delete and the write-back would lose both.
        if (RETRY_EINTR(fsync(out.get())) != 0) return copy_failed(controller, src, out.get(), before, true);
        if (safe_remove_file(dir.get(), slash + 1) != 0) {
            int err = errno;
            HLOG(TAG_MAIN, WLOG_ERROR, "remove %s failed(%s)", src, strerror(err));
        }
    }
    // A missing source leaves the note line alone, telling that its piece is missing.
    WLOG(TAG_MAIN, WLOG_DEBUG, "copy '%s' done", src);
    usleep(COPY_PAUSE_US);
    return COPY_DONE;
}

CopyResult copy_named_file(LogController* controller, const char* src_dir, const char* dst_dir,
                           const char* name) {
    char src[PATH_LEN];
    char dst[PATH_LEN];
    if (!join(src, src_dir, name) || !join(dst, dst_dir, name)) return COPY_KEPT;
    if (!exists(src)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "%s is not exits", src);
        return COPY_DONE;
    }
    HLOG(TAG_MAIN, WLOG_INFO, "starts copy '%s'", src);
    return copy_log_file(controller, src, dst);
}

CopyResult copy_remaining_files(LogController* controller, const char* src_dir, const char* dst_dir) {
    NameList list;
    UniqueFd dir(safe_open_dir("/data", src_dir, false, 0));
    if (!dir.ok() || safe_list_dir(dir.get(), collect_name, &list) < 0) {
        int err = errno;
        if (err != ENOENT) HLOG(TAG_MAIN, WLOG_ERROR, "open %s fail %s", src_dir, strerror(err));
        return COPY_KEPT;
    }
    for (int i = 0; i < list.count; i++) {
        if (copy_named_file(controller, src_dir, dst_dir, list.names[i]) == COPY_ABORT) return COPY_ABORT;
    }
    return COPY_DONE;
}

CopyResult copy_rotated_log(LogController* controller, const char* src_dir, const char* dst_dir,
                            const char* name, const char* suffix) {
    HLOG(TAG_MAIN, WLOG_INFO, "starts copy '%s'", name);
    char base[PATH_LEN];
    char dst[PATH_LEN];
    if (!join(base, src_dir, name) || !join(dst, dst_dir, name, suffix)) return COPY_KEPT;
    // Oldest piece first. A piece that cannot be read stays for a later copy;
    // the newer ones still go here, the one file of this log the writer never
    // touches.
    CopyResult result = COPY_DONE;
    for (int n = OLDEST_PIECE; n >= 1; n--) {
        char piece[PATH_LEN + 8];
        snprintf(piece, sizeof(piece), "%s.%d", base, n);
        if (!exists(piece)) continue;
        CopyResult rc = copy_log_file(controller, piece, dst);
        if (rc == COPY_ABORT) return rc;
        if (rc == COPY_KEPT) result = COPY_KEPT;
    }
    CopyResult rc = copy_log_file(controller, base, dst);
    return rc == COPY_DONE ? result : rc;
}

CopyResult copy_log_folder(LogController* controller, const char* src_dir, const char* dst_dir,
                           const char* suffix) {
    WLOG(TAG_MAIN, WLOG_DEBUG, "prepare to copy '%s' to sdcard", suffix);
    const struct {
        int on;
        const char* name;
    } types[] = {{controller->kernel_log, "kernel_log"},
                 {controller->android_log, "main_log"},
                 {controller->android_log, "events_log"},
                 {controller->android_log, "radio_log"},
                 {controller->bt_log, "bt_log"}};
    for (const auto& type : types) {
        // A log switched off now may hold pieces from when it was on: they too
        // go into its suffixed file, never under a name the run writes.
        if (!type.on && !holds_pieces(src_dir, type.name)) continue;
        if (copy_rotated_log(controller, src_dir, dst_dir, type.name, suffix) == COPY_ABORT)
            return COPY_ABORT;
    }
    return copy_remaining_files(controller, src_dir, dst_dir);
}
