// Creation of the transist for a run, its process-wide state and the wake-ups
// that let a stop finish without waiting for time-outs.
#include "transist/transist.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <cutils/sockets.h>

#include "common/io_util.h"
#include "common/text.h"
#include "platform/properties.h"
#include "record/record.h"
#include "transist/log_files.h"
#include "transist/transist_queue.h"
#include "transist/transist_state.h"

std::atomic<bool> stop_requested{false};
int transist_listen_fd = -1;
pthread_t read_thread_id;
pthread_t write_thread_id;

int transist_capacity = DEFAULT_CAPACITY;
int transist_interval = 1;
int transist_throughput = 2;
TransistHost* transist_host = nullptr;
std::atomic<bool> writer_running{false};
bool reader_paused = false;
bool writer_idle = false;
int reader_wake_fd = -1;

// Guards the writer's wake-up flags and the reader's "done" flag.
static pthread_mutex_t wake_lock = PTHREAD_MUTEX_INITIALIZER;
static pthread_cond_t wake_cond;
static bool writer_kicked = false;  // wake_lock
static bool data_arrived = false;   // wake_lock: the reader woke the idle writer
static bool reader_done = false;    // wake_lock

// The longest period the writer's microsecond arithmetic was designed for.
static const int MAX_INTERVAL = 2147;

static void init_wake_once() {
    static pthread_once_t once = PTHREAD_ONCE_INIT;
    pthread_once(&once, [] {
        pthread_condattr_t attr;
        pthread_condattr_init(&attr);
        // Waits must not stretch or shrink when the wall clock is set.
        pthread_condattr_setclock(&attr, CLOCK_MONOTONIC);
        pthread_cond_init(&wake_cond, &attr);
        pthread_condattr_destroy(&attr);
    });
}

static timespec deadline_after_us(int64_t usec) {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    int64_t ns = ts.tv_nsec + (usec % 1000000) * 1000;
    ts.tv_sec += static_cast<time_t>(usec / 1000000 + ns / 1000000000);
    ts.tv_nsec = static_cast<long>(ns % 1000000000);
    return ts;
}

void writer_sleep_us(int64_t usec) {
    if (usec <= 0) return;
    timespec until = deadline_after_us(usec);
    pthread_mutex_lock(&wake_lock);
    while (!stop_requested && !writer_kicked) {
        if (pthread_cond_timedwait(&wake_cond, &wake_lock, &until) == ETIMEDOUT) break;
    }
    writer_kicked = false;
    pthread_mutex_unlock(&wake_lock);
}

bool writer_idle_wait() {
    pthread_mutex_lock(&wake_lock);
    while (!stop_requested && !writer_kicked && !data_arrived) pthread_cond_wait(&wake_cond, &wake_lock);
    bool kicked = writer_kicked;
    writer_kicked = false;
    data_arrived = false;
    pthread_mutex_unlock(&wake_lock);
    return kicked;
}

void wake_idle_writer() {
    pthread_mutex_lock(&wake_lock);
    data_arrived = true;
    pthread_cond_broadcast(&wake_cond);
    pthread_mutex_unlock(&wake_lock);
}

void kick_writer() {
    pthread_mutex_lock(&wake_lock);
    writer_kicked = true;
    pthread_cond_broadcast(&wake_cond);
    pthread_mutex_unlock(&wake_lock);
}

void mark_reader_done() {
    pthread_mutex_lock(&wake_lock);
    reader_done = true;
    pthread_cond_broadcast(&wake_cond);
    pthread_mutex_unlock(&wake_lock);
}

bool wait_reader_done(int ms) {
    timespec until = deadline_after_us(static_cast<int64_t>(ms) * 1000);
    pthread_mutex_lock(&wake_lock);
    while (!reader_done) {
        if (pthread_cond_timedwait(&wake_cond, &wake_lock, &until) == ETIMEDOUT) break;
    }
    bool done = reader_done;
    pthread_mutex_unlock(&wake_lock);
    return done;
}

void wake_reader() {
    if (reader_wake_fd < 0) return;
    uint64_t one = 1;
    TEMP_FAILURE_RETRY(write(reader_wake_fd, &one, sizeof(one)));
}

static void close_if_open(int* fd) {
    if (*fd > 0) close(*fd);
    *fd = -1;
}

void transist_close_in_child() {
    // The tables may be mid-update by the daemon's threads at the fork; the
    // child only reads its own copy and owns no lock.
    for (LogFile& file : log_files) {
        close_if_open(&file.fd);
        close_if_open(&file.sock);
    }
    close_if_open(&transist_listen_fd);
}

void transist_wake() {
    wake_reader();
    init_wake_once();
    pthread_mutex_lock(&wake_lock);
    pthread_cond_broadcast(&wake_cond);
    pthread_mutex_unlock(&wake_lock);
}

// A decimal number and nothing else (surrounding blanks allowed); false for
// anything atoi would have to guess at.
static bool parse_number(const char* value, long* out) {
    errno = 0;
    char* end = nullptr;
    long v = strtol(value, &end, 10);
    if (end == value || errno == ERANGE) return false;
    while (*end == ' ' || *end == '\t') end++;
    if (*end != '\0') return false;
    *out = v;
    return true;
}

int choose_capacity(const char* value) {
    long v = 0;
    char shown[PROPERTY_VALUE_MAX];
    // Below one chunk the placement rule cannot hold a read.
    if (!parse_number(value, &v) || v < CHUNK_MAX) {
        printable_copy(shown, sizeof(shown), value);
        HLOG(TAG_TRANSIST, WLOG_WARN, "bad debug.TQ.buffersize '%s', use %d", shown,
             DEFAULT_CAPACITY);
        return DEFAULT_CAPACITY;
    }
    if (v > MAX_CAPACITY) {
        HLOG(TAG_TRANSIST, WLOG_WARN, "debug.TQ.buffersize %ld too big, use %d", v, MAX_CAPACITY);
        return MAX_CAPACITY;
    }
    return static_cast<int>(v);
}

int choose_interval(const char* value) {
    long v = 0;
    char shown[PROPERTY_VALUE_MAX];
    if (!parse_number(value, &v) || v < 1) {
        printable_copy(shown, sizeof(shown), value);
        HLOG(TAG_TRANSIST, WLOG_WARN, "bad debug.TQ.interval '%s', use 1", shown);
        return 1;
    }
    if (v > MAX_INTERVAL) {
        HLOG(TAG_TRANSIST, WLOG_WARN, "debug.TQ.interval %ld too big, use %d", v, MAX_INTERVAL);
        return MAX_INTERVAL;
    }
    return static_cast<int>(v);
}

static void read_parameters() {
    char value[PROPERTY_VALUE_MAX];
    property_get("debug.TQ.buffersize", value, "65535");
    transist_capacity = choose_capacity(value);
    property_get("debug.TQ.throughput", value, "2");
    transist_throughput = atoi(value);
    property_get("debug.TQ.interval", value, "1");
    transist_interval = choose_interval(value);
    long capacity = transist_capacity, throughput = transist_throughput,
         interval = transist_interval;
    record_history(1, "buffer:%ldB; throughput:%ldMB/s; interval: %lds", capacity, throughput,
                interval);
    WLOG(TAG_TRANSIST, WLOG_INFO, "buffer:%ldB; throughput:%ldMB/s; interval: %lds", capacity,
         throughput, interval);
}

// Only types whose file was not open, or whose folder vanished, leave bytes
// behind; they belong to a finished run.
static void discard_leftovers() {
    pthread_mutex_lock(&queue_lock);
    for (int i = 0; i < QUEUE_COUNT; i++) {
        if (transist_queues[i].total == 0) continue;
        HLOG(TAG_TRANSIST, WLOG_INFO, "delete transist queue:%d,%d", i, transist_queues[i].total);
        queue_clear(&transist_queues[i]);
    }
    reset_queue_roles();
    reader_paused = false;
    writer_idle = false;
    pthread_mutex_unlock(&queue_lock);
    node_pool_trim(0);
}

int transist_listen() {
    if (transist_listen_fd >= 0) return 1;
    int fd = socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    if (fd < 0) {
        int err = errno;
        HLOG(TAG_TRANSIST, WLOG_ERROR, "create log reader socket failed (%s), errno = %d",
             strerror(err), err);
        if (err == EADDRINUSE) {
            HLOG(TAG_TRANSIST, WLOG_ERROR, "log_socket is held by another process");
        }
        return 0;
    }
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    if (listen(fd, 10) < 0) {
        HLOG(TAG_TRANSIST, WLOG_ERROR, "listen reader socket failed");
        close(fd);
        return 0;
    }
    // Accepting must never block the reader: the backlog is also emptied at stop.
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
    transist_listen_fd = fd;
    return 1;
}

void transist_create(TransistHost* host, const TransistRun& run) {
    init_wake_once();
    rotate_limit_kb = run.rotate_kb;
    transist_host = host;
    read_parameters();
    discard_leftovers();
    open_output_files(run);

    if (reader_wake_fd < 0) reader_wake_fd = eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    uint64_t stale;
    while (reader_wake_fd >= 0 && read(reader_wake_fd, &stale, sizeof(stale)) > 0) {
    }
    pthread_mutex_lock(&wake_lock);
    writer_kicked = false;
    data_arrived = false;
    reader_done = false;
    pthread_mutex_unlock(&wake_lock);
    writer_running = true;
    // No connection yet; the table starts zeroed, and 0 is a descriptor.
    pthread_mutex_lock(&file_table_lock);
    for (LogFile& entry : log_files) entry.sock = -1;
    pthread_mutex_unlock(&file_table_lock);

    // Held already when the daemon could bind it at start; else tried again.
    transist_listen();

    int read_err = pthread_create(&read_thread_id, nullptr, read_thread, nullptr);
    if (read_err != 0) {
        HLOG(TAG_TRANSIST, WLOG_ERROR, "create read thread failed (%s)", strerror(read_err));
        read_thread_id = pthread_t();
        mark_reader_done();
    }
    int write_err = pthread_create(&write_thread_id, nullptr, write_thread, nullptr);
    if (write_err != 0) {
        HLOG(TAG_TRANSIST, WLOG_ERROR, "create write thread failed (%s)", strerror(write_err));
        write_thread_id = pthread_t();
        writer_running = false;
    }
    if (read_err == 0 && write_err == 0) {
        HLOG(TAG_TRANSIST, WLOG_INFO, "create read/write thread success");
    }
}
