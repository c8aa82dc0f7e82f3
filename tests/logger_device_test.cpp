// The emulated phone's logger devices (emu_logger at /dev/log) against the
// rules of the phone's logger driver that the collectors rely on.
#include <grp.h>
#include <poll.h>
#include <pthread.h>
#include <sys/uio.h>

#include <log/log_read.h>
#include <log/logprint.h>

#include <atomic>
#include <thread>

#include "platform/logger_write.h"
#include "tests/test_util.h"

namespace {

struct Entry {
    LoggerHeader header = {};
    std::string payload;
};

// One read of at most size bytes: its length, or -errno.
ssize_t read_entry(int fd, Entry* e, size_t size = 5120) {
    char buf[5120];
    ssize_t n = read(fd, buf, size);
    if (n < 0) return -errno;
    if (n >= static_cast<ssize_t>(LOGGER_HEADER_LEN)) {
        memcpy(&e->header, buf, LOGGER_HEADER_LEN);
        e->payload.assign(buf + LOGGER_HEADER_LEN, n - LOGGER_HEADER_LEN);
    }
    return n;
}

bool readable(int fd) {
    struct pollfd p = {fd, POLLIN, 0};
    return poll(&p, 1, 0) == 1 && (p.revents & POLLIN);
}

void on_signal(int) {}

class LoggerDevice : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_TRUE(start_logger_devices("--size 8192"));
    }
};

TEST_F(LoggerDevice, EachWriteIsOneWholeEntry) {
    const LoggerHeader given = {0, 0, 1234, 5678, 10, 500000000};
    struct Row {
        const char* what;
        std::vector<std::string> parts;  // one writev
        const LoggerHeader* header;      // through the injection file
        std::string payload;             // "" when nothing is appended
    } rows[] = {
        {"plain write", {"hello"}, nullptr, "hello"},
        {"writev of priority, tag and message", {std::string("\4", 1), std::string("tag\0", 4), std::string("msg\0", 4)},
         nullptr, std::string("\4tag\0msg\0", 9)},
        {"payload cut at 4076", {std::string(5000, 'x')}, nullptr, std::string(4076, 'x')},
        {"empty write", {""}, nullptr, ""},
        {"injected header", {"given"}, &given, "given"},
    };
    int reader = open("/dev/log/main", O_RDONLY | O_NONBLOCK);
    ASSERT_GE(reader, 0);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        struct timespec before, after;
        clock_gettime(CLOCK_REALTIME, &before);
        if (row.header != nullptr) {
            ASSERT_EQ(1, logger_write("main", row.parts[0].data(), row.parts[0].size(), row.header));
        } else {
            std::vector<struct iovec> iov;
            for (const std::string& part : row.parts) iov.push_back({const_cast<char*>(part.data()), part.size()});
            int fd = open("/dev/log/main", O_WRONLY);
            EXPECT_EQ(static_cast<ssize_t>(row.payload.size()), writev(fd, iov.data(), static_cast<int>(iov.size())));
            close(fd);
        }
        clock_gettime(CLOCK_REALTIME, &after);
        Entry e;
        if (row.payload.empty()) {
            EXPECT_EQ(-EAGAIN, read_entry(reader, &e));
            continue;
        }
        ASSERT_EQ(static_cast<ssize_t>(LOGGER_HEADER_LEN + row.payload.size()), read_entry(reader, &e));
        EXPECT_EQ(row.payload.size(), e.header.len);
        EXPECT_EQ(row.payload, e.payload);
        if (row.header != nullptr) {
            EXPECT_EQ(0, memcmp(&e.header.pid, &given.pid, 16));
        } else {
            EXPECT_EQ(getpid(), e.header.pid);
            EXPECT_EQ(gettid(), e.header.tid);
            long long at = e.header.sec * 1000000000LL + e.header.nsec;
            EXPECT_LE(before.tv_sec * 1000000000LL + before.tv_nsec, at);
            EXPECT_GE(after.tv_sec * 1000000000LL + after.tv_nsec, at);
        }
    }
    close(reader);
}

TEST_F(LoggerDevice, ReadAndPollFollowUnreadEntries) {
    enum Op { POLL, READ, WRITE };
    struct Step {
        Op op;
        size_t size;     // READ: buffer size
        const char* text;  // WRITE: payload
        long expected;   // POLL: readable; READ: length or -errno
    } steps[] = {
        {POLL, 0, nullptr, 0},       {READ, 5120, nullptr, -EAGAIN}, {WRITE, 0, "first", 0},
        {WRITE, 0, "second!", 0},    {POLL, 0, nullptr, 1},          {READ, 24, nullptr, -EINVAL},
        {POLL, 0, nullptr, 1},       {READ, 25, nullptr, 25},        {READ, 26, nullptr, -EINVAL},
        {READ, 5120, nullptr, 27},   {POLL, 0, nullptr, 0},          {READ, 5120, nullptr, -EAGAIN},
    };
    int fd = open("/dev/log/radio", O_RDONLY | O_NONBLOCK);
    ASSERT_GE(fd, 0);
    for (size_t i = 0; i < sizeof(steps) / sizeof(steps[0]); i++) {
        SCOPED_TRACE("step " + std::to_string(i));
        const Step& s = steps[i];
        Entry e;
        if (s.op == POLL) {
            EXPECT_EQ(s.expected != 0, readable(fd));
        } else if (s.op == READ) {
            EXPECT_EQ(s.expected, read_entry(fd, &e, s.size));
        } else {
            ASSERT_EQ(1, logger_write("radio", s.text, strlen(s.text)));
        }
    }

    // Blocking waits end with the next entry; a signal ends a blocked read with EINTR.
    ASSERT_EQ(0, fcntl(fd, F_SETFL, 0));
    std::thread writer([] { usleep(20000), logger_write("radio", "woken", 5); });
    struct pollfd p = {fd, POLLIN, 0};
    EXPECT_EQ(1, poll(&p, 1, -1));  // a lost wake-up hangs here
    writer.join();
    Entry e;
    EXPECT_EQ(25, read_entry(fd, &e));
    struct sigaction sa = {};
    sa.sa_handler = on_signal;
    sigaction(SIGUSR1, &sa, nullptr);  // no SA_RESTART
    pthread_t self = pthread_self();
    std::atomic<bool> done(false);
    std::thread interrupter([&] {
        while (!done) usleep(20000), pthread_kill(self, SIGUSR1);
    });
    EXPECT_EQ(-EINTR, read_entry(fd, &e));
    done = true;
    interrupter.join();
    close(fd);
}

TEST_F(LoggerDevice, ReadersEachSeeEveryEntryAndLoseOldestWhole) {
    // 100 entries of 26 to 325 bytes wrap the 8 KiB ring several times.
    auto payload_of = [](int n) { return std::to_string(1000 + n) + std::string(n * 37 % 300, 'a' + n % 26); };
    int along = open("/dev/log/events", O_RDONLY | O_NONBLOCK);
    int behind = open("/dev/log/events", O_RDONLY | O_NONBLOCK);
    std::vector<int> seen_along;
    for (int n = 0; n < 100; n++) {
        std::string p = payload_of(n);
        ASSERT_EQ(1, logger_write("events", p.data(), p.size()));
        Entry e;
        if (read_entry(along, &e) > 0) seen_along.push_back(atoi(e.payload.substr(0, 4).c_str()) - 1000);
    }
    int late = open("/dev/log/events", O_RDONLY | O_NONBLOCK);
    EXPECT_EQ(100u, seen_along.size());
    for (int fd : {behind, late}) {
        std::vector<int> seen;
        Entry e;
        while (read_entry(fd, &e) > 0) {
            int n = atoi(e.payload.substr(0, 4).c_str()) - 1000;
            EXPECT_EQ(payload_of(n), e.payload);
            seen.push_back(n);
        }
        ASSERT_FALSE(seen.empty());
        EXPECT_GT(seen.front(), 0);  // the oldest are gone
        EXPECT_EQ(99, seen.back());
        for (size_t i = 1; i < seen.size(); i++) EXPECT_EQ(seen[i - 1] + 1, seen[i]);
        close(fd);
    }
    close(along);
}

TEST_F(LoggerDevice, WhoMayOpenWhat) {
    struct Row {
        const char* options;
        const char* path;
        int flags;
        bool log_group;  // opened as uid 2000, with or without group log
        int error;
    } rows[] = {
        {"", "/dev/log/main", O_WRONLY, false, 0},
        {"", "/dev/log/main", O_RDONLY, false, EACCES},
        {"", "/dev/log/main", O_RDONLY, true, 0},
        {"", "/dev/log/.inject", O_WRONLY, true, EACCES},
        {"--no-system", "/dev/log/system", O_RDONLY, true, ENOENT},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(std::string(row.path) + " " + row.options);
        ASSERT_TRUE(start_logger_devices(row.options));
        pid_t pid = fork();
        if (pid == 0) {
            gid_t groups[] = {1000, 1007};
            if (setgroups(row.log_group ? 2 : 1, groups) != 0 || setresgid(1000, 1000, 1000) != 0 ||
                setresuid(2000, 2000, 2000) != 0)
                _exit(99);
            int fd = open(row.path, row.flags);
            _exit(fd >= 0 ? 0 : errno);
        }
        EXPECT_TRUE(exits_with(pid, row.error));
    }
}

// The events writer's values as the platform's decoder reads them.
TEST(EventPayload, DecodesAsThePlatformReadsIt) {
    struct Row {
        std::vector<const char*> words;
        const char* message;  // "" when the words are refused
    } rows[] = {
        {{"i:5", "s:abc"}, "[5,abc]"},
        {{"l:-7"}, "-7"},
        {{"f:1.5"}, "1.500000"},
        {{"[", "i:1", "[", "s:x", "]", "]"}, "[1,[x]]"},
        {{"i:1", "]"}, ""},
        {{"[", "i:1"}, ""},
        {{"n:1"}, ""},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.message);
        uint8_t payload[LOGGER_MAX_PAYLOAD];
        long n = logger_event_payload(1000003, row.words.data(), static_cast<int>(row.words.size()), payload,
                                      sizeof(payload));
        ASSERT_EQ(*row.message == '\0', n < 0);
        if (n < 0) continue;
        struct logger_entry entry = {};
        uint8_t raw[sizeof(entry) + LOGGER_MAX_PAYLOAD];
        entry.len = static_cast<uint16_t>(n);
        entry.hdr_size = sizeof(entry);
        memcpy(raw, &entry, sizeof(entry));
        memcpy(raw + sizeof(entry), payload, n);
        AndroidLogEntry line;
        char text[1024];
        ASSERT_EQ(0, android_log_processBinaryLogBuffer(reinterpret_cast<struct logger_entry*>(raw), &line, nullptr,
                                                        text, sizeof(text)));
        EXPECT_EQ(row.message, std::string(line.message, line.messageLen));
    }
}

}  // namespace
