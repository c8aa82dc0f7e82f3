// The transist: its queues, and end to end with clients on "log_socket".
#include "transist/transist.h"

#include <poll.h>
#include <sys/socket.h>

#include <cutils/sockets.h>

#include <thread>

#include "storage/storage_check.h"
#include "test_util.h"
#include "transist/log_files.h"
#include "transist/transist_queue.h"
#include "transist/transist_state.h"
#include "transist/transist_writer.h"

namespace {

const char kRun[] = "/data/run/";
const std::string kHeader = "-----timezone: GMT\n";

void send_all(int fd, const std::string& data) {
    for (size_t done = 0; done < data.size();) {
        ssize_t n = send(fd, data.data() + done, data.size() - done, MSG_NOSIGNAL);
        ASSERT_GT(n, 0) << strerror(errno);
        done += static_cast<size_t>(n);
    }
}

// A connection to "log_socket" that has sent first (its log type and more).
int connect_log_socket(const std::string& first = "") {
    int fd = socket_local_client(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    EXPECT_GE(fd, 0);
    send_all(fd, first);
    return fd;
}

// A collector in miniature: connects, names its type, streams in pieces, ends.
void stream_log(char letter, const std::string& data, size_t piece = 0) {
    int fd = connect_log_socket(std::string(1, letter));
    if (piece == 0) piece = data.size();
    for (size_t at = 0; at < data.size(); at += piece) send_all(fd, data.substr(at, piece));
    close(fd);
}

// Numbered lines, so that a lost, doubled or moved line shows.
std::string numbered_lines(char tag, size_t bytes) {
    std::string out;
    for (int seq = 0; out.size() < bytes; seq++) out += std::string(1, tag) + " line " + std::to_string(seq) + " of the stream\n";
    return out;
}

// The peer closed our connection within ms (end of stream, or a reset).
bool closed_by_peer(int fd, int ms) {
    struct pollfd p = {fd, POLLIN, 0};
    if (poll(&p, 1, ms) <= 0) return false;
    char c;
    ssize_t n = recv(fd, &c, 1, MSG_DONTWAIT);
    return n == 0 || (n < 0 && errno == ECONNRESET);
}

// The host a run's controller is, for a run held in /data: the writer checks "/data".
struct FakeHost : TransistHost {
    const char* space_root() const override { return "/data"; }
    void writer_gave_up(const char*, uint64_t) override {}
    int flush_records() override { return transist_records_flush(); }
};

class TransistTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(system("rm -rf /data/run /data/misc/tqlog/tqlog_history"), 0);
        ASSERT_EQ(property_set("debug.TQ.interval", "1"), 0);
        mkdir(kRun, 0770);
    }
    void TearDown() override {
        if (running_) stop();
    }
    void start(int rotate_kb = 1024) {
        run_.rotate_kb = rotate_kb;
        transist_create(&host_, run_);
        running_ = true;
    }
    // The controller's stop sequence once the collectors have ended.
    void stop() {
        stop_requested = true;
        transist_wake();
        void* value = nullptr;
        EXPECT_EQ(pthread_join(read_thread_id, &value), 0);
        EXPECT_EQ(reinterpret_cast<intptr_t>(value), 1);
        EXPECT_EQ(pthread_join(write_thread_id, &value), 0);
        EXPECT_EQ(reinterpret_cast<intptr_t>(value), 2);
        stop_requested = false;
        running_ = false;
    }
    std::string log(const char* name) { return read_file(std::string(kRun) + name); }

    FakeHost host_;
    TransistRun run_ = {kRun, "", {true, true, true, true, true}, 1024};
    bool running_ = false;
};

// With the default node size and with the smallest one accepted, which is
// below what the reader takes in one read.
TEST_F(TransistTest, EveryByteSentBeforeTheStopIsInTheFile) {
    for (const char* node_size : {"65535", "4095"}) {
        SCOPED_TRACE(node_size);
        ASSERT_EQ(property_set("debug.TQ.buffersize", node_size), 0);
        ASSERT_EQ(system("rm -rf /data/run && mkdir /data/run"), 0);
        start();
        std::string data;
        for (int i = 0; i < 1 << 20; i++) data += static_cast<char>((i * 7 + i / 251) & 0xff);
        stream_log('K', data);
        // The reader cannot queue a chunk now, so these bytes are still in the
        // socket when the stop begins: the stop itself must collect them.
        pthread_mutex_lock(&queue_lock);
        std::string tail = numbered_lines('M', 32768);
        stream_log('M', tail);
        stop_requested = true;
        pthread_mutex_unlock(&queue_lock);
        stop();
        EXPECT_TRUE(log("kernel_log") == kHeader + data);
        EXPECT_TRUE(log("main_log") == kHeader + tail);
        EXPECT_EQ(log("bt_log"), kHeader);
        for (const LogFile& entry : log_files) EXPECT_TRUE(entry.fd == -1 && entry.sock == -1);
    }
    ASSERT_EQ(property_set("debug.TQ.buffersize", ""), 0);
}

// A connection without a log type holds up only the connections accepted after it (they may be
// of its type), never one already registered; after five seconds it is closed, the later ones go on.
TEST_F(TransistTest, SilentConnectionHoldsUpOnlyLaterOnesUntilItIsClosed) {
    start();
    int kernel = connect_log_socket("Kbefore\n");
    EXPECT_TRUE(wait_for([&] { return log("kernel_log") == kHeader + "before\n"; }, 3000));
    int silent = connect_log_socket();
    int radio = connect_log_socket("Rafter\n");
    send_all(kernel, "during\n");
    EXPECT_TRUE(wait_for([&] { return log("kernel_log") == kHeader + "before\nduring\n"; }, 3000));
    EXPECT_TRUE(log("radio_log") == kHeader || closed_by_peer(silent, 0)) << "read before the silent one ended";
    EXPECT_TRUE(closed_by_peer(silent, 8000));
    EXPECT_TRUE(wait_for([&] { return log("radio_log") == kHeader + "after\n"; }, 3000));
    for (int fd : {kernel, radio, silent}) close(fd);
}

// Also when the earlier connection's letter arrives after the later one's.
TEST_F(TransistTest, LaterConnectionOfATypeTakesOverAfterTheEarlierOnesData) {
    start();
    int first = connect_log_socket();
    usleep(50000);  // accepted without its letter
    int second = connect_log_socket("Msecond stream\n");
    usleep(50000);  // accepted with it
    send_all(first, "Mfirst stream\n");
    EXPECT_TRUE(closed_by_peer(first, 2000));
    close(first);
    close(second);
    stop();
    EXPECT_EQ(log("main_log"), kHeader + "first stream\nsecond stream\n");
}

// Only the daemon's own processes may feed "log_socket": another process is
// closed at once, never displaces a collector and lands nothing in a file.
TEST_F(TransistTest, ConnectionsOfOtherProcessesAreRefused) {
    start();
    int collector = connect_log_socket("Kreal\n");
    pid_t child = fork();
    if (child == 0) {
        if (fork() == 0) {  // a grandchild: no child of this "daemon" once its parent is gone
            while (getppid() != 1) usleep(1000);
            int fd = connect_log_socket("Kforged\n");
            _exit(closed_by_peer(fd, 5000) ? 0 : 1);
        }
        _exit(0);
    }
    ASSERT_TRUE(exits_with(child, 0));
    ASSERT_TRUE(wait_for([] { return history_has("refuse log_socket client uid 0 pid "); }, 5000));
    send_all(collector, "still real\n");
    close(collector);
    stop();
    EXPECT_EQ(log("kernel_log"), kHeader + "real\nstill real\n");
}

// A type whose collector ended can connect again; a type without a file is dropped.
TEST_F(TransistTest, EndedTypesReconnectAndTypesWithoutFileAreDropped) {
    run_.enabled[LOG_MAIN] = run_.enabled[LOG_RADIO] = run_.enabled[LOG_EVENTS] = false;
    start();
    stream_log('K', "one\n");
    ASSERT_TRUE(wait_for([] { return history_has("handle log message failed in fd of kernel_log."); }, 2000));
    stream_log('K', "two\n");
    stream_log('M', "nobody writes this\n");
    stop();
    EXPECT_EQ(log("kernel_log"), kHeader + "one\ntwo\n");
    EXPECT_FALSE(exists("/data/run/main_log"));
    for (const TransistQueue& q : transist_queues) EXPECT_EQ(q.total, 0);
}

TEST_F(TransistTest, SquattedSocketNameIsReportedAndTheRunStillStops) {
    int squatter = socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    ASSERT_GE(squatter, 0);
    start();
    stop();
    EXPECT_TRUE(history_has("log_socket is held by another process"));
    close(squatter);
}

// With nothing to write the writer sleeps without a clock; the first data
// after that wakes it.
TEST_F(TransistTest, IdleWriterIsWokenByData) {
    start();
    int kernel = connect_log_socket("Kone\n");
    auto idle = [] {
        pthread_mutex_lock(&queue_lock);
        bool asleep = writer_idle;
        pthread_mutex_unlock(&queue_lock);
        return asleep;
    };
    EXPECT_TRUE(wait_for(idle, 5000));
    EXPECT_EQ(log("kernel_log"), kHeader + "one\n");
    send_all(kernel, "two\n");
    EXPECT_TRUE(wait_for([&] { return log("kernel_log") == kHeader + "one\ntwo\n"; }, 3000));
    close(kernel);
}

// With a 1000 s interval nothing would reach the file without the early cycle,
// and the stop must not wait for the interval either.
TEST_F(TransistTest, BurstFasterThanTheIntervalIsWrittenEarlyWithBoundedMemory) {
    ASSERT_EQ(property_set("debug.TQ.interval", "1000"), 0);
    start(1 << 20);
    std::string data = numbered_lines('K', 24 << 20);
    std::thread client(stream_log, 'K', data, 65536);
    int peak = 0;
    EXPECT_TRUE(wait_for([&] {
        pthread_mutex_lock(&queue_lock);
        peak = std::max(peak, fill_queue->total);
        pthread_mutex_unlock(&queue_lock);
        struct stat st;
        return stat("/data/run/kernel_log", &st) == 0 && st.st_size > (16 << 20);
    }, 10000));
    client.join();
    EXPECT_LE(peak, QUEUE_HIGH_WATER + 65535);
    stop();
    EXPECT_TRUE(log("kernel_log") == kHeader + data);
}

// An 11 MiB card: its free space shrinks as kernel_log grows.
uint64_t small_card_free(const char*) {
    struct stat st;
    return (11 << 20) - static_cast<uint64_t>(stat("/data/run/kernel_log", &st) == 0 ? st.st_size : 0);
}

// One cycle carrying 8 MB must stop at the 10 MiB reserve, not after it.
TEST_F(TransistTest, ReserveHoldsWhileACycleWrites) {
    writer_free_space = small_card_free;
    transist_host = &host_;  // as a run's start sets it
    rotate_limit_kb = 1 << 20;          // one file holds it all
    open_output_files(run_);
    TransistQueue q = {};
    std::string chunk(CHUNK_MAX, 'k');
    for (int i = 0; i < (8 << 20) / CHUNK_MAX; i++) ASSERT_EQ(queue_append(&q, LOG_KERNEL, chunk.data(), CHUNK_MAX, 65535), 1);
    pthread_mutex_lock(&file_table_lock);
    EXPECT_EQ(flush_one_queue(&q, false), FLUSH_STORAGE_LOW);
    close_all_log_files();
    pthread_mutex_unlock(&file_table_lock);
    EXPECT_GE(small_card_free("/data") + 65535, LOW_STORAGE_BYTES) << "below the reserve by more than a node";
    EXPECT_GT(q.total, 0) << "what did not fit stays queued";
    queue_clear(&q);
    writer_free_space = [](const char* path) { return get_free_space(path, 0); };
}

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

// Released nodes are handed out again only at their own size, and however
// many a burst released, the pool keeps at most its cap.
TEST(NodePool, ReusesNodesOfTheSameSizeUpToTheCap) {
    node_pool_trim(0);
    TransistQueue q = {};
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "abc", 3, 4095), 1);
    queue_clear(&q);
    ASSERT_EQ(queue_append(&q, LOG_MAIN, "abc", 3, 8192), 1);
    EXPECT_EQ(q.lists[LOG_MAIN].head->cap, 8192) << "a pooled node of another size was handed out";
    EXPECT_EQ(list_content(q.lists[LOG_MAIN]), "abc");
    queue_clear(&q);
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
    } cases[] = {{"4095", 4095, 2147}, {"4094", 65535, 2147}, {"5", 65535, 5},       {"0", 65535, 1},
                 {"-3", 65535, 1},     {"12kb", 65535, 1},    {"99999999999999999999", 65535, 1},
                 {"2000000", 1048576, 2147}, {" 8192 ", 8192, 2147}};
    for (const auto& c : cases) {
        EXPECT_EQ(choose_capacity(c.value), c.capacity) << c.value;
        EXPECT_EQ(choose_interval(c.value), c.interval) << c.value;
    }
}

}  // namespace
