// A small client of the control socket "tavlologd", used by tavlologctl and
// by the tests: connect (checking who serves the socket), send a command,
// read its reply with a time-out, wait for broadcasts.
#pragma once

#include <stddef.h>
#include <sys/types.h>

#include "common/control_protocol.h"
#include "common/unique_fd.h"

enum ControlClientResult {
    CC_OK = 0,
    CC_UNREACHABLE = -1,  // nobody serves "tavlologd" (or the connection could not be made)
    CC_UNTRUSTED = -2,    // "tavlologd" is served by a user other than root or the daemon's
    CC_TIMEOUT = -3,      // no (complete) answer within the time-out
    CC_CLOSED = -4,       // the daemon closed the connection
    CC_IO = -5,           // a read or write failed
    CC_BAD_COMMAND = -6,  // empty, too long (over CONTROL_CMD_MAX) or not one line of text
    CC_PROTOCOL = -7,     // the daemon sent something that is neither the reply nor a broadcast
};

// Receive buffer: a reply plus several broadcasts.
constexpr int CONTROL_RECV_MAX = 1024;

struct ControlConnection {
    UniqueFd fd;
    // Bytes received but not handed out yet (broadcasts that came with a reply).
    char pending[CONTROL_RECV_MAX];
    size_t pending_len = 0;
    uid_t server_uid = 0;  // the serving process's user, from SO_PEERCRED
    pid_t server_pid = 0;
};

// Text for a ControlClientResult.
const char* control_result_text(int result);

// 1 when uid may serve "tavlologd": root, or the user the daemon runs as.
int control_server_trusted(uid_t uid);

// Connects to "tavlologd", retrying while the daemon's backlog is full, for at
// most timeout_ms. Returns CC_OK, CC_UNREACHABLE, CC_UNTRUSTED or CC_TIMEOUT.
int control_connect(ControlConnection* conn, int timeout_ms);

// Sends cmd followed by its terminating NUL in one write, waiting at most
// timeout_ms for room in the socket. Returns CC_OK, CC_BAD_COMMAND, CC_TIMEOUT,
// CC_CLOSED or CC_IO.
int control_send(ControlConnection* conn, const char* cmd, int timeout_ms);

// Sends bytes exactly as given (no terminator added, nothing checked): for
// tests of malformed messages.
int control_send_raw(ControlConnection* conn, const void* data, size_t len, int timeout_ms);

// The reply the daemon gives to cmd, without its ",1"/",0": the command word,
// or for a configuration message the message without trailing spaces and line feeds.
void control_expected_reply(const char* cmd, char* out, size_t n);

// Waits for the reply to cmd and copies it (e.g. "start,1") into reply (at
// least CONTROL_REPLY_MAX + 1 bytes). Broadcasts that arrive before or with it
// stay queued for control_next_event. Returns CC_OK, CC_TIMEOUT, CC_CLOSED,
// CC_IO or CC_PROTOCOL.
int control_read_reply(ControlConnection* conn, const char* cmd, char* reply, size_t n,
                       int timeout_ms);

// 1 when reply ends with ",1", 0 when with ",0", -1 otherwise.
int control_reply_status(const char* reply);

// Waits for the next broadcast (or any other unsolicited text) and copies it
// into out. Returns CC_OK, CC_TIMEOUT (timeout_ms < 0 waits for ever),
// CC_CLOSED or CC_IO.
int control_next_event(ControlConnection* conn, char* out, size_t n, int timeout_ms);

// One command on a connection of its own: connect, send, read the reply.
int control_command(const char* cmd, char* reply, size_t n, int timeout_ms);
