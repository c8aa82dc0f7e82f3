// The emulated phone's Bluetooth log service (emu_btlog) as far as the
// Bluetooth collector's own tests do not reach it: bytes fed while nobody
// listens wait, every client gets every byte, strangers are turned away, and
// a stop ends every client's stream.
#include <grp.h>
#include <sys/socket.h>

#include <thread>

#include <cutils/sockets.h>

#include "tests/test_util.h"

namespace {

// A lost byte ends the wait after 10 s rather than hang the test.
int connect_btlog() {
    int fd = socket_local_client("btlog", ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    struct timeval limit = {10, 0};
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
    return fd;
}

// n bytes from fd, or what came before its end.
std::string receive(int fd, size_t n) {
    std::string got(n, '\0');
    size_t done = 0;
    for (ssize_t r = 1; done < n && r > 0; done += r > 0 ? r : 0) r = recv(fd, &got[done], n - done, 0);
    return got.substr(0, done);
}

TEST(BtlogService, ServesEveryClientEveryByteUntilItStops) {
    SKIP_OUTSIDE_PHONE();
    ASSERT_EQ(0, mkfifo("/tmp/feed", 0600));
    int feed = open("/tmp/feed", O_RDWR | O_NONBLOCK | O_CLOEXEC);  // held, as the phone's init does
    ASSERT_EQ(5, write(feed, "early", 5));
    std::string out;
    ASSERT_EQ(0, run_shell("emu_btlog start --feed /tmp/feed", &out)) << out;
    int first = connect_btlog();
    EXPECT_EQ("early", receive(first, 5));

    pid_t stranger = fork();
    if (stranger == 0) {
        gid_t groups[] = {1000};
        if (setgroups(1, groups) != 0 || setresgid(1000, 1000, 1000) != 0 || setresuid(2000, 2000, 2000) != 0)
            _exit(99);
        _exit(receive(connect_btlog(), 1).empty() ? 0 : 1);  // let in, then shut out at once
    }
    EXPECT_TRUE(exits_with(stranger, 0));

    // More than the pipe and the sockets hold.
    int second = connect_btlog();
    std::string bytes(300000, '\0');
    for (size_t i = 0; i < bytes.size(); i++) bytes[i] = static_cast<char>(i * 7 / 3);
    std::thread writer([&] {
        for (size_t done = 0; done < bytes.size(); usleep(1000)) {
            ssize_t n = write(feed, bytes.data() + done, bytes.size() - done);
            done += n > 0 ? n : 0;
        }
    });
    std::string got_second;
    // The second client is slow to start reading: it must hold the feed back, not lose bytes.
    std::thread reader([&] { usleep(100000), got_second = receive(second, bytes.size()); });
    EXPECT_TRUE(receive(first, bytes.size()) == bytes);
    reader.join();
    writer.join();
    EXPECT_TRUE(got_second == bytes);

    ASSERT_EQ(0, run_shell("emu_btlog stop", &out)) << out;
    EXPECT_EQ("", receive(first, 1));
    EXPECT_EQ("", receive(second, 1));
    EXPECT_LT(connect_btlog(), 0);
}

}  // namespace
