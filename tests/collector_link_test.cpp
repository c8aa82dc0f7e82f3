// Collectors end their process, so the collector side always runs in a forked child.
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>

#include <cutils/sockets.h>

#include <thread>

#include "collectors/collector_link.h"
#include "test_util.h"
#include "transist/transist.h"

namespace {

int32_t word_at(const void* base, size_t offset) {
    int32_t value;
    memcpy(&value, static_cast<const char*>(base) + offset, sizeof(value));
    return value;
}

class LinkTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_TRUE(run_.ok());
        run_.reset();
        connect_retry_us = 10000;
    }
    // Runs body as a collector child with the block attached; returns its pid.
    template <typename Body>
    pid_t run_collector(CollectorKind kind, char letter, Body body) {
        pid_t pid = fork();
        if (pid == 0) {
            CollectorLink collector(kind, letter);
            collector.shm_fd = run_.fd;
            install_stop_signal(&collector);
            if (!attach_control_block(&collector)) _exit(99);
            body(collector);
            _exit(77);
        }
        return pid;
    }

    RunBlock run_;
    ControlBlock* const block_ = run_.block;
};

// The controller reads fixed byte offsets (exited at 264*slot, reason 4 bytes
// later) of the mapping the collector wrote through its own.
TEST_F(LinkTest, ExitCollectorMarksTheSlotOfItsType) {
    const struct {
        CollectorKind kind;
        char letter;
        int status, reason;
        int slot;  // 0: no slot may be marked
        int expect_reason;
    } cases[] = {
        {KIND_ANDROID, 'M', 1, REASON_OUTPUT, SLOT_MAIN, REASON_OUTPUT},
        {KIND_ANDROID, 'R', 0, REASON_SIGNAL, SLOT_RADIO, REASON_SIGNAL},
        {KIND_ANDROID, 'E', 1, REASON_FORMAT, SLOT_EVENTS, REASON_FORMAT},
        {KIND_KERNEL, 'K', 0, REASON_NONE, SLOT_KERNEL, REASON_NONE},  // reason kept
        {KIND_BT, 'B', 1, REASON_BT_TIMEOUT, SLOT_BT, REASON_BT_TIMEOUT},
        {KIND_ANDROID, 'X', 3, REASON_READ, 0, REASON_NONE},  // unknown letter: nothing marked
    };
    for (const auto& c : cases) {
        run_.reset();
        pid_t pid = run_collector(c.kind, c.letter,
                                  [&](CollectorLink& collector) { exit_collector(&collector, c.status, c.reason); });
        EXPECT_TRUE(exits_with(pid, c.status)) << c.letter;
        for (size_t offset = 0; offset < CONTROL_BLOCK_SIZE; offset += 4) {
            if (offset >= CONTROL_SEM_OFFSET && offset < CONTROL_SEM_OFFSET + sizeof(sem_t)) continue;
            int slot = static_cast<int>(offset / CONTROL_SLOT_SIZE);
            size_t word = offset % CONTROL_SLOT_SIZE;
            int32_t expected = 0;
            if (slot >= SLOT_MAIN && word == 0) expected = slot == c.slot ? 1 : 0;
            if (slot >= SLOT_MAIN && word == 4) expected = slot == c.slot ? c.expect_reason : REASON_NONE;
            EXPECT_EQ(word_at(block_, offset), expected) << c.letter << " offset " << offset;
        }
    }
    EXPECT_TRUE(history_has("unknow log type X"));
}

TEST_F(LinkTest, CheckStopEndsOnlyOnceStopIsSet) {
    auto check_then_42 = [](CollectorLink& collector) {
        check_stop(&collector);
        _exit(42);
    };
    EXPECT_TRUE(exits_with(run_collector(KIND_KERNEL, 'K', check_then_42), 42));
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 0);

    int32_t one = 1;
    memcpy(block_, &one, sizeof(one));  // the controller's stop word at offset 0
    EXPECT_TRUE(exits_with(run_collector(KIND_KERNEL, 'K', check_then_42), 0));
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_NONE);
    EXPECT_EQ(sem_trywait(run_.sem), 0) << "the semaphore was not given back";
    sem_post(run_.sem);
}

TEST_F(LinkTest, StopSignalBeforeTheBlockIsMappedEndsWithStatusZero) {
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        CollectorLink collector(KIND_KERNEL, 'K');
        install_stop_signal(&collector);
        raise(SIGUSR1);
        _exit(77);
    }
    EXPECT_TRUE(exits_with(pid, 0));
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 0);
}

// Signals queued for the whole process, from /proc.
unsigned long long shared_pending(pid_t pid) {
    std::string status = read_file("/proc/" + std::to_string(pid) + "/status");
    size_t at = status.find("ShdPnd:");
    return at == std::string::npos ? 0 : strtoull(status.c_str() + at + 7, nullptr, 16);
}

// The stop handler takes the semaphore too, so it must wait while the
// collector's own check takes or holds it.
TEST_F(LinkTest, StopSignalWaitsWhileCheckStopUsesTheSemaphore) {
    ASSERT_EQ(sem_wait(run_.sem), 0);  // the controller holds the block
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    pid_t pid = run_collector(KIND_KERNEL, 'K', [&](CollectorLink& collector) {
        if (write(ready[1], "r", 1) != 1) _exit(98);
        for (;;) check_stop(&collector);
    });
    close(ready[1]);
    char byte;
    ASSERT_EQ(read(ready[0], &byte, 1), 1);
    close(ready[0]);
    usleep(50000);  // the child now waits inside check_stop
    kill(pid, SIGUSR1);
    usleep(50000);
    EXPECT_NE(shared_pending(pid) & (1ULL << (SIGUSR1 - 1)), 0ULL)
        << "the stop handler ran while check_stop was using the semaphore";
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 0);
    sem_post(run_.sem);

    EXPECT_TRUE(exits_with(pid, 0, 2000)) << "collector did not end on the stop signal";
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_SIGNAL);
    EXPECT_EQ(read_file("/dev/emu/wlog").find("busy for"), std::string::npos);
}

void on_alarm(int) {}

// Signals interrupt a blocked write part-way; every byte must still arrive, in order.
TEST(SendToTransist, DeliversEveryByteDespiteInterruptedWrites) {
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
    int small = 4096;
    setsockopt(pair[0], SOL_SOCKET, SO_SNDBUF, &small, sizeof(small));
    struct sigaction sa = {};
    sa.sa_handler = on_alarm;
    sa.sa_flags = 0;  // blocked writes fail with EINTR or come back short
    sigaction(SIGALRM, &sa, nullptr);
    struct itimerval tick = {{0, 200}, {0, 200}}, off = {};
    setitimer(ITIMER_REAL, &tick, nullptr);
    sigset_t alarm_set, old;
    sigemptyset(&alarm_set);
    sigaddset(&alarm_set, SIGALRM);
    pthread_sigmask(SIG_BLOCK, &alarm_set, &old);  // the reader is not interrupted
    std::string got;
    std::thread reader([&] {
        char buf[1000];
        for (ssize_t n; (n = read(pair[1], buf, sizeof(buf))) != 0 && (n > 0 || errno == EINTR);)
            if (n > 0) got.append(buf, static_cast<size_t>(n));
    });
    pthread_sigmask(SIG_SETMASK, &old, nullptr);

    std::string sent;
    for (int i = 0; i < 2 * 1024 * 1024; i++) sent.push_back(static_cast<char>('a' + i % 23));
    EXPECT_EQ(send_to_transist(sent.data(), sent.size(), pair[0]), static_cast<int>(sent.size()));
    setitimer(ITIMER_REAL, &off, nullptr);
    close(pair[0]);
    reader.join();
    close(pair[1]);
    EXPECT_EQ(got.size(), sent.size());
    EXPECT_TRUE(got == sent);
}

// Reads from fd until it ends or want bytes came, for at most timeout_ms per read.
std::string read_some(int fd, size_t want, int timeout_ms) {
    std::string got;
    char buf[4096];
    struct pollfd p = {fd, POLLIN, 0};
    ssize_t n;
    while (got.size() < want && poll(&p, 1, timeout_ms) > 0 && (n = read(fd, buf, sizeof(buf))) > 0)
        got.append(buf, static_cast<size_t>(n));
    return got;
}

int accept_within(int listen_fd, int timeout_ms) {
    struct pollfd p = {listen_fd, POLLIN, 0};
    return poll(&p, 1, timeout_ms) <= 0 ? -1 : accept(listen_fd, nullptr, nullptr);
}

// Another process serves "log_socket": the collector must not hand it a byte.
TEST_F(LinkTest, RefusesALogSocketServedByAnotherProcess) {
    int report[2];
    ASSERT_EQ(pipe(report), 0);
    pid_t squatter = fork();
    ASSERT_GE(squatter, 0);
    if (squatter == 0) {
        int server = socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
        if (server < 0 || write(report[1], "L", 1) != 1) _exit(2);
        size_t received = 0;
        for (int conn; (conn = accept_within(server, 500)) >= 0; close(conn)) received += read_some(conn, 1, 200).size();
        _exit(received == 0 ? 0 : 1);
    }
    close(report[1]);
    char ready;
    ASSERT_EQ(read(report[0], &ready, 1), 1);
    close(report[0]);

    pid_t pid = run_collector(KIND_KERNEL, 'K', [](CollectorLink& collector) {
        connect_transist(&collector);
        _exit(55);  // must never get here
    });
    EXPECT_TRUE(exits_with(pid, 1));
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_NONE);
    EXPECT_TRUE(exits_with(squatter, 0)) << "the squatter received data";
    std::string history = read_file(kHistory);
    EXPECT_EQ(count_of(history, "log_socket is served by pid " + std::to_string(squatter) + ", not the daemon"), 5u);
    EXPECT_EQ(count_of(history, "Has been retry 5s.."), 1u);
}

TEST_F(LinkTest, GivesUpAfterFiveAttemptsWhenNothingServes) {
    pid_t pid = run_collector(KIND_BT, 'B', [](CollectorLink& collector) {
        connect_transist(&collector);
        _exit(55);
    });
    EXPECT_TRUE(exits_with(pid, 1));
    EXPECT_EQ(block_->slots[SLOT_BT].exited, 1);
    std::string history = read_file(kHistory);
    std::string refused = std::string("socket fd < 0(") + strerror(ECONNREFUSED) + "), errno = " +
                          std::to_string(ECONNREFUSED) + ".";
    EXPECT_EQ(count_of(history, refused), 6u);  // five attempts, then the give-up record
    EXPECT_EQ(count_of(history, "Has retry 5s.."), 1u);
}

}  // namespace
