// The emulated phone's /proc/kmsg: a one-file user-space file system (low-level
// FUSE) mounted over FILE that hands out the kernel log as the kernel does
// (platform/kmsg_buffer.h), fed by the host through the FIFO FEED. As on the
// phone the file is 0440 root:system and an open also needs CAP_SYSLOG (or
// CAP_SYS_ADMIN), which the kernel checks itself. A read waits for the log to
// have unread text (EAGAIN with O_NONBLOCK; EINTR when a signal comes) and
// returns as many whole lines as fit; every reader waiting then wakes, and one
// that finds the text taken by another gets 0 bytes, as on a phone's kernel;
// poll reports readable exactly while unread text exists.
//
//   emu_kmsg [-f] FEED FILE
//
// Returns once FILE serves (exit 0) and goes on in the background; -f keeps it
// in the foreground. SIGTERM unmounts and ends it.
#define FUSE_USE_VERSION 34

#include <errno.h>
#include <fcntl.h>
#include <fuse_lowlevel.h>
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <new>

#include "common/io_util.h"
#include "common/unique_fd.h"
#include "platform/kmsg_buffer.h"

namespace {

constexpr gid_t AID_SYSTEM = 1000;
constexpr int CAP_SYS_ADMIN_BIT = 21;
constexpr int CAP_SYSLOG_BIT = 34;
constexpr double CACHE_SECONDS = 3600;  // the file never changes while mounted
constexpr int MAX_OPENERS = 16384;      // bounds what openers can make us hold
// A line the feed left unfinished is a record of its own after this long
// without more text: one write of the host is in the FIFO whole, so only a
// feed that ends without a line feed, or one longer than the FIFO, waits here.
constexpr int LINE_WAIT_MS = 100;

// One open; the descriptor's file handle points at it.
struct Opener {
    struct fuse_pollhandle* poll = nullptr;  // a poller waiting for text
    Opener* next = nullptr;
};

// A blocking read waiting for text.
struct PendingRead {
    fuse_req_t req;
    size_t size;
    bool registering = true;  // inside fuse_req_interrupt_func
    bool interrupted = false;
    PendingRead* next = nullptr;
};

KmsgBuffer g_log;
char g_out[KMSG_BUFFER_SIZE];  // one read's reply
Opener* g_openers = nullptr;
int g_opener_count = 0;
PendingRead* g_pending = nullptr;  // oldest first
struct timespec g_mount_time;

long long now_ms() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

// Whether the thread tid (in our pid namespace) holds CAP_SYSLOG or CAP_SYS_ADMIN.
bool may_read_kernel_log(pid_t tid) {
    char path[48];
    snprintf(path, sizeof(path), "/proc/%d/status", static_cast<int>(tid));
    UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC)));
    char text[2048];
    ssize_t n = fd.ok() ? TEMP_FAILURE_RETRY(read(fd.get(), text, sizeof(text) - 1)) : -1;
    if (n <= 0) return false;
    text[n] = '\0';
    const char* at = strstr(text, "\nCapEff:");
    if (at == nullptr) return false;
    unsigned long long caps = strtoull(at + 8, nullptr, 16);
    return (caps >> CAP_SYSLOG_BIT & 1) != 0 || (caps >> CAP_SYS_ADMIN_BIT & 1) != 0;
}

void op_getattr(fuse_req_t req, fuse_ino_t ino, struct fuse_file_info*) {
    if (ino != FUSE_ROOT_ID) {
        fuse_reply_err(req, ENOENT);
        return;
    }
    struct stat st;
    memset(&st, 0, sizeof(st));
    st.st_ino = ino;
    st.st_nlink = 1;
    st.st_mode = S_IFREG | 0440;  // as a phone's init leaves it
    st.st_gid = AID_SYSTEM;
    st.st_atim = st.st_mtim = st.st_ctim = g_mount_time;
    fuse_reply_attr(req, &st, CACHE_SECONDS);
}

void op_open(fuse_req_t req, fuse_ino_t, struct fuse_file_info* fi) {
    // The mode bits the kernel has checked already (default_permissions).
    if (!may_read_kernel_log(fuse_req_ctx(req)->pid)) {
        fuse_reply_err(req, EPERM);
        return;
    }
    Opener* opener = g_opener_count < MAX_OPENERS ? new (std::nothrow) Opener : nullptr;
    if (opener == nullptr) {
        fuse_reply_err(req, ENFILE);
        return;
    }
    fi->direct_io = 1;  // every read reaches us with the reader's own size
    fi->nonseekable = 1;
    fi->noflush = 1;
    fi->fh = static_cast<uint64_t>(reinterpret_cast<uintptr_t>(opener));
    if (fuse_reply_open(req, fi) != 0) {
        delete opener;  // the opener is gone (interrupted): no release will come
        return;
    }
    opener->next = g_openers;
    g_openers = opener;
    g_opener_count++;
}

void op_release(fuse_req_t req, fuse_ino_t, struct fuse_file_info* fi) {
    Opener* opener = reinterpret_cast<Opener*>(static_cast<uintptr_t>(fi->fh));
    for (Opener** p = &g_openers; *p != nullptr; p = &(*p)->next) {
        if (*p == opener) {
            *p = opener->next;
            if (opener->poll != nullptr) fuse_pollhandle_destroy(opener->poll);
            delete opener;
            g_opener_count--;
            break;
        }
    }
    fuse_reply_err(req, 0);
}

void reply_text(fuse_req_t req, size_t size) {
    size_t n = g_log.read(g_out, size < sizeof(g_out) ? size : sizeof(g_out));
    fuse_reply_buf(req, g_out, n);
}

void unlink_pending(PendingRead* pending) {
    for (PendingRead** p = &g_pending; *p != nullptr; p = &(*p)->next) {
        if (*p == pending) {
            *p = pending->next;
            return;
        }
    }
}

// A signal reached the blocked reader: its read ends with EINTR. During
// registration the reply waits for fuse_req_interrupt_func to return.
void on_interrupt(fuse_req_t req, void* data) {
    PendingRead* pending = static_cast<PendingRead*>(data);
    pending->interrupted = true;
    if (pending->registering) return;
    unlink_pending(pending);
    delete pending;
    fuse_reply_err(req, EINTR);
}

void op_read(fuse_req_t req, fuse_ino_t, size_t size, off_t, struct fuse_file_info* fi) {
    if (size == 0 || g_log.unread()) {
        reply_text(req, size);
        return;
    }
    if (fi->flags & O_NONBLOCK) {
        fuse_reply_err(req, EAGAIN);
        return;
    }
    PendingRead* pending = new (std::nothrow) PendingRead{req, size};
    if (pending == nullptr) {
        fuse_reply_err(req, ENOMEM);
        return;
    }
    PendingRead** last = &g_pending;
    while (*last != nullptr) last = &(*last)->next;
    *last = pending;
    fuse_req_interrupt_func(req, on_interrupt, pending);
    pending->registering = false;
    if (pending->interrupted) {
        unlink_pending(pending);
        delete pending;
        fuse_reply_err(req, EINTR);
    }
}

void op_poll(fuse_req_t req, fuse_ino_t, struct fuse_file_info* fi, struct fuse_pollhandle* ph) {
    Opener* opener = reinterpret_cast<Opener*>(static_cast<uintptr_t>(fi->fh));
    unsigned revents = g_log.unread() ? POLLIN | POLLRDNORM : 0;
    if (ph != nullptr && revents == 0 && opener != nullptr) {
        if (opener->poll != nullptr) fuse_pollhandle_destroy(opener->poll);
        opener->poll = ph;
        ph = nullptr;
    }
    if (ph != nullptr) fuse_pollhandle_destroy(ph);
    fuse_reply_poll(req, revents);
}

// New text: every waiting read wakes and takes what is left, pollers hear of it.
void wake_readers() {
    while (g_pending != nullptr) {
        PendingRead* pending = g_pending;
        g_pending = pending->next;
        reply_text(pending->req, pending->size);
        delete pending;
    }
    for (Opener* o = g_openers; o != nullptr; o = o->next) {
        if (o->poll != nullptr) {
            fuse_lowlevel_notify_poll(o->poll);
            fuse_pollhandle_destroy(o->poll);
            o->poll = nullptr;
        }
    }
}

// Takes what the FIFO holds while the log has room; false when it failed.
bool take_feed(int feed_fd, long long* last_feed_ms) {
    char chunk[65536];
    bool took = false;
    for (;;) {
        size_t room = g_log.room();
        if (room == 0) break;
        ssize_t n = read(feed_fd, chunk, room < sizeof(chunk) ? room : sizeof(chunk));
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && errno == EAGAIN) break;
        if (n <= 0) return false;
        g_log.take(chunk, static_cast<size_t>(n));
        took = true;
    }
    if (took) *last_feed_ms = now_ms();
    if (g_log.unread()) wake_readers();
    return true;
}

// Answers what still waits and frees every opener, for a clean exit.
void release_all() {
    while (g_pending != nullptr) {
        PendingRead* pending = g_pending;
        g_pending = pending->next;
        fuse_reply_err(pending->req, EIO);
        delete pending;
    }
    while (Opener* opener = g_openers) {
        g_openers = opener->next;
        if (opener->poll != nullptr) fuse_pollhandle_destroy(opener->poll);
        delete opener;
    }
}

// Serves requests and the feed until the session ends (SIGTERM).
int serve(struct fuse_session* se, int feed_fd) {
    struct fuse_buf buf;
    memset(&buf, 0, sizeof(buf));
    long long last_feed_ms = 0;
    int rc = 0;
    while (!fuse_session_exited(se)) {
        // A full log leaves the feed in the FIFO: the host's writes wait,
        // and an open line then waits for room rather than for its end.
        bool reading = g_log.room() > 0;
        int wait_ms = -1;
        if (reading && g_log.line_open()) {
            long long left = last_feed_ms + LINE_WAIT_MS - now_ms();
            if (left <= 0) {
                g_log.end_line();
                wake_readers();
            } else {
                wait_ms = static_cast<int>(left);
            }
        }
        struct pollfd fds[2] = {{fuse_session_fd(se), POLLIN, 0}, {feed_fd, POLLIN, 0}};
        int n = poll(fds, reading ? 2 : 1, wait_ms);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            rc = 1;
            break;
        }
        if ((fds[1].revents & POLLIN) && !take_feed(feed_fd, &last_feed_ms)) {
            rc = 1;
            break;
        }
        if (fds[0].revents & (POLLIN | POLLERR | POLLHUP)) {
            int got = fuse_session_receive_buf(se, &buf);
            if (got == -EINTR || got == -EAGAIN) continue;
            if (got <= 0) break;  // unmounted
            fuse_session_process_buf(se, &buf);
        }
    }
    free(buf.mem);
    return rc;
}

int usage() {
    fprintf(stderr, "usage: emu_kmsg [-f] FEED FILE\n");
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    bool foreground = false;
    const char* paths[2] = {nullptr, nullptr};
    int npaths = 0;
    for (int i = 1; i < argc; i++) {
        if (strcmp(argv[i], "-f") == 0)
            foreground = true;
        else if (argv[i][0] != '-' && npaths < 2)
            paths[npaths++] = argv[i];
        else
            return usage();
    }
    if (npaths != 2) return usage();
    // Held open for writing too, the FIFO never shows us an end, and the host
    // can write into it whether or not we read. The larger buffer holds a
    // burst of the host's lines while the log is full.
    UniqueFd feed(TEMP_FAILURE_RETRY(open(paths[0], O_RDWR | O_NONBLOCK | O_CLOEXEC)));
    if (!feed.ok()) {
        fprintf(stderr, "emu_kmsg: cannot open %s: %s\n", paths[0], strerror(errno));
        return 1;
    }
    fcntl(feed.get(), F_SETPIPE_SZ, 1 << 20);
    clock_gettime(CLOCK_REALTIME, &g_mount_time);

    // In the background: the caller learns from our exit status whether the
    // file serves; the server goes on in a session of its own.
    int ready[2] = {-1, -1};
    if (!foreground) {
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
        int null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
        int console = open("/dev/emu/console.log", O_WRONLY | O_APPEND | O_CLOEXEC | O_NOFOLLOW);
        dup2(null_fd, 0);
        dup2(null_fd, 1);
        dup2(console >= 0 ? console : null_fd, 2);
        if (console >= 0) close(console);
        if (null_fd >= 0) close(null_fd);
    }

    struct fuse_lowlevel_ops ops;
    memset(&ops, 0, sizeof(ops));
    ops.getattr = op_getattr;
    ops.open = op_open;
    ops.release = op_release;
    ops.read = op_read;
    ops.poll = op_poll;

    // The collectors read as uid 2000: others reach the file, the kernel checks its mode.
    const char* fuse_argv[] = {"emu_kmsg", "-o", "allow_other,default_permissions,fsname=kmsg,subtype=kmsg"};
    struct fuse_args args = FUSE_ARGS_INIT(3, const_cast<char**>(fuse_argv));
    struct fuse_session* se = fuse_session_new(&args, &ops, sizeof(ops), nullptr);
    int rc = 1;
    if (se != nullptr && fuse_set_signal_handlers(se) == 0) {
        if (fuse_session_mount(se, paths[1]) == 0) {
            if (ready[1] >= 0) {
                char ok = 1;
                write_fully(ready[1], &ok, 1);
                close(ready[1]);
                ready[1] = -1;
            }
            rc = serve(se, feed.get());
            release_all();
            fuse_session_unmount(se);
        }
        fuse_remove_signal_handlers(se);
    }
    if (se != nullptr) fuse_session_destroy(se);
    fuse_opt_free_args(&args);
    return rc;
}
