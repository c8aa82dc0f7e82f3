// tavlologctl: command-line client of tavlo_log_d.
//
//   tavlologctl [-t SECONDS] COMMAND       send COMMAND, print the reply
//   tavlologctl [-t SECONDS] --listen [--send COMMAND]
//                                          print each broadcast on its own line
//                                          until the daemon closes the connection
//   tavlologctl status                     the daemon's state from its properties
//   tavlologctl [-t SECONDS] --raw TEXT    (tests) send TEXT's bytes exactly, with no
//                                          terminator, and print the first answer
//
// Exit status: 0 reply ",1" (or listening ended normally), 1 reply ",0",
// 2 the daemon cannot be reached, is not trusted, does not answer in time,
// or the arguments are wrong.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "common/control_client.h"
#include "common/control_protocol.h"
#include "platform/properties.h"

static constexpr int DEFAULT_TIMEOUT_S = 10;
static constexpr int MAX_TIMEOUT_S = 3600;

enum { EXIT_DONE = 0, EXIT_COMMAND_FAILED = 1, EXIT_TROUBLE = 2 };

static void usage() {
    fprintf(stderr,
            "usage: tavlologctl [-t SECONDS] COMMAND\n"
            "       tavlologctl [-t SECONDS] --listen [--send COMMAND]\n"
            "       tavlologctl status\n"
            "COMMAND: start, stop, deep_start, deep_stop, copy, HBR_SHUTDOWN or key=value\n");
}

static int trouble(const char* what, int result) {
    fprintf(stderr, "tavlologctl: %s: %s\n", what, control_result_text(result));
    return EXIT_TROUBLE;
}

static int exit_for_reply(const char* reply) {
    int status = control_reply_status(reply);
    if (status == 1) return EXIT_DONE;
    if (status == 0) return EXIT_COMMAND_FAILED;
    return EXIT_TROUBLE;
}

static int connect_to_daemon(ControlConnection* conn, int timeout_ms) {
    int rc = control_connect(conn, timeout_ms);
    if (rc == CC_UNTRUSTED) {
        fprintf(stderr, "tavlologctl: refusing \"%s\": served by uid %d pid %d\n",
                CONTROL_SOCKET_NAME, static_cast<int>(conn->server_uid),
                static_cast<int>(conn->server_pid));
        return EXIT_TROUBLE;
    }
    if (rc != CC_OK) return trouble("connect", rc);
    return EXIT_DONE;
}

// Sends cmd and prints its reply; broadcasts that come first stay queued.
static int send_and_print(ControlConnection* conn, const char* cmd, int timeout_ms) {
    int rc = control_send(conn, cmd, timeout_ms);
    if (rc != CC_OK) return trouble(cmd, rc);
    char reply[CONTROL_REPLY_MAX + 1];
    rc = control_read_reply(conn, cmd, reply, sizeof(reply), timeout_ms);
    if (rc != CC_OK) return trouble(cmd, rc);
    printf("%s\n", reply);
    fflush(stdout);
    return exit_for_reply(reply);
}

static int run_command(const char* cmd, int timeout_ms) {
    ControlConnection conn;
    int rc = connect_to_daemon(&conn, timeout_ms);
    if (rc != EXIT_DONE) return rc;
    rc = send_and_print(&conn, cmd, timeout_ms);
    // Notices that arrived with the reply are not the reply: keep stdout for it.
    char event[CONTROL_RECV_MAX];
    while (control_next_event(&conn, event, sizeof(event), 0) == CC_OK) {
        fprintf(stderr, "tavlologctl: broadcast: %s\n", event);
    }
    return rc;
}

static int run_listen(const char* cmd, int timeout_ms) {
    ControlConnection conn;
    int rc = connect_to_daemon(&conn, timeout_ms);
    if (rc != EXIT_DONE) return rc;
    int result = EXIT_DONE;
    if (cmd) {
        result = send_and_print(&conn, cmd, timeout_ms);
        if (result == EXIT_TROUBLE) return result;
    }
    char event[CONTROL_RECV_MAX];
    for (;;) {
        rc = control_next_event(&conn, event, sizeof(event), -1);
        if (rc == CC_CLOSED) return result;
        if (rc != CC_OK) return trouble("listen", rc);
        printf("%s\n", event);
        fflush(stdout);
    }
}

// For tests of malformed messages: the daemon sees exactly these bytes.
static int run_raw(const char* text, int timeout_ms) {
    ControlConnection conn;
    int rc = connect_to_daemon(&conn, timeout_ms);
    if (rc != EXIT_DONE) return rc;
    rc = control_send_raw(&conn, text, strlen(text), timeout_ms);
    if (rc != CC_OK) return trouble("raw", rc);
    char answer[CONTROL_RECV_MAX];
    rc = control_next_event(&conn, answer, sizeof(answer), timeout_ms);
    if (rc != CC_OK) return trouble("raw", rc);
    printf("%s\n", answer);
    fflush(stdout);
    return exit_for_reply(answer);
}

// "main=up,radio=up,..." as "collectors: main up, radio up, ..."; "none"
// while no run is active.
static void print_collectors() {
    char value[PROPERTY_VALUE_MAX];
    property_get(PROP_COLLECTORS, value, "");
    printf("collectors: %s", value[0] ? "" : "none");
    for (const char* c = value; *c; c++) {
        if (*c == '=') {
            putchar(' ');
        } else if (*c == ',') {
            fputs(", ", stdout);
        } else {
            putchar(*c);
        }
    }
    putchar('\n');
}

static int run_status() {
    char running[PROPERTY_VALUE_MAX];
    char folder[PROPERTY_VALUE_MAX];
    char logsize[PROPERTY_VALUE_MAX];
    property_get(PROP_RUNNING, running, "0");
    property_get(PROP_REALPATH, folder, "");
    property_get(PROP_LOGSIZE, logsize, "");
    printf("running: %s\n", atoi(running) != 0 ? "yes" : "no");
    printf("run folder: %s\n", folder[0] ? folder : "none");
    if (logsize[0]) {
        printf("rotation size: %s KB\n", logsize);
    } else {
        printf("rotation size: unknown\n");
    }
    // Read by each Android collector as a run starts.
    char budget[PROPERTY_VALUE_MAX];
    property_get(PROP_PID_BUDGET, budget, "0");
    long kb = atol(budget);
    if (kb > 0 && kb <= FLOOD_BUDGET_MAX_KB) {
        printf("per-pid budget (%s): %ld KB/s, entries past it dropped and summarised\n", PROP_PID_BUDGET, kb);
    } else {
        printf("per-pid budget (%s): off, every entry kept\n", PROP_PID_BUDGET);
    }
    print_collectors();
    return EXIT_DONE;
}

int main(int argc, char** argv) {
    int timeout_s = DEFAULT_TIMEOUT_S;
    bool listen = false;
    const char* send_cmd = nullptr;
    const char* raw_text = nullptr;
    const char* command = nullptr;

    for (int i = 1; i < argc; i++) {
        const char* arg = argv[i];
        if (strcmp(arg, "-t") == 0 || strcmp(arg, "--timeout") == 0) {
            if (++i >= argc) return usage(), EXIT_TROUBLE;
            char* end = nullptr;
            long value = strtol(argv[i], &end, 10);
            if (*argv[i] == '\0' || *end != '\0' || value < 1 || value > MAX_TIMEOUT_S) {
                fprintf(stderr, "tavlologctl: bad time-out '%s' (1 to %d seconds)\n", argv[i],
                        MAX_TIMEOUT_S);
                return EXIT_TROUBLE;
            }
            timeout_s = static_cast<int>(value);
        } else if (strcmp(arg, "--listen") == 0) {
            listen = true;
        } else if (strcmp(arg, "--send") == 0) {
            if (++i >= argc) return usage(), EXIT_TROUBLE;
            send_cmd = argv[i];
        } else if (strcmp(arg, "--raw") == 0) {
            if (++i >= argc) return usage(), EXIT_TROUBLE;
            raw_text = argv[i];
        } else if (strcmp(arg, "-h") == 0 || strcmp(arg, "--help") == 0) {
            usage();
            return EXIT_DONE;
        } else if (!command) {
            command = arg;
        } else {
            usage();
            return EXIT_TROUBLE;
        }
    }

    int timeout_ms = timeout_s * 1000;
    // "listen" and "status" are words of this tool, not commands of the daemon
    // (the daemon would take them for configuration messages and ignore them).
    if (command && strcmp(command, "listen") == 0) {
        listen = true;
        command = nullptr;
    }
    if (raw_text) {
        if (listen || command || send_cmd || raw_text[0] == '\0') return usage(), EXIT_TROUBLE;
        return run_raw(raw_text, timeout_ms);
    }
    if (listen) {
        if (command) return usage(), EXIT_TROUBLE;
        return run_listen(send_cmd, timeout_ms);
    }
    if (send_cmd || !command) return usage(), EXIT_TROUBLE;
    if (strcmp(command, "status") == 0) return run_status();
    return run_command(command, timeout_ms);
}
