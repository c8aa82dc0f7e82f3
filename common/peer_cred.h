// What the kernel says about the process at the other end of a local socket.
#pragma once

#include <sys/types.h>

// Credentials of the process at the other end of a local stream socket, as the
// kernel recorded them at connect (or listen) time. Returns 1, or 0 with errno
// set when they cannot be read.
int peer_credentials(int fd, uid_t* uid, pid_t* pid);

// True when pid is this process or one of its children (checked through
// /proc, so a child is known before its fork has returned in the parent).
bool is_self_or_child(pid_t pid);
