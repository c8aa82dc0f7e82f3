#include "core/peer_auth.h"

#include <unistd.h>

#include "common/control_protocol.h"
#include "record/record_limit.h"
#include "transist/transist.h"

RecordLimit refused_control_peers = RECORD_LIMIT(TAG_MAIN, "refused control clients");

// A command can start or stop recording and rewrite the configuration, so
// only the platform's privileged users and the shell (adb) are trusted; apps
// run with uids of 10000 and above.
int control_peer_allowed(uid_t uid) {
    return uid == CONTROL_UID_ROOT || uid == CONTROL_UID_SYSTEM || uid == CONTROL_UID_SHELL ||
           uid == getuid();
}

int peer_records_flush() {
    int a = record_limit_flush(&refused_control_peers);
    int b = transist_records_flush();
    if (a < 0) return b;
    return b < 0 || a < b ? a : b;
}
