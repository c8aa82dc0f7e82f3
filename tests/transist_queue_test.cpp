// The transist's queues: chunk placement, node reuse and the tuning values.
#include "transist/transist_queue.h"

#include <sys/resource.h>

#include "test_util.h"
#include "transist/transist_state.h"

namespace {

// Node lengths of one list, head first, with tail and byte count checked.
std::vector<int> node_lengths(const BufferList& list) {
    std::vector<int> out;
    int sum = 0;
    const LogBuffer* last = nullptr;
    for (const LogBuffer* n = list.head; n != nullptr; last = n, n = n->next) {
        out.push_back(n->len);
        sum += n->len;
    }
    EXPECT_EQ(list.tail, last);
    EXPECT_EQ(list.bytes, sum);
    return out;
}

std::string list_content(const BufferList& list) {
    std::string out;
    for (const LogBuffer* n = list.head; n != nullptr; n = n->next) out.append(n->buf, n->len);
    return out;
}

TEST(QueueAppend, ChunksLandWholeInTheExpectedNodes) {
    const struct {
        int capacity;
        std::vector<int> chunks, nodes;
    } cases[] = {
        {8192, {4096, 4096}, {8192}},                        // an exact fit goes into the tail
        {8192, {4096, 4097}, {4096, 4097}},                  // one byte more starts a node
        {4095, {1, 4095}, {1, 4095}},                        // even after an almost empty tail
        {65535, {4095, 4095, 1810}, {10000}},                // 10000 bytes in one write
        {65535, std::vector<int>(17, 4095), {65520, 4095}},  // sixteen full chunks fill a node
        {10, {3, 3, 3, 1, 3}, {10, 3}},
    };
    for (const auto& c : cases) {
        TransistQueue q = {};
        std::string sent;
        for (int n : c.chunks) {
            std::string chunk(static_cast<size_t>(n), static_cast<char>('a' + sent.size() % 26));
            ASSERT_EQ(queue_append(&q, LOG_KERNEL, chunk.data(), n, c.capacity), 1);
            sent += chunk;
        }
        EXPECT_EQ(node_lengths(q.lists[LOG_KERNEL]), c.nodes);
        EXPECT_EQ(list_content(q.lists[LOG_KERNEL]), sent);
        EXPECT_EQ(q.total, static_cast<int>(sent.size()));
        for (int t = 0; t < LOG_TYPE_COUNT; t++) EXPECT_TRUE(t == LOG_KERNEL || q.lists[t].head == nullptr) << t;
        EXPECT_EQ(queue_clear(&q), static_cast<int>(sent.size()));
    }
}

TEST(QueueAppend, RefusesWhatCannotBePlaced) {
    TransistQueue q = {};
    char data[16] = {};
    const int rows[][3] = {{LOG_TYPE_COUNT, 4, 4095}, {-1, 4, 4095}, {LOG_MAIN, 0, 4095}, {LOG_MAIN, 16, 8}};
    for (const auto& r : rows) EXPECT_EQ(queue_append(&q, r[0], data, r[1], r[2]), -1) << r[0] << " " << r[1];
    EXPECT_EQ(q.total, 0);
    EXPECT_EQ(q.lists[LOG_MAIN].head, nullptr);
}

TEST(QueueAppend, FailedAllocationDropsTheChunkAndCopiesNothing) {
#if defined(__SANITIZE_ADDRESS__)
    GTEST_SKIP() << "an address-space limit breaks the sanitizer's shadow memory";
#else
    node_pool_trim(0);
    TransistQueue q = {};
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "kept", 4, 4095), 1);
    struct rlimit old_limit, low;
    ASSERT_EQ(getrlimit(RLIMIT_AS, &old_limit), 0);
    low = old_limit;
    low.rlim_cur = 1ul << 30;  // far below what a 1.5 GB node needs on top
    ASSERT_EQ(setrlimit(RLIMIT_AS, &low), 0);
    // qemu's user mode does not enforce the limit on the programs it runs.
    void* probe = mmap(nullptr, low.rlim_cur, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    int rc = probe == MAP_FAILED ? queue_append(&q, LOG_KERNEL, "lost", 4, 1536 << 20) : -2;
    if (probe != MAP_FAILED) munmap(probe, low.rlim_cur);
    setrlimit(RLIMIT_AS, &old_limit);
    if (rc == -2) GTEST_SKIP() << "the address-space limit is not enforced here";
    EXPECT_EQ(rc, 0);
    EXPECT_EQ(q.lists[LOG_KERNEL].head, nullptr);
    EXPECT_EQ(q.total, 4);
    EXPECT_EQ(list_content(q.lists[LOG_MAIN]), "kept");
    queue_clear(&q);
#endif
}

TEST(NodePool, ReleasedNodesAreReusedUpToTheCapAndTrimmed) {
    node_pool_trim(0);
    TransistQueue q = {};
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "abc", 3, 4095), 1);
    const LogBuffer* first = q.lists[LOG_MAIN].head;
    release_head(&q.lists[LOG_MAIN]);
    q.total = 0;
    EXPECT_EQ(node_pool_bytes(), 4095);
    ASSERT_EQ(queue_append(&q, LOG_KERNEL, "xy", 2, 4095), 1);
    EXPECT_EQ(q.lists[LOG_KERNEL].head, first);  // the same block, emptied
    EXPECT_EQ(list_content(q.lists[LOG_KERNEL]), "xy");
    EXPECT_EQ(node_pool_bytes(), 0);
    queue_clear(&q);
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "abc", 3, 8192), 1);
    EXPECT_EQ(q.lists[LOG_MAIN].head->cap, 8192) << "a pooled node of another size was handed out";
    queue_clear(&q);

    // However many nodes a burst released, the pool keeps at most its cap.
    node_pool_trim(0);
    std::string chunk(65535, 'n');
    for (int i = 0; i < 200; i++) ASSERT_EQ(queue_append(&q, LOG_BT, chunk.data(), 65535, 65535), 1);
    queue_clear(&q);
    EXPECT_LE(node_pool_bytes(), NODE_POOL_MAX_BYTES);
    EXPECT_GT(node_pool_bytes(), NODE_POOL_MAX_BYTES - 65535);
    node_pool_trim(3 * 65535);
    EXPECT_EQ(node_pool_bytes(), 3 * 65535);
    node_pool_trim(0);
}

TEST(Tuning, UnusableValuesFallBackOrAreCapped) {
    const struct {
        const char* value;
        int capacity, interval;
    } cases[] = {
        {"65535", 65535, 2147}, {"4095", 4095, 2147},     {"4094", 65535, 2147},  {"5", 65535, 5},
        {"0", 65535, 1},        {"-3", 65535, 1},         {"", 65535, 1},         {"12kb", 65535, 1},
        {"99999999999999999999", 65535, 1}, {"2000000", 1048576, 2147}, {" 8192 ", 8192, 2147},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(choose_capacity(c.value), c.capacity) << c.value;
        EXPECT_EQ(choose_interval(c.value), c.interval) << c.value;
    }
}

}  // namespace
