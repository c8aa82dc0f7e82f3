// Running the dump list into a run folder.
#include "storage/debug_dump.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/unique_fd.h"
#include "platform/kernel_files.h"
#include "platform/properties.h"
#include "record/record.h"
#include "storage/safe_file.h"

namespace {

const char kFooter[] = "================ END of FILE ===============\n\n";
constexpr int LINE_BUF = 1024;
constexpr useconds_t DUMP_PAUSE_US = 100000;

// Opens a source to dump. What lies in /data is opened without following
// links; a source that is no regular file (a folder, a FIFO, a device) could
// block the dump or never end, so it is refused.
int open_source(const char* source) {
    const char* root = trusted_root_of(source, nullptr);
    if (root != nullptr) return safe_open_path_file(root, source, SAFE_READ, 0);
    int fd = TEMP_FAILURE_RETRY(open(kernel_file_path(source), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    struct stat st;
    if (fd >= 0 && (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode))) {
        close(fd);
        HLOG(TAG_DUPM, WLOG_ERROR, "%s is not a regular file, not dumped", source);
        errno = EINVAL;
        return -1;
    }
    return fd;
}

bool write_text(int fd, const char* text, size_t len) {
    return write_fully(fd, text, len) == static_cast<ssize_t>(len);
}

void write_property(const char* key, const char* value, void* cookie) {
    char line[LINE_BUF];
    int len = snprintf(line, LINE_BUF - 1, "[%s]: [%s]\n", key, value);
    if (len < 0) return;
    if (len > LINE_BUF - 2) {
        len = LINE_BUF - 2;
        line[len - 1] = '\n';
    }
    write_text(*static_cast<int*>(cookie), line, static_cast<size_t>(len));
}

}  // namespace

void dump_file(DumpEntry* entry) {
    UniqueFd in(open_source(entry->source));
    if (!in.ok()) {
        int err = errno;
        WLOG(TAG_DUPM, WLOG_ERROR, "open %s failed!errno:%s(%d)", entry->source, strerror(err), err);
        return;
    }
    UniqueFd out(safe_open_path_file(entry->root, entry->output, SAFE_APPEND, 0666));
    if (!out.ok()) {
        int err = errno;
        HLOG(TAG_DUPM, WLOG_ERROR, "open %s failed!errno:%s(%d)", entry->output, strerror(err), err);
        return;
    }
    char buf[LINE_BUF];
    int len = snprintf(buf, sizeof(buf), "<< %s >>:\n", entry->source);
    bool ok = write_text(out.get(), buf, static_cast<size_t>(len));
    // The bytes go over unchanged; a failing read or write ends this file's
    // dump with one record, not one per line.
    for (ssize_t n; ok && (n = TEMP_FAILURE_RETRY(read(in.get(), buf, sizeof(buf)))) != 0;)
        ok = n > 0 && write_text(out.get(), buf, static_cast<size_t>(n));
    if (!ok) HLOG(TAG_DUPM, WLOG_ERROR, "error when dump %s, file may incomplete", entry->source);
    write_text(out.get(), kFooter, sizeof(kFooter) - 1);
    HLOG(TAG_DUPM, WLOG_INFO, "dump %s", entry->source);
    usleep(DUMP_PAUSE_US);
}

void dump_properties(DumpEntry* entry) {
    UniqueFd out(safe_open_path_file(entry->root, entry->output, SAFE_APPEND, 0600));
    if (out.ok()) {
        static const char header[] = "<< system properties >>\n";
        int fd = out.get();
        write_text(fd, header, sizeof(header) - 1);
        property_list(write_property, &fd);
        write_text(fd, kFooter, sizeof(kFooter) - 1);
    } else {
        int err = errno;
        HLOG(TAG_DUPM, WLOG_ERROR, "open %s failed! errno:%s(%d)", entry->output, strerror(err), err);
    }
    HLOG(TAG_DUPM, WLOG_INFO, "dump sys property");
}

void run_debug_dump(const char* root, const char* run_folder) {
    DumpEntry* list = build_dump_list(root, run_folder);
    if (list == nullptr) {
        HLOG(TAG_DUPM, WLOG_ERROR, "init dump list fail");
        return;
    }
    while (list != nullptr) {
        DumpEntry* entry = list;
        list = entry->next;
        entry->dumper(entry);
        entry->next = nullptr;
        free_dump_list(entry);
    }
}
