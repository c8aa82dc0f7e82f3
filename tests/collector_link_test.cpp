// Collectors end their process, so each runs in a forked child, with the test
// serving "log_socket" and "btlog" and a FIFO standing in for /proc/kmsg.
#include <poll.h>
#include <sys/socket.h>

#include <cutils/sockets.h>

#include "collectors/bt_cat.h"
#include "collectors/collector_link.h"
#include "collectors/kmsg_cat.h"
#include "collectors/log_cat.h"
#include "test_util.h"
#include "transist/transist.h"

// Linked in place of read (--wrap): a collector child sets these to make its
// next reads of a chunk fail as a blocking read may, without taking anything.
static int spurious_errors[2];
static int spurious_left = 0;
extern "C" ssize_t __real_read(int fd, void* buf, size_t n);
extern "C" ssize_t __wrap_read(int fd, void* buf, size_t n) {
    if (n == 255 && spurious_left > 0) {
        errno = spurious_errors[--spurious_left];
        return -1;
    }
    return __real_read(fd, buf, n);
}

namespace {

const char kFifo[] = "/tmp/kmsg_fifo";

int server(const char* name) { return socket_local_server(name, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM); }

int accept_within(int listen_fd, int ms) {
    struct pollfd p = {listen_fd, POLLIN, 0};
    return poll(&p, 1, ms) == 1 ? accept(listen_fd, nullptr, nullptr) : -1;
}

// Appends to *got what fd sends until want bytes came, it ends or it is quiet for ms.
std::string receive(int fd, std::string* got, size_t want, int ms = 5000) {
    char buf[4096];
    struct pollfd p = {fd, POLLIN, 0};
    ssize_t n;
    while (got->size() < want && poll(&p, 1, ms) > 0 && (n = read(fd, buf, sizeof(buf))) > 0)
        got->append(buf, static_cast<size_t>(n));
    return *got;
}

class LinkTest : public ::testing::Test {
  protected:
    void SetUp() override {
        signal(SIGPIPE, SIG_IGN);
        ASSERT_TRUE(run_.ok());
        run_.reset();
        connect_retry_us = 10000;
        BtCat::pause_us = 2000;
        failed_wait_pause_us = 50000;
    }
    // Runs body in a child that ends with status 77 if body returns.
    template <typename Body>
    pid_t fork_child(Body body) {
        pid_t pid = fork();
        if (pid == 0) {
            body();
            _exit(77);
        }
        return pid;
    }
    // Runs body as a collector child with the block attached.
    template <typename Body>
    pid_t run_collector(CollectorKind kind, char letter, Body body) {
        return fork_child([&] {
            CollectorLink collector(kind, letter);
            collector.shm_fd = run_.fd;
            install_stop_signal(&collector);
            if (!attach_control_block(&collector)) _exit(99);
            body(collector);
        });
    }
    // The child's exit status and what its slot shows.
    void expect_end(pid_t pid, int slot, int status, int exited, int reason) {
        EXPECT_TRUE(exits_with(pid, status));
        EXPECT_EQ(run_.block->slots[slot].exited, exited);
        EXPECT_EQ(run_.block->slots[slot].reason, reason);
    }

    RunBlock run_;
};

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
    pid_t pid = run_collector(KIND_KERNEL, 'K', [&](CollectorLink& link) {
        if (write(ready[1], "r", 1) != 1) _exit(98);
        for (;;) check_stop(&link);
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
    EXPECT_EQ(run_.block->slots[SLOT_KERNEL].exited, 0);
    sem_post(run_.sem);
    expect_end(pid, SLOT_KERNEL, 0, 1, REASON_SIGNAL);
}

// Another process serves "log_socket": the collector must not hand it a byte.
TEST_F(LinkTest, RefusesALogSocketServedByAnotherProcess) {
    int report[2];
    ASSERT_EQ(pipe(report), 0);
    pid_t squatter = fork_child([&] {
        int listen_fd = server(LOG_SOCKET_NAME);
        if (listen_fd < 0 || write(report[1], "L", 1) != 1) _exit(2);
        std::string got;
        for (int conn; (conn = accept_within(listen_fd, 500)) >= 0; close(conn)) receive(conn, &got, 1, 200);
        _exit(got.empty() ? 0 : 1);
    });
    close(report[1]);
    char ready;
    ASSERT_EQ(read(report[0], &ready, 1), 1);
    close(report[0]);
    pid_t pid = run_collector(KIND_KERNEL, 'K', [](CollectorLink& link) { connect_transist(&link); });
    expect_end(pid, SLOT_KERNEL, 1, 1, REASON_NONE);
    EXPECT_TRUE(exits_with(squatter, 0)) << "the squatter received data";
    EXPECT_EQ(count_of(read_file(kHistory), "log_socket is served by pid " + std::to_string(squatter)), 5u);
}

// CPU time of process pid so far, in milliseconds.
long cpu_ms(pid_t pid) {
    std::string stat = read_file("/proc/" + std::to_string(pid) + "/stat");
    unsigned long user = 0, system = 0;
    size_t name_end = stat.rfind(')');
    if (name_end == std::string::npos ||
        sscanf(stat.c_str() + name_end + 1, " %*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %lu %lu", &user,
               &system) != 2)
        return -1;
    return static_cast<long>((user + system) * 1000 / static_cast<unsigned long>(sysconf(_SC_CLK_TCK)));
}

// A wait that keeps failing (here on a closed descriptor) is recorded once,
// and the collector pauses between tries instead of spinning: over half a
// second of failures it stays mostly asleep. The stop signal still ends it.
TEST_F(LinkTest, AWaitThatKeepsFailingIsRecordedOnceAndDoesNotSpin) {
    const struct {
        char letter;
        int slot;
    } cases[] = {{'K', SLOT_KERNEL}, {'M', SLOT_MAIN}, {'B', SLOT_BT}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.letter);
        run_.reset();
        unlink(kHistory);
        pid_t pid = fork_child([&] {
            int closed = dup(0);
            close(closed);
            KmsgCat kernel;
            LogCat android("main_log");
            BtCat bt;
            CollectorLink* link = c.letter == 'K' ? static_cast<CollectorLink*>(&kernel)
                                  : c.letter == 'M' ? static_cast<CollectorLink*>(&android)
                                                    : &bt;
            link->shm_fd = run_.fd;
            install_stop_signal(link);
            if (!attach_control_block(link)) _exit(99);
            if (c.letter == 'K') kernel.forward(closed);
            android.add_device("/dev/log/main", false, LOG_ID_MAIN, closed);
            if (c.letter == 'M') android.read_log_lines();
            bt.mSockListenId = closed;
            bt.forward();
        });
        const std::string record = std::string(1, c.letter) + ": select failed: Bad file descriptor(9)";
        ASSERT_TRUE(wait_for([&] { return history_has(record); }, 5000));
        long before = cpu_ms(pid);
        usleep(500000);
        EXPECT_LT(cpu_ms(pid) - before, 50) << "it spins";
        kill(pid, SIGUSR1);
        expect_end(pid, c.slot, 0, 1, REASON_SIGNAL);
        EXPECT_EQ(count_of(read_file(kHistory), record), 1u);
    }
}

// The kernel collector with the test serving "log_socket".
class KmsgCatTest : public LinkTest {
  protected:
    void SetUp() override {
        LinkTest::SetUp();
        unlink(kFifo);
        ASSERT_EQ(mkfifo(kFifo, 0600), 0);
        // Read-write: opening never blocks, and the source has a writer until the test closes it.
        ASSERT_GE(source_ = open(kFifo, O_RDWR), 0);
        ASSERT_GE(server_ = server(LOG_SOCKET_NAME), 0);
    }
    void TearDown() override {
        for (int fd : {conn_, source_, server_})
            if (fd >= 0) close(fd);
    }
    pid_t start_collector(int block_fd, bool accept_it) {
        KmsgCat::kmsg_path = kFifo;
        pid_t pid = fork_child([&] {
            close(source_);
            close(server_);
            KmsgCat().run("kernel_log", block_fd);
        });
        if (accept_it) {
            EXPECT_GE(conn_ = accept_within(server_, 5000), 0) << "the collector did not connect";
        }
        return pid;
    }
    void feed(const std::string& text) {
        ASSERT_EQ(write(source_, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    int source_ = -1, server_ = -1, conn_ = -1;
    std::string got_;
};

TEST_F(KmsgCatTest, ForwardsMessagesWholeAndInOrderAfterTheLetter) {
    pid_t pid = start_collector(run_.fd, true);
    std::string sent;
    for (size_t length : {1, 254, 255, 256, 600, 4096, 10000}) {
        std::string message;
        for (size_t j = 0; j < length; j++) message.push_back(static_cast<char>('A' + (length + j) % 26));
        sent += message + "\n";
        feed(message + "\n");
    }
    sent += std::string("\0\x01\xff binary\n", 12);
    feed(std::string("\0\x01\xff binary\n", 12));
    EXPECT_TRUE(receive(conn_, &got_, 1 + sent.size()) == "K" + sent);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
}

// Each way the kernel collector ends, with its exit status and what its slot shows.
TEST_F(KmsgCatTest, Endings) {
    enum How { STOP_WORD, STOP_SIGNAL, NO_BLOCK, SEND_FAILS };
    const struct {
        How how;
        int status, exited, reason;
    } cases[] = {
        {STOP_WORD, 0, 1, REASON_NONE}, {STOP_SIGNAL, 0, 1, REASON_SIGNAL},
        {NO_BLOCK, 1, 0, REASON_NONE},  {SEND_FAILS, 77, 0, REASON_NONE},  // run returns, nothing marked
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.how);
        run_.reset();
        got_.clear();
        pid_t pid = start_collector(c.how == NO_BLOCK ? -1 : run_.fd, c.how != NO_BLOCK);
        if (c.how == STOP_WORD) {
            ASSERT_EQ(sem_wait(run_.sem), 0);
            control_stop(run_.block) = 1;
            sem_post(run_.sem);
            feed("wake\n");  // the collector looks at the stop word after its wait
        } else if (c.how == STOP_SIGNAL) {
            feed("one line\n");
            receive(conn_, &got_, 10);
            usleep(20000);  // parked in its wait again
            kill(pid, SIGUSR1);
        } else if (c.how == SEND_FAILS) {
            EXPECT_EQ(receive(conn_, &got_, 1), "K");
            close(conn_);  // the transist went away
            conn_ = -1;
            feed("lost\n");
        }
        expect_end(pid, SLOT_KERNEL, c.status, c.exited, c.reason);
        if (conn_ >= 0) close(conn_);
        conn_ = -1;
    }
}

// The Bluetooth collector, started before any "btlog" serves.
class BtCatTest : public LinkTest {
  protected:
    void SetUp() override {
        LinkTest::SetUp();
        pid_ = fork_child([&] {
            spurious_errors[0] = EINTR;  // the first two reads fail, EAGAIN then EINTR
            spurious_errors[1] = EAGAIN;
            spurious_left = 2;
            BtCat().run("bt_log", run_.fd);
        });
    }
    pid_t pid_ = -1;
};

// Late service, then spurious read failures and a chunk longer than one read,
// then the service ends.
TEST_F(BtCatTest, ForwardsTheLateServiceExactlyAndEndsWhenItCloses) {
    ASSERT_TRUE(wait_for([] { return history_has("mSockListenId<0 , errno = 111"); }, 5000));
    int service = server(BT_LOG_SOCKET_NAME), transist = server(LOG_SOCKET_NAME);
    int from_collector = accept_within(service, 5000), to_transist = accept_within(transist, 5000);
    ASSERT_GE(from_collector, 0);
    ASSERT_GE(to_transist, 0);
    std::string chunk, got;
    for (int i = 0; i < 600; i++) chunk.push_back(static_cast<char>(i * 7));
    ASSERT_EQ(write(from_collector, chunk.data(), chunk.size()), 600);
    EXPECT_TRUE(receive(to_transist, &got, 601) == "B" + chunk) << got.size() << " bytes";
    close(from_collector);
    expect_end(pid_, SLOT_BT, 0, 1, REASON_READ);
    EXPECT_LT(accept_within(service, 0), 0) << "it connected again";
    for (int fd : {service, transist, to_transist}) close(fd);
}

TEST_F(BtCatTest, GivesUpAfterAHundredAttempts) {
    expect_end(pid_, SLOT_BT, 1, 1, REASON_BT_TIMEOUT);
    EXPECT_EQ(count_of(read_file(kHistory), "mSockListenId<0 , errno = 111"), 100u);
}

// An app serving "btlog" is not the stack: its bytes never reach the transist.
TEST_F(BtCatTest, RefusesAnAppServingTheName) {
    pid_t squatter = fork_child([] {
        if (setgid(10050) != 0 || setuid(10050) != 0) _exit(2);
        int fd = server(BT_LOG_SOCKET_NAME);
        for (int c; fd >= 0 && (c = accept(fd, nullptr, nullptr)) >= 0; close(c)) (void)!write(c, "forged", 6);
    });
    expect_end(pid_, SLOT_BT, 1, 1, REASON_BT_TIMEOUT);
    kill(squatter, SIGKILL);
    waitpid(squatter, nullptr, 0);
    EXPECT_TRUE(history_has("btlog is served by uid 10050, not the Bluetooth stack"));
}

}  // namespace
