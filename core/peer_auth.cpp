#include "core/peer_auth.h"

#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "common/control_protocol.h"
#include "common/io_util.h"
#include "common/unique_fd.h"
#include "record/record_limit.h"

RecordLimit refused_control_peers = RECORD_LIMIT(TAG_MAIN, "refused control clients");
static RecordLimit refused_log_peers = RECORD_LIMIT(TAG_TRANSIST, "refused log_socket clients");

int peer_credentials(int fd, uid_t* uid, pid_t* pid) {
    struct ucred cred = {};
    socklen_t len = sizeof(cred);
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) < 0) return 0;
    *uid = cred.uid;
    *pid = cred.pid;
    return 1;
}

// A command can start or stop recording and rewrite the configuration, so
// only the platform's privileged users and the shell (adb) are trusted; apps
// run with uids of 10000 and above.
int control_peer_allowed(uid_t uid) {
    return uid == CONTROL_UID_ROOT || uid == CONTROL_UID_SYSTEM || uid == CONTROL_UID_SHELL ||
           uid == getuid();
}

// The parent of pid from /proc/<pid>/stat ("pid (comm) state ppid ..."; the
// name may hold spaces and parentheses, so it is skipped up to the last ')').
static pid_t parent_of(pid_t pid) {
    char path[32];
    snprintf(path, sizeof(path), "/proc/%d/stat", static_cast<int>(pid));
    UniqueFd fd(RETRY_EINTR(open(path, O_RDONLY | O_CLOEXEC)));
    char stat[512];
    ssize_t n = fd.ok() ? RETRY_EINTR(read(fd.get(), stat, sizeof(stat) - 1)) : -1;
    if (n <= 0) return -1;
    stat[n] = '\0';
    const char* end = strrchr(stat, ')');
    int ppid = -1;
    if (end == nullptr || sscanf(end + 1, " %*c %d", &ppid) != 1) return -1;
    return ppid;
}

// Any local process can connect to an abstract socket: an app could forge
// log lines, or displace a collector's connection and stop the run. The
// collectors are the daemon's children; the daemon's user alone would also
// admit the shell.
int log_peer_allowed(int fd) {
    uid_t uid = 0;
    pid_t pid = 0;
    if (!peer_credentials(fd, &uid, &pid)) {
        int err = errno;
        HLOG_LIMITED(refused_log_peers, TAG_TRANSIST, WLOG_WARN,
                     "cannot get credentials of log_socket client (%s), closed", strerror(err));
        return 0;
    }
    pid_t self = getpid();
    if (pid > 0 && (pid == self || parent_of(pid) == self)) return 1;
    HLOG_LIMITED(refused_log_peers, TAG_TRANSIST, WLOG_WARN, "refuse log_socket client uid %d pid %d, closed",
                 static_cast<int>(uid), static_cast<int>(pid));
    return 0;
}

int peer_records_flush() {
    int a = record_limit_flush(&refused_control_peers);
    int b = record_limit_flush(&refused_log_peers);
    if (a < 0) return b;
    return b < 0 || a < b ? a : b;
}
