// The transist's queues: the placement rule (a chunk goes whole into the tail
// node when it fits, else into a new node), node release, the role rotation and
// the tuning values that size the nodes and pace the writer.
#include "transist/transist_queue.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <string>
#include <vector>

#include "transist/transist_state.h"

namespace {

// Node lengths of one list, head first, with the list's byte count checked.
std::vector<int> node_lengths(const BufferList& list) {
    std::vector<int> out;
    int sum = 0;
    const LogBuffer* last = nullptr;
    for (const LogBuffer* n = list.head; n != nullptr; n = n->next) {
        out.push_back(n->len);
        sum += n->len;
        last = n;
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

struct PlacementCase {
    const char* name;
    int capacity;
    std::vector<int> chunks;
    std::vector<int> nodes;
};

class PlacementTest : public ::testing::TestWithParam<PlacementCase> {
  protected:
    void TearDown() override { queue_clear(&q_); }
    TransistQueue q_ = {};
};

TEST_P(PlacementTest, ChunksLandWholeInTheExpectedNodes) {
    const PlacementCase& c = GetParam();
    std::string sent;
    char next = 'a';
    for (int n : c.chunks) {
        std::string chunk(static_cast<size_t>(n), next);
        next = next == 'z' ? 'a' : static_cast<char>(next + 1);
        ASSERT_EQ(queue_append(&q_, LOG_KERNEL, chunk.data(), n, c.capacity), 1);
        sent += chunk;
    }
    EXPECT_EQ(node_lengths(q_.lists[LOG_KERNEL]), c.nodes);
    EXPECT_EQ(list_content(q_.lists[LOG_KERNEL]), sent);
    EXPECT_EQ(q_.total, static_cast<int>(sent.size()));
    for (int type = 0; type < LOG_TYPE_COUNT; type++) {
        if (type != LOG_KERNEL) {
            EXPECT_EQ(q_.lists[type].head, nullptr);
        }
    }
}

INSTANTIATE_TEST_SUITE_P(
    Queue, PlacementTest,
    ::testing::Values(
        PlacementCase{"ExactFitGoesIntoTail", 8192, {4096, 4096}, {8192}},
        PlacementCase{"OneByteTooManyStartsNode", 8192, {4096, 4097}, {4096, 4097}},
        PlacementCase{"AlmostEmptyTailStillStartsNode", 4095, {1, 4095}, {1, 4095}},
        PlacementCase{"TenThousandBytesInOneWrite", 65535, {4095, 4095, 1810}, {10000}},
        PlacementCase{"SixteenFullChunksFillOneNode", 65535,
                      std::vector<int>(17, 4095), {65520, 4095}},
        PlacementCase{"SmallChunksPackTightly", 10, {3, 3, 3, 1, 3}, {10, 3}}),
    [](const ::testing::TestParamInfo<PlacementCase>& info) { return info.param.name; });

TEST(QueueAppend, RefusesWhatCannotBePlaced) {
    TransistQueue q = {};
    char data[16] = {};
    EXPECT_EQ(queue_append(&q, LOG_TYPE_COUNT, data, 4, 4095), -1);
    EXPECT_EQ(queue_append(&q, -1, data, 4, 4095), -1);
    EXPECT_EQ(queue_append(&q, LOG_MAIN, data, 0, 4095), -1);
    EXPECT_EQ(queue_append(&q, LOG_MAIN, data, 16, 8), -1);  // larger than a node
    EXPECT_EQ(q.total, 0);
    EXPECT_EQ(q.lists[LOG_MAIN].head, nullptr);
}

TEST(QueueAppend, TypesKeepSeparateLists) {
    TransistQueue q = {};
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "main", 4, 4095), 1);
    ASSERT_EQ(queue_append(&q, LOG_BT, "bt", 2, 4095), 1);
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "+", 1, 4095), 1);
    EXPECT_EQ(list_content(q.lists[LOG_MAIN]), "main+");
    EXPECT_EQ(list_content(q.lists[LOG_BT]), "bt");
    EXPECT_EQ(q.total, 7);
    EXPECT_EQ(queue_clear(&q), 7);
    EXPECT_EQ(q.total, 0);
    for (const BufferList& list : q.lists) {
        EXPECT_EQ(list.head, nullptr);
        EXPECT_EQ(list.tail, nullptr);
        EXPECT_EQ(list.bytes, 0);
    }
}

TEST(QueueAppend, FailedAllocationDropsTheChunkAndCopiesNothing) {
#if defined(__SANITIZE_ADDRESS__)
    GTEST_SKIP() << "an address-space limit breaks the sanitizer's shadow memory";
#else
    node_pool_trim(0);
    TransistQueue q = {};
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "kept", 4, 4095), 1);
    struct rlimit old_limit;
    ASSERT_EQ(getrlimit(RLIMIT_AS, &old_limit), 0);
    struct rlimit low = old_limit;
    low.rlim_cur = 1ul << 30;  // far below what a 1.5 GB node needs on top
    ASSERT_EQ(setrlimit(RLIMIT_AS, &low), 0);
    const int huge = 1536 << 20;
    errno = 0;
    int rc = queue_append(&q, LOG_KERNEL, "lost", 4, huge);
    int err = errno;
    setrlimit(RLIMIT_AS, &old_limit);
    EXPECT_EQ(rc, 0);
    EXPECT_EQ(err, ENOMEM);
    EXPECT_EQ(q.lists[LOG_KERNEL].head, nullptr);
    EXPECT_EQ(q.total, 4);
    EXPECT_EQ(list_content(q.lists[LOG_MAIN]), "kept");
    queue_clear(&q);
#endif
}

TEST(ReleaseHead, UnlinksOldestAndKeepsCountsRight) {
    TransistQueue q = {};
    BufferList* list = &q.lists[LOG_RADIO];
    ASSERT_EQ(queue_append(&q, LOG_RADIO, "aaaa", 4, 4), 1);
    ASSERT_EQ(queue_append(&q, LOG_RADIO, "bbb", 3, 4), 1);
    ASSERT_EQ(queue_append(&q, LOG_RADIO, "cc", 2, 4), 1);
    ASSERT_EQ(node_lengths(*list), (std::vector<int>{4, 3, 2}));

    release_head(list);
    EXPECT_EQ(node_lengths(*list), (std::vector<int>{3, 2}));
    EXPECT_EQ(list_content(*list), "bbbcc");
    release_head(list);
    release_head(list);
    EXPECT_EQ(list->head, nullptr);
    EXPECT_EQ(list->tail, nullptr);  // the last node was the tail
    EXPECT_EQ(list->bytes, 0);
    release_head(list);  // empty: nothing happens
    EXPECT_EQ(list->head, nullptr);

    // An emptied list takes chunks again from a fresh node.
    ASSERT_EQ(queue_append(&q, LOG_RADIO, "d", 1, 4), 1);
    EXPECT_EQ(list_content(*list), "d");
    queue_clear(&q);
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

    // A pooled node of another size is not handed out for this one.
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "abc", 3, 8192), 1);
    EXPECT_EQ(q.lists[LOG_MAIN].head->cap, 8192);
    queue_clear(&q);
    node_pool_trim(0);
    EXPECT_EQ(node_pool_bytes(), 0);

    // However many nodes a burst released, the pool keeps at most its cap.
    std::string chunk(65535, 'n');
    for (int i = 0; i < 200; i++) {
        ASSERT_EQ(queue_append(&q, LOG_BT, chunk.data(), 65535, 65535), 1);
    }
    queue_clear(&q);
    EXPECT_LE(node_pool_bytes(), NODE_POOL_MAX_BYTES);
    EXPECT_GT(node_pool_bytes(), NODE_POOL_MAX_BYTES - 65535);
    node_pool_trim(3 * 65535);
    EXPECT_EQ(node_pool_bytes(), 3 * 65535);
    node_pool_trim(0);
}

TEST(QueueRoles, RotationCyclesFillDrainSpare) {
    reset_queue_roles();
    TransistQueue* first = &transist_queues[0];
    TransistQueue* second = &transist_queues[1];
    TransistQueue* third = &transist_queues[2];
    EXPECT_EQ(fill_queue, first);
    EXPECT_EQ(spare_queue, second);
    EXPECT_EQ(drain_queue, third);

    rotate_queue_roles();  // what was filled is drained; the spare takes new data
    EXPECT_EQ(drain_queue, first);
    EXPECT_EQ(fill_queue, second);
    EXPECT_EQ(spare_queue, third);
    rotate_queue_roles();
    rotate_queue_roles();
    EXPECT_EQ(fill_queue, first);
    EXPECT_EQ(spare_queue, second);
    EXPECT_EQ(drain_queue, third);
}

struct TuningCase {
    const char* value;
    int capacity;
    int interval;
};

class TuningTest : public ::testing::TestWithParam<TuningCase> {};

TEST_P(TuningTest, UnusableValuesFallBackOrAreCapped) {
    EXPECT_EQ(choose_capacity(GetParam().value), GetParam().capacity) << GetParam().value;
    EXPECT_EQ(choose_interval(GetParam().value), GetParam().interval) << GetParam().value;
}

INSTANTIATE_TEST_SUITE_P(Tuning, TuningTest,
                         ::testing::Values(TuningCase{"65535", 65535, 2147},
                                           TuningCase{"4095", 4095, 2147},
                                           TuningCase{"4094", 65535, 2147},
                                           TuningCase{"5", 65535, 5},
                                           TuningCase{"1", 65535, 1},
                                           TuningCase{"0", 65535, 1},
                                           TuningCase{"-3", 65535, 1},
                                           TuningCase{"", 65535, 1},
                                           TuningCase{"abc", 65535, 1},
                                           TuningCase{"12kb", 65535, 1},
                                           TuningCase{"99999999999999999999", 65535, 1},
                                           TuningCase{"2000000", 1048576, 2147},
                                           TuningCase{" 8192 ", 8192, 2147}),
                         [](const ::testing::TestParamInfo<TuningCase>& info) {
                             return "Value" + std::to_string(info.index);
                         });

TEST(PrintableCopy, ShowsControlAndBinaryBytesAsQuestionMarks) {
    char out[8];
    printable_copy(out, sizeof(out), "a\nb\x01\xff" "cdefgh");
    EXPECT_STREQ(out, "a?b??cd");
}

}  // namespace
