// The transist's queues: per-type lists of fixed-size nodes that the reader
// fills and the writer drains, and the three process-wide queues whose roles
// (fill, drain, spare) the writer rotates once per cycle.
#pragma once

#include <pthread.h>

#include "common/log_types.h"

// Smallest node block (debug.TQ.buffersize below it is not accepted).
constexpr int CHUNK_MAX = 4095;
// Largest chunk the reader takes from a connection in one read (and at most
// a node block): a read costs a system call and a turn of queue_lock, and a
// stream of line-sized messages fills it many messages at a time.
constexpr int READ_MAX = 16384;
// Node block size when debug.TQ.buffersize is unset or unusable.
constexpr int DEFAULT_CAPACITY = 65535;
// Largest node block we accept from debug.TQ.buffersize; bigger values only
// waste memory on a phone, since the writer's system calls are already few.
constexpr int MAX_CAPACITY = 1 << 20;

struct LogBuffer {
    char* buf;        // block of `cap` bytes, owned by the node
    int len;          // bytes used in buf, 0..cap
    int cap;          // block size at allocation; a node never outgrows it
    LogBuffer* next;  // next node of the same list, or null
};

// Chunks of one log type in one queue, oldest first.
struct BufferList {
    LogBuffer* head;  // null when empty
    LogBuffer* tail;  // null exactly when head is null
    int bytes;        // sum of len over the nodes
};

struct TransistQueue {
    int total;  // bytes of all five lists together
    BufferList lists[LOG_TYPE_COUNT];
};

constexpr int QUEUE_COUNT = 3;

// The three queues, made empty at process start and reused by every run.
extern TransistQueue transist_queues[QUEUE_COUNT];

// Role pointers, guarded by queue_lock (as is the content of the fill queue;
// the drain queue belongs to the writer alone between two rotations).
extern TransistQueue* fill_queue;
extern TransistQueue* drain_queue;
extern TransistQueue* spare_queue;
extern pthread_mutex_t queue_lock;

// Appends one chunk of n bytes (1..capacity) to q's list of type: into the tail
// node when tail.len + n <= its block size, else into a new node of `capacity`
// bytes. A chunk is never split. Returns 1 when appended, 0 when the node could
// not be allocated (nothing copied, chunk dropped; errno from malloc), -1 for a
// bad type or size. The caller holds queue_lock when q is shared.
int queue_append(TransistQueue* q, int type, const char* data, int n, int capacity);

// Unlinks and frees the first node of list, keeping bytes, head and tail right.
// Freed nodes are kept for reuse (see node_pool_trim).
void release_head(BufferList* list);

// Released nodes wait here for the reader's next allocations, up to this many
// bytes: handing 64 KB blocks back to the system and faulting them in again
// costs the transist more than moving the log data itself.
constexpr int NODE_POOL_MAX_BYTES = 8 << 20;

// Frees pooled nodes beyond keep_bytes (the writer keeps what its last cycle
// needed, so a burst's memory goes back once the burst is over).
void node_pool_trim(int keep_bytes);

// Bytes held by pooled nodes.
int node_pool_bytes();

// Frees every node of q; returns the byte count it held (its total).
int queue_clear(TransistQueue* q);

// The writer's role rotation: drain -> spare, fill -> drain, spare -> fill.
// Caller holds queue_lock.
void rotate_queue_roles();

// First queue fill, second spare, third drain (each run's start).
void reset_queue_roles();
