// The emulated phone's Bluetooth stack log service: serves the stack's log as
// a byte stream to every client of the abstract socket "btlog". The log comes
// from a feed, the FIFO /dev/emu/btlog that the host writes into
// (`printf ... > DIR/.emu/btlog`). Every connected client gets every byte fed
// while it is connected, in order; while nobody is connected the bytes wait in
// the feed. A slow client holds the feed back rather than lose bytes. Only
// root and members of the log group may connect, as with the stack's socket.
//
//   emu_btlog [--feed PATH]         serve in the foreground (the phone's init)
//   emu_btlog start [--feed PATH]   start in the background, return once it serves
//   emu_btlog stop                  stop it as a stack going down: its clients
//                                   see the end of the stream
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <cutils/sockets.h>

#include "common/io_util.h"
#include "common/unique_fd.h"

namespace {

constexpr char kSocketName[] = "btlog";
constexpr char kDefaultFeed[] = "/dev/emu/btlog";
constexpr char kPidFile[] = "/dev/emu/btlog.pid";
constexpr char kConsole[] = "/dev/emu/console.log";
constexpr gid_t AID_LOG = 1007;
constexpr int MAX_CLIENTS = 8;
constexpr size_t CHUNK = 64 * 1024;

struct Client {
    int fd = -1;
    size_t sent = 0;  // of the current chunk
};

Client g_clients[MAX_CLIENTS];
char g_chunk[CHUNK];
size_t g_chunk_len = 0;
volatile sig_atomic_t g_stop = 0;

void on_stop(int) { g_stop = 1; }

// Whether the "Groups:" line of pid's status lists gid.
bool status_lists_group(pid_t pid, gid_t gid) {
    char path[64];
    snprintf(path, sizeof(path), "/proc/%d/status", static_cast<int>(pid));
    UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC)));
    char text[4096];
    ssize_t n = fd.ok() ? TEMP_FAILURE_RETRY(read(fd.get(), text, sizeof(text) - 1)) : -1;
    if (n <= 0) return false;
    text[n] = '\0';
    const char* p = strstr(text, "\nGroups:");
    if (p == nullptr) return false;
    p += strlen("\nGroups:");
    for (;;) {
        char* end;
        unsigned long g = strtoul(p, &end, 10);
        if (end == p) return false;  // the end of the line
        if (g == gid) return true;
        p = end;
    }
}

// Root, or a member of the log group (the collector runs as uid 2000 with it).
bool peer_may_read(int fd) {
    struct ucred cred;
    socklen_t len = sizeof(cred);
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) return false;
    if (cred.uid == 0 || cred.gid == AID_LOG) return true;
    gid_t groups[64];
    len = sizeof(groups);
    // qemu's user mode does not pass SO_PEERGROUPS through; the peer's status
    // file tells the same.
    if (getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, groups, &len) != 0)
        return status_lists_group(cred.pid, AID_LOG);
    for (size_t i = 0; i < len / sizeof(gid_t); i++)
        if (groups[i] == AID_LOG) return true;
    return false;
}

void drop_client(Client* c) {
    close(c->fd);
    c->fd = -1;
    c->sent = 0;
}

void accept_client(int listen_fd) {
    int fd = accept4(listen_fd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) return;
    if (!peer_may_read(fd)) {
        close(fd);
        return;
    }
    for (Client& c : g_clients) {
        if (c.fd < 0) {
            c.fd = fd;
            // A newcomer starts with the next chunk, not inside this one.
            c.sent = g_chunk_len;
            return;
        }
    }
    close(fd);
}

// Sends what the client still lacks of the chunk; drops it when it is gone.
void send_some(Client* c) {
    while (c->sent < g_chunk_len) {
        ssize_t n = send(c->fd, g_chunk + c->sent, g_chunk_len - c->sent, MSG_NOSIGNAL);
        if (n > 0) {
            c->sent += static_cast<size_t>(n);
        } else if (n < 0 && errno == EINTR) {
            continue;
        } else {
            if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return;
            drop_client(c);
            return;
        }
    }
}

int serve(const char* feed_path, int ready_fd) {
    UniqueFd feed(TEMP_FAILURE_RETRY(open(feed_path, O_RDWR | O_NONBLOCK | O_CLOEXEC)));
    if (!feed.ok()) {
        fprintf(stderr, "emu_btlog: cannot open %s: %s\n", feed_path, strerror(errno));
        return 1;
    }
    UniqueFd listener(socket_local_server(kSocketName, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM));
    if (!listener.ok()) {
        fprintf(stderr, "emu_btlog: cannot serve \"%s\": %s\n", kSocketName, strerror(errno));
        return 1;
    }
    fcntl(listener.get(), F_SETFD, FD_CLOEXEC);
    fcntl(listener.get(), F_SETFL, O_NONBLOCK);

    struct sigaction sa;
    memset(&sa, 0, sizeof(sa));
    sa.sa_handler = on_stop;
    sigaction(SIGTERM, &sa, nullptr);
    sigaction(SIGINT, &sa, nullptr);
    signal(SIGPIPE, SIG_IGN);

    char pid_text[16];
    int n = snprintf(pid_text, sizeof(pid_text), "%d\n", static_cast<int>(getpid()));
    UniqueFd pid_fd(TEMP_FAILURE_RETRY(open(kPidFile, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0644)));
    if (pid_fd.ok()) write_fully(pid_fd.get(), pid_text, static_cast<size_t>(n));
    pid_fd.reset();
    if (ready_fd >= 0) {
        char ok = 1;
        write_fully(ready_fd, &ok, 1);
        close(ready_fd);
    }

    while (!g_stop) {
        struct pollfd fds[2 + MAX_CLIENTS];
        int clients = 0;
        bool all_sent = true;
        for (Client& c : g_clients) {
            if (c.fd < 0) continue;
            clients++;
            if (c.sent < g_chunk_len) all_sent = false;
        }
        if (all_sent) g_chunk_len = 0;
        fds[0] = {listener.get(), POLLIN, 0};
        // The feed is read only when someone listens and has the last chunk.
        fds[1] = {clients > 0 && all_sent ? feed.get() : -1, POLLIN, 0};
        for (int i = 0; i < MAX_CLIENTS; i++)
            fds[2 + i] = {g_clients[i].fd, static_cast<short>(g_clients[i].sent < g_chunk_len ? POLLOUT : POLLIN), 0};
        if (poll(fds, 2 + MAX_CLIENTS, -1) < 0) continue;  // EINTR: the stop flag is looked at
        if (fds[0].revents & POLLIN) accept_client(listener.get());
        if (fds[1].revents & POLLIN) {
            ssize_t got = read(feed.get(), g_chunk, sizeof(g_chunk));
            if (got > 0) {
                g_chunk_len = static_cast<size_t>(got);
                for (Client& c : g_clients) c.sent = 0;
            }
        }
        for (int i = 0; i < MAX_CLIENTS; i++) {
            Client& c = g_clients[i];
            if (c.fd < 0) continue;
            if (fds[2 + i].revents & (POLLIN | POLLHUP | POLLERR) && c.sent >= g_chunk_len) {
                // A client has nothing to say: what it sends is dropped; its end ends it.
                char discard[256];
                ssize_t r = recv(c.fd, discard, sizeof(discard), MSG_DONTWAIT);
                if (r == 0 || (r < 0 && errno != EAGAIN && errno != EINTR)) {
                    drop_client(&c);
                    continue;
                }
            }
            send_some(&c);
        }
    }
    for (Client& c : g_clients)
        if (c.fd >= 0) drop_client(&c);
    unlink(kPidFile);
    return 0;
}

// The running service's pid, or -1: the pid file must name an emu_btlog.
pid_t running_pid() {
    char text[32] = "";
    UniqueFd fd(TEMP_FAILURE_RETRY(open(kPidFile, O_RDONLY | O_CLOEXEC)));
    if (!fd.ok() || TEMP_FAILURE_RETRY(read(fd.get(), text, sizeof(text) - 1)) <= 0) return -1;
    pid_t pid = static_cast<pid_t>(atoi(text));
    if (pid <= 0) return -1;
    char path[64];
    char comm[32] = "";
    snprintf(path, sizeof(path), "/proc/%d/comm", static_cast<int>(pid));
    UniqueFd comm_fd(TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC)));
    if (!comm_fd.ok() || TEMP_FAILURE_RETRY(read(comm_fd.get(), comm, sizeof(comm) - 1)) <= 0) return -1;
    return strncmp(comm, "emu_btlog\n", 10) == 0 ? pid : -1;
}

// Gone, or a zombie its parent has not reaped yet.
bool has_ended(pid_t pid) {
    char path[64];
    char stat_text[256] = "";
    snprintf(path, sizeof(path), "/proc/%d/stat", static_cast<int>(pid));
    UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC)));
    if (!fd.ok() || TEMP_FAILURE_RETRY(read(fd.get(), stat_text, sizeof(stat_text) - 1)) <= 0) return true;
    const char* state = strrchr(stat_text, ')');
    return state != nullptr && (state[2] == 'Z' || state[2] == 'X');
}

int stop_service() {
    pid_t pid = running_pid();
    if (pid < 0) return 0;
    if (kill(pid, SIGTERM) != 0) return errno == ESRCH ? 0 : 1;
    for (int tries = 0; tries < 500; tries++) {
        if (has_ended(pid)) return 0;
        struct timespec pause = {0, 10 * 1000 * 1000};
        nanosleep(&pause, nullptr);
    }
    fprintf(stderr, "emu_btlog: pid %d does not stop\n", static_cast<int>(pid));
    return 1;
}

int start_service(const char* feed_path) {
    if (running_pid() > 0) return 0;
    int ready[2];
    if (pipe2(ready, O_CLOEXEC) != 0) return 1;
    pid_t pid = fork();
    if (pid < 0) return 1;
    if (pid > 0) {
        close(ready[1]);
        char ok = 0;
        return TEMP_FAILURE_RETRY(read(ready[0], &ok, 1)) == 1 && ok == 1 ? 0 : 1;
    }
    close(ready[0]);
    setsid();
    // Whoever started us may wait for the end of our output: keep none of it.
    int null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
    int console = open(kConsole, O_WRONLY | O_APPEND | O_CLOEXEC | O_NOFOLLOW);
    dup2(null_fd, 0);
    dup2(null_fd, 1);
    dup2(console >= 0 ? console : null_fd, 2);
    _exit(serve(feed_path, ready[1]));
}

}  // namespace

int main(int argc, char** argv) {
    const char* command = "serve";
    const char* feed = kDefaultFeed;
    int i = 1;
    if (i < argc && (strcmp(argv[i], "start") == 0 || strcmp(argv[i], "stop") == 0)) command = argv[i++];
    if (i + 1 < argc && strcmp(argv[i], "--feed") == 0) {
        feed = argv[i + 1];
        i += 2;
    }
    if (i != argc) {
        fprintf(stderr, "usage: emu_btlog [start|stop] [--feed PATH]\n");
        return 2;
    }
    if (strcmp(command, "stop") == 0) return stop_service();
    if (strcmp(command, "start") == 0) return start_service(feed);
    return serve(feed, -1);
}
