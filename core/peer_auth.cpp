#include "core/peer_auth.h"

#include <sys/socket.h>
#include <unistd.h>

#include "common/control_protocol.h"

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
