// The emulated phone's logger devices (emu_logger at /dev/log) against the
// rules of the phone's logger driver that the collectors rely on.
#include <poll.h>
#include <pthread.h>
#include <sys/uio.h>

#include <atomic>
#include <thread>

#include "platform/logger_write.h"
#include "tests/test_util.h"

namespace {

// One read of at most size bytes: its length, or -errno; the entry in *e.
ssize_t read_entry(int fd, std::string* e = nullptr, size_t size = 5120) {
    char buf[5120];
    ssize_t n = read(fd, buf, size);
    if (n >= 0 && e != nullptr) e->assign(buf, n);
    return n < 0 ? -errno : n;
}

bool readable(int fd) {
    struct pollfd p = {fd, POLLIN, 0};
    return poll(&p, 1, 0) == 1;
}

void on_signal(int) {}

class LoggerDevice : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_TRUE(start_logger_devices("--size 8192"));
    }
};

// A writev is one entry (cut at the largest payload, nothing for an empty
// one), stamped with the writer's ids; an injected entry keeps its header.
TEST_F(LoggerDevice, EachWriteIsOneWholeEntry) {
    const LoggerHeader given = {0, 0, 1234, 5678, 10, 500000000};
    const struct {
        std::vector<std::string> parts;
        const LoggerHeader* header;  // inject with this header instead of a writev
        std::string payload;         // "" when nothing is appended
    } rows[] = {
        {{std::string("\4", 1), std::string("tag\0", 4), std::string("msg\0", 4)}, nullptr, std::string("\4tag\0msg\0", 9)},
        {{std::string(5000, 'x')}, nullptr, std::string(4076, 'x')},
        {{""}, nullptr, ""},
        {{"given"}, &given, "given"},
    };
    int reader = open("/dev/log/main", O_RDONLY | O_NONBLOCK);
    for (const auto& row : rows) {
        SCOPED_TRACE(row.payload.substr(0, 9));
        if (row.header != nullptr) {
            ASSERT_EQ(1, logger_write("main", row.parts[0].data(), row.parts[0].size(), row.header));
        } else {
            std::vector<struct iovec> iov;
            for (const std::string& part : row.parts) iov.push_back({const_cast<char*>(part.data()), part.size()});
            int fd = open("/dev/log/main", O_WRONLY);
            EXPECT_EQ(static_cast<ssize_t>(row.payload.size()), writev(fd, iov.data(), static_cast<int>(iov.size())));
            close(fd);
        }
        std::string e;
        ssize_t n = read_entry(reader, &e);
        ASSERT_EQ(row.payload.empty() ? -EAGAIN : static_cast<ssize_t>(LOGGER_HEADER_LEN + row.payload.size()), n);
        if (n < 0) continue;
        LoggerHeader h;
        memcpy(&h, e.data(), sizeof(h));
        EXPECT_EQ(row.payload.size(), h.len);
        EXPECT_EQ(row.payload, e.substr(LOGGER_HEADER_LEN));
        LoggerHeader own = {0, 0, getpid(), static_cast<int32_t>(gettid()), 0, 0};
        EXPECT_EQ(0, memcmp(&h.pid, row.header ? &given.pid : &own.pid, row.header ? 16 : 8));
    }
    close(reader);
}

TEST_F(LoggerDevice, ReadAndPollFollowUnreadEntries) {
    // Each step: write text (when given), then poll, then one read of size.
    struct Step {
        const char* text;
        bool readable;
        size_t size;
        long result;  // length or -errno
    } steps[] = {
        {nullptr, false, 5120, -EAGAIN}, {"first", true, 24, -EINVAL}, {"second!", true, 25, 25},
        {nullptr, true, 26, -EINVAL},    {nullptr, true, 5120, 27},    {nullptr, false, 5120, -EAGAIN},
    };
    int fd = open("/dev/log/radio", O_RDONLY | O_NONBLOCK);
    for (const Step& s : steps) {
        SCOPED_TRACE(s.result);
        if (s.text != nullptr) {
            ASSERT_EQ(1, logger_write("radio", s.text, strlen(s.text)));
        }
        EXPECT_EQ(s.readable, readable(fd));
        EXPECT_EQ(s.result, read_entry(fd, nullptr, s.size));
    }

    // A blocked poll wakes for the next entry; a signal ends a blocked read with EINTR.
    ASSERT_EQ(0, fcntl(fd, F_SETFL, 0));
    std::thread writer([] { usleep(20000), logger_write("radio", "woken", 5); });
    struct pollfd p = {fd, POLLIN, 0};
    EXPECT_EQ(1, poll(&p, 1, -1));  // a lost wake-up hangs here
    writer.join();
    EXPECT_EQ(25, read_entry(fd));
    struct sigaction sa = {};
    sa.sa_handler = on_signal;
    sigaction(SIGUSR1, &sa, nullptr);  // no SA_RESTART
    pthread_t self = pthread_self();
    std::atomic<bool> done(false);
    std::thread interrupter([&] {
        while (!done) usleep(20000), pthread_kill(self, SIGUSR1);
    });
    EXPECT_EQ(-EINTR, read_entry(fd));
    done = true;
    interrupter.join();
    close(fd);
}

TEST_F(LoggerDevice, ReadersEachSeeEveryEntryAndLoseOldestWhole) {
    // 100 entries of 24 to 323 bytes wrap the 8 KiB ring several times.
    auto payload_of = [](int n) { return std::to_string(1000 + n) + std::string(n * 37 % 300, 'a' + n % 26); };
    int along = open("/dev/log/events", O_RDONLY | O_NONBLOCK);
    int behind = open("/dev/log/events", O_RDONLY | O_NONBLOCK);
    int read_along = 0;
    for (int n = 0; n < 100; n++) {
        std::string p = payload_of(n), e;
        ASSERT_EQ(1, logger_write("events", p.data(), p.size()));
        read_along += read_entry(along, &e) > 0 && e.substr(LOGGER_HEADER_LEN) == p;
    }
    EXPECT_EQ(100, read_along);
    for (int fd : {behind, open("/dev/log/events", O_RDONLY | O_NONBLOCK)}) {
        std::vector<int> seen;
        for (std::string e; read_entry(fd, &e) > 0;) {
            seen.push_back(atoi(e.substr(LOGGER_HEADER_LEN, 4).c_str()) - 1000);
            EXPECT_EQ(payload_of(seen.back()), e.substr(LOGGER_HEADER_LEN));
        }
        ASSERT_FALSE(seen.empty());
        EXPECT_GT(seen.front(), 0);  // the oldest are gone
        EXPECT_EQ(99, seen.back());
        for (size_t i = 1; i < seen.size(); i++) EXPECT_EQ(seen[i - 1] + 1, seen[i]);
        close(fd);
    }
    close(along);
}

}  // namespace
