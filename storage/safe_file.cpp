#include "storage/safe_file.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <libgen.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "record/record.h"
#include "record/record_limit.h"

namespace {

constexpr int DIR_FLAGS = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
// A folder the daemon may pass through but not list (/data/misc is 01771):
// enough to open and make what lies below it.
constexpr int PASS_FLAGS = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
constexpr int MAX_TREE_DEPTH = 16;

// Whoever can write the card can plant links as fast as it likes.
RecordLimit refused_limit = RECORD_LIMIT(TAG_UTIL, "refused links or odd files");

// Length of root without trailing slashes; "/" (or "//") counts as 0.
size_t root_len(const char* root) {
    size_t n = strlen(root);
    while (n > 0 && root[n - 1] == '/') n--;
    return n;
}

bool is_below(const char* path, const char* root) {
    size_t n = root_len(root);
    if (root[0] != '/' || path[0] != '/') return false;
    return strncmp(path, root, n) == 0 && (path[n] == '/' || path[n] == '\0');
}

bool is_dot_name(const char* name, size_t len) {
    return (len == 1 && name[0] == '.') || (len == 2 && name[0] == '.' && name[1] == '.');
}

// Records why an existing name was refused and sets errno: ELOOP for a link,
// ENOTDIR (want_dir) or EINVAL for anything else of the wrong kind. Returns
// false when the name is not there or of the wanted kind after all.
bool refuse_odd(int dirfd, const char* name, const char* shown, bool want_dir) {
    struct stat st;
    if (fstatat(dirfd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) return false;
    if (S_ISLNK(st.st_mode)) {
        HLOG_LIMITED(refused_limit, TAG_UTIL, WLOG_ERROR, "%s is a symbolic link, refused", shown);
        errno = ELOOP;
        return true;
    }
    if (want_dir ? S_ISDIR(st.st_mode) : S_ISREG(st.st_mode)) return false;
    if (want_dir) {
        HLOG_LIMITED(refused_limit, TAG_UTIL, WLOG_ERROR, "%s is not a folder, refused", shown);
        errno = ENOTDIR;
    } else {
        HLOG_LIMITED(refused_limit, TAG_UTIL, WLOG_ERROR, "%s is not a regular file, refused", shown);
        errno = EINVAL;
    }
    return true;
}

// "<folder of dirfd>/<name>" for records; name alone when /proc cannot tell.
const char* describe(int dirfd, const char* name, char* out, size_t n) {
    char link[32];
    snprintf(link, sizeof(link), "/proc/self/fd/%d", dirfd);
    char dir[PATH_LEN];
    ssize_t len = readlink(link, dir, sizeof(dir) - 1);
    int used = -1;
    if (len > 0) {
        dir[len] = '\0';
        used = snprintf(out, n, "%s/%s", strcmp(dir, "/") == 0 ? "" : dir, name);
    }
    if (used < 0 || static_cast<size_t>(used) >= n) snprintf(out, n, "%s", name);
    return out;
}

int open_dir_at(int parent, const char* name) {
    int fd = TEMP_FAILURE_RETRY(openat(parent, name, DIR_FLAGS));
    if (fd < 0 && errno == EACCES) fd = TEMP_FAILURE_RETRY(openat(parent, name, PASS_FLAGS));
    return fd;
}

int open_root_as_is(const char* root) {
    int fd = TEMP_FAILURE_RETRY(open(root, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (fd < 0 && errno == EACCES) fd = TEMP_FAILURE_RETRY(open(root, O_PATH | O_DIRECTORY | O_CLOEXEC));
    return fd;
}

// Opens the trusted root as it stands (links followed), creating its missing
// folders path by path when asked: it is trusted, so its parents are too.
int open_root(const char* root, size_t len, bool create, mode_t mode, char* failed_at) {
    char buf[PATH_LEN];
    if (len == 0) return open_root_as_is("/");
    memcpy(buf, root, len);
    buf[len] = '\0';
    int fd = open_root_as_is(buf);
    if (fd >= 0 || errno != ENOENT || !create) {
        if (fd < 0 && failed_at) copy_str(failed_at, PATH_LEN, buf);
        return fd;
    }
    for (size_t i = 1; i <= len; i++) {
        if (i < len && buf[i] != '/') continue;
        char saved = buf[i];
        buf[i] = '\0';
        if (mkdir(buf, mode) == 0) {
            chmod(buf, mode);
        } else if (errno != EEXIST) {
            if (failed_at) copy_str(failed_at, PATH_LEN, buf);
            return -1;
        }
        buf[i] = saved;
    }
    fd = open_root_as_is(buf);
    if (fd < 0 && failed_at) copy_str(failed_at, PATH_LEN, buf);
    return fd;
}

// One component below an open folder, made when missing and asked to.
int open_component(int parent, const char* name, const char* shown, bool create, mode_t mode) {
    int fd = open_dir_at(parent, name);
    if (fd < 0 && errno == ENOENT && create) {
        bool made = mkdirat(parent, name, mode) == 0;
        if (!made && errno != EEXIST) return -1;
        fd = open_dir_at(parent, name);
        // The umask must not decide who may read the logs.
        if (fd >= 0 && made) fchmod(fd, mode);
    }
    if (fd < 0) {
        int err = errno;
        if (!refuse_odd(parent, name, shown, true)) errno = err;
    }
    return fd;
}

int remove_tree(int dirfd, const char* name, int depth);

struct TreeWalk {
    int dirfd;
    int depth;
    int failed;  // errno of the first failure, 0 when none
};

int remove_entry(void* arg, const char* name, int) {
    TreeWalk* walk = static_cast<TreeWalk*>(arg);
    if (remove_tree(walk->dirfd, name, walk->depth) != 0 && walk->failed == 0) walk->failed = errno;
    return 0;
}

int remove_tree(int dirfd, const char* name, int depth) {
    struct stat st;
    if (fstatat(dirfd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) return -1;
    if (!S_ISDIR(st.st_mode)) return unlinkat(dirfd, name, 0);
    if (depth >= MAX_TREE_DEPTH) {
        errno = ELOOP;
        return -1;
    }
    UniqueFd sub(TEMP_FAILURE_RETRY(openat(dirfd, name, DIR_FLAGS)));
    if (!sub.ok()) return -1;
    // Entries removed during a listing may hide others from it: a second pass
    // takes what the first missed.
    for (int pass = 0; pass < 2; pass++) {
        TreeWalk walk = {sub.get(), depth + 1, 0};
        if (safe_list_dir(sub.get(), remove_entry, &walk) < 0) return -1;
        if (walk.failed != 0) {
            errno = walk.failed;
            return -1;
        }
        if (unlinkat(dirfd, name, AT_REMOVEDIR) == 0) return 0;
        if (errno != ENOTEMPTY && errno != EEXIST) return -1;
    }
    return -1;
}

}  // namespace

const char* trusted_root_of(const char* path, const char* logpath) {
    if (path == nullptr) return nullptr;
    if (logpath != nullptr && logpath[0] != '\0' && is_below(path, logpath)) return logpath;
    if (is_below(path, "/data")) return "/data";
    return nullptr;
}

const char* trusted_root_for(const char* path, const char* logpath, char* buf) {
    const char* root = trusted_root_of(path, logpath);
    if (root != nullptr || path == nullptr || path[0] != '/') return root;
    copy_str(buf, PATH_LEN, path);
    size_t n = strlen(buf);
    while (n > 1 && buf[n - 1] == '/') buf[--n] = '\0';
    char* slash = strrchr(buf, '/');
    slash[slash == buf ? 1 : 0] = '\0';
    return buf;
}

int safe_open_dir(const char* root, const char* path, bool create, mode_t mode, char* failed_at) {
    if (failed_at) failed_at[0] = '\0';
    if (root == nullptr || path == nullptr || !is_below(path, root)) {
        errno = EINVAL;
        return -1;
    }
    size_t path_len = strnlen(path, PATH_LEN);
    if (path_len >= static_cast<size_t>(PATH_LEN)) {
        errno = ENAMETOOLONG;
        return -1;
    }
    size_t rlen = root_len(root);
    UniqueFd dir(open_root(path, rlen, create, mode, failed_at));
    if (!dir.ok()) return -1;

    // shown: the path up to the component being opened, for records.
    char shown[PATH_LEN];
    memcpy(shown, path, rlen);
    for (size_t at = rlen; at < path_len;) {
        while (at < path_len && path[at] == '/') at++;
        size_t end = at;
        while (end < path_len && path[end] != '/') end++;
        if (end == at) break;
        char name[PATH_LEN];
        memcpy(name, path + at, end - at);
        name[end - at] = '\0';
        memcpy(shown, path, end);
        shown[end] = '\0';
        if (is_dot_name(name, end - at)) {
            HLOG_LIMITED(refused_limit, TAG_UTIL, WLOG_ERROR, "%s has a '.' or '..' component, refused",
                         shown);
            if (failed_at) copy_str(failed_at, PATH_LEN, shown);
            errno = EINVAL;
            return -1;
        }
        int next = open_component(dir.get(), name, shown, create, mode);
        if (next < 0) {
            if (failed_at) copy_str(failed_at, PATH_LEN, shown);
            return -1;
        }
        dir.reset(next);
        at = end;
    }
    return dir.release();
}

int open_daemon_dir(mode_t mode) {
    return safe_open_dir("/data/misc", DAEMON_DIR, true, mode);
}

int safe_open_file(int dirfd, const char* name, SafeOpen how, mode_t mode) {
    size_t len = name ? strnlen(name, NAME_MAX + 1) : 0;
    if (len == 0 || len > NAME_MAX || strchr(name, '/') != nullptr || is_dot_name(name, len)) {
        errno = EINVAL;
        return -1;
    }
    // O_NONBLOCK: opening a planted FIFO must not hang the daemon.
    const int base = O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK |
                     (how == SAFE_READ ? O_RDONLY : O_WRONLY) | (how == SAFE_APPEND ? O_APPEND : 0);
    int fd = -1;
    bool created = false;
    if (how == SAFE_READ) {
        fd = TEMP_FAILURE_RETRY(openat(dirfd, name, base));
    } else {
        // O_EXCL first tells whether this open made the file (and so sets its mode).
        for (int tries = 0; tries < 3; tries++) {
            fd = TEMP_FAILURE_RETRY(openat(dirfd, name, base | O_CREAT | O_EXCL, mode));
            if (fd >= 0) {
                created = true;
                break;
            }
            if (errno != EEXIST || how == SAFE_EXCL) break;
            fd = TEMP_FAILURE_RETRY(openat(dirfd, name, base | (how == SAFE_TRUNC ? O_TRUNC : 0)));
            if (fd >= 0 || errno != ENOENT) break;
        }
    }
    char shown[PATH_LEN];
    if (fd < 0) {
        int err = errno;
        if (err == ENOENT || err == EEXIST ||
            !refuse_odd(dirfd, name, describe(dirfd, name, shown, sizeof(shown)), false)) {
            errno = err;
        }
        return -1;
    }
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        close(fd);
        HLOG_LIMITED(refused_limit, TAG_UTIL, WLOG_ERROR, "%s is not a regular file, refused",
                     describe(dirfd, name, shown, sizeof(shown)));
        errno = EINVAL;
        return -1;
    }
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) & ~O_NONBLOCK);
    if (created) fchmod(fd, mode);
    return fd;
}

int safe_open_path_file(const char* root, const char* path, SafeOpen how, mode_t mode) {
    const char* slash = path ? strrchr(path, '/') : nullptr;
    if (slash == nullptr) {
        errno = EINVAL;
        return -1;
    }
    char folder[PATH_LEN];
    size_t len = static_cast<size_t>(slash - path) + 1;
    if (len >= sizeof(folder)) {
        errno = ENAMETOOLONG;
        return -1;
    }
    memcpy(folder, path, len);
    folder[len] = '\0';
    UniqueFd dir(safe_open_dir(root, folder, false, 0));
    if (!dir.ok()) return -1;
    return safe_open_file(dir.get(), slash + 1, how, mode);
}

// The temporary name beside name; false when it does not fit.
static bool temp_name(const char* name, char* out) {
    int len = snprintf(out, NAME_MAX + 1, "%s.tmp", name);
    if (len < 0 || len > NAME_MAX) {
        errno = ENAMETOOLONG;
        return false;
    }
    return true;
}

int safe_replace_begin(int dirfd, const char* name, mode_t mode) {
    char tmp[NAME_MAX + 1];
    if (!temp_name(name, tmp)) return -1;
    // A leftover of an interrupted replace goes; O_EXCL then makes sure the
    // new file is ours, with our mode, and not a link planted meanwhile.
    unlinkat(dirfd, tmp, 0);
    return safe_open_file(dirfd, tmp, SAFE_EXCL, mode);
}

int safe_replace_commit(int dirfd, const char* name, int fd) {
    char tmp[NAME_MAX + 1];
    if (!temp_name(name, tmp)) {
        close(fd);
        return -1;
    }
    int rc = TEMP_FAILURE_RETRY(fsync(fd));
    int err = errno;
    if (close(fd) != 0 && rc == 0) {
        rc = -1;
        err = errno;
    }
    if (rc == 0 && renameat(dirfd, tmp, dirfd, name) != 0) {
        rc = -1;
        err = errno;
    }
    if (rc != 0) {
        unlinkat(dirfd, tmp, 0);
        errno = err;
        return -1;
    }
    // Makes the rename itself survive a power cut; the new file is in place
    // whatever this says.
    if (TEMP_FAILURE_RETRY(fsync(dirfd)) != 0) {
        err = errno;
        HLOG(TAG_UTIL, WLOG_ERROR, "sync of the folder of %s failed(%s)", name, strerror(err));
    }
    return 0;
}

void safe_replace_abort(int dirfd, const char* name, int fd) {
    close(fd);
    char tmp[NAME_MAX + 1];
    if (temp_name(name, tmp)) unlinkat(dirfd, tmp, 0);
}

int safe_replace_file(int dirfd, const char* name, const void* data, size_t len, mode_t mode) {
    int fd = safe_replace_begin(dirfd, name, mode);
    if (fd < 0) return -1;
    if (write_fully(fd, data, len) != static_cast<ssize_t>(len)) {
        int err = len == 0 ? EIO : errno;
        safe_replace_abort(dirfd, name, fd);
        errno = err;
        return -1;
    }
    return safe_replace_commit(dirfd, name, fd);
}

int safe_list_dir(int dirfd, int (*visit)(void* arg, const char* name, int type), void* arg) {
    // A descriptor of its own: closedir closes it, and the caller's stays put.
    int fd = TEMP_FAILURE_RETRY(openat(dirfd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (fd < 0) return -1;
    DIR* dir = fdopendir(fd);
    if (dir == nullptr) {
        close(fd);
        return -1;
    }
    int count = 0;
    int err = 0;
    for (;;) {
        errno = 0;
        struct dirent* entry = readdir(dir);
        if (entry == nullptr) {
            err = errno;
            break;
        }
        if (is_dot_name(entry->d_name, strlen(entry->d_name))) continue;
        int type = entry->d_type;
        if (type == DT_UNKNOWN) {
            struct stat st;
            if (fstatat(dirfd, entry->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0) {
                type = S_ISDIR(st.st_mode)   ? DT_DIR
                       : S_ISREG(st.st_mode) ? DT_REG
                       : S_ISLNK(st.st_mode) ? DT_LNK
                                             : DT_UNKNOWN;
            }
        }
        count++;
        if (visit(arg, entry->d_name, type) != 0) break;
    }
    closedir(dir);
    if (err != 0) {
        errno = err;
        return -1;
    }
    return count;
}

int safe_remove_file(int dirfd, const char* name) { return unlinkat(dirfd, name, 0); }

int safe_remove_dir(int dirfd, const char* name) { return unlinkat(dirfd, name, AT_REMOVEDIR); }

int safe_remove_tree(int dirfd, const char* name) { return remove_tree(dirfd, name, 0); }

// Paths up to 254 characters, as the history cuts its lines.
static constexpr size_t MAKE_DIR_BUF = 255;

int make_dir_recursive(const char* path) {
    WLOG(TAG_UTIL, WLOG_INFO, "create dir %s", path);

    char buf[MAKE_DIR_BUF];
    int ok = copy_str(buf, sizeof(buf), path);
    if (ok) {
        char parent[MAKE_DIR_BUF];
        copy_str(parent, sizeof(parent), dirname(buf));
        // A failure of the parent shows in the mkdir below.
        if (access(parent, F_OK) != 0) make_dir_recursive(parent);
        if (mkdir(path, 0775) == 0) return 1;
    } else {
        // A cut path would create some other directory.
        errno = ENAMETOOLONG;
    }
    int err = errno;
    HLOG(TAG_UTIL, WLOG_ERROR, "mkdir fail(%s)", strerror(err));
    errno = err;
    return 0;
}

bool path_exists(const char* path) {
    struct stat st;
    return lstat(path, &st) == 0;
}
