// Who may talk to the control socket: the peer credentials of a connection.
#pragma once

#include <sys/types.h>

#include "record/record_limit.h"

// Records of refused control clients: any app can connect in a loop.
extern RecordLimit refused_control_peers;

// Credentials of the process at the other end of a local stream socket, as the
// kernel recorded them at connect (or listen) time. Returns 1, or 0 with errno
// set when they cannot be read.
int peer_credentials(int fd, uid_t* uid, pid_t* pid);

// 1 when uid may send commands: root, system, shell, or the daemon's own user.
int control_peer_allowed(uid_t uid);

// 1 when the peer of a "log_socket" connection is one of this daemon's own
// processes: its collectors (children of the daemon, checked through /proc
// so that a collector connecting before its pid was stored is admitted too)
// or the daemon itself. Anything else is recorded (rate-limited) and 0.
int log_peer_allowed(int fd);

// Writes the summaries of refusal records held back. Returns the ms until it
// should be called again, or -1 when nothing is held back.
int peer_records_flush();
