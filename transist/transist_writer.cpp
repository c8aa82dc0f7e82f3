// The writer thread: once per interval it exchanges the queue roles and writes
// what the reader gathered to the log files. At a stop it writes every queued
// byte and syncs the files before it ends.
#include "transist/transist_writer.h"

#include <errno.h>
#include <string.h>
#include <sys/prctl.h>
#include <unistd.h>

#include "common/control_protocol.h"
#include "common/io_util.h"
#include "record/record.h"
#include "storage/storage_check.h"
#include "transist/log_files.h"
#include "transist/transist.h"
#include "transist/transist_queue.h"
#include "transist/transist_reader.h"
#include "transist/transist_state.h"

int writer_storage_blocked(TransistHost* host, int (*is_low)(const char*), bool notify) {
    if (host == nullptr || is_low(host->space_root()) != 1) return 0;
    HLOG(TAG_TRANSIST, WLOG_ERROR, "no space to write log");
    if (notify) host->writer_gave_up(BROADCAST_STORAGE_FULL, EVENT_STORAGE_LOW);
    return 1;
}

static uint64_t measure_free_space(const char* path) { return get_free_space(path, 0); }
uint64_t (*writer_free_space)(const char* path) = measure_free_space;

// Free space is measured again after this many bytes at most, and before
// every node once less than that is left above the reserve.
constexpr int64_t SPACE_RECHECK_BYTES = 1 << 20;

// Bytes a flush may still write before it measures the free space again;
// negative until the first measurement.
struct SpaceBudget {
    int64_t bytes = -1;
};

// The reserve has to hold while a cycle writes, not only when it begins: one
// cycle may carry megabytes. A node is written while the last measurement
// left room above the reserve, so the reserve is crossed by one node at most.
static bool room_for_node(SpaceBudget* budget, const char* path, int len) {
    if (budget->bytes <= 0) {
        uint64_t free_bytes = writer_free_space(path);
        if (is_free_space_low(free_bytes)) return false;
        uint64_t above = free_bytes - LOW_STORAGE_BYTES;
        budget->bytes = above < static_cast<uint64_t>(SPACE_RECHECK_BYTES) ? static_cast<int64_t>(above)
                                                                           : SPACE_RECHECK_BYTES;
    }
    budget->bytes -= len;
    return true;
}

int flush_one_queue(TransistQueue* q, bool notify) {
    int written = 0;
    SpaceBudget budget;
    for (int type = 0; type < LOG_TYPE_COUNT; type++) {
        LogFile* entry = &log_files[type];
        BufferList* list = &q->lists[type];
        // A type without a file keeps its chunks (the reader queues none).
        if (entry->fd <= 0 || list->head == nullptr) continue;
        int retries = 10;
        while (list->head != nullptr) {
            // The folder can be removed under a running log: notice it here
            // rather than write into unlinked files.
            if (access(entry->name, F_OK) != 0) {
                int err = errno;
                if (err == EINTR && retries-- > 0) {
                    HLOG(TAG_TRANSIST, WLOG_ERROR, "EINTR come when access %s", entry->name);
                    continue;
                }
                HLOG(TAG_TRANSIST, WLOG_ERROR, "log files %s not exist:%d", entry->name, err);
                if (notify && transist_host != nullptr) {
                    transist_host->writer_gave_up(BROADCAST_FOLDER_LOST, EVENT_FOLDER_LOST);
                }
                return FLUSH_FOLDER_LOST;
            }
            LogBuffer* node = list->head;
            // The same root as the check at the start of a cycle; the
            // host changes it only after the writer has ended.
            const char* root = transist_host ? transist_host->space_root() : entry->name;
            if (!room_for_node(&budget, root, node->len)) {
                HLOG(TAG_UTIL, WLOG_ERROR, "%s is almost full or unavailable!!", root);
                HLOG(TAG_TRANSIST, WLOG_ERROR, "no space to write log");
                if (notify && transist_host != nullptr) {
                    transist_host->writer_gave_up(BROADCAST_STORAGE_FULL, EVENT_STORAGE_LOW);
                }
                return FLUSH_STORAGE_LOW;
            }
            written += write_log_data(type, node->buf, node->len);
            // The node leaves the queue whether or not the disk took it all.
            q->total -= node->len;
            release_head(list);
            if (rotation_due(entry->size, rotate_limit_kb) && rotate_log_files(entry) != 0) {
                return FLUSH_REOPEN_FAILED;
            }
        }
    }
    return written;
}

int flush_queue() {
    pthread_mutex_lock(&file_table_lock);
    int rc = flush_one_queue(drain_queue, true);
    pthread_mutex_unlock(&file_table_lock);
    sync_retired_files();
    return rc;
}

// The writer is gone for the rest of the run: leave no file open behind it.
static void close_files_only() {
    pthread_mutex_lock(&file_table_lock);
    for (LogFile& entry : log_files) close_log_file(&entry);
    pthread_mutex_unlock(&file_table_lock);
}

static int finish_at_stop() {
    if (!wait_reader_done(STOP_DRAIN_MS + 200)) {
        HLOG(TAG_TRANSIST, WLOG_WARN, "reader still busy at stop, writing what is queued");
    }
    int rc = 0;
    pthread_mutex_lock(&file_table_lock);
    // Oldest first: the spare queue was drained a cycle before the drain
    // queue, which was filled before the fill queue. The flush keeps the
    // reserve of the run's log root.
    pthread_mutex_lock(&queue_lock);
    TransistQueue* order[QUEUE_COUNT] = {spare_queue, drain_queue, fill_queue};
    pthread_mutex_unlock(&queue_lock);
    for (TransistQueue* q : order) {
        rc = flush_one_queue(q, false);
        if (rc < 0) break;
    }
    close_all_log_files();
    pthread_mutex_unlock(&file_table_lock);
    sync_retired_files();
    return rc == FLUSH_REOPEN_FAILED ? 1 : 2;
}

// After a cycle with nothing to write: when the fill queue is empty too,
// sleeps until something happens instead of cycling on the clock. Nothing
// needs a clock meanwhile: the free space matters only to what is written and
// is measured again at the start of the next cycle, as every cycle does, and
// the stop wakes the wait. Once data arrives the writer gathers for one
// interval, as at the start of a run, and then cycles as before. Returns true
// when the next cycle is due at once (kicked).
static bool wait_while_idle() {
    pthread_mutex_lock(&queue_lock);
    writer_idle = fill_queue->total == 0;
    bool idle = writer_idle;
    pthread_mutex_unlock(&queue_lock);
    if (!idle) return false;
    bool kicked = writer_idle_wait();
    pthread_mutex_lock(&queue_lock);
    writer_idle = false;
    pthread_mutex_unlock(&queue_lock);
    if (kicked || stop_requested) return true;
    writer_sleep_us(static_cast<int64_t>(transist_interval) * 1000000);
    return true;
}

void* write_thread(void*) {
    prctl(PR_SET_NAME, "tavlo.writer");
    WLOG(TAG_TRANSIST, WLOG_DEBUG, "write_thread: pid: %d, tid: %d", getpid(), gettid());
    const int64_t interval_us = static_cast<int64_t>(transist_interval) * 1000000;
    writer_sleep_us(interval_us);
    while (!stop_requested) {
        if (writer_storage_blocked(transist_host, is_storage_low, true)) {
            writer_sleep_us(interval_us);
            continue;
        }
        int64_t t0 = monotonic_us();
        pthread_mutex_lock(&queue_lock);
        rotate_queue_roles();
        bool resume_reader = reader_paused;
        reader_paused = false;
        pthread_mutex_unlock(&queue_lock);
        if (resume_reader) wake_reader();
        int pooled = node_pool_bytes();
        bool wrote = drain_queue->total != 0;
        if (wrote && flush_queue() == FLUSH_REOPEN_FAILED) {
            writer_running = false;
            close_files_only();
            node_pool_trim(0);
            return reinterpret_cast<void*>(1);
        }
        // Keep as many spare nodes as this cycle released: the next cycle
        // likely needs as many, and an idle cycle gives them all back.
        int released = node_pool_bytes() - pooled;
        node_pool_trim(released > 0 ? released : 0);
        if (!wrote && wait_while_idle()) continue;
        int64_t elapsed = monotonic_us() - t0;
        if (elapsed >= 0 && elapsed <= interval_us) writer_sleep_us(interval_us - elapsed);
    }
    int rc = finish_at_stop();
    node_pool_trim(0);
    writer_running = false;
    WLOG(TAG_TRANSIST, WLOG_DEBUG, "write_thread exits");
    return reinterpret_cast<void*>(static_cast<intptr_t>(rc));
}
