// Folders and files the daemon writes where another process may have planted
// a symbolic link (the storage card, /data/misc/tqlog of the shell user): each
// is opened from its parent's descriptor without following links.
//
// A path is opened knowing which leading part is trusted as it stands (the
// root: the log path, which may itself be or go through a link, or "/data"
// for the holding folders). Every component below the root is opened with
// O_NOFOLLOW | O_DIRECTORY from its parent (created with mkdirat when asked);
// a component that is a link or not a folder is refused with a record and
// errno ELOOP or ENOTDIR. "." and ".." below the root are refused (EINVAL).
//
// Modes are set through the descriptor (fchmod) on creation, so they do not
// depend on the umask. Every descriptor is O_CLOEXEC. A folder the daemon may
// search but not read is opened with O_PATH: good for the *at calls below,
// not for listing it or syncing it. Functions return a
// descriptor or 0, and -1 with errno set on failure.
#pragma once

#include <stddef.h>
#include <sys/types.h>

// The daemon's own folder: configuration, history, folder records.
#define DAEMON_DIR "/data/misc/tqlog"

// The leading part of path to trust: logpath when path lies below it (or is
// it), else "/data" for paths below /data, else nullptr. logpath may be null.
const char* trusted_root_of(const char* path, const char* logpath);

// trusted_root_of, or for a path below neither its parent folder (copied into
// buf, PATH_LEN bytes): then only its last component is opened without
// following links. nullptr for a path that is not absolute.
const char* trusted_root_for(const char* path, const char* logpath, char* buf);

// Opens the folder path, which must be root or lie below it. With create,
// missing folders (the root's own ones included) are made with mode.
// failed_at (PATH_LEN bytes, may be null) gets the path up to the component
// that failed.
int safe_open_dir(const char* root, const char* path, bool create, mode_t mode,
                  char* failed_at = nullptr);

// Opens DAEMON_DIR, creating it (and /data/misc) with mode when missing.
int open_daemon_dir(mode_t mode);

enum SafeOpen {
    SAFE_READ,    // read only
    SAFE_APPEND,  // write at the end; created when missing
    SAFE_TRUNC,   // write from an empty file; created when missing
    SAFE_EXCL,    // write a new file; fails with EEXIST when the name exists
};

// Opens the regular file name (one component) in the folder dirfd. A link is
// refused (ELOOP), so is anything but a regular file (EINVAL), both recorded;
// opening never blocks on a planted FIFO. A file created here gets mode.
int safe_open_file(int dirfd, const char* name, SafeOpen how, mode_t mode);

// safe_open_file on a whole path: its folder opened below root, no creation.
int safe_open_path_file(const char* root, const char* path, SafeOpen how, mode_t mode);

// Replacing a whole file atomically: begin writes a temporary "<name>.tmp"
// (made afresh with O_EXCL, mode set), commit syncs it, renames it over name
// and syncs the folder; abort removes it. Readers see the old or the new file,
// never a part of one. commit and abort close fd.
int safe_replace_begin(int dirfd, const char* name, mode_t mode);
int safe_replace_commit(int dirfd, const char* name, int fd);
void safe_replace_abort(int dirfd, const char* name, int fd);
// begin, one write of len bytes, commit.
int safe_replace_file(int dirfd, const char* name, const void* data, size_t len, mode_t mode);

// Calls visit for each entry of dirfd but "." and "..", with its type as
// lstat sees it (DT_DIR, DT_REG, DT_LNK, ... of <dirent.h>), until visit
// returns nonzero. Returns the number of entries visited, or -1 when the
// folder could not be read to its end: a failed listing is never an empty one.
int safe_list_dir(int dirfd, int (*visit)(void* arg, const char* name, int type), void* arg);

// unlinkat: a link is removed itself, never what it points to.
int safe_remove_file(int dirfd, const char* name);
int safe_remove_dir(int dirfd, const char* name);  // empty folders only
// Removes name and, when it is a folder, everything in it, without following
// links. Fails (ELOOP) on folders nested deeper than 16.
int safe_remove_tree(int dirfd, const char* name);

// mkdir -p with mode 0775, following links (for the daemon's own folders in
// /data). Returns 1 when the final mkdir succeeded, 0 otherwise (an existing
// path counts as failure).
int make_dir_recursive(const char* path);

// True when path names anything, a link included (lstat).
bool path_exists(const char* path);
