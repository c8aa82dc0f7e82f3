// The Android log collector.
#include "collectors/log_cat.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/select.h>
#include <sys/time.h>
#include <unistd.h>

#include <new>

#include <log/event_tag_map.h>

#include "collectors/control_block.h"
#include "common/io_util.h"
#include "common/limits.h"
#include "record/record.h"
#include "platform/properties.h"

const char* LogCat::device_root = "/dev/log/";

// After data, entries arriving within this time from several devices are
// merged before they go out.
constexpr long BATCH_NS = 5 * 1000 * 1000;
constexpr int PRIORITY_WARN = 5;
constexpr int READS_PER_PASS = 64;
constexpr int SINGLE_READ_PASSES = 8;

// One read buffer for the process: a read hands over one whole entry, which
// is then copied into a block of its own size.
static char read_buf[LOGGER_READ_MAX + 1];

static bool is_prefix_of(const char* name, const char* full) {
    size_t n = strlen(name);
    return n <= strlen(full) && strncmp(name, full, n) == 0;
}

// The stream letter from the collector name; '?' for none of the three, which
// the exit routine reports.
static char letter_for(const char* name) {
    if (is_prefix_of(name, "main_log")) return 'M';
    if (is_prefix_of(name, "radio_log")) return 'R';
    if (is_prefix_of(name, "events_log")) return 'E';
    return '?';
}

LogCat::LogCat(const char* name) : CollectorLink(KIND_ANDROID, letter_for(name)) {}

LogCat::~LogCat() {
    while (LogDevice* d = devices) {
        while (QueuedEntry* e = dequeue_oldest(d)) free_queued_entry(e);
        if (d->fd >= 0) close(d->fd);
        free(d->device);
        devices = d->next;
        delete d;
    }
    if (format != nullptr) android_log_format_free(format);
    if (event_tag_map != nullptr) android_closeEventTagMap(event_tag_map);
}

LogDevice* LogCat::add_device(const char* path, bool binary, log_id_t log_id, int fd) {
    LogDevice* device = new (std::nothrow) LogDevice();
    char* copy = strdup(path);
    if (device == nullptr || copy == nullptr) {
        delete device;
        free(copy);
        return nullptr;
    }
    device->device = copy;
    device->binary = binary;
    device->log_id = log_id;
    device->fd = fd;
    LogDevice** end = &devices;
    while (*end != nullptr) end = &(*end)->next;
    *end = device;
    device_count++;
    return device;
}

int LogCat::set_output_format() {
    if (format == nullptr) format = android_log_format_new();
    AndroidLogPrintFormat id = android_log_formatFromString("threadtime");
    if (format == nullptr || id == FORMAT_OFF) return 0;
    android_log_setPrintFormat(format, id);
    return 1;
}

void LogCat::queue(LogDevice* device, QueuedEntry* entry) {
    enqueue_entry(device, entry);
    queued_count++;
    queued_bytes += queued_entry_size(entry);
    if (queued_count > OVERLOAD_THRESHOLD || queued_bytes > OVERLOAD_BYTES) overloaded = true;
}

static int64_t monotonic_now_us() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000000 + ts.tv_nsec / 1000;
}

// The writer and tag of legacy entry bytes, for the flood budget: a text
// entry's tag follows its priority byte; an event's is its number.
static bool entry_writer(const LogDevice* device, const char* raw, size_t n, int32_t* pid, char* tag) {
    if (n < LEGACY_HEADER_SIZE + 4) return false;
    uint32_t value;
    memcpy(&value, raw + 4, sizeof(value));  // little-endian, as the device
    *pid = static_cast<int32_t>(value);
    if (device->binary) {
        memcpy(&value, raw + LEGACY_HEADER_SIZE, sizeof(value));
        snprintf(tag, FLOOD_TAG_LEN, "%u", value);
        return true;
    }
    const char* text = raw + LEGACY_HEADER_SIZE + 1;
    size_t len = strnlen(text, n - LEGACY_HEADER_SIZE - 1);
    if (len >= FLOOD_TAG_LEN) len = FLOOD_TAG_LEN - 1;
    memcpy(tag, text, len);
    tag[len] = '\0';
    return true;
}

int LogCat::take_entry(LogDevice* device, const char* raw, size_t n) {
    if (flood.budget() != 0) {
        int32_t pid;
        char tag[FLOOD_TAG_LEN];
        if (entry_writer(device, raw, n, &pid, tag) && !flood.admit(pid, tag, n, monotonic_now_us())) return 0;
    }
    QueuedEntry* entry = adapt_legacy_entry(raw, n, device->log_id);
    if (entry == nullptr) {
        // Once per process: a device that keeps handing out such bytes must
        // not flood the history.
        static bool recorded = false;
        if (!recorded) {
            recorded = true;
            HLOG(TAG_ANDROID, WLOG_ERROR, "entry of %zu bytes from %s dropped: not whole or no memory",
                 n, device->device);
        }
        return 0;
    }
    queue(device, entry);
    return 1;
}

void LogCat::flush_output() {
    if (output_len == 0) return;
    int rc = send_to_transist(output, output_len, transist_fd);
    output_len = 0;
    if (rc < 0) {
        HLOG(TAG_ANDROID, WLOG_ERROR, "output error");
        exit_collector(this, 1, REASON_OUTPUT);
    }
}

void LogCat::append_output(const char* text, size_t len) {
    if (output_len + len > sizeof(output)) flush_output();
    if (len > sizeof(output)) {
        int rc = send_to_transist(text, len, transist_fd);
        if (rc < 0) {
            HLOG(TAG_ANDROID, WLOG_ERROR, "output error");
            exit_collector(this, 1, REASON_OUTPUT);
        }
        return;
    }
    memcpy(output + output_len, text, len);
    output_len += len;
}

void LogCat::print_start_marker(LogDevice* device) {
    if (device->printed) return;
    device->printed = true;
    if (device_count <= 1) return;
    char line[1024];
    int n = snprintf(line, sizeof(line), "--------- beginning of %s\n", device->device);
    if (n < 0) return;
    append_output(line, static_cast<size_t>(n) < sizeof(line) ? static_cast<size_t>(n) : sizeof(line) - 1);
}

void LogCat::format_and_send(const AndroidLogEntry& line) {
    // Rendered straight into the batch when it fits in 512 bytes, as nearly
    // every line does: one copy less per line.
    const size_t room = 512;
    if (sizeof(output) - output_len < room) flush_output();
    char* buf = output + output_len;
    size_t len = 0;
    char* text = android_log_formatLogLine(format, buf, room, &line, &len);
    if (text == nullptr) {
        // The lines rendered before this one are whole: they still go out
        // (a failed send records "output error" and ends there).
        flush_output();
        HLOG(TAG_ANDROID, WLOG_ERROR, "output error");
        exit_collector(this, 1, REASON_OUTPUT);
    }
    if (text == buf) {
        output_len += len;
        return;
    }
    append_output(text, len);
    free(text);
}

void LogCat::drop_next_entry(LogDevice* device) {
    print_start_marker(device);
    QueuedEntry* entry = dequeue_oldest(device);
    if (entry == nullptr) return;
    queued_bytes -= queued_entry_size(entry);
    free_queued_entry(entry);
    queued_count--;
    if (queued_count <= OVERLOAD_THRESHOLD && queued_bytes <= OVERLOAD_BYTES) {
        overloaded = false;
        marker_queued = false;
    }
}

void LogCat::print_next_entry(LogDevice* device) {
    print_start_marker(device);
    QueuedEntry* entry = device->queue;
    AndroidLogEntry line;
    int rc;
    if (device->binary) {
        rc = android_log_processBinaryLogBuffer(&entry->entry, &line, event_tag_map, event_text,
                                                sizeof(event_text));
        // This build of the library shows an event's tag as its number; the
        // tag map names it, as the library does on the phone.
        size_t name_len = 0;
        uint32_t tag = 0;
        if (rc == 0 && event_tag_map != nullptr && entry->entry.len >= sizeof(tag)) {
            memcpy(&tag, entry_payload(entry), sizeof(tag));  // little-endian, as the device
            const char* name = android_lookupEventTag_len(event_tag_map, &name_len, tag);
            if (name != nullptr && name_len > 0) {
                if (name_len >= sizeof(event_tag)) name_len = sizeof(event_tag) - 1;
                memcpy(event_tag, name, name_len);
                event_tag[name_len] = '\0';
                line.tag = event_tag;
                line.tagLen = name_len;
            }
        }
    } else {
        rc = android_log_processLogBuffer(&entry->entry, &line);
    }
    // The priority is the entry's own byte, any value at all: read it as the
    // number it is, not as one of the enumerated priorities.
    int priority;
    memcpy(&priority, &line.priority, sizeof(priority));
    // An entry that cannot be decoded is dropped without a word.
    if (rc == 0 && android_log_shouldPrintLine(format, line.tag, static_cast<android_LogPriority>(priority)))
        format_and_send(line);
    drop_next_entry(device);
}

void LogCat::report_drops(bool all) {
    if (flood.budget() == 0) return;
    FloodDrops drops;
    int64_t now_us = monotonic_now_us();
    while (all ? flood.next_summary_now(&drops) : flood.next_summary(now_us, &drops)) {
        char message[192];
        snprintf(message, sizeof(message),
                 "dropped %ld entries (%ld bytes) of pid %d tag %s: past its budget of %ld KB/s", drops.entries,
                 drops.bytes, static_cast<int>(drops.pid), drops.tag, flood.budget() / 1024);
        struct timeval now;
        gettimeofday(&now, nullptr);
        AndroidLogEntry line = {};
        line.tv_sec = now.tv_sec;
        line.tv_nsec = now.tv_usec * 1000L;
        line.priority = ANDROID_LOG_WARN;
        line.tag = "TavloLogD";
        line.tagLen = strlen(line.tag);
        line.message = message;
        line.messageLen = strlen(message);
        format_and_send(line);
    }
}

void LogCat::push_marker_entry(LogDevice* device) {
    struct timeval now;
    gettimeofday(&now, nullptr);
    char raw[64];
    size_t n = make_legacy_text_entry(raw, 0, 0, static_cast<uint32_t>(now.tv_sec),
                                      static_cast<uint32_t>(now.tv_usec) * 1000, PRIORITY_WARN, "ORU",
                                      "trigger log");
    take_entry(device, raw, n);
}

void LogCat::print_ready() {
    for (;;) {
        LogDevice* first = choose_first_device(devices);
        if (first == nullptr) break;
        if (holds_single_entry(first)) {
            if (!overloaded) break;
            // Too much held back: the lone entry goes out, with one marker per
            // overload to say so. The marker is dated now; when the clock has
            // stepped back behind the entries it sorts first and goes out
            // first, and the lone entry follows in the next turn all the same.
            if (!marker_queued) {
                push_marker_entry(first);
                marker_queued = true;
            }
        }
        print_next_entry(first);
    }
    // What is rendered waits for a full batch or the quiet time, at most the
    // 5 ms the merge holds entries anyway.
}

void LogCat::print_all() {
    for (LogDevice* first; (first = choose_first_device(devices)) != nullptr;) print_next_entry(first);
    flush_output();
}

void LogCat::finish(int status, int reason) {
    print_all();
    report_drops(true);
    flush_output();
    exit_collector(this, status, reason);
}

int LogCat::read_entry(LogDevice* device, bool* interrupted) {
    ssize_t n = read(device->fd, read_buf, LOGGER_READ_MAX);
    if (n < 0) {
        if (errno == EINTR) *interrupted = true;
        if (errno == EINTR || errno == EAGAIN) return 0;
        HLOG(TAG_ANDROID, WLOG_ERROR, "logcat read");
        finish(1, REASON_READ);
    }
    if (n == 0) {
        HLOG(TAG_ANDROID, WLOG_ERROR, "read: Unexpected EOF!\n");
        finish(1, REASON_READ);
    }
    take_entry(device, read_buf, static_cast<size_t>(n));
    return 1;
}

void LogCat::finish_at_stop(int reason) {
    // Entries written before the stop are taken too, as far as the process
    // may hold them.
    for (bool more = true; more && !overloaded;) {
        more = false;
        for (LogDevice* d = devices; d != nullptr; d = d->next) {
            struct pollfd p = {d->fd, POLLIN, 0};
            bool interrupted = false;
            if (poll(&p, 1, 0) == 1 && (p.revents & POLLIN) && read_entry(d, &interrupted) == 1) more = true;
        }
    }
    finish(0, reason);
}

void LogCat::read_log_lines() {
    // The stop signal is taken only inside the wait, and then only noted: the
    // loop ends the collector once everything read has been sent.
    sigset_t wait_mask;
    hold_stop_signal(&wait_mask);
    defer_stop_signal = true;

    int maxfd = -1;
    for (LogDevice* d = devices; d != nullptr; d = d->next) {
        maxfd = d->fd > maxfd ? d->fd : maxfd;
        // A device with a backlog is read until it has nothing more, up to
        // READS_PER_PASS entries: a wait per entry would cost a busy log (or
        // a flood) more than reading it. One that had none is read an entry
        // a pass for a while: the read finding nothing would cost as much.
        fcntl(d->fd, F_SETFL, fcntl(d->fd, F_GETFL) | O_NONBLOCK);
    }
    bool wait_forever = false;
    for (;;) {
        if (stop_signalled) finish_at_stop(REASON_SIGNAL);
        if (stop_asked(this)) finish_at_stop(REASON_NONE);

        fd_set readable;
        int ready;
        do {
            FD_ZERO(&readable);
            for (LogDevice* d = devices; d != nullptr; d = d->next) FD_SET(d->fd, &readable);
            // Every bounded wait gets the whole batching time again: with the
            // remainder a timed-out select leaves, later waits would return
            // at once and the collector would spin.
            struct timespec batch = {0, BATCH_NS};
            // Drops of a flood are told once a second, also when the flood
            // has stopped: the only clock this loop keeps while nothing flows.
            int due_ms = flood.budget() != 0 ? flood.summary_due_ms(monotonic_now_us()) : -1;
            struct timespec summary = {due_ms / 1000, (due_ms % 1000) * 1000000L};
            struct timespec* wait = wait_forever ? (due_ms >= 0 ? &summary : nullptr) : &batch;
            ready = pselect(maxfd + 1, &readable, nullptr, nullptr, wait, &wait_mask);
        } while (ready < 0 && errno == EINTR && !stop_signalled);
        if (ready < 0) {
            if (errno != EINTR) back_off_after_failed_wait(this, errno, &wait_mask);
            continue;
        }

        if (ready == 0) {
            // Quiet for the batching time: nothing older can still come.
            print_all();
            report_drops(false);
            flush_output();
            trim_entry_pool(ENTRY_POOL_QUIET);
            wait_forever = true;
            continue;
        }
        bool interrupted = false;
        for (LogDevice* d = devices; d != nullptr && !interrupted; d = d->next) {
            if (!FD_ISSET(d->fd, &readable)) continue;
            int max_reads = d->single_reads > 0 ? 1 : READS_PER_PASS;
            if (d->single_reads > 0) d->single_reads--;
            int reads = 0;
            while (reads < max_reads && read_entry(d, &interrupted) == 1) reads++;
            if (max_reads > 1 && reads < 2 && !interrupted) d->single_reads = SINGLE_READ_PASSES;
        }
        if (interrupted) continue;
        print_ready();
        report_drops(false);
        wait_forever = false;
    }
}

void LogCat::run(const char*, const char* device, int block_fd) {
    if (install_stop_signal(this) != 0) {
        HLOG(TAG_ANDROID, WLOG_ERROR, "can't catch. errno = %d", errno);
    }
    shm_fd = block_fd;
    if (shm_fd == -1 || !attach_control_block(this)) {
        HLOG(TAG_ANDROID, WLOG_ERROR, "shm open failed!");
        _exit(1);  // see exit_collector
    }
    WLOG(TAG_ANDROID, WLOG_DEBUG, "map Shared memory ok!");
    format = android_log_format_new();
    char budget[PROPERTY_VALUE_MAX];
    property_get(PROP_PID_BUDGET, budget, "0");
    long kb = atol(budget);
    if (kb > 0 && kb <= FLOOD_BUDGET_MAX_KB) {
        flood.set_budget(kb * 1024);
        WLOG(TAG_ANDROID, WLOG_INFO, "entries past %ld KB/s of one pid are dropped", kb);
    }

    char path[PATH_LEN];
    if (device != nullptr) {
        snprintf(path, sizeof(path), "%s%s", device_root, device);
        bool events = strcmp(device, "events") == 0;
        add_device(path, events, events ? LOG_ID_EVENTS : LOG_ID_RADIO, -1);
    } else {
        snprintf(path, sizeof(path), "%smain", device_root);
        add_device(path, false, LOG_ID_MAIN, -1);
        snprintf(path, sizeof(path), "%ssystem", device_root);
        if (access(path, F_OK) == 0) add_device(path, false, LOG_ID_SYSTEM, -1);
    }

    if (!set_output_format()) {
        HLOG(TAG_ANDROID, WLOG_ERROR, "setLogFormat failed");
        exit_collector(this, 1, REASON_FORMAT);
    }
    bool any_binary = false;
    for (LogDevice* d = devices; d != nullptr; d = d->next) {
        d->fd = TEMP_FAILURE_RETRY(open(d->device, O_RDONLY | O_CLOEXEC));
        if (d->fd < 0) {
            HLOG(TAG_ANDROID, WLOG_ERROR, "Unable to open log device '%s': %s", d->device,
                 strerror(errno));
            exit_collector(this, 1, REASON_OPEN);
        }
        any_binary = any_binary || d->binary;
    }
    if (devices == nullptr) {
        HLOG(TAG_ANDROID, WLOG_ERROR, "Unable to open log device '%s': %s", path, strerror(ENOMEM));
        exit_collector(this, 1, REASON_OPEN);
    }
    // A missing map is accepted: events then show their tag numbers.
    if (any_binary) event_tag_map = android_openEventTagMap(EVENT_TAG_MAP_FILE);

    connect_transist(this);
    read_log_lines();
}
