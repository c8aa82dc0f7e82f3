#include "common/control_client.h"

#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <utility>

#include <cutils/sockets.h>

#include "common/clock.h"
#include "common/io_util.h"

// Pause between connection attempts while the daemon's backlog is full.
static constexpr int CONNECT_RETRY_MS = 20;

const char* control_result_text(int result) {
    switch (result) {
        case CC_OK:
            return "ok";
        case CC_UNREACHABLE:
            return "the daemon cannot be reached on \"" CONTROL_SOCKET_NAME "\"";
        case CC_UNTRUSTED:
            return "\"" CONTROL_SOCKET_NAME "\" is not served by root or the daemon's user";
        case CC_TIMEOUT:
            return "the daemon did not answer in time";
        case CC_CLOSED:
            return "the daemon closed the connection";
        case CC_IO:
            return "the connection failed";
        case CC_BAD_COMMAND:
            return "the command is empty, too long or not one line of text";
        case CC_PROTOCOL:
            return "the daemon's answer is not understood";
        default:
            return "unknown error";
    }
}

int control_server_trusted(uid_t uid) {
    return uid == static_cast<uid_t>(CONTROL_UID_ROOT) ||
           uid == static_cast<uid_t>(CONTROL_UID_SHELL);
}

// Milliseconds left until deadline (never negative); -1 for no deadline.
static int remaining_ms(long long deadline) {
    if (deadline < 0) return -1;
    long long left = deadline - monotonic_ms();
    return left > 0 ? static_cast<int>(left) : 0;
}

static long long deadline_after(int timeout_ms) {
    return timeout_ms < 0 ? -1 : monotonic_ms() + timeout_ms;
}

// Waits until fd is ready for events. Returns CC_OK or CC_TIMEOUT/CC_IO.
static int wait_fd(int fd, short events, long long deadline) {
    for (;;) {
        struct pollfd pfd = {fd, events, 0};
        int rc = poll(&pfd, 1, remaining_ms(deadline));
        if (rc > 0) return CC_OK;  // hang-ups and errors show in the read or write that follows
        if (rc == 0) return CC_TIMEOUT;
        if (errno != EINTR) return CC_IO;
    }
}

int control_connect(ControlConnection* conn, int timeout_ms) {
    long long deadline = deadline_after(timeout_ms);
    conn->fd.reset();
    conn->pending_len = 0;
    for (;;) {
        // Non-blocking, so that a daemon whose backlog is full (its control
        // thread busy or stuck) cannot hold the connect up for ever.
        UniqueFd fd(socket(AF_LOCAL, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
        if (!fd.ok()) return CC_IO;
        if (socket_local_client_connect(fd.get(), CONTROL_SOCKET_NAME,
                                        ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM) >= 0) {
            conn->fd = std::move(fd);
            break;
        }
        if (errno != EAGAIN && errno != EINTR) return CC_UNREACHABLE;
        if (remaining_ms(deadline) == 0) return CC_TIMEOUT;
        usleep(CONNECT_RETRY_MS * 1000);
    }

    // Commands and replies are only worth anything when the real daemon
    // serves the name: any local user could bind it first.
    struct ucred cred = {};
    socklen_t len = sizeof(cred);
    if (getsockopt(conn->fd.get(), SOL_SOCKET, SO_PEERCRED, &cred, &len) < 0 ||
        !control_server_trusted(cred.uid)) {
        conn->server_uid = cred.uid;
        conn->server_pid = cred.pid;
        conn->fd.reset();
        return CC_UNTRUSTED;
    }
    conn->server_uid = cred.uid;
    conn->server_pid = cred.pid;
    return CC_OK;
}

static int send_bytes(ControlConnection* conn, const char* data, size_t len, int timeout_ms) {
    long long deadline = deadline_after(timeout_ms);
    size_t done = 0;
    while (done < len) {
        ssize_t n = send(conn->fd.get(), data + done, len - done, MSG_NOSIGNAL);
        if (n > 0) {
            done += static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            int rc = wait_fd(conn->fd.get(), POLLOUT, deadline);
            if (rc != CC_OK) return rc;
            continue;
        }
        return (n < 0 && (errno == EPIPE || errno == ECONNRESET)) ? CC_CLOSED : CC_IO;
    }
    return CC_OK;
}

int control_send(ControlConnection* conn, const char* cmd, int timeout_ms) {
    size_t len = strlen(cmd);
    if (len == 0 || len > static_cast<size_t>(CONTROL_CMD_MAX)) return CC_BAD_COMMAND;
    for (size_t i = 0; i < len; i++) {
        unsigned char c = static_cast<unsigned char>(cmd[i]);
        if (c < 0x20 || c == 0x7f) return CC_BAD_COMMAND;
    }
    // The daemon drops the last byte of what one read returns: send the
    // terminating NUL with the text, in one piece.
    return send_bytes(conn, cmd, len + 1, timeout_ms);
}

int control_send_raw(ControlConnection* conn, const void* data, size_t len, int timeout_ms) {
    return send_bytes(conn, static_cast<const char*>(data), len, timeout_ms);
}

void control_expected_reply(const char* cmd, char* out, size_t n) {
    int command = match_control_command(cmd);
    if (command != CONTROL_CONFIG) {
        copy_str(out, n, control_commands[command]);
        return;
    }
    // As the daemon trims a configuration message: trailing spaces and line
    // feeds go, the first character always stays, leading spaces stay.
    copy_str(out, n, cmd);
    size_t len = strlen(out);
    while (len > 1 && (out[len - 1] == ' ' || out[len - 1] == '\n')) out[--len] = '\0';
}

int control_reply_status(const char* reply) {
    size_t len = strlen(reply);
    if (len < static_cast<size_t>(REPLY_SUFFIX_LEN)) return -1;
    const char* suffix = reply + len - REPLY_SUFFIX_LEN;
    if (strcmp(suffix, REPLY_DONE) == 0) return 1;
    if (strcmp(suffix, REPLY_FAILED) == 0) return 0;
    return -1;
}

// Reads what is there into pending, waiting until deadline for the first byte.
static int receive_more(ControlConnection* conn, long long deadline) {
    if (conn->pending_len >= sizeof(conn->pending)) return CC_PROTOCOL;
    for (;;) {
        ssize_t n = read(conn->fd.get(), conn->pending + conn->pending_len,
                         sizeof(conn->pending) - conn->pending_len);
        if (n > 0) {
            conn->pending_len += static_cast<size_t>(n);
            return CC_OK;
        }
        if (n == 0) return CC_CLOSED;
        if (errno == EINTR) continue;
        if (errno == ECONNRESET) return CC_CLOSED;
        if (errno != EAGAIN && errno != EWOULDBLOCK) return CC_IO;
        int rc = wait_fd(conn->fd.get(), POLLIN, deadline);
        if (rc != CC_OK) return rc;
    }
}

// Length of the broadcast word that data begins with, 0 when none does
// completely; *partial is set when data is a proper beginning of one.
static size_t broadcast_at(const char* data, size_t len, bool* partial) {
    *partial = false;
    for (const char* word : control_broadcasts) {
        size_t word_len = strlen(word);
        if (len >= word_len) {
            if (memcmp(data, word, word_len) == 0) return word_len;
        } else if (memcmp(data, word, len) == 0) {
            *partial = true;
        }
    }
    return 0;
}

static void drop_pending(ControlConnection* conn, size_t at, size_t len) {
    memmove(conn->pending + at, conn->pending + at + len, conn->pending_len - at - len);
    conn->pending_len -= len;
}

int control_read_reply(ControlConnection* conn, const char* cmd, char* reply, size_t n,
                       int timeout_ms) {
    long long deadline = deadline_after(timeout_ms);
    char expected[CONTROL_REPLY_MAX + 1];
    control_expected_reply(cmd, expected, sizeof(expected));
    size_t expected_len = strlen(expected);

    for (;;) {
        // Broadcasts are written whole and never inside a reply, so the reply
        // follows zero or more complete broadcast words.
        size_t pos = 0;
        bool need_more = false;
        while (!need_more) {
            const char* rest = conn->pending + pos;
            size_t rest_len = conn->pending_len - pos;
            size_t reply_len = expected_len + REPLY_SUFFIX_LEN;
            if (rest_len >= reply_len && memcmp(rest, expected, expected_len) == 0 &&
                rest[expected_len] == ',' &&
                (rest[expected_len + 1] == '1' || rest[expected_len + 1] == '0')) {
                size_t copy = reply_len < n ? reply_len : n - 1;
                memcpy(reply, rest, copy);
                reply[copy] = '\0';
                drop_pending(conn, pos, reply_len);
                return CC_OK;
            }
            // The reply may still be on its way (it can begin like a broadcast word).
            if (rest_len < reply_len &&
                memcmp(rest, expected, rest_len < expected_len ? rest_len : expected_len) == 0 &&
                (rest_len <= expected_len || rest[expected_len] == ',')) {
                need_more = true;
                break;
            }
            bool partial = false;
            size_t word_len = broadcast_at(rest, rest_len, &partial);
            if (word_len > 0) {
                pos += word_len;
                continue;
            }
            if (!partial) return CC_PROTOCOL;
            need_more = true;
        }
        int rc = receive_more(conn, deadline);
        if (rc != CC_OK) return rc;
    }
}

int control_next_event(ControlConnection* conn, char* out, size_t n, int timeout_ms) {
    long long deadline = deadline_after(timeout_ms);
    for (;;) {
        if (conn->pending_len > 0) {
            bool partial = false;
            size_t len = broadcast_at(conn->pending, conn->pending_len, &partial);
            if (len == 0 && !partial) {
                // Not a known word: hand out the text up to the next one.
                len = 1;
                while (len < conn->pending_len) {
                    bool ignored;
                    if (broadcast_at(conn->pending + len, conn->pending_len - len, &ignored) > 0)
                        break;
                    len++;
                }
            }
            if (len > 0) {
                size_t copy = len < n ? len : n - 1;
                memcpy(out, conn->pending, copy);
                out[copy] = '\0';
                drop_pending(conn, 0, len);
                return CC_OK;
            }
        }
        int rc = receive_more(conn, deadline);
        if (rc == CC_CLOSED && conn->pending_len > 0) {
            // The rest of a word that never came: hand it out as it is.
            size_t copy = conn->pending_len < n ? conn->pending_len : n - 1;
            memcpy(out, conn->pending, copy);
            out[copy] = '\0';
            conn->pending_len = 0;
            return CC_OK;
        }
        if (rc != CC_OK) return rc;
    }
}

int control_command(const char* cmd, char* reply, size_t n, int timeout_ms) {
    long long deadline = deadline_after(timeout_ms);
    ControlConnection conn;
    int rc = control_connect(&conn, timeout_ms);
    if (rc != CC_OK) return rc;
    rc = control_send(&conn, cmd, remaining_ms(deadline));
    if (rc != CC_OK) return rc;
    return control_read_reply(&conn, cmd, reply, n, remaining_ms(deadline));
}
