// The transist end to end: clients on the real "log_socket", both threads, files in /data.
#include "transist/transist.h"

#include <poll.h>
#include <sys/socket.h>

#include <cutils/sockets.h>

#include <thread>

#include "core/log_controller.h"
#include "test_util.h"
#include "transist/log_files.h"
#include "transist/transist_queue.h"
#include "transist/transist_state.h"
#include "transist/transist_writer.h"
#include "storage/storage_check.h"

namespace {

const char kRun[] = "/data/run/";
const std::string kHeader = "-----timezone: GMT\n";
const char* const kNames[] = {"main_log", "radio_log", "events_log", "kernel_log", "bt_log"};

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

// The peer closed our connection within ms: end of stream, or a reset when it
// closed with our bytes still unread.
bool closed_by_peer(int fd, int ms) {
    struct pollfd p = {fd, POLLIN, 0};
    if (poll(&p, 1, ms) <= 0) return false;
    char c;
    ssize_t n = recv(fd, &c, 1, MSG_DONTWAIT);
    return n == 0 || (n < 0 && errno == ECONNRESET);
}

class TransistTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_EQ(system("rm -rf /data/run /data/misc/tqlog/tqlog_history"), 0);
        ASSERT_EQ(property_set("debug.TQ.interval", "1"), 0);
        mkdir(kRun, 0770);
        controller_ = new LogController();  // like the daemon's, never destroyed
        controller_->android_log = controller_->kernel_log = controller_->bt_log = 1;
        controller_->log_path_state = 0;  // a run in /data: the writer checks "/data"
    }
    void TearDown() override {
        if (running_) stop();
    }
    void start(int rotate_kb = 1024) {
        transist_create(controller_, kRun, rotate_kb);
        running_ = true;
    }
    // The controller's stop sequence once the collectors have ended; returns
    // how long it took in milliseconds.
    int64_t stop() {
        int64_t t0 = monotonic_us();
        stop_requested = true;
        transist_wake();
        void* value = nullptr;
        EXPECT_EQ(pthread_join(read_thread_id, &value), 0);
        read_exit_ = static_cast<int>(reinterpret_cast<intptr_t>(value));
        EXPECT_EQ(pthread_join(write_thread_id, &value), 0);
        write_exit_ = static_cast<int>(reinterpret_cast<intptr_t>(value));
        stop_requested = false;
        running_ = false;
        return (monotonic_us() - t0) / 1000;
    }
    std::string log(const char* name) { return read_file(std::string(kRun) + name); }

    LogController* controller_ = nullptr;
    bool running_ = false;
    int read_exit_ = 0, write_exit_ = 0;
};

TEST_F(TransistTest, EveryByteSentBeforeTheStopIsInTheFile) {
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
    int64_t ms = stop();
    EXPECT_TRUE(log("kernel_log") == kHeader + data);
    EXPECT_TRUE(log("main_log") == kHeader + tail);
    EXPECT_EQ(log("bt_log"), kHeader);
    EXPECT_EQ(read_exit_, 1);
    EXPECT_EQ(write_exit_, 2);
    EXPECT_LT(ms, 500);
    EXPECT_TRUE(history_has("buffer:65535B; throughput:2MB/s; interval: 1s"));
    EXPECT_TRUE(history_has("create read/write thread success"));
    for (const LogFile& entry : log_files) EXPECT_TRUE(entry.fd == -1 && entry.sock == -1);
}

TEST_F(TransistTest, StopDoesNotWaitForTheIntervalOrTheSelectTimeout) {
    ASSERT_EQ(property_set("debug.TQ.interval", "5"), 0);
    start();
    EXPECT_TRUE(wait_for([] { return has_thread("tavlo.reader") && has_thread("tavlo.writer"); }, 2000));
    usleep(50000);  // both threads are now waiting
    EXPECT_LT(stop(), 300);
    EXPECT_EQ(write_exit_, 2);
    EXPECT_TRUE(history_has("interval: 5s"));
}

TEST_F(TransistTest, FiveConcurrentStreamsStayInOrderAcrossRotations) {
    start(100);  // rotate past 100K: each type spans several generations
    const char letters[] = "MREKB";
    std::vector<std::string> sent;
    std::vector<std::thread> clients;
    for (int i = 0; i < 5; i++) sent.push_back(numbered_lines(letters[i], 300000));
    // Odd piece sizes make chunk boundaries fall anywhere in a line.
    for (int i = 0; i < 5; i++) clients.emplace_back(stream_log, letters[i], sent[i], 1000 + 377 * i);
    for (std::thread& t : clients) t.join();
    stop();
    for (int i = 0; i < 5; i++) {
        std::string joined;
        int files = 0;
        for (int gen = 4; gen >= 0; gen--) {
            std::string path = std::string(kRun) + kNames[i] + (gen > 0 ? "." + std::to_string(gen) : "");
            if (!exists(path)) continue;
            files++;
            std::string content = read_file(path);
            ASSERT_EQ(content.compare(0, kHeader.size(), kHeader), 0) << path;
            std::string body = content.substr(kHeader.size());
            if (gen > 0) {  // a file rotates after the node that passes the limit
                EXPECT_GE(body.size(), 101u * 1024) << path;
                EXPECT_LE(body.size(), 101u * 1024 + 65535) << path;
            }
            joined += body;
        }
        EXPECT_GE(files, 2) << kNames[i];
        EXPECT_TRUE(joined == sent[i]) << kNames[i] << ": " << joined.size() << " of " << sent[i].size() << " bytes";
    }
}

TEST_F(TransistTest, SilentConnectionDoesNotHoldUpOtherTypesAndIsClosedAfterFiveSeconds) {
    start();
    int silent = connect_log_socket();
    int64_t t0 = monotonic_us();
    int kernel = connect_log_socket("Khello from the kernel\n");
    // The writer's next cycle (1 s) writes it while the silent client waits.
    EXPECT_TRUE(wait_for([&] { return log("kernel_log") == kHeader + "hello from the kernel\n"; }, 3000));
    EXPECT_FALSE(closed_by_peer(silent, 0));
    EXPECT_TRUE(closed_by_peer(silent, 8000));
    EXPECT_GE((monotonic_us() - t0) / 1000, 4500);
    EXPECT_TRUE(history_has("new client sent no log type in 5000 ms, closed"));
    close(kernel);
    close(silent);
}

TEST_F(TransistTest, UnknownLogTypeIsClosedAndItsDataIgnored) {
    start();
    for (std::string first : {std::string("X"), std::string(1, '\0'), std::string("\xff")}) {
        int fd = connect_log_socket(first + "not a log\n");
        EXPECT_TRUE(closed_by_peer(fd, 2000));
        close(fd);
    }
    stop();
    for (const char* hex : {"0x58", "0x00", "0xff"})
        EXPECT_TRUE(history_has(std::string("unknown log type ") + hex + " from new client, closed")) << hex;
    for (const char* name : kNames) EXPECT_EQ(log(name), kHeader) << name;
}

TEST_F(TransistTest, LaterConnectionOfATypeTakesOverAfterTheEarlierOnesData) {
    start();
    int first = connect_log_socket("Mfirst stream\n");
    int second = connect_log_socket("Msecond stream\n");
    EXPECT_TRUE(closed_by_peer(first, 2000));
    close(first);
    close(second);
    stop();
    EXPECT_EQ(log("main_log"), kHeader + "first stream\nsecond stream\n");
    EXPECT_TRUE(history_has("main_log connection replaced by a new one"));
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

TEST_F(TransistTest, CollectorEndIsRecordedAndTheTypeCanReconnect) {
    start();
    stream_log('R', "one\n");
    ASSERT_TRUE(wait_for([] { return history_has("handle log message failed in fd of radio_log."); }, 2000));
    EXPECT_TRUE(history_has("receive an empty message from socket"));
    stream_log('R', "two\n");
    stop();
    EXPECT_EQ(log("radio_log"), kHeader + "one\ntwo\n");
}

TEST_F(TransistTest, DataOfATypeWithoutFileIsDropped) {
    controller_->android_log = 0;
    controller_->bt_log = 0;
    start();
    stream_log('M', "nobody writes this\n");
    stream_log('K', "kept\n");
    stop();
    EXPECT_FALSE(exists("/data/run/main_log"));
    EXPECT_EQ(log("kernel_log"), kHeader + "kept\n");
    EXPECT_TRUE(history_has("no writable main_log file, its data is dropped"));
    for (const TransistQueue& q : transist_queues) EXPECT_EQ(q.total, 0);
}

// (Clients hearing "log_folder_lost" is the integration tests' business.)
TEST_F(TransistTest, RemovedFolderIsReportedAsLogFolderLost) {
    start();
    ASSERT_EQ(system("rm -rf /data/run"), 0);
    int fd = connect_log_socket("Klost line\n");
    struct pollfd p = {efd_thread, POLLIN, 0};
    ASSERT_EQ(poll(&p, 1, 3000), 1);
    uint64_t value = 0;
    ASSERT_EQ(read(efd_thread, &value, sizeof(value)), 8);
    EXPECT_EQ(value % EVENT_FOLDER_LOST, 0u);  // one or more notifications
    EXPECT_TRUE(history_has("log files /data/run/kernel_log not exist:2"));
    close(fd);
    stop();
    // The stop notifies nobody and skips the gone file; the next run discards the unwritten bytes.
    EXPECT_EQ(read(efd_thread, &value, sizeof(value)), -1);
    EXPECT_FALSE(history_has("no space to write log"));
    mkdir(kRun, 0770);
    start();
    EXPECT_TRUE(history_has("delete transist queue:"));
    for (const TransistQueue& q : transist_queues) EXPECT_EQ(q.total, 0);
}

TEST_F(TransistTest, SquattedSocketNameIsReportedAndTheRunStillStops) {
    int squatter = socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    ASSERT_GE(squatter, 0);
    start();
    EXPECT_LT(stop(), 300);
    EXPECT_EQ(read_exit_, 1);
    EXPECT_EQ(write_exit_, 2);
    EXPECT_TRUE(history_has("create log reader socket failed (Address already in use), errno = 98"));
    EXPECT_TRUE(history_has("log_socket is held by another process"));
    close(squatter);
}

TEST_F(TransistTest, BurstFasterThanTheIntervalIsWrittenEarlyWithBoundedMemory) {
    ASSERT_EQ(property_set("debug.TQ.interval", "1000"), 0);
    start(1 << 20);
    std::string data = numbered_lines('K', 24 << 20);
    std::thread client(stream_log, 'K', data, 65536);
    int peak = 0;
    // Without the early cycle nothing would reach the file for 1000 s.
    EXPECT_TRUE(wait_for(
        [&] {
            pthread_mutex_lock(&queue_lock);
            peak = std::max(peak, fill_queue->total);
            pthread_mutex_unlock(&queue_lock);
            struct stat st;
            return stat("/data/run/kernel_log", &st) == 0 && st.st_size > (16 << 20);
        },
        10000));
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
    transist_controller = controller_;  // as a run's start sets it
    rotate_limit_kb = 1 << 20;          // one file holds it all
    open_output_files(controller_, kRun);
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

std::string checked_path;
int probe_result = 0;
int fake_probe(const char* path) {
    checked_path = path;
    return probe_result;
}

// The writer checks "/data" for a run in a holding folder, else the log path.
TEST(StorageGate, LowStorageNotifiesAndHoldsTheQueues) {
    const struct {
        int log_path_state, low;
        const char* checked;
    } cases[] = {{0, 1, "/data"}, {1, 1, "/mnt/sdcard"}, {-1, 0, "/mnt/sdcard"}, {0, 0, "/data"}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.log_path_state);
        unlink(kHistory);
        LogController controller;
        strcpy(controller.logpath, "/mnt/sdcard");
        controller.log_path_state = c.log_path_state;
        int pair[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
        controller.clients[3].fd = pair[0];
        probe_result = c.low;
        EXPECT_EQ(writer_storage_blocked(&controller, fake_probe, true), c.low);
        EXPECT_EQ(checked_path, c.checked);
        char reply[32] = {};
        uint64_t value = 0;
        EXPECT_EQ(recv(pair[1], reply, sizeof(reply) - 1, MSG_DONTWAIT), c.low ? 12 : -1);
        EXPECT_STREQ(reply, c.low ? "storage_full" : "");
        EXPECT_EQ(read(efd_thread, &value, sizeof(value)), c.low ? 8 : -1);
        EXPECT_EQ(value, c.low ? EVENT_STORAGE_LOW : 0);
        EXPECT_EQ(history_has("no space to write log"), c.low == 1);
        // Without notification (the stop's own check) only the record is written.
        EXPECT_EQ(writer_storage_blocked(&controller, fake_probe, false), c.low);
        EXPECT_EQ(recv(pair[1], reply, sizeof(reply) - 1, MSG_DONTWAIT), -1);
        EXPECT_EQ(read(efd_thread, &value, sizeof(value)), -1);
        controller.clients[3].fd = -1;
        close(pair[0]);
        close(pair[1]);
    }
}

}  // namespace
