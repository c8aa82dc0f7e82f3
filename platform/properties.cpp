// System properties of the emulated phone: one file per key in a folder that
// every process of the phone shares. Values are never changed in place: a set
// writes a private temporary file and renames it over the old one, so a reader
// that opened either file sees one whole value. No lock is needed between
// readers and writers, which keeps the calls safe from any thread, in forked
// children and across processes.
#include "platform/properties.h"

#include <atomic>
#include <ctype.h>
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "platform/property_area.h"

static_assert(PROPERTY_KEY_MAX == PROP_KEY_LEN && PROPERTY_VALUE_MAX == PROP_VALUE_LEN,
              "property limits disagree");

// Files of the runtime area are replaced by processes of other users (root
// tools, the daemon as uid 2000 in group 1000), so they are group-writable.
static const mode_t kAreaFileMode = 0664;
static const mode_t kPersistFileMode = 0600;

// Distinguishes temporary files of two sets in the same thread.
static std::atomic<unsigned> g_temp_seq{0};

int property_key_valid(const char* key) {
    if (key == nullptr) return 0;
    size_t len = strnlen(key, PROPERTY_KEY_MAX);
    if (len == 0 || len >= PROPERTY_KEY_MAX) return 0;
    if (key[0] == '.' || key[len - 1] == '.') return 0;
    for (size_t i = 0; i < len; i++) {
        unsigned char c = static_cast<unsigned char>(key[i]);
        if (c == '.') {
            if (key[i - 1] == '.') return 0;
            continue;
        }
        if (c == '_' || c == '-' || c == '@' || c == ':') continue;
        if (c < 0x80 && isalnum(c)) continue;
        return 0;
    }
    return 1;
}

static int value_valid(const char* value) {
    return value != nullptr && strnlen(value, PROPERTY_VALUE_MAX) < PROPERTY_VALUE_MAX;
}

static int starts_with(const char* s, const char* prefix) {
    return strncmp(s, prefix, strlen(prefix)) == 0;
}

// Reads the value stored for key in dir into value (PROPERTY_VALUE_MAX bytes).
// Returns its length, or -1 when there is no such property.
static int read_value(const char* dir, const char* key, char* value) {
    char path[PATH_LEN];
    snprintf(path, sizeof(path), "%s/%s", dir, key);
    UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC | O_NOFOLLOW)));
    if (!fd.ok()) return -1;
    // A value is at most PROPERTY_VALUE_MAX - 1 bytes; anything beyond (a file
    // written by hand on the host) is cut.
    size_t got = 0;
    while (got < PROPERTY_VALUE_MAX - 1) {
        ssize_t n = TEMP_FAILURE_RETRY(read(fd.get(), value + got, PROPERTY_VALUE_MAX - 1 - got));
        if (n < 0) return -1;
        if (n == 0) break;
        got += static_cast<size_t>(n);
    }
    value[got] = '\0';
    return static_cast<int>(strlen(value));
}

// Writes value into a new temporary file of dir and returns its path in tmp.
static int write_temp(const char* dir, const char* key, const char* value, mode_t mode,
                      bool sync, char* tmp, size_t tmp_len) {
    // The leading dot keeps temporary files out of listings: no key starts
    // with one. pid, thread id and a counter make the name private.
    snprintf(tmp, tmp_len, "%s/.tmp.%s.%d.%d.%u", dir, key, static_cast<int>(getpid()),
             static_cast<int>(gettid()), g_temp_seq.fetch_add(1, std::memory_order_relaxed));
    UniqueFd fd(TEMP_FAILURE_RETRY(
        open(tmp, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, mode)));
    if (!fd.ok()) return -1;
    size_t len = strlen(value);
    // fchmod because the caller's umask (0 in the daemon, 022 in tools) must
    // not decide who may replace the value later.
    if (fchmod(fd.get(), mode) != 0 ||
        (len > 0 && write_fully(fd.get(), value, len) != static_cast<ssize_t>(len)) ||
        (sync && fsync(fd.get()) != 0)) {
        int saved = errno;
        unlink(tmp);
        errno = saved;
        return -1;
    }
    return 0;
}

// Puts value in place as dir/key. With once, an existing key is kept and the
// call fails with EEXIST: link() never replaces, so of two racing first sets
// exactly one wins.
static int publish(const char* dir, const char* key, const char* value, mode_t mode, bool sync,
                   bool once) {
    char tmp[PATH_LEN];
    char path[PATH_LEN];
    snprintf(path, sizeof(path), "%s/%s", dir, key);
    if (write_temp(dir, key, value, mode, sync, tmp, sizeof(tmp)) != 0) return -1;
    int rc;
    if (once) {
        rc = link(tmp, path);
        int saved = errno;
        unlink(tmp);
        errno = saved;
    } else {
        rc = rename(tmp, path);
        if (rc != 0) {
            int saved = errno;
            unlink(tmp);
            errno = saved;
        }
    }
    if (rc != 0) return -1;
    if (sync) {
        // The rename itself must reach the disk, or a power cut loses it.
        UniqueFd dfd(TEMP_FAILURE_RETRY(open(dir, O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
        if (!dfd.ok() || fsync(dfd.get()) != 0) return -1;
    }
    return 0;
}

static int check_args(const char* key, const char* value) {
    if (!property_key_valid(key) || !value_valid(value)) {
        errno = EINVAL;
        return -1;
    }
    return 0;
}

int property_set_runtime(const char* key, const char* value) {
    if (check_args(key, value) != 0) return -1;
    return publish(PROPERTY_AREA_DIR, key, value, kAreaFileMode, false, starts_with(key, "ro."));
}

int property_set(const char* key, const char* value) {
    if (check_args(key, value) != 0) return -1;
    if (!starts_with(key, "persist.")) return property_set_runtime(key, value);

    // The stored copy is written first and the set fails without touching the
    // running value when it cannot be: a persist. value that would silently
    // vanish at the next boot is worse than a refused set. The folder lock
    // keeps concurrent sets of one key from leaving the two copies different.
    UniqueFd dfd(TEMP_FAILURE_RETRY(open(PROPERTY_PERSIST_DIR, O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
    if (!dfd.ok()) return -1;
    if (TEMP_FAILURE_RETRY(flock(dfd.get(), LOCK_EX)) != 0) return -1;
    if (publish(PROPERTY_PERSIST_DIR, key, value, kPersistFileMode, true, false) != 0) return -1;
    return publish(PROPERTY_AREA_DIR, key, value, kAreaFileMode, false, false);
}

int property_get(const char* key, char* value, const char* default_value) {
    if (value == nullptr) return 0;
    int len = -1;
    if (property_key_valid(key)) len = read_value(PROPERTY_AREA_DIR, key, value);
    // As libcutils: an empty value counts as unset and yields the default.
    if (len > 0) return len;
    if (default_value == nullptr) default_value = "";
    copy_str(value, PROPERTY_VALUE_MAX, default_value);
    return static_cast<int>(strlen(value));
}

static int select_key(const struct dirent* entry) {
    return property_key_valid(entry->d_name);
}

// Plain byte order: the listing must not depend on the locale.
static int compare_names(const struct dirent** a, const struct dirent** b) {
    return strcmp((*a)->d_name, (*b)->d_name);
}

int property_list(void (*propfn)(const char* key, const char* value, void* cookie), void* cookie) {
    if (propfn == nullptr) return -1;
    struct dirent** names = nullptr;
    int n = scandir(PROPERTY_AREA_DIR, &names, select_key, compare_names);
    if (n < 0) return -1;
    for (int i = 0; i < n; i++) {
        char value[PROPERTY_VALUE_MAX];
        // A property removed since the scan (only the emulator does that) is skipped.
        if (read_value(PROPERTY_AREA_DIR, names[i]->d_name, value) >= 0)
            propfn(names[i]->d_name, value, cookie);
        free(names[i]);
    }
    free(names);
    return 0;
}
