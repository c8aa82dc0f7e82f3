// The kernel collector against a FIFO standing in for /proc/kmsg and a test
// server standing in for the transist's "log_socket".
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <semaphore.h>
#include <signal.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cutils/ashmem.h>
#include <cutils/sockets.h>
#include <gtest/gtest.h>

#include <string>

#include "collectors/collector_link.h"
#include "collectors/control_block.h"
#include "collectors/kmsg_cat.h"
#include "transist/transist.h"

namespace {

const char* const kFifo = "/tmp/kmsg_fifo";
const char* const kHistory = "/data/misc/tqlog/tqlog_history";
// Status of a child whose run returned (the wrapper's exit(0), told apart).
const int kRunReturned = 33;

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

class KmsgCatTest : public ::testing::Test {
  protected:
    void SetUp() override {
        signal(SIGPIPE, SIG_IGN);
        block_fd_ = ashmem_create_region(CONTROL_BLOCK_NAME, CONTROL_BLOCK_SIZE);
        ASSERT_GE(block_fd_, 0);
        sem_unlink(CONTROL_SEM_NAME);
        sem_ = sem_open(CONTROL_SEM_NAME, O_CREAT, 0644, 1);
        ASSERT_NE(sem_, SEM_FAILED);
        void* map =
            mmap(nullptr, CONTROL_BLOCK_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, block_fd_, 0);
        ASSERT_NE(map, MAP_FAILED);
        block_ = static_cast<ControlBlock*>(map);
        for (int slot = SLOT_MAIN; slot <= SLOT_BT; slot++) block_->slots[slot].reason = REASON_NONE;

        unlink(kFifo);
        ASSERT_EQ(mkfifo(kFifo, 0600), 0);
        KmsgCat::kmsg_path = kFifo;
        // Read-write: opening never blocks, and the source has a writer until
        // the test closes it.
        source_ = open(kFifo, O_RDWR);
        ASSERT_GE(source_, 0);
        server_ = socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
        ASSERT_GE(server_, 0);
    }
    void TearDown() override {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
        if (conn_ >= 0) close(conn_);
        if (source_ >= 0) close(source_);
        close(server_);
        munmap(block_, CONTROL_BLOCK_SIZE);
        sem_close(sem_);
        sem_unlink(CONTROL_SEM_NAME);
        close(block_fd_);
    }

    void start_collector(int block_fd) {
        pid_ = fork();
        ASSERT_GE(pid_, 0);
        if (pid_ == 0) {
            close(source_);
            close(server_);
            KmsgCat collector;
            collector.run("kernel_log", block_fd);
            _exit(kRunReturned);
        }
    }
    void start_and_accept() {
        start_collector(block_fd_);
        struct pollfd p = {server_, POLLIN, 0};
        ASSERT_EQ(poll(&p, 1, 5000), 1) << "the collector did not connect";
        conn_ = accept(server_, nullptr, nullptr);
        ASSERT_GE(conn_, 0);
    }
    // Reads the connection until want bytes came or nothing more arrives.
    std::string receive(size_t want) {
        char buf[4096];
        while (received_.size() < want) {
            struct pollfd p = {conn_, POLLIN, 0};
            if (poll(&p, 1, 5000) <= 0) break;
            ssize_t n = read(conn_, buf, sizeof(buf));
            if (n <= 0) break;
            received_.append(buf, static_cast<size_t>(n));
        }
        return received_;
    }
    void feed(const std::string& text) {
        ASSERT_EQ(write(source_, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    int wait_exit() {
        int status = -1;
        for (int i = 0; i < 500 && waitpid(pid_, &status, WNOHANG) == 0; i++) usleep(10000);
        if (status != -1) pid_ = -1;
        return status;
    }

    int block_fd_ = -1;
    sem_t* sem_ = nullptr;
    ControlBlock* block_ = nullptr;
    int source_ = -1;
    int server_ = -1;
    int conn_ = -1;
    pid_t pid_ = -1;
    std::string received_;
};

TEST_F(KmsgCatTest, ForwardsLongMessagesWholeAndInOrderAfterTheLetter) {
    start_and_accept();
    std::string sent;
    const size_t lengths[] = {1, 254, 255, 256, 600, 4096, 10000};
    for (size_t i = 0; i < sizeof(lengths) / sizeof(lengths[0]); i++) {
        std::string message;
        for (size_t j = 0; j < lengths[i]; j++) message.push_back(static_cast<char>('A' + (i + j) % 26));
        message += "\n";
        feed(message);
        sent += message;
    }
    sent += std::string("\0\x01\xff binary\n", 12);
    feed(std::string("\0\x01\xff binary\n", 12));
    EXPECT_TRUE(receive(1 + sent.size()) == "K" + sent);
}

TEST_F(KmsgCatTest, EndOfFileOnTheSourceDoesNotEndIt) {
    start_and_accept();
    feed("before\n");
    EXPECT_EQ(receive(8), "Kbefore\n");
    close(source_);  // the source now reports end of file
    source_ = -1;
    usleep(20000);
    source_ = open(kFifo, O_RDWR);
    ASSERT_GE(source_, 0);
    feed("after\n");
    EXPECT_EQ(receive(14), "Kbefore\nafter\n");
    EXPECT_EQ(waitpid(pid_, nullptr, WNOHANG), 0) << "the collector ended";
}

TEST_F(KmsgCatTest, StopWordEndsItWithReasonKept) {
    start_and_accept();
    ASSERT_EQ(sem_wait(sem_), 0);
    control_stop(block_) = 1;
    sem_post(sem_);
    feed("wake\n");  // the collector looks at the stop word after its wait
    int status = wait_exit();
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_NONE);
}

TEST_F(KmsgCatTest, StopSignalWhileIdleEndsItWithReasonSignal) {
    start_and_accept();
    feed("one line\n");
    receive(10);
    usleep(20000);  // parked in its wait again
    kill(pid_, SIGUSR1);
    int status = wait_exit();
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_SIGNAL);
    EXPECT_NE(read_file("/dev/emu/wlog").find("K has been set."), std::string::npos);
}

TEST_F(KmsgCatTest, UnopenableSourceEndsWithReasonOpen) {
    KmsgCat::kmsg_path = "/tmp/no_such_kmsg";
    start_collector(block_fd_);
    int status = wait_exit();
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].reason, REASON_OPEN);
    EXPECT_NE(read_file(kHistory).find("Unable to open /proc/kmsg: No such file or directory"),
              std::string::npos);
}

TEST_F(KmsgCatTest, MissingBlockEndsWithStatusOneAndNoMark) {
    start_collector(-1);
    int status = wait_exit();
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 1);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 0);
    EXPECT_NE(read_file(kHistory).find("shm open failed! errno = "), std::string::npos);
}

TEST_F(KmsgCatTest, FailedSendReturnsFromRunWithoutMarking) {
    start_and_accept();
    EXPECT_EQ(receive(1), "K");
    close(conn_);  // the transist went away
    conn_ = -1;
    feed("lost\n");
    int status = wait_exit();
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), kRunReturned);
    EXPECT_EQ(block_->slots[SLOT_KERNEL].exited, 0);
    EXPECT_NE(read_file(kHistory).find("write fails: Broken pipe, errno = 32"), std::string::npos);
}

}  // namespace
