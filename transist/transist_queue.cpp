// Queue nodes and the placement rule.
#include "transist/transist_queue.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>

TransistQueue transist_queues[QUEUE_COUNT];
TransistQueue* fill_queue = &transist_queues[0];
TransistQueue* spare_queue = &transist_queues[1];
TransistQueue* drain_queue = &transist_queues[2];
pthread_mutex_t queue_lock = PTHREAD_MUTEX_INITIALIZER;

// Free nodes for reuse; pool_lock is a leaf lock, taken inside any other.
static pthread_mutex_t pool_lock = PTHREAD_MUTEX_INITIALIZER;
static LogBuffer* pool_head = nullptr;  // pool_lock
static int pool_bytes = 0;              // pool_lock

static LogBuffer* pooled_node(int capacity) {
    pthread_mutex_lock(&pool_lock);
    LogBuffer* node = pool_head;
    // A node of another size is left from a run with another buffersize;
    // it goes at the next trim.
    if (node != nullptr && node->cap == capacity) {
        pool_head = node->next;
        pool_bytes -= node->cap;
    } else {
        node = nullptr;
    }
    pthread_mutex_unlock(&pool_lock);
    return node;
}

static void free_node(LogBuffer* node) {
    pthread_mutex_lock(&pool_lock);
    bool kept = pool_bytes + node->cap <= NODE_POOL_MAX_BYTES;
    if (kept) {
        node->next = pool_head;
        pool_head = node;
        pool_bytes += node->cap;
    }
    pthread_mutex_unlock(&pool_lock);
    if (!kept) {
        free(node->buf);
        free(node);
    }
}

void node_pool_trim(int keep_bytes) {
    LogBuffer* spill = nullptr;
    pthread_mutex_lock(&pool_lock);
    while (pool_head != nullptr && pool_bytes > keep_bytes) {
        LogBuffer* node = pool_head;
        pool_head = node->next;
        pool_bytes -= node->cap;
        node->next = spill;
        spill = node;
    }
    pthread_mutex_unlock(&pool_lock);
    while (spill != nullptr) {
        LogBuffer* next = spill->next;
        free(spill->buf);
        free(spill);
        spill = next;
    }
}

int node_pool_bytes() {
    pthread_mutex_lock(&pool_lock);
    int bytes = pool_bytes;
    pthread_mutex_unlock(&pool_lock);
    return bytes;
}

static LogBuffer* new_node(int capacity) {
    LogBuffer* node = pooled_node(capacity);
    if (node != nullptr) {
        node->len = 0;
        node->next = nullptr;
        return node;
    }
    node = static_cast<LogBuffer*>(malloc(sizeof(LogBuffer)));
    if (node == nullptr) return nullptr;
    node->buf = static_cast<char*>(malloc(static_cast<size_t>(capacity)));
    if (node->buf == nullptr) {
        int saved = errno;
        free(node);
        errno = saved;
        return nullptr;
    }
    node->len = 0;
    node->cap = capacity;
    node->next = nullptr;
    return node;
}

int queue_append(TransistQueue* q, int type, const char* data, int n, int capacity) {
    if (type < 0 || type >= LOG_TYPE_COUNT || n <= 0 || n > capacity) return -1;
    BufferList* list = &q->lists[type];
    LogBuffer* tail = list->tail;
    // Fill the tail only when the whole chunk fits: keeping chunks whole means
    // a node is written with one call and never holds half of a read.
    if (tail == nullptr || tail->len + n > tail->cap) {
        LogBuffer* node = new_node(capacity);
        if (node == nullptr) return 0;
        if (tail == nullptr) {
            list->head = node;
        } else {
            tail->next = node;
        }
        list->tail = node;
        tail = node;
    }
    memcpy(tail->buf + tail->len, data, static_cast<size_t>(n));
    tail->len += n;
    list->bytes += n;
    q->total += n;
    return 1;
}

void release_head(BufferList* list) {
    LogBuffer* node = list->head;
    if (node == nullptr) return;
    list->head = node->next;
    if (list->tail == node) list->tail = nullptr;
    list->bytes -= node->len;
    free_node(node);
}

int queue_clear(TransistQueue* q) {
    int total = q->total;
    for (BufferList& list : q->lists) {
        while (list.head != nullptr) release_head(&list);
        list.bytes = 0;
    }
    q->total = 0;
    return total;
}

void rotate_queue_roles() {
    TransistQueue* old_drain = drain_queue;
    drain_queue = fill_queue;
    fill_queue = spare_queue;
    spare_queue = old_drain;
}

void reset_queue_roles() {
    fill_queue = &transist_queues[0];
    spare_queue = &transist_queues[1];
    drain_queue = &transist_queues[2];
}
