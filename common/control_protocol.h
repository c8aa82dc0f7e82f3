// Wire protocol of the control socket "tavlologd": shared by the daemon, the
// client library, tavlologctl and the tests.
//
// A client writes one command as text followed by one terminating byte (NUL or
// newline); the daemon reads it with one read of at most CONTROL_MSG_MAX bytes
// and drops the last byte. Replies and broadcasts carry no terminator: a reply
// is the command word (or, for a configuration message, the trimmed message)
// followed by ",1" (done) or ",0" (failed); broadcasts are whole words written
// by one write each, so they never split a reply but may share a read with it.
#pragma once

#include <stddef.h>
#include <string.h>

// Abstract-namespace local socket.
#define CONTROL_SOCKET_NAME "tavlologd"
constexpr int CONTROL_BACKLOG = 4;

// One command message: the daemon's single read, terminating byte included.
constexpr int CONTROL_MSG_MAX = 254;
// Longest command text a client may send: the terminating byte takes the last place.
constexpr int CONTROL_CMD_MAX = CONTROL_MSG_MAX - 1;
// Longest reply text: a whole command text plus ",1".
constexpr int CONTROL_REPLY_MAX = CONTROL_CMD_MAX + 2;

// Command words, matched as prefixes in the order of control_commands[].
#define CMD_DEEP_START "deep_start"
#define CMD_START "start"
#define CMD_DEEP_STOP "deep_stop"
#define CMD_STOP "stop"
#define CMD_COPY "copy"
#define CMD_HBR_SHUTDOWN "HBR_SHUTDOWN"

enum ControlCommand {
    CONTROL_CONFIG = -1,  // none of the words: a key=value configuration message
    CONTROL_DEEP_START = 0,
    CONTROL_START,
    CONTROL_DEEP_STOP,
    CONTROL_STOP,
    CONTROL_COPY,
    CONTROL_HBR_SHUTDOWN,
};

// "deep_start" must be tried before "start" and "deep_stop" before "stop":
// anything after the word is ignored, so "stopped" is a stop.
constexpr const char* control_commands[] = {CMD_DEEP_START, CMD_START, CMD_DEEP_STOP,
                                            CMD_STOP,       CMD_COPY,  CMD_HBR_SHUTDOWN};
constexpr int CONTROL_COMMAND_COUNT = sizeof(control_commands) / sizeof(control_commands[0]);

// The command a message begins with, or CONTROL_CONFIG.
inline int match_control_command(const char* message) {
    for (int i = 0; i < CONTROL_COMMAND_COUNT; i++) {
        if (strncmp(message, control_commands[i], strlen(control_commands[i])) == 0) return i;
    }
    return CONTROL_CONFIG;
}

#define REPLY_DONE ",1"
#define REPLY_FAILED ",0"
constexpr int REPLY_SUFFIX_LEN = 2;

// Unsolicited notices to every connected client.
#define BROADCAST_STOPPED "tqlog_stopped"        // all collectors died
#define BROADCAST_STORAGE_FULL "storage_full"    // the log root ran low on space
#define BROADCAST_FOLDER_LOST "log_folder_lost"  // the run folder disappeared
constexpr const char* control_broadcasts[] = {BROADCAST_STOPPED, BROADCAST_STORAGE_FULL,
                                              BROADCAST_FOLDER_LOST};
constexpr int CONTROL_BROADCAST_COUNT = sizeof(control_broadcasts) / sizeof(control_broadcasts[0]);

// The daemon's run state as clients read it from system properties.
#define PROP_RUNNING "debug.TQ.running"    // "1" while a logging run is active
#define PROP_REALPATH "debug.TQ.realpath"  // the run folder, "" when none
#define PROP_LOGSIZE "debug.TQ.logsize"    // the rotation size of the run in KB
// Which collectors of the run are alive, in the fixed order of the log types:
// "main=up,radio=up,events=up,kernel=down,bt=off" (up: running; down: enabled
// but ended, or never started; off: not enabled for this run); "" while no run
// is active. Updated at run start, at each death and at stop.
#define PROP_COLLECTORS "debug.TQ.collectors"
// The option against a flooding app: KB per second per pid; unset, 0, not a
// number or more than FLOOD_BUDGET_MAX_KB: off.
#define PROP_PID_BUDGET "persist.TQ.pid_budget"
constexpr long FLOOD_BUDGET_MAX_KB = 1 << 20;
// "SECONDS.NANOS": the wall-clock time at which the boot clock read zero, set at
// every run start and folder switch, so that the run's properties dump lets a
// reader give the kernel's lines (timed since boot) their wall-clock time.
#define PROP_BOOT_WALLCLOCK "debug.TQ.boot_wallclock"

// Peers allowed on the control socket besides the daemon's own user.
constexpr int CONTROL_UID_ROOT = 0;
constexpr int CONTROL_UID_SYSTEM = 1000;
constexpr int CONTROL_UID_SHELL = 2000;  // also the user the daemon runs as
