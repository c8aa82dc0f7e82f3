// The collector link: exit routine, stop check, stop signal, sends and the
// connection to "log_socket". Collectors end their process, so every case runs
// the collector side in a forked child.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <semaphore.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cutils/ashmem.h>
#include <cutils/sockets.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "collectors/collector_link.h"
#include "collectors/control_block.h"
#include "transist/transist.h"

namespace {

std::string read_file(const char* path) {
    std::string out;
    int fd = open(path, O_RDONLY);
    if (fd < 0) return out;
    char buf[4096];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) out.append(buf, static_cast<size_t>(n));
    close(fd);
    return out;
}

size_t count_of(const std::string& text, const std::string& what) {
    size_t count = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) count++;
    return count;
}

const char* const kHistory = "/data/misc/tqlog/tqlog_history";

// A run's block and semaphore, as the controller makes them.
class LinkTest : public ::testing::Test {
  protected:
    void SetUp() override {
        fd_ = ashmem_create_region(CONTROL_BLOCK_NAME, CONTROL_BLOCK_SIZE);
        ASSERT_GE(fd_, 0);
        sem_unlink(CONTROL_SEM_NAME);
        sem_ = sem_open(CONTROL_SEM_NAME, O_CREAT, 0644, 1);
        ASSERT_NE(sem_, SEM_FAILED);
        void* map = mmap(nullptr, CONTROL_BLOCK_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, fd_, 0);
        ASSERT_NE(map, MAP_FAILED);
        block_ = static_cast<ControlBlock*>(map);
        reset_block();
        connect_retry_us = 10000;
    }
    // A fresh run's block: all clear, no reasons.
    void reset_block() {
        memset(block_, 0, sizeof(*block_));
        for (int slot = SLOT_MAIN; slot <= SLOT_BT; slot++) block_->slots[slot].reason = REASON_NONE;
    }
    void TearDown() override {
        munmap(block_, CONTROL_BLOCK_SIZE);
        sem_close(sem_);
        sem_unlink(CONTROL_SEM_NAME);
        close(fd_);
    }

    // Runs body as a collector child with the block attached; returns the wait status.
    template <typename Body>
    int run_collector(CollectorKind kind, char letter, Body body, pid_t* child = nullptr) {
        pid_t pid = fork();
        if (pid == 0) {
            CollectorLink collector(kind, letter);
            collector.shm_fd = fd_;
            install_stop_signal(&collector);
            if (!attach_control_block(&collector)) _exit(99);
            body(collector);
            _exit(77);
        }
        if (child != nullptr) *child = pid;
        return pid;
    }
    static int wait_status(pid_t pid) {
        int status = -1;
        waitpid(pid, &status, 0);
        return status;
    }

    int fd_ = -1;
    sem_t* sem_ = nullptr;
    ControlBlock* block_ = nullptr;
};

struct ExitCase {
    CollectorKind kind;
    char letter;
    int status;
    int reason;
    int slot;            // 0: no slot may be marked
    int expect_reason;
};

TEST_F(LinkTest, ExitCollectorMarksTheSlotOfItsType) {
    const ExitCase cases[] = {
        {KIND_ANDROID, 'M', 1, REASON_OUTPUT, SLOT_MAIN, REASON_OUTPUT},
        {KIND_ANDROID, 'R', 0, REASON_SIGNAL, SLOT_RADIO, REASON_SIGNAL},
        {KIND_ANDROID, 'E', 1, REASON_FORMAT, SLOT_EVENTS, REASON_FORMAT},
        {KIND_KERNEL, 'K', 0, REASON_NONE, SLOT_KERNEL, REASON_NONE},  // reason kept
        {KIND_BT, 'B', 1, REASON_BT_TIMEOUT, SLOT_BT, REASON_BT_TIMEOUT},
        {KIND_ANDROID, 'X', 3, REASON_READ, 0, REASON_NONE},  // unknown letter: nothing marked
    };
    for (const ExitCase& c : cases) {
        reset_block();
        pid_t pid = run_collector(c.kind, c.letter, [&](CollectorLink& collector) {
            exit_collector(&collector, c.status, c.reason);
        });
        int status = wait_status(pid);
        ASSERT_TRUE(WIFEXITED(status)) << c.letter;
        EXPECT_EQ(WEXITSTATUS(status), c.status) << c.letter;
        for (int slot = SLOT_MAIN; slot <= SLOT_BT; slot++) {
            EXPECT_EQ(block_->slots[slot].exited, slot == c.slot ? 1 : 0) << c.letter << slot;
            EXPECT_EQ(block_->slots[slot].reason, slot == c.slot ? c.expect_reason : REASON_NONE)
                << c.letter << slot;
        }
    }
    EXPECT_NE(read_file(kHistory).find("unknow log type X"), std::string::npos);
}

TEST_F(LinkTest, CheckStopEndsOnlyOnceStopIsSet) {
    pid_t pid = run_collector(KIND_KERNEL, 'K', [](CollectorLink& collector) {
        check_stop(&collector);
        _exit(42);
    });
    int status = wait_status(pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 42);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 0);

    control_stop(block_) = 1;
    pid = run_collector(KIND_KERNEL, 'K', [](CollectorLink& collector) {
        check_stop(&collector);
        _exit(42);
    });
    status = wait_status(pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_NONE);
    // The semaphore was given back both times.
    EXPECT_EQ(sem_trywait(sem_), 0);
    sem_post(sem_);
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
    int status = wait_status(pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 0);
}

// Mask of the signals queued for the whole process, from /proc.
unsigned long long shared_pending(pid_t pid) {
    char path[64];
    snprintf(path, sizeof(path), "/proc/%d/status", pid);
    std::string status = read_file(path);
    size_t at = status.find("ShdPnd:");
    if (at == std::string::npos) return 0;
    return strtoull(status.c_str() + at + 7, nullptr, 16);
}

// The stop handler takes the semaphore as well, so it must wait while the
// collector's own check is taking or holding it: here the check waits behind
// the controller, the signal arrives, and it may only run once the check has
// let go.
TEST_F(LinkTest, StopSignalWaitsWhileCheckStopUsesTheSemaphore) {
    ASSERT_EQ(sem_wait(sem_), 0);  // the controller holds the block
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
    sem_post(sem_);

    int status = -1;
    for (int i = 0; i < 200 && waitpid(pid, &status, WNOHANG) == 0; i++) usleep(10000);
    if (status == -1) {
        kill(pid, SIGKILL);
        waitpid(pid, &status, 0);
        FAIL() << "collector did not end on the stop signal";
    }
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_SIGNAL);
    EXPECT_EQ(read_file("/dev/emu/wlog").find("busy for"), std::string::npos);
}

void on_alarm(int) {}

struct Drain {
    int fd;
    std::string got;
};

void* slow_reader(void* arg) {
    Drain* drain = static_cast<Drain*>(arg);
    char buf[1000];
    ssize_t n;
    while ((n = read(drain->fd, buf, sizeof(buf))) != 0) {
        if (n < 0) {
            if (errno == EINTR) continue;
            break;
        }
        drain->got.append(buf, static_cast<size_t>(n));
    }
    return nullptr;
}

// Signals interrupt a blocked write part-way; every byte must still arrive, in order.
TEST(SendToTransist, DeliversEveryByteDespiteInterruptedWrites) {
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
    int small = 4096;
    setsockopt(pair[0], SOL_SOCKET, SO_SNDBUF, &small, sizeof(small));

    struct sigaction sa;
    memset(&sa, 0, sizeof(sa));
    sa.sa_handler = on_alarm;
    sa.sa_flags = SA_RESTART;
    sigaction(SIGALRM, &sa, nullptr);
    struct itimerval tick = {{0, 200}, {0, 200}};
    setitimer(ITIMER_REAL, &tick, nullptr);

    Drain drain{pair[1], {}};
    pthread_t reader;
    sigset_t alarm_set, old;
    sigemptyset(&alarm_set);
    sigaddset(&alarm_set, SIGALRM);
    pthread_sigmask(SIG_BLOCK, &alarm_set, &old);  // the reader is not interrupted
    pthread_create(&reader, nullptr, slow_reader, &drain);
    pthread_sigmask(SIG_SETMASK, &old, nullptr);

    std::string sent;
    for (int i = 0; i < 2 * 1024 * 1024; i++) sent.push_back(static_cast<char>('a' + i % 23));
    EXPECT_EQ(send_to_transist(sent.data(), sent.size(), pair[0]), static_cast<int>(sent.size()));

    struct itimerval off = {{0, 0}, {0, 0}};
    setitimer(ITIMER_REAL, &off, nullptr);
    close(pair[0]);
    pthread_join(reader, nullptr);
    close(pair[1]);
    EXPECT_EQ(drain.got.size(), sent.size());
    EXPECT_TRUE(drain.got == sent);
}

TEST(SendToTransist, FailureIsRecordedAndReported) {
    signal(SIGPIPE, SIG_IGN);
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
    close(pair[1]);
    EXPECT_EQ(send_to_transist("abc", 3, pair[0]), -1);
    char expected[64];
    snprintf(expected, sizeof(expected), "%d send fail(%s)%d", pair[0], strerror(EPIPE), EPIPE);
    EXPECT_NE(read_file(kHistory).find(expected), std::string::npos);
    close(pair[0]);
}

// Reads from fd until it ends or want bytes came, for at most timeout_ms.
std::string read_some(int fd, size_t want, int timeout_ms) {
    std::string got;
    char buf[4096];
    while (got.size() < want) {
        struct pollfd p = {fd, POLLIN, 0};
        if (poll(&p, 1, timeout_ms) <= 0) break;
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n <= 0) break;
        got.append(buf, static_cast<size_t>(n));
    }
    return got;
}

int accept_within(int listen_fd, int timeout_ms) {
    struct pollfd p = {listen_fd, POLLIN, 0};
    if (poll(&p, 1, timeout_ms) <= 0) return -1;
    return accept(listen_fd, nullptr, nullptr);
}

TEST_F(LinkTest, ConnectionToTheDaemonStartsWithTheLogType) {
    int server = socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    ASSERT_GE(server, 0);
    pid_t pid = run_collector(KIND_BT, 'B', [](CollectorLink& collector) {
        connect_transist(&collector);
        send_to_transist("hello", 5, collector.transist_fd);
        _exit(0);
    });
    int conn = accept_within(server, 5000);
    ASSERT_GE(conn, 0);
    EXPECT_EQ(read_some(conn, 100, 5000), "Bhello");
    int status = wait_status(pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    close(conn);
    close(server);
}

// Another process serves "log_socket": the collector must not hand it a byte.
TEST_F(LinkTest, RefusesALogSocketServedByAnotherProcess) {
    int report[2];
    ASSERT_EQ(pipe(report), 0);
    pid_t squatter = fork();
    ASSERT_GE(squatter, 0);
    if (squatter == 0) {
        close(report[0]);
        int server =
            socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
        if (server < 0) _exit(2);
        if (write(report[1], "L", 1) != 1) _exit(2);
        size_t received = 0;
        for (;;) {
            int conn = accept_within(server, 500);
            if (conn < 0) break;
            received += read_some(conn, 1, 200).size();
            close(conn);
        }
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
    int status = wait_status(pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_NONE);

    status = wait_status(squatter);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "the squatter received data";
    std::string history = read_file(kHistory);
    char expected[80];
    snprintf(expected, sizeof(expected), "log_socket is served by pid %d, not the daemon", squatter);
    EXPECT_EQ(count_of(history, expected), 5u);
    EXPECT_EQ(count_of(history, "Has been retry 5s.."), 1u);
}

TEST_F(LinkTest, GivesUpAfterFiveAttemptsWhenNothingServes) {
    pid_t pid = run_collector(KIND_BT, 'B', [](CollectorLink& collector) {
        connect_transist(&collector);
        _exit(55);
    });
    int status = wait_status(pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 1);
    EXPECT_EQ(block_->slots[SLOT_BT].exited, 1);
    std::string history = read_file(kHistory);
    char refused[80];
    snprintf(refused, sizeof(refused), "socket fd < 0(%s), errno = %d.", strerror(ECONNREFUSED),
             ECONNREFUSED);
    EXPECT_EQ(count_of(history, refused), 6u);  // five attempts, then the give-up record
    EXPECT_EQ(count_of(history, "Has retry 5s.."), 1u);
}

}  // namespace
