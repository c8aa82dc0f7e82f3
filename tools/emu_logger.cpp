// The emulated phone's logger devices: a user-space file system (low-level
// FUSE) mounted at /dev/log that behaves as the phone's legacy logger driver.
// "main", "system", "radio" and "events" each hold one ring of whole entries
// (platform/logger_ring.h). Every write appends one entry stamped with the
// writer's pid and tid (as seen inside the phone) and the time (to the 10-ms
// tick as on the phone, to the nanosecond with --fine-clock); every open for
// reading has its own position, starting at the oldest kept entry; a read
// hands over exactly one entry (EINVAL when the buffer is too small for it),
// waits for one when there is none (EAGAIN with O_NONBLOCK); poll reports
// readable exactly while unread entries exist. ".inject" (root only) appends
// an entry with a header of the writer's choice.
//
//   emu_logger [--size BYTES] [--no-system] [--fine-clock] [-f] MOUNTPOINT
//
// Returns once the devices serve (exit 0) and goes on in the background; -f
// keeps it in the foreground. SIGTERM unmounts and ends it.
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
#include "platform/logger_ring.h"

namespace {

constexpr gid_t AID_LOG = 1007;
constexpr fuse_ino_t INJECT_INO = 2 + LOGGER_BUFFER_COUNT;
constexpr double CACHE_SECONDS = 3600;  // the tree never changes while mounted
constexpr int MAX_READERS = 16384;       // bounds what openers can make us hold (48 bytes each)
constexpr long TICK_NS = 10000000;

// One open for reading; the descriptor's file handle points at it.
struct Reader {
    int buffer;
    uint64_t pos;
    struct fuse_pollhandle* poll = nullptr;  // a poller waiting for data
    Reader* next = nullptr;                  // same buffer's readers
};

// A blocking read waiting for the next entry.
struct PendingRead {
    fuse_req_t req;
    Reader* reader;
    size_t size;
    bool registering = true;  // inside fuse_req_interrupt_func
    bool interrupted = false;
    PendingRead* next = nullptr;
};

LoggerRing g_rings[LOGGER_BUFFER_COUNT];
LoggerRing* g_present[LOGGER_BUFFER_COUNT];  // null for a buffer left absent
Reader* g_readers[LOGGER_BUFFER_COUNT];
int g_reader_count = 0;
PendingRead* g_pending = nullptr;
struct timespec g_mount_time;
bool g_fine_clock = false;  // stamps to the nanosecond instead of the tick

int buffer_of(fuse_ino_t ino) {
    int buffer = static_cast<int>(ino) - 2;
    return ino >= 2 && buffer < LOGGER_BUFFER_COUNT && g_present[buffer] != nullptr ? buffer : -1;
}

bool attr_of(fuse_ino_t ino, struct stat* st) {
    memset(st, 0, sizeof(*st));
    st->st_ino = ino;
    st->st_nlink = 1;
    st->st_atim = st->st_mtim = st->st_ctim = g_mount_time;
    if (ino == FUSE_ROOT_ID) {
        st->st_mode = S_IFDIR | 0755;
        st->st_nlink = 2;
    } else if (buffer_of(ino) >= 0) {
        // Everyone writes; only the log group reads, as on the phone.
        st->st_mode = S_IFREG | 0662;
        st->st_gid = AID_LOG;
    } else if (ino == INJECT_INO) {
        st->st_mode = S_IFREG | 0200;
    } else {
        return false;
    }
    return true;
}

// A writer's process id: the request carries its thread id. Reading
// /proc/TID/status costs more than the rest of a write, so recent writers are
// remembered with a handle on their /proc folder: it tells whether that very
// thread still lives, so a reused thread id is never taken for the old one.
struct KnownWriter {
    pid_t tid = 0;
    int32_t tgid = 0;
    int dir = -1;
};
KnownWriter g_writers[16];
unsigned g_next_writer = 0;

int32_t tgid_in(int dir, pid_t tid) {
    UniqueFd fd(TEMP_FAILURE_RETRY(openat(dir, "status", O_RDONLY | O_CLOEXEC)));
    char text[512];
    ssize_t n = fd.ok() ? TEMP_FAILURE_RETRY(read(fd.get(), text, sizeof(text) - 1)) : -1;
    if (n <= 0) return tid;
    text[n] = '\0';
    const char* at = strstr(text, "\nTgid:");
    return at != nullptr ? static_cast<int32_t>(atoi(at + 6)) : tid;
}

int32_t pid_of_writer(pid_t tid) {
    for (KnownWriter& w : g_writers) {
        if (w.tid != tid) continue;
        if (faccessat(w.dir, "status", F_OK, 0) == 0) return w.tgid;
        close(w.dir);
        w = KnownWriter();
        break;
    }
    char path[32];
    snprintf(path, sizeof(path), "/proc/%d", static_cast<int>(tid));
    int dir = TEMP_FAILURE_RETRY(open(path, O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (dir < 0) return tid;
    KnownWriter& slot = g_writers[g_next_writer++ % 16];
    if (slot.dir >= 0) close(slot.dir);
    slot.tid = tid;
    slot.tgid = tgid_in(dir, tid);
    slot.dir = dir;
    return slot.tgid;
}

Reader* reader_of(const struct fuse_file_info* fi) {
    return reinterpret_cast<Reader*>(static_cast<uintptr_t>(fi->fh));
}

// Answers the read with the reader's next entry (or EINVAL when it does not
// fit); false, with nothing sent, when the reader has read everything.
bool reply_entry(fuse_req_t req, Reader* reader, size_t size) {
    const LoggerRing& ring = *g_present[reader->buffer];
    reader->pos = ring.clamp(reader->pos);
    if (reader->pos == ring.end()) return false;
    size_t len = ring.entry_len(reader->pos);
    if (size < len) {
        fuse_reply_err(req, EINVAL);
        return true;
    }
    uint8_t entry[LOGGER_MAX_ENTRY];
    ring.copy_entry(reader->pos, entry);
    reader->pos += len;
    fuse_reply_buf(req, reinterpret_cast<const char*>(entry), len);
    return true;
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

// After an append to buffer: waiting reads get their entry, pollers a wake-up.
void wake_readers(int buffer) {
    for (PendingRead** p = &g_pending; *p != nullptr;) {
        PendingRead* pending = *p;
        if (pending->reader->buffer == buffer && reply_entry(pending->req, pending->reader, pending->size)) {
            *p = pending->next;
            delete pending;
        } else {
            p = &pending->next;
        }
    }
    for (Reader* r = g_readers[buffer]; r != nullptr; r = r->next) {
        if (r->poll != nullptr) {
            fuse_lowlevel_notify_poll(r->poll);
            fuse_pollhandle_destroy(r->poll);
            r->poll = nullptr;
        }
    }
}

// The phone's driver stamps an entry with the kernel's coarse clock, the time
// of the last scheduler tick: entries written within one tick, in any buffer,
// carry equal stamps. Ticks here are 10 ms (a kernel with HZ=100).
struct timespec write_time() {
    struct timespec now;
    clock_gettime(g_fine_clock ? CLOCK_REALTIME : CLOCK_REALTIME_COARSE, &now);
    if (!g_fine_clock) now.tv_nsec -= now.tv_nsec % TICK_NS;
    return now;
}

void op_lookup(fuse_req_t req, fuse_ino_t parent, const char* name) {
    struct fuse_entry_param e;
    memset(&e, 0, sizeof(e));
    e.attr_timeout = e.entry_timeout = CACHE_SECONDS;
    fuse_ino_t ino = 0;
    int buffer = logger_buffer_by_name(name);
    if (buffer >= 0 && g_present[buffer] != nullptr)
        ino = 2 + buffer;
    else if (strcmp(name, ".inject") == 0)
        ino = INJECT_INO;
    if (parent == FUSE_ROOT_ID && ino != 0) {
        e.ino = ino;
        attr_of(ino, &e.attr);
    }
    fuse_reply_entry(req, &e);  // ino 0: a remembered "no such file"
}

void op_getattr(fuse_req_t req, fuse_ino_t ino, struct fuse_file_info*) {
    struct stat st;
    if (attr_of(ino, &st))
        fuse_reply_attr(req, &st, CACHE_SECONDS);
    else
        fuse_reply_err(req, ENOENT);
}

// Truncation (an O_TRUNC open from a shell) means nothing to a log: ignored.
void op_setattr(fuse_req_t req, fuse_ino_t ino, struct stat*, int, struct fuse_file_info* fi) {
    op_getattr(req, ino, fi);
}

void op_readdir(fuse_req_t req, fuse_ino_t ino, size_t size, off_t off, struct fuse_file_info*) {
    if (ino != FUSE_ROOT_ID) {
        fuse_reply_err(req, ENOTDIR);
        return;
    }
    char buf[1024];
    size_t used = 0;
    struct stat st;
    memset(&st, 0, sizeof(st));
    // Entry k of the listing is ".", "..", then the present buffers.
    for (off_t k = off; k < 2 + LOGGER_BUFFER_COUNT; k++) {
        const char* name = k == 0 ? "." : k == 1 ? ".." : logger_buffer_name(static_cast<int>(k) - 2);
        if (k >= 2 && g_present[k - 2] == nullptr) continue;
        st.st_ino = k < 2 ? FUSE_ROOT_ID : static_cast<fuse_ino_t>(k);
        st.st_mode = k < 2 ? S_IFDIR : S_IFREG;
        size_t add = fuse_add_direntry(req, buf + used, sizeof(buf) - used, name, &st, k + 1);
        if (used + add > size || used + add > sizeof(buf)) break;
        used += add;
    }
    fuse_reply_buf(req, buf, used);
}

void op_open(fuse_req_t req, fuse_ino_t ino, struct fuse_file_info* fi) {
    int buffer = buffer_of(ino);
    if (buffer < 0 && ino != INJECT_INO) {
        fuse_reply_err(req, ino == FUSE_ROOT_ID ? EISDIR : ENOENT);
        return;
    }
    fi->direct_io = 1;  // every read and write reaches us whole and unbuffered
    fi->nonseekable = 1;
    fi->noflush = 1;
    fi->fh = 0;
    if (buffer >= 0 && (fi->flags & O_ACCMODE) != O_WRONLY) {
        Reader* reader = g_reader_count < MAX_READERS ? new (std::nothrow) Reader : nullptr;
        if (reader == nullptr) {
            fuse_reply_err(req, ENFILE);
            return;
        }
        g_reader_count++;
        reader->buffer = buffer;
        reader->pos = g_present[buffer]->oldest();
        reader->next = g_readers[buffer];
        g_readers[buffer] = reader;
        fi->fh = static_cast<uint64_t>(reinterpret_cast<uintptr_t>(reader));
    }
    if (fuse_reply_open(req, fi) != 0 && fi->fh != 0) {
        // The opener is gone (interrupted): no release will come.
        Reader* reader = g_readers[buffer];
        g_readers[buffer] = reader->next;
        delete reader;
        g_reader_count--;
    }
}

void op_release(fuse_req_t req, fuse_ino_t, struct fuse_file_info* fi) {
    Reader* reader = reader_of(fi);
    if (reader != nullptr) {
        for (Reader** p = &g_readers[reader->buffer]; *p != nullptr; p = &(*p)->next) {
            if (*p == reader) {
                *p = reader->next;
                break;
            }
        }
        if (reader->poll != nullptr) fuse_pollhandle_destroy(reader->poll);
        delete reader;
        g_reader_count--;
    }
    fuse_reply_err(req, 0);
}

void op_read(fuse_req_t req, fuse_ino_t, size_t size, off_t, struct fuse_file_info* fi) {
    Reader* reader = reader_of(fi);
    if (reader == nullptr) {
        fuse_reply_err(req, EBADF);
        return;
    }
    if (reply_entry(req, reader, size)) return;
    if (fi->flags & O_NONBLOCK) {
        fuse_reply_err(req, EAGAIN);
        return;
    }
    PendingRead* pending = new (std::nothrow) PendingRead{req, reader, size};
    if (pending == nullptr) {
        fuse_reply_err(req, ENOMEM);
        return;
    }
    pending->next = g_pending;
    g_pending = pending;
    fuse_req_interrupt_func(req, on_interrupt, pending);
    pending->registering = false;
    if (pending->interrupted) {
        unlink_pending(pending);
        delete pending;
        fuse_reply_err(req, EINTR);
    }
}

void op_write(fuse_req_t req, fuse_ino_t ino, const char* buf, size_t size, off_t, struct fuse_file_info*) {
    const struct fuse_ctx* ctx = fuse_req_ctx(req);
    int buffer = buffer_of(ino);
    if (buffer >= 0) {
        // pid 0: a writer outside the phone (the host through its root).
        int32_t tid = ctx->pid;
        int32_t pid = tid > 0 ? pid_of_writer(tid) : 0;
        struct timespec now = write_time();
        size_t kept = logger_device_write(g_present[buffer], pid, tid, now, buf, size);
        if (kept > 0) wake_readers(buffer);
        fuse_reply_write(req, kept);
        return;
    }
    if (ino != INJECT_INO || ctx->uid != 0) {
        fuse_reply_err(req, EPERM);
        return;
    }
    long taken = logger_inject_write(g_present, buf, size);
    if (taken < 0) {
        fuse_reply_err(req, EINVAL);
        return;
    }
    int injected = logger_buffer_by_name(buf);
    if (static_cast<size_t>(taken) > strlen(buf) + 1 + LOGGER_HEADER_LEN) wake_readers(injected);
    fuse_reply_write(req, static_cast<size_t>(taken));
}

void op_poll(fuse_req_t req, fuse_ino_t, struct fuse_file_info* fi, struct fuse_pollhandle* ph) {
    Reader* reader = reader_of(fi);
    unsigned revents = POLLOUT | POLLWRNORM;
    if (reader != nullptr) {
        const LoggerRing& ring = *g_present[reader->buffer];
        bool unread = ring.clamp(reader->pos) != ring.end();
        if (unread) revents |= POLLIN | POLLRDNORM;
        if (ph != nullptr && !unread) {
            if (reader->poll != nullptr) fuse_pollhandle_destroy(reader->poll);
            reader->poll = ph;
            ph = nullptr;
        }
    }
    if (ph != nullptr) fuse_pollhandle_destroy(ph);
    fuse_reply_poll(req, revents);
}

// Answers what still waits and frees every reader, for a clean exit.
void release_all() {
    while (g_pending != nullptr) {
        PendingRead* pending = g_pending;
        g_pending = pending->next;
        fuse_reply_err(pending->req, EIO);
        delete pending;
    }
    for (int b = 0; b < LOGGER_BUFFER_COUNT; b++) {
        while (Reader* reader = g_readers[b]) {
            g_readers[b] = reader->next;
            if (reader->poll != nullptr) fuse_pollhandle_destroy(reader->poll);
            delete reader;
        }
    }
}

int usage() {
    fprintf(stderr, "usage: emu_logger [--size BYTES] [--no-system] [--fine-clock] [-f] MOUNTPOINT\n");
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    size_t size = LOGGER_DEFAULT_SIZE;
    bool with_system = true;
    bool foreground = false;
    const char* mountpoint = nullptr;
    for (int i = 1; i < argc; i++) {
        if (strcmp(argv[i], "--size") == 0 && i + 1 < argc) {
            char* end;
            unsigned long long n = strtoull(argv[++i], &end, 10);
            if (*end != '\0' || n < LOGGER_MIN_SIZE || n > LOGGER_MAX_SIZE) {
                fprintf(stderr, "emu_logger: --size must be %zu to %zu bytes\n", LOGGER_MIN_SIZE,
                        LOGGER_MAX_SIZE);
                return 2;
            }
            size = static_cast<size_t>(n);
        } else if (strcmp(argv[i], "--no-system") == 0) {
            with_system = false;
        } else if (strcmp(argv[i], "--fine-clock") == 0) {
            g_fine_clock = true;
        } else if (strcmp(argv[i], "-f") == 0) {
            foreground = true;
        } else if (argv[i][0] != '-' && mountpoint == nullptr) {
            mountpoint = argv[i];
        } else {
            return usage();
        }
    }
    if (mountpoint == nullptr) return usage();
    for (int b = 0; b < LOGGER_BUFFER_COUNT; b++) {
        if (b == LOGGER_SYSTEM && !with_system) continue;
        if (!g_rings[b].init(size)) {
            fprintf(stderr, "emu_logger: no memory for %zu-byte buffers\n", size);
            return 1;
        }
        g_present[b] = &g_rings[b];
    }
    clock_gettime(CLOCK_REALTIME, &g_mount_time);

    // In the background: the caller learns from our exit status whether the
    // devices serve; the server goes on in a session of its own.
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
        // Whoever started us may wait for the end of our output: keep none
        // of it; errors go to the phone's console when there is one.
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
    ops.lookup = op_lookup;
    ops.getattr = op_getattr;
    ops.setattr = op_setattr;
    ops.readdir = op_readdir;
    ops.open = op_open;
    ops.release = op_release;
    ops.read = op_read;
    ops.write = op_write;
    ops.poll = op_poll;

    // Other users read and write too: the collectors run as uid 2000.
    const char* fuse_argv[] = {"emu_logger", "-o", "allow_other,default_permissions,fsname=logger,subtype=logger"};
    struct fuse_args args = FUSE_ARGS_INIT(3, const_cast<char**>(fuse_argv));
    struct fuse_session* se = fuse_session_new(&args, &ops, sizeof(ops), nullptr);
    int rc = 1;
    if (se != nullptr && fuse_set_signal_handlers(se) == 0) {
        if (fuse_session_mount(se, mountpoint) == 0) {
            if (ready[1] >= 0) {
                char ok = 1;
                write_fully(ready[1], &ok, 1);
                close(ready[1]);
                ready[1] = -1;
            }
            rc = fuse_session_loop(se) == 0 ? 0 : 1;
            release_all();
            fuse_session_unmount(se);
        }
        fuse_remove_signal_handlers(se);
    }
    if (se != nullptr) fuse_session_destroy(se);
    fuse_opt_free_args(&args);
    return rc;
}
