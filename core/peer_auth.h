// Who may talk to the control socket: the peer credentials of a connection.
#pragma once

#include <sys/types.h>

// Credentials of the process at the other end of a local stream socket, as the
// kernel recorded them at connect (or listen) time. Returns 1, or 0 with errno
// set when they cannot be read.
int peer_credentials(int fd, uid_t* uid, pid_t* pid);

// 1 when uid may send commands: root, system, shell, or the daemon's own user.
int control_peer_allowed(uid_t uid);
