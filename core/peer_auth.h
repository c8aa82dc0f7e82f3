// Who may talk to the control socket: the peer credentials of a connection.
#pragma once

#include <sys/types.h>

#include "common/peer_cred.h"
#include "record/record_limit.h"

// Records of refused control clients: any app can connect in a loop.
extern RecordLimit refused_control_peers;

// 1 when uid may send commands: root, system, shell, or the daemon's own user.
int control_peer_allowed(uid_t uid);

// Writes the summaries of refusal records held back, the control socket's and
// the transist's. Returns the ms until it should be called again, or -1 when
// nothing is held back.
int peer_records_flush();
