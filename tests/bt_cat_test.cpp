// The Bluetooth collector against a test "btlog" service and a test server
// standing in for the transist's "log_socket".
#include "collectors/bt_cat.h"

#include <poll.h>

#include <cutils/sockets.h>

#include "test_util.h"
#include "transist/transist.h"

namespace {

int server(const char* name) {
    return socket_local_server(name, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
}

int accept_within(int listen_fd, int ms) {
    struct pollfd p = {listen_fd, POLLIN, 0};
    return poll(&p, 1, ms) == 1 ? accept(listen_fd, nullptr, nullptr) : -1;
}

class BtCatTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_TRUE(run_.ok());
        run_.reset();
        BtCat::pause_us = 2000;
        pid_ = fork();
        ASSERT_GE(pid_, 0);
        if (pid_ == 0) {
            BtCat collector;
            collector.run("bt_log", run_.fd);
            _exit(33);
        }
    }
    void TearDown() override {
        if (pid_ > 0) wait_exit(pid_, 0);
    }
    RunBlock run_;
    pid_t pid_ = -1;
};

// Late service, then a chunk longer than one read, then the service ends.
TEST_F(BtCatTest, ForwardsTheLateServiceExactlyAndEndsWhenItCloses) {
    ASSERT_TRUE(wait_for([] { return history_has("mSockListenId<0 , errno = 111"); }, 5000));
    int service = server(BT_LOG_SOCKET_NAME), transist = server(LOG_SOCKET_NAME);
    int from_collector = accept_within(service, 5000);
    int to_transist = accept_within(transist, 5000);
    ASSERT_GE(from_collector, 0);
    ASSERT_GE(to_transist, 0);

    std::string chunk;
    for (int i = 0; i < 600; i++) chunk.push_back(static_cast<char>(i * 7));
    ASSERT_EQ(write(from_collector, chunk.data(), chunk.size()), 600);
    std::string got;
    char buf[1024];
    struct pollfd p = {to_transist, POLLIN, 0};
    for (ssize_t n; got.size() < 601 && poll(&p, 1, 5000) == 1 && (n = read(to_transist, buf, sizeof(buf))) > 0;)
        got.append(buf, static_cast<size_t>(n));
    EXPECT_TRUE(got == "B" + chunk) << got.size() << " bytes";

    close(from_collector);
    EXPECT_TRUE(exits_with(pid_, 0));
    pid_ = -1;
    EXPECT_EQ(run_.block->slots[SLOT_BT].exited, 1);
    EXPECT_EQ(run_.block->slots[SLOT_BT].reason, REASON_READ);
    EXPECT_TRUE(history_has("read: Unexpected EOF, errno = "));
    EXPECT_LT(accept_within(service, 0), 0) << "it connected again";
    for (int fd : {service, transist, to_transist}) close(fd);
}

TEST_F(BtCatTest, GivesUpAfterAHundredAttempts) {
    EXPECT_TRUE(exits_with(pid_, 1));
    pid_ = -1;
    EXPECT_EQ(run_.block->slots[SLOT_BT].exited, 1);
    EXPECT_EQ(run_.block->slots[SLOT_BT].reason, REASON_BT_TIMEOUT);
    std::string history = read_file(kHistory);
    EXPECT_EQ(count_of(history, "mSockListenId<0 , errno = 111"), 100u);
    EXPECT_EQ(count_of(history, "BT connect timeout!"), 1u);
}

// An app serving "btlog" is not the stack: its bytes never reach the transist.
TEST_F(BtCatTest, RefusesAnAppServingTheName) {
    pid_t squatter = fork();
    ASSERT_GE(squatter, 0);
    if (squatter == 0) {
        if (setgid(10050) != 0 || setuid(10050) != 0) _exit(2);
        int fd = server(BT_LOG_SOCKET_NAME);
        for (int c; fd >= 0 && (c = accept(fd, nullptr, nullptr)) >= 0;) {
            (void)!write(c, "forged", 6);
            close(c);
        }
        _exit(3);
    }
    EXPECT_TRUE(exits_with(pid_, 1));
    pid_ = -1;
    kill(squatter, SIGKILL);
    waitpid(squatter, nullptr, 0);
    EXPECT_EQ(run_.block->slots[SLOT_BT].reason, REASON_BT_TIMEOUT);
    EXPECT_TRUE(history_has("btlog is served by uid 10050, not the Bluetooth stack"));
}

}  // namespace
