// The kernel collector against a FIFO standing in for /proc/kmsg and a test
// server standing in for the transist's "log_socket".
#include "collectors/kmsg_cat.h"

#include <poll.h>

#include <cutils/sockets.h>

#include "test_util.h"
#include "transist/transist.h"

namespace {

const char* const kFifo = "/tmp/kmsg_fifo";
const int kRunReturned = 33;  // status of a child whose run returned

class KmsgCatTest : public ::testing::Test {
  protected:
    void SetUp() override {
        signal(SIGPIPE, SIG_IGN);
        ASSERT_TRUE(run_.ok());
        run_.reset();
        unlink(kFifo);
        ASSERT_EQ(mkfifo(kFifo, 0600), 0);
        KmsgCat::kmsg_path = kFifo;
        // Read-write: opening never blocks, and the source has a writer until the test closes it.
        source_ = open(kFifo, O_RDWR);
        ASSERT_GE(source_, 0);
        server_ = socket_local_server(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
        ASSERT_GE(server_, 0);
    }
    void TearDown() override {
        if (pid_ > 0) wait_exit(pid_, 0);
        for (int fd : {conn_, source_, server_})
            if (fd >= 0) close(fd);
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
        start_collector(run_.fd);
        struct pollfd p = {server_, POLLIN, 0};
        ASSERT_EQ(poll(&p, 1, 5000), 1) << "the collector did not connect";
        ASSERT_GE(conn_ = accept(server_, nullptr, nullptr), 0);
    }
    // Everything received so far, once want bytes came or nothing more arrives.
    std::string receive(size_t want) {
        char buf[4096];
        struct pollfd p = {conn_, POLLIN, 0};
        ssize_t n;
        while (received_.size() < want && poll(&p, 1, 5000) > 0 && (n = read(conn_, buf, sizeof(buf))) > 0)
            received_.append(buf, static_cast<size_t>(n));
        return received_;
    }
    void feed(const std::string& text) {
        ASSERT_EQ(write(source_, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    // Waits for the collector's end; checks its status and what its slot shows.
    void expect_end(int status, int exited, int reason) {
        EXPECT_TRUE(exits_with(pid_, status));
        pid_ = -1;
        EXPECT_EQ(run_.block->slots[SLOT_KERNEL].exited, exited);
        EXPECT_EQ(run_.block->slots[SLOT_KERNEL].reason, reason);
    }

    RunBlock run_;
    int source_ = -1, server_ = -1, conn_ = -1;
    pid_t pid_ = -1;
    std::string received_;
};

TEST_F(KmsgCatTest, ForwardsLongMessagesWholeAndInOrderAfterTheLetter) {
    start_and_accept();
    std::string sent;
    for (size_t length : {1, 254, 255, 256, 600, 4096, 10000}) {
        std::string message;
        for (size_t j = 0; j < length; j++) message.push_back(static_cast<char>('A' + (length + j) % 26));
        sent += message + "\n";
        feed(message + "\n");
    }
    const std::string binary("\0\x01\xff binary\n", 12);
    sent += binary;
    feed(binary);
    EXPECT_TRUE(receive(1 + sent.size()) == "K" + sent);
}

TEST_F(KmsgCatTest, EndOfFileOnTheSourceDoesNotEndIt) {
    start_and_accept();
    feed("before\n");
    EXPECT_EQ(receive(8), "Kbefore\n");
    close(source_);  // the source now reports end of file
    usleep(20000);
    source_ = open(kFifo, O_RDWR);
    ASSERT_GE(source_, 0);
    feed("after\n");
    EXPECT_EQ(receive(14), "Kbefore\nafter\n");
    EXPECT_EQ(waitpid(pid_, nullptr, WNOHANG), 0) << "the collector ended";
}

TEST_F(KmsgCatTest, StopWordEndsItWithReasonKept) {
    start_and_accept();
    ASSERT_EQ(sem_wait(run_.sem), 0);
    control_stop(run_.block) = 1;
    sem_post(run_.sem);
    feed("wake\n");  // the collector looks at the stop word after its wait
    expect_end(0, 1, REASON_NONE);
}

TEST_F(KmsgCatTest, StopSignalWhileIdleEndsItWithReasonSignal) {
    start_and_accept();
    feed("one line\n");
    receive(10);
    usleep(20000);  // parked in its wait again
    kill(pid_, SIGUSR1);
    expect_end(0, 1, REASON_SIGNAL);
    EXPECT_NE(read_file("/dev/emu/wlog").find("K has been set."), std::string::npos);
}

TEST_F(KmsgCatTest, SetUpFailuresEndItWithStatusOne) {
    start_collector(-1);  // no block: nothing can be marked
    expect_end(1, 0, REASON_NONE);
    EXPECT_TRUE(history_has("shm open failed! errno = "));
    KmsgCat::kmsg_path = "/tmp/no_such_kmsg";
    start_collector(run_.fd);
    expect_end(1, 1, REASON_OPEN);
    EXPECT_TRUE(history_has("Unable to open /proc/kmsg: No such file or directory"));
}

TEST_F(KmsgCatTest, FailedSendReturnsFromRunWithoutMarking) {
    start_and_accept();
    EXPECT_EQ(receive(1), "K");
    close(conn_);  // the transist went away
    conn_ = -1;
    feed("lost\n");
    expect_end(kRunReturned, 0, REASON_NONE);
    EXPECT_TRUE(history_has(" send fail(Broken pipe)32"));
    EXPECT_TRUE(history_has("write fails: Broken pipe, errno = 32"));
}

}  // namespace
