// The reader thread: accepts collector connections on "log_socket", learns
// each one's log type from its first byte and appends what it sends to the
// fill queue. At a stop it reads every connection to its end first, so that
// nothing a collector sent before it ended is lost.
#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/peer_cred.h"
#include "record/record_limit.h"
#include "record/record.h"
#include "transist/log_files.h"
#include "transist/transist.h"
#include "transist/transist_queue.h"
#include "transist/transist_reader.h"
#include "transist/transist_state.h"

// Refusals of "log_socket" clients: any app can connect in a loop.
static RecordLimit refused_log_peers = RECORD_LIMIT(TAG_TRANSIST, "refused log_socket clients");

// Any local process can connect to an abstract socket: an app could forge
// log lines, or displace a collector's connection and stop the run. The
// collectors are the daemon's children; the daemon's user alone would also
// admit the shell.
static int log_peer_allowed(int fd) {
    uid_t uid = 0;
    pid_t pid = 0;
    if (!peer_credentials(fd, &uid, &pid)) {
        int err = errno;
        HLOG_LIMITED(refused_log_peers, TAG_TRANSIST, WLOG_WARN,
                     "cannot get credentials of log_socket client (%s), closed", strerror(err));
        return 0;
    }
    if (is_self_or_child(pid)) return 1;
    HLOG_LIMITED(refused_log_peers, TAG_TRANSIST, WLOG_WARN, "refuse log_socket client uid %d pid %d, closed",
                 static_cast<int>(uid), static_cast<int>(pid));
    return 0;
}

int transist_records_flush() { return record_limit_flush(&refused_log_peers); }

// Guards only the copy of the registered descriptors into the poll set.
static pthread_mutex_t select_set_lock = PTHREAD_MUTEX_INITIALIZER;

// A connection that is not registered yet: it has not sent its log type, or
// it has and waits for a connection accepted before it. Connections are
// registered in the order they were accepted, so that of two connections of
// one type the later one always takes over from the earlier one, whichever
// letter happened to arrive first.
struct PendingConn {
    int fd;           // -1 when the slot is free
    int type;         // -1 until its letter has arrived
    int64_t seq;      // order of acceptance
    int64_t expires;  // monotonic microseconds; applies while type is -1
};
static PendingConn pending[MAX_PENDING];
static int64_t accept_seq = 0;
static bool pending_full_recorded = false;

// Per type, while its connection lasts: whether dropping its data was recorded,
// and whether an allocation failure was.
static bool drop_recorded[LOG_TYPE_COUNT];
static bool malloc_failure_recorded = false;

static void close_fd(int fd) {
    if (fd >= 0) close(fd);
}

// Puts a chunk into the fill queue, or drops it when nobody will write it.
static void queue_chunk(int type, const char* data, int n) {
    if (log_files[type].fd <= 0 || !writer_running) {
        // Kept chunks of a type without a file would only grow the daemon's
        // memory until the run ends; any local process can send them.
        if (!drop_recorded[type]) {
            drop_recorded[type] = true;
            HLOG(TAG_TRANSIST, WLOG_WARN, "no writable %s file, its data is dropped",
                 log_type_name(type));
        }
        return;
    }
    pthread_mutex_lock(&queue_lock);
    int rc = queue_append(fill_queue, type, data, n, transist_capacity);
    int err = errno;
    bool writer_was_idle = writer_idle;
    writer_idle = false;
    pthread_mutex_unlock(&queue_lock);
    if (writer_was_idle) wake_idle_writer();
    if (rc == 1) {
        malloc_failure_recorded = false;
    } else if (!malloc_failure_recorded) {
        // Recorded once per streak: a memory shortage fails every chunk.
        malloc_failure_recorded = true;
        HLOG(TAG_TRANSIST, WLOG_ERROR, "malloc buf %d fail(%s)", transist_capacity, strerror(err));
    }
}

int read_log_message(int type, int fd, int* taken) {
    char buf[READ_MAX];
    int room = transist_capacity < READ_MAX ? transist_capacity : READ_MAX;
    ssize_t n = read(fd, buf, static_cast<size_t>(room));
    if (taken != nullptr) *taken = n > 0 ? static_cast<int>(n) : 0;
    if (n < 0) {
        int err = errno;
        if (err == EAGAIN || err == EWOULDBLOCK || err == EINTR) return -1;
        HLOG(TAG_TRANSIST, WLOG_ERROR, "read from socket %d failed (%s)%d", fd, strerror(err), err);
        return 0;
    }
    if (n == 0) {
        HLOG(TAG_TRANSIST, WLOG_ERROR, "receive an empty message from socket");
        return 0;
    }
    queue_chunk(type, buf, static_cast<int>(n));
    return 1;
}

// Called with file_table_lock held, after read_log_message returned 0.
static void drop_connection(int type) {
    HLOG(TAG_TRANSIST, WLOG_ERROR, "handle log message failed in fd of %s.", log_type_name(type));
    close_fd(log_files[type].sock);
    pthread_mutex_lock(&select_set_lock);
    log_files[type].sock = -1;
    pthread_mutex_unlock(&select_set_lock);
}

// Reads the type's connection until it has nothing more right now (or ends),
// at most max_chunks chunks. Returns false when the connection was closed.
// Called with file_table_lock held.
static bool read_available(int type, int max_chunks) {
    for (int i = 0; i < max_chunks; i++) {
        int taken = 0;
        int rc = read_log_message(type, log_files[type].sock, &taken);
        if (rc < 0) return true;
        if (rc == 0) {
            drop_connection(type);
            return false;
        }
        // A short read emptied the connection: no read for EAGAIN.
        if (taken < READ_MAX && taken < transist_capacity) return true;
    }
    return true;
}

// A later connection of the same type takes the slot. What the earlier one
// still has buffered is read first, so its bytes stay ahead of the new
// stream's; the earlier connection is then closed.
static void register_connection(int type, int fd) {
    pthread_mutex_lock(&file_table_lock);
    if (log_files[type].sock >= 0) {
        if (read_available(type, 256)) {
            HLOG(TAG_TRANSIST, WLOG_WARN, "%s connection replaced by a new one",
                 log_type_name(type));
            close_fd(log_files[type].sock);
        }
    }
    drop_recorded[type] = false;
    pthread_mutex_lock(&select_set_lock);
    log_files[type].sock = fd;
    pthread_mutex_unlock(&select_set_lock);
    pthread_mutex_unlock(&file_table_lock);
    WLOG(TAG_TRANSIST, WLOG_DEBUG, "accept over, new client:%c", LOG_TYPE_LETTERS[type]);
}

static void free_pending(int slot) {
    pending[slot].fd = -1;
    pending[slot].type = -1;
    pending_full_recorded = false;
}

// Registers pending connections in the order they were accepted, as long as
// the earliest one has named its type.
static void register_in_order() {
    for (;;) {
        int first = -1;
        for (int i = 0; i < MAX_PENDING; i++) {
            if (pending[i].fd >= 0 && (first < 0 || pending[i].seq < pending[first].seq)) first = i;
        }
        if (first < 0 || pending[first].type < 0) return;
        int fd = pending[first].fd;
        int type = pending[first].type;
        free_pending(first);
        register_connection(type, fd);
    }
}

static void close_pending(int slot) {
    close_fd(pending[slot].fd);
    free_pending(slot);
    // It may have held up connections accepted after it.
    register_in_order();
}

// Reads the one-byte log type of a pending connection, if it has arrived.
static void handle_pending(int slot) {
    unsigned char letter = 0;
    ssize_t n = read(pending[slot].fd, &letter, 1);
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)) return;
    if (n <= 0) {
        int err = n < 0 ? errno : 0;
        HLOG(TAG_TRANSIST, WLOG_WARN, "new client ended before its log type (%d)", err);
        close_pending(slot);
        return;
    }
    int type = log_type_from_letter(static_cast<char>(letter));
    if (type < 0) {
        HLOG(TAG_TRANSIST, WLOG_WARN, "unknown log type 0x%02x from new client, closed", letter);
        close_pending(slot);
        return;
    }
    pending[slot].type = type;
    register_in_order();
}

static void accept_connections() {
    // Bounded, so that a process connecting in a loop cannot keep the reader
    // from the collectors' data.
    for (int accepted = 0; accepted < MAX_PENDING; accepted++) {
        int fd = accept4(transist_listen_fd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
        if (fd < 0) {
            int err = errno;
            if (err == EAGAIN || err == EWOULDBLOCK || err == EINTR || err == ECONNABORTED) return;
            HLOG(TAG_TRANSIST, WLOG_ERROR, "accept failed (%s), errno = %d", strerror(err), err);
            // Usually out of descriptors: give the system a moment, but stay
            // responsive to a stop.
            struct pollfd wake = {reader_wake_fd, POLLIN, 0};
            if (!stop_requested) TEMP_FAILURE_RETRY(poll(&wake, 1, 1000));
            return;
        }
        if (!log_peer_allowed(fd)) {
            close(fd);
            continue;
        }
        int slot = -1;
        for (int i = 0; i < MAX_PENDING; i++) {
            if (pending[i].fd < 0) {
                slot = i;
                break;
            }
        }
        if (slot < 0) {
            if (!pending_full_recorded) {
                pending_full_recorded = true;
                HLOG(TAG_TRANSIST, WLOG_WARN, "too many new clients without log type, closed");
            }
            close(fd);
            continue;
        }
        pending[slot].fd = fd;
        pending[slot].type = -1;
        pending[slot].seq = accept_seq++;
        pending[slot].expires = monotonic_us() + PENDING_TIMEOUT_MS * 1000LL;
        // Collectors send their letter right after connecting: usually it is
        // already here.
        handle_pending(slot);
    }
}

static void expire_pending(int64_t now) {
    for (int i = 0; i < MAX_PENDING; i++) {
        if (pending[i].fd >= 0 && pending[i].type < 0 && now >= pending[i].expires) {
            HLOG(TAG_TRANSIST, WLOG_WARN, "new client sent no log type in %d ms, closed",
                 PENDING_TIMEOUT_MS);
            close_pending(i);
        }
    }
}

// Layout of one poll set: listening socket, wake counter, pending, registered.
struct PollSet {
    struct pollfd fds[2 + MAX_PENDING + LOG_TYPE_COUNT];
    int pending_slot[MAX_PENDING + LOG_TYPE_COUNT];  // per entry after the first two
    int type[MAX_PENDING + LOG_TYPE_COUNT];          // -1 for a pending entry
    int count;
};

static void add_fd(PollSet* set, int fd, int slot, int type) {
    set->fds[set->count] = {fd, POLLIN, 0};
    if (set->count >= 2) {
        set->pending_slot[set->count - 2] = slot;
        set->type[set->count - 2] = type;
    }
    set->count++;
}

static void build_poll_set(PollSet* set, bool with_registered, bool with_control) {
    set->count = 0;
    if (with_control) {
        add_fd(set, transist_listen_fd, -1, -1);
        add_fd(set, reader_wake_fd, -1, -1);
    }
    // Keep the first two entries' places so indexes stay fixed.
    while (set->count < 2) add_fd(set, -1, -1, -1);
    // A connection that has named its type waits without being read.
    for (int i = 0; i < MAX_PENDING; i++) {
        if (pending[i].fd >= 0 && pending[i].type < 0) add_fd(set, pending[i].fd, i, -1);
    }
    if (!with_registered) return;
    pthread_mutex_lock(&select_set_lock);
    for (int type = 0; type < LOG_TYPE_COUNT; type++) {
        if (log_files[type].sock >= 0) add_fd(set, log_files[type].sock, -1, type);
    }
    pthread_mutex_unlock(&select_set_lock);
}

// Handles what poll reported for pending and registered connections; reads at
// most chunks_per_fd chunks from each registered one.
static void handle_ready(const PollSet* set, int chunks_per_fd) {
    bool any_registered = false;
    for (int i = 2; i < set->count; i++) {
        if (set->fds[i].revents == 0) continue;
        if (set->type[i - 2] < 0) {
            if (pending[set->pending_slot[i - 2]].fd == set->fds[i].fd) {
                handle_pending(set->pending_slot[i - 2]);
            }
        } else {
            any_registered = true;
        }
    }
    if (!any_registered) return;
    pthread_mutex_lock(&file_table_lock);
    for (int i = 2; i < set->count; i++) {
        int type = set->type[i - 2];
        if (type < 0 || set->fds[i].revents == 0) continue;
        // The slot may have been taken over by a connection registered above.
        if (log_files[type].sock != set->fds[i].fd) continue;
        read_available(type, chunks_per_fd);
    }
    pthread_mutex_unlock(&file_table_lock);
}

// See GATHER_LOW_WATER. Called after poll reported data on registered
// connections; last_data_us is when that happened the time before.
static void gather_small_messages(const PollSet* set, int64_t* last_data_us) {
    int64_t now = monotonic_us();
    bool streaming = now - *last_data_us < GATHER_WINDOW_MS * 1000LL;
    *last_data_us = now;
    if (!streaming) return;
    int waiting = 0;
    for (int i = 2; i < set->count; i++) {
        if (set->type[i - 2] < 0 || set->fds[i].revents == 0) continue;
        int bytes = 0;
        if (ioctl(set->fds[i].fd, FIONREAD, &bytes) != 0) return;  // ended or failed: read it now
        waiting += bytes;
    }
    if (waiting >= GATHER_LOW_WATER) return;
    struct pollfd wake = {reader_wake_fd, POLLIN, 0};
    poll(&wake, 1, GATHER_WAIT_MS);
}

static bool registered_ready(const PollSet* set) {
    for (int i = 2; i < set->count; i++) {
        if (set->type[i - 2] >= 0 && set->fds[i].revents != 0) return true;
    }
    return false;
}

// Decides under queue_lock whether the fill queue is too full to take more;
// the writer's rotation clears the state and wakes us.
static bool queue_full() {
    pthread_mutex_lock(&queue_lock);
    bool was_paused = reader_paused;
    // Without a writer the queue never drains; the data is dropped instead.
    reader_paused = writer_running && fill_queue->total >= QUEUE_HIGH_WATER;
    bool paused = reader_paused;
    pthread_mutex_unlock(&queue_lock);
    if (paused && !was_paused) kick_writer();
    return paused;
}

// At a stop the collectors have ended: a letter that has not arrived never
// will, and such a connection must not keep those accepted after it waiting.
static void close_unnamed_pending() {
    for (int i = 0; i < MAX_PENDING; i++) {
        if (pending[i].fd < 0 || pending[i].type >= 0) continue;
        handle_pending(i);
        if (pending[i].fd >= 0 && pending[i].type < 0) {
            HLOG(TAG_TRANSIST, WLOG_WARN, "new client sent no log type before the stop, closed");
            close_pending(i);
        }
    }
}

// After stop_requested: the collectors have ended, so every connection
// reaches its end soon; read them all to it, within a short deadline.
static void drain_at_stop() {
    const int64_t deadline = monotonic_us() + STOP_DRAIN_MS * 1000LL;
    for (;;) {
        if (transist_listen_fd >= 0) accept_connections();
        close_unnamed_pending();
        PollSet set;
        build_poll_set(&set, true, false);
        if (set.count == 2) break;
        int64_t left_ms = (deadline - monotonic_us()) / 1000;
        if (left_ms <= 0) break;
        int n = poll(set.fds + 2, static_cast<nfds_t>(set.count - 2), static_cast<int>(left_ms));
        if (n < 0 && errno != EINTR) break;
        if (n > 0) handle_ready(&set, 64);
    }
    pthread_mutex_lock(&file_table_lock);
    for (int type = 0; type < LOG_TYPE_COUNT; type++) {
        if (log_files[type].sock < 0) continue;
        HLOG(TAG_TRANSIST, WLOG_WARN, "%s connection still open at stop, closed",
             log_type_name(type));
        close_fd(log_files[type].sock);
        pthread_mutex_lock(&select_set_lock);
        log_files[type].sock = -1;
        pthread_mutex_unlock(&select_set_lock);
    }
    pthread_mutex_unlock(&file_table_lock);
    for (int i = 0; i < MAX_PENDING; i++) {
        close_fd(pending[i].fd);
        free_pending(i);
    }
}

static void drain_wake_counter() {
    uint64_t count;
    while (read(reader_wake_fd, &count, sizeof(count)) > 0) {
    }
}

void* read_thread(void*) {
    prctl(PR_SET_NAME, "tavlo.reader");
    WLOG(TAG_TRANSIST, WLOG_DEBUG, "read_thread: pid: %d, tid: %d", getpid(), gettid());
    pthread_mutex_lock(&file_table_lock);
    for (LogFile& entry : log_files) entry.sock = -1;
    pthread_mutex_unlock(&file_table_lock);
    for (PendingConn& conn : pending) conn = {-1, -1, 0, 0};
    for (bool& recorded : drop_recorded) recorded = false;
    pending_full_recorded = false;
    malloc_failure_recorded = false;

    if (transist_listen_fd < 0) {
        // Creation failed and was recorded; the run goes on without collectors.
        mark_reader_done();
        return reinterpret_cast<void*>(1);
    }

    int flush_ms = -1;
    int64_t last_data_us = 0;
    while (!stop_requested) {
        bool paused = queue_full();
        PollSet set;
        build_poll_set(&set, !paused, true);
        // Only a connection that has not named its type yet and a summary of
        // refused clients held back need a clock; otherwise the reader sleeps
        // until a connection, data or the wake counter (stop, resume).
        int timeout_ms = flush_ms;
        int64_t now = monotonic_us();
        for (const PendingConn& conn : pending) {
            if (conn.fd < 0 || conn.type >= 0) continue;
            int64_t left = (conn.expires - now) / 1000 + 1;
            if (left < 0) left = 0;
            if (timeout_ms < 0 || left < timeout_ms) timeout_ms = static_cast<int>(left);
        }
        int n = poll(set.fds, static_cast<nfds_t>(set.count), timeout_ms);
        if (n < 0) {
            int err = errno;
            if (err == EINTR) continue;
            HLOG(TAG_TRANSIST, WLOG_ERROR, "select failed (%s), error = %d", strerror(err), err);
            struct pollfd wake = {reader_wake_fd, POLLIN, 0};
            TEMP_FAILURE_RETRY(poll(&wake, 1, 1000));
            continue;
        }
        if (n > 0) {
            if (set.fds[1].revents != 0) drain_wake_counter();
            if (set.fds[0].revents != 0) accept_connections();
            if (registered_ready(&set)) gather_small_messages(&set, &last_data_us);
            handle_ready(&set, READS_PER_WAKE);
        }
        expire_pending(monotonic_us());
        flush_ms = transist_host != nullptr ? transist_host->flush_records() : -1;
    }

    // The listening socket stays for the next run: freed, its name could be
    // taken by any app in between.
    drain_at_stop();
    WLOG(TAG_TRANSIST, WLOG_DEBUG, "read_thread exits");
    mark_reader_done();
    return reinterpret_cast<void*>(1);
}
