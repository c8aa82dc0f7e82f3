// Giving up root at start-up while keeping the one capability the kernel
// collector needs (syslog, to read /proc/kmsg).
#pragma once

#include <stdint.h>
#include <sys/types.h>

constexpr uid_t DAEMON_UID = 2000;
constexpr gid_t DAEMON_GID = 1000;
constexpr int DAEMON_GROUP_COUNT = 8;
extern const gid_t DAEMON_GROUPS[DAEMON_GROUP_COUNT];

// Runs the privilege steps when started as root; records what fails and goes on.
void drop_privileges();

// The inheritable word to ask for: "all", limited to what the bounding set
// allows for the 32 capabilities of word `word` (0 or 1).
uint32_t inheritable_within_bounds(int word, uint32_t wanted);
