// The transist end to end inside a throwaway phone: clients on the real
// "log_socket", both threads running, files in /data. Covers the no-loss stop,
// per-type order under concurrency and rotation, misbehaving connections, the
// folder-lost and storage-low notifications and the prompt stop.
#include "transist/transist.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cutils/sockets.h>

#include <algorithm>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "core/log_controller.h"
#include "platform/properties.h"
#include "transist/log_files.h"
#include "transist/transist_queue.h"
#include "transist/transist_state.h"
#include "transist/transist_writer.h"

namespace {

const char kHistory[] = "/data/misc/tqlog/tqlog_history";
const char kRun[] = "/data/run/";
const std::string kHeader = "-----timezone: GMT\n";

std::string read_file(const std::string& path) {
    std::string out;
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return "<missing>";
    char buf[65536];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) out.append(buf, static_cast<size_t>(n));
    close(fd);
    return out;
}

bool history_has(const std::string& text) {
    return read_file(kHistory).find(text) != std::string::npos;
}

// Polls cond every 10 ms for at most ms milliseconds.
bool wait_for(const std::function<bool()>& cond, int ms) {
    for (int waited = 0; waited < ms; waited += 10) {
        if (cond()) return true;
        usleep(10000);
    }
    return cond();
}

int connect_log_socket() {
    return socket_local_client(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
}

void send_all(int fd, const std::string& data) {
    size_t done = 0;
    while (done < data.size()) {
        ssize_t n = send(fd, data.data() + done, data.size() - done, MSG_NOSIGNAL);
        ASSERT_GT(n, 0) << strerror(errno);
        done += static_cast<size_t>(n);
    }
}

// A collector in miniature: connects, names its type, streams, ends.
void stream_log(char letter, const std::string& data, size_t piece = 0) {
    int fd = connect_log_socket();
    ASSERT_GE(fd, 0);
    send_all(fd, std::string(1, letter));
    if (piece == 0) piece = data.size();
    for (size_t at = 0; at < data.size(); at += piece) send_all(fd, data.substr(at, piece));
    close(fd);
}

// Numbered lines, so that a lost, doubled or moved line shows.
std::string numbered_lines(char tag, size_t bytes) {
    std::string out;
    for (int seq = 0; out.size() < bytes; seq++) {
        out += tag;
        out += " line " + std::to_string(seq) + " of the " + std::string(1, tag) + " stream\n";
    }
    return out;
}

// Peer closed our connection within ms: end of stream, or a reset when it
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
        // Each test normally has a phone of its own; this also lets the whole
        // binary run in one.
        ASSERT_EQ(system("rm -rf /data/run /data/misc/tqlog/tqlog_history"), 0);
        ASSERT_EQ(property_set("debug.TQ.interval", "1"), 0);
        mkdir(kRun, 0770);
        controller_ = new LogController();  // like the daemon's, never destroyed
        controller_->android_log = 1;
        controller_->kernel_log = 1;
        controller_->bt_log = 1;
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
    int read_exit_ = 0;
    int write_exit_ = 0;
};

TEST_F(TransistTest, EveryByteSentBeforeTheStopIsInTheFile) {
    start();
    std::string data;
    for (int i = 0; i < 1 << 20; i++) data += static_cast<char>((i * 7 + i / 251) & 0xff);
    stream_log('K', data);
    // No pause: the stop itself must collect what is still in the socket.
    int64_t ms = stop();
    EXPECT_EQ(log("kernel_log"), kHeader + data);
    EXPECT_EQ(log("main_log"), kHeader);
    EXPECT_EQ(read_exit_, 1);
    EXPECT_EQ(write_exit_, 2);
    EXPECT_LT(ms, 500);
    EXPECT_TRUE(history_has("buffer:65535B; throughput:2MB/s; interval: 1s"));
    EXPECT_TRUE(history_has("create read/write thread success"));
    for (const LogFile& entry : log_files) {
        EXPECT_EQ(entry.fd, -1);
        EXPECT_EQ(entry.sock, -1);
    }
}

TEST_F(TransistTest, TenThousandBytesInOneWriteLandInOneNode) {
    ASSERT_EQ(property_set("debug.TQ.interval", "100"), 0);  // keep the writer away
    start();
    std::string data = numbered_lines('K', 10000).substr(0, 10000);
    stream_log('K', data);
    ASSERT_TRUE(wait_for(
        [] {
            pthread_mutex_lock(&queue_lock);
            int total = fill_queue->total;
            pthread_mutex_unlock(&queue_lock);
            return total == 10000;
        },
        3000));
    const BufferList& list = fill_queue->lists[LOG_KERNEL];
    ASSERT_NE(list.head, nullptr);
    EXPECT_EQ(list.head, list.tail);
    EXPECT_EQ(std::string(list.head->buf, list.head->len), data);
    stop();
    EXPECT_EQ(log("kernel_log"), kHeader + data);
}

TEST_F(TransistTest, StopDoesNotWaitForTheIntervalOrTheSelectTimeout) {
    ASSERT_EQ(property_set("debug.TQ.interval", "5"), 0);
    start();
    usleep(50000);  // both threads are now waiting
    EXPECT_LT(stop(), 300);
    EXPECT_EQ(write_exit_, 2);
    EXPECT_TRUE(history_has("interval: 5s"));
}

std::vector<std::string> thread_names() {
    std::vector<std::string> names;
    DIR* d = opendir("/proc/self/task");
    if (d == nullptr) return names;
    while (dirent* e = readdir(d)) {
        if (e->d_name[0] == '.') continue;
        std::string comm = read_file(std::string("/proc/self/task/") + e->d_name + "/comm");
        names.push_back(comm.substr(0, comm.find('\n')));
    }
    closedir(d);
    return names;
}

bool has_thread(const char* name) {
    std::vector<std::string> names = thread_names();
    return std::find(names.begin(), names.end(), name) != names.end();
}

TEST_F(TransistTest, ThreadsAreNamed) {
    start();
    EXPECT_TRUE(wait_for([] { return has_thread("tavlo.reader"); }, 2000));
    EXPECT_TRUE(wait_for([] { return has_thread("tavlo.writer"); }, 2000));
}

TEST_F(TransistTest, FiveConcurrentStreamsStayInOrderAcrossRotations) {
    start(100);  // rotate past 100K: each type spans several generations
    const char letters[] = "MREKB";
    const char* names[] = {"main_log", "radio_log", "events_log", "kernel_log", "bt_log"};
    std::vector<std::string> sent;
    for (int i = 0; i < 5; i++) sent.push_back(numbered_lines(letters[i], 300000));
    std::vector<std::thread> clients;
    for (int i = 0; i < 5; i++) {
        // Odd piece sizes make chunk boundaries fall anywhere in a line.
        clients.emplace_back(stream_log, letters[i], sent[i], 1000 + 377 * i);
    }
    for (std::thread& t : clients) t.join();
    stop();
    for (int i = 0; i < 5; i++) {
        std::string joined;
        int files = 0;
        for (int gen = 4; gen >= 0; gen--) {
            std::string path = std::string(kRun) + names[i];
            if (gen > 0) path += "." + std::to_string(gen);
            std::string content = read_file(path);
            if (content == "<missing>") continue;
            files++;
            ASSERT_EQ(content.compare(0, kHeader.size(), kHeader), 0) << path;
            std::string body = content.substr(kHeader.size());
            if (gen > 0) {
                // A file rotates after the node that passes the limit.
                EXPECT_GE(body.size(), 101u * 1024) << path;
                EXPECT_LE(body.size(), 101u * 1024 + 65535) << path;
            }
            joined += body;
        }
        EXPECT_GE(files, 2) << names[i];
        EXPECT_TRUE(joined == sent[i]) << names[i] << ": " << joined.size() << " of "
                                       << sent[i].size() << " bytes, in order";
    }
}

TEST_F(TransistTest, SilentConnectionDoesNotHoldUpOtherTypes) {
    start();
    int silent = connect_log_socket();
    ASSERT_GE(silent, 0);
    int kernel = connect_log_socket();
    ASSERT_GE(kernel, 0);
    send_all(kernel, "Khello from the kernel\n");
    // The writer's next cycle (1 s) writes it while the silent client waits.
    EXPECT_TRUE(wait_for([&] { return log("kernel_log") == kHeader + "hello from the kernel\n"; },
                         3000));
    EXPECT_FALSE(closed_by_peer(silent, 0));
    close(kernel);
    close(silent);
}

TEST_F(TransistTest, ConnectionWithoutLogTypeIsClosedAfterFiveSeconds) {
    start();
    int silent = connect_log_socket();
    ASSERT_GE(silent, 0);
    int64_t t0 = monotonic_us();
    EXPECT_TRUE(closed_by_peer(silent, 8000));
    int64_t ms = (monotonic_us() - t0) / 1000;
    EXPECT_GE(ms, 4500);
    EXPECT_TRUE(history_has("new client sent no log type in 5000 ms, closed"));
    close(silent);
}

TEST_F(TransistTest, UnknownLogTypeIsClosedAndItsDataIgnored) {
    start();
    for (std::string first : {std::string("X"), std::string(1, '\0'), std::string("\xff")}) {
        int fd = connect_log_socket();
        ASSERT_GE(fd, 0);
        send_all(fd, first + "not a log\n");
        EXPECT_TRUE(closed_by_peer(fd, 2000));
        close(fd);
    }
    stop();
    EXPECT_TRUE(history_has("unknown log type 0x58 from new client, closed"));
    EXPECT_TRUE(history_has("unknown log type 0x00 from new client, closed"));
    EXPECT_TRUE(history_has("unknown log type 0xff from new client, closed"));
    for (const char* name : {"main_log", "radio_log", "events_log", "kernel_log", "bt_log"}) {
        EXPECT_EQ(log(name), kHeader) << name;
    }
}

TEST_F(TransistTest, LaterConnectionOfATypeTakesOverAfterTheEarlierOnesData) {
    start();
    int first = connect_log_socket();
    ASSERT_GE(first, 0);
    send_all(first, "Mfirst stream\n");
    int second = connect_log_socket();
    ASSERT_GE(second, 0);
    send_all(second, "Msecond stream\n");
    EXPECT_TRUE(closed_by_peer(first, 2000));
    close(first);
    close(second);
    stop();
    EXPECT_EQ(log("main_log"), kHeader + "first stream\nsecond stream\n");
    EXPECT_TRUE(history_has("main_log connection replaced by a new one"));
}

TEST_F(TransistTest, CollectorEndIsRecordedAndTheTypeCanReconnect) {
    start();
    stream_log('R', "one\n");
    ASSERT_TRUE(wait_for([] { return history_has("handle log message failed in fd of radio_log."); },
                         2000));
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
    EXPECT_EQ(log("main_log"), "<missing>");
    EXPECT_EQ(log("kernel_log"), kHeader + "kept\n");
    EXPECT_TRUE(history_has("no writable main_log file, its data is dropped"));
    for (const TransistQueue& q : transist_queues) EXPECT_EQ(q.total, 0);
}

TEST_F(TransistTest, RemovedFolderIsReportedAsLogFolderLost) {
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    controller_->clients[0].fd = pair[0];
    start();
    ASSERT_EQ(system("rm -rf /data/run"), 0);
    int fd = connect_log_socket();
    ASSERT_GE(fd, 0);
    send_all(fd, "Klost line\n");
    struct pollfd p = {efd_thread, POLLIN, 0};
    ASSERT_EQ(poll(&p, 1, 3000), 1);
    uint64_t value = 0;
    ASSERT_EQ(read(efd_thread, &value, sizeof(value)), 8);
    EXPECT_EQ(value % EVENT_FOLDER_LOST, 0u);  // one or more notifications
    char reply[64] = {};
    ASSERT_GT(recv(pair[1], reply, sizeof(reply) - 1, MSG_DONTWAIT), 0);
    EXPECT_EQ(std::string(reply).find("log_folder_lost"), 0u);
    EXPECT_TRUE(history_has("log files /data/run/kernel_log not exist:2"));
    close(fd);
    stop();
    // The stop notifies nobody; the unwritable bytes are discarded by the next run.
    EXPECT_EQ(read(efd_thread, &value, sizeof(value)), -1);
    EXPECT_FALSE(history_has("no space to write log"));
    mkdir(kRun, 0770);
    start();
    EXPECT_TRUE(history_has("delete transist queue:"));
    for (const TransistQueue& q : transist_queues) EXPECT_EQ(q.total, 0);
    controller_->clients[0].fd = -1;
    close(pair[0]);
    close(pair[1]);
}

TEST_F(TransistTest, SquattedSocketNameIsReportedAndTheRunStillStops) {
    int squatter =
        socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
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

struct StorageCase {
    const char* name;
    int log_path_state;
    int low;
    const char* checked;
};

class StorageGateTest : public ::testing::TestWithParam<StorageCase> {};

std::string checked_path;
int probe_result = 0;
int fake_probe(const char* path) {
    checked_path = path;
    return probe_result;
}

TEST_P(StorageGateTest, LowStorageNotifiesAndHoldsTheQueues) {
    const StorageCase& c = GetParam();
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
    if (c.low) {
        EXPECT_EQ(recv(pair[1], reply, sizeof(reply) - 1, MSG_DONTWAIT), 12);
        EXPECT_STREQ(reply, "storage_full");
        ASSERT_EQ(read(efd_thread, &value, sizeof(value)), 8);
        EXPECT_EQ(value, EVENT_STORAGE_LOW);
        EXPECT_TRUE(history_has("no space to write log"));
    } else {
        EXPECT_EQ(recv(pair[1], reply, sizeof(reply) - 1, MSG_DONTWAIT), -1);
        EXPECT_EQ(read(efd_thread, &value, sizeof(value)), -1);
    }
    // Without notification (the stop's own check) only the record is written.
    if (c.low) {
        EXPECT_EQ(writer_storage_blocked(&controller, fake_probe, false), 1);
        EXPECT_EQ(recv(pair[1], reply, sizeof(reply) - 1, MSG_DONTWAIT), -1);
        EXPECT_EQ(read(efd_thread, &value, sizeof(value)), -1);
    }
    controller.clients[3].fd = -1;
    close(pair[0]);
    close(pair[1]);
}

INSTANTIATE_TEST_SUITE_P(
    Transist, StorageGateTest,
    ::testing::Values(StorageCase{"TemporaryFolderChecksData", 0, 1, "/data"},
                      StorageCase{"CardRunChecksLogPath", 1, 1, "/mnt/sdcard"},
                      StorageCase{"UnknownStateChecksLogPath", -1, 0, "/mnt/sdcard"},
                      StorageCase{"EnoughSpaceGoesOn", 0, 0, "/data"}),
    [](const ::testing::TestParamInfo<StorageCase>& info) { return info.param.name; });

}  // namespace
