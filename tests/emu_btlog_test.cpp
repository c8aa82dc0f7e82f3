// The emulated phone's Bluetooth log service (emu_btlog) as far as the
// Bluetooth collector's own tests do not reach it: bytes fed while nobody
// listens wait, every client gets every byte, strangers are turned away, and
// a stop ends every client's stream.
#include <grp.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <thread>

#include "tests/test_util.h"

namespace {

constexpr char kFeed[] = "/tmp/btlog_feed";

int connect_btlog() {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    memcpy(addr.sun_path + 1, "btlog", 5);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), offsetof(sockaddr_un, sun_path) + 6) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// Exactly n bytes from fd, or what came before its end.
std::string receive(int fd, size_t n) {
    std::string got;
    char buf[65536];
    while (got.size() < n) {
        ssize_t r = recv(fd, buf, std::min(sizeof(buf), n - got.size()), 0);
        if (r <= 0) break;
        got.append(buf, static_cast<size_t>(r));
    }
    return got;
}

TEST(BtlogService, ServesEveryClientEveryByteUntilItStops) {
    SKIP_OUTSIDE_PHONE();
    ASSERT_EQ(0, mkfifo(kFeed, 0600));
    int feed = open(kFeed, O_RDWR | O_NONBLOCK | O_CLOEXEC);  // held, as the phone's init does
    ASSERT_EQ(5, write(feed, "early", 5));
    std::string out;
    ASSERT_EQ(0, run_shell(std::string("emu_btlog start --feed ") + kFeed, &out)) << out;

    int first = connect_btlog();
    ASSERT_GE(first, 0);
    EXPECT_EQ("early", receive(first, 5));
    pid_t stranger = fork();
    if (stranger == 0) {
        gid_t groups[] = {1000};
        if (setgroups(1, groups) != 0 || setresgid(1000, 1000, 1000) != 0 || setresuid(2000, 2000, 2000) != 0)
            _exit(99);
        int fd = connect_btlog();
        char c;
        _exit(fd >= 0 && recv(fd, &c, 1, 0) == 0 ? 0 : 1);  // let in, then shut out
    }
    EXPECT_TRUE(exits_with(stranger, 0));
    int second = connect_btlog();
    ASSERT_GE(second, 0);

    // More than a pipe and a socket hold: the service must not lose any.
    std::string bytes(300000, '\0');
    for (size_t i = 0; i < bytes.size(); i++) bytes[i] = static_cast<char>(i * 7 / 3);
    std::thread writer([&] {
        for (size_t done = 0; done < bytes.size();) {
            ssize_t n = write(feed, bytes.data() + done, bytes.size() - done);
            if (n > 0) done += static_cast<size_t>(n);
            else usleep(1000);
        }
    });
    std::string got_second;
    std::thread reader([&] { got_second = receive(second, bytes.size()); });
    EXPECT_TRUE(receive(first, bytes.size()) == bytes);
    reader.join();
    writer.join();
    EXPECT_TRUE(got_second == bytes);

    ASSERT_EQ(0, run_shell("emu_btlog stop", &out)) << out;
    char c;
    EXPECT_EQ(0, recv(first, &c, 1, 0));
    EXPECT_EQ(0, recv(second, &c, 1, 0));
    EXPECT_LT(connect_btlog(), 0);
    close(first);
    close(second);
    close(feed);
}

}  // namespace
