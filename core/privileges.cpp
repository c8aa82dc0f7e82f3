#include "core/privileges.h"

#include <errno.h>
#include <grp.h>
#include <linux/capability.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "record/record.h"

const gid_t DAEMON_GROUPS[DAEMON_GROUP_COUNT] = {1000, 1001, 1007, 1015, 9998, 2001, 1028, 1023};

namespace {

struct CapRow {
    uint32_t eff_prm[2];
    uint32_t inheritable[2];
};

// Before the identity change: set-gid, set-uid, sys-nice and syslog; after it: syslog only.
constexpr CapRow CAPS_BEFORE = {{0x008000C0, 0x00000004}, {0xFFFFFFFF, 0xFFFFFFFF}};
constexpr CapRow CAPS_AFTER = {{0, 0x00000004}, {0xFFFFFFFF, 0xFFFFFFFF}};

int set_caps(const CapRow& row, bool bounded) {
    __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct data[2] = {};
    for (int i = 0; i < 2; i++) {
        data[i].effective = row.eff_prm[i];
        data[i].permitted = row.eff_prm[i];
        data[i].inheritable =
            bounded ? inheritable_within_bounds(i, row.inheritable[i]) : row.inheritable[i];
    }
    return static_cast<int>(syscall(SYS_capset, &header, data));
}

// The kernel refuses an inheritable set beyond the bounding set (a container, or
// a phone whose init narrowed it). Failing the whole call would leave the daemon
// with every permitted capability, so ask again for what the bounds allow.
int set_caps_checked(const CapRow& row) {
    int rc = set_caps(row, false);
    if (rc != 0 && errno == EPERM) rc = set_caps(row, true);
    return rc;
}

}  // namespace

uint32_t inheritable_within_bounds(int word, uint32_t wanted) {
    uint32_t allowed = 0;
    for (int bit = 0; bit < 32; bit++) {
        int cap = word * 32 + bit;
        if (prctl(PR_CAPBSET_READ, cap, 0, 0, 0) == 1) allowed |= 1u << bit;
    }
    return wanted & allowed;
}

void drop_privileges() {
    if (prctl(PR_SET_KEEPCAPS, 1, 0, 0) != 0) {
        WLOG(TAG_DEBUG, WLOG_WARN, "    prctl failed: %s", strerror(errno));
        return;
    }
    if (set_caps_checked(CAPS_BEFORE) != 0) {
        WLOG(TAG_DEBUG, WLOG_WARN, "    cap setting failed, %s", strerror(errno));
    }
    if (setgroups(DAEMON_GROUP_COUNT, DAEMON_GROUPS) != 0) {
        HLOG(TAG_DEBUG, WLOG_ERROR, "setgroups fails");
    }
    if (setgid(DAEMON_GID) != 0) HLOG(TAG_DEBUG, WLOG_ERROR, "setgid fails");
    if (setuid(DAEMON_UID) != 0) HLOG(TAG_DEBUG, WLOG_ERROR, "setuid fails");
    if (set_caps_checked(CAPS_AFTER) != 0) {
        WLOG(TAG_DEBUG, WLOG_WARN, "    cap re-setting failed, %s", strerror(errno));
    }
}
