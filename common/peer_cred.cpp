#include "common/peer_cred.h"

#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/unique_fd.h"

int peer_credentials(int fd, uid_t* uid, pid_t* pid) {
    struct ucred cred = {};
    socklen_t len = sizeof(cred);
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) < 0) return 0;
    *uid = cred.uid;
    *pid = cred.pid;
    return 1;
}

// The parent of pid from /proc/<pid>/stat ("pid (comm) state ppid ..."; the
// name may hold spaces and parentheses, so it is skipped up to the last ')').
static pid_t parent_of(pid_t pid) {
    char path[32];
    snprintf(path, sizeof(path), "/proc/%d/stat", static_cast<int>(pid));
    UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC)));
    char stat[512];
    ssize_t n = fd.ok() ? TEMP_FAILURE_RETRY(read(fd.get(), stat, sizeof(stat) - 1)) : -1;
    if (n <= 0) return -1;
    stat[n] = '\0';
    const char* end = strrchr(stat, ')');
    int ppid = -1;
    if (end == nullptr || sscanf(end + 1, " %*c %d", &ppid) != 1) return -1;
    return ppid;
}

bool is_self_or_child(pid_t pid) {
    pid_t self = getpid();
    return pid > 0 && (pid == self || parent_of(pid) == self);
}
