// The Android collector (its merge fed from memory, its endings on datagram socket
// pairs), and the rules of the phone's logger devices that it relies on.
#include "collectors/log_cat.h"

#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <sstream>

#include "platform/logger_write.h"
#include "test_util.h"

// Linked in place of the library's call (--wrap): rendering an entry whose
// message is "unrenderable" fails, as when the library finds no memory for a long line.
extern "C" char* __real_android_log_formatLogLine(AndroidLogFormat*, char*, size_t, const AndroidLogEntry*, size_t*);
extern "C" char* __wrap_android_log_formatLogLine(AndroidLogFormat* format, char* buf, size_t size,
                                                  const AndroidLogEntry* line, size_t* len) {
    if (line->messageLen >= 12 && strncmp(line->message, "unrenderable", 12) == 0) return nullptr;
    return __real_android_log_formatLogLine(format, buf, size, line, len);
}

namespace {

const char kOut[] = "/tmp/logcat_out";

// An entry dated ms milliseconds after second base, written by pid.
std::string entry(int32_t ms, const std::string& message, uint32_t base = 0, int32_t pid = 100) {
    char raw[LOGGER_READ_MAX];
    size_t n = make_legacy_text_entry(raw, pid, 101, base + ms / 1000, (ms % 1000) * 1000000u, 4, "t",
                                      message.c_str());
    return std::string(raw, n);
}

// One token per line sent: "^main" for a beginning line, else the message.
std::string tokens(const std::string& text) {
    std::string out;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        size_t begin = line.find("--------- beginning of ");
        size_t colon = line.find(": ");
        if (begin == 0) out += "^" + line.substr(line.rfind('/') + 1) + " ";
        else out += (colon == std::string::npos ? "?" + line : line.substr(colon + 2)) + " ";
    }
    return out;
}

// A collector's engine writing into a file, devices "M" (main) and "S" (system).
struct Engine {
    explicit Engine(const char* devices) : cat("main_log") {
        cat.transist_fd = open(kOut, O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        EXPECT_EQ(cat.set_output_format(), 1);
        for (const char* d = devices; *d; d++)
            cat.add_device(*d == 'M' ? "/dev/log/main" : "/dev/log/system", false, LOG_ID_MAIN, -1);
    }
    ~Engine() { close(cat.transist_fd); }
    LogDevice* device(int index) {
        LogDevice* d = cat.devices;
        while (index-- > 0) d = d->next;
        return d;
    }
    std::string sent() { return read_file(kOut); }
    LogCat cat;
};

// Steps: "M 10500 m1" queues entry m1 at 10.5 s on main ("S" system); "data"
// ends a pass that read data, "pause" a quiet batching time. Each ending adds
// the tokens sent since the previous one and "/".
TEST(LogCatMerge, SendsInTimeOrderAndHoldsALoneEntryUntilItIsSafe) {
    const struct {
        const char* name;
        const char* devices;
        std::vector<std::string> steps;
        const char* expect;
    } cases[] = {
        {"system older", "MS", {"M 10500 m", "S 10200 s", "data", "pause"}, "/ ^system s ^main m /"},
        {"equal times", "MS", {"M 7000 m1", "S 7000 s1", "S 7000 s2", "M 7000 m2", "pause"},
         "^main m1 m2 ^system s1 s2 /"},
        {"released by its own device", "MS",
         {"M 1000 m1", "S 2000 s1", "S 3000 s2", "data", "M 4000 m2", "data", "pause"},
         "/ ^main m1 ^system s1 / s2 m2 /"},
        {"late arrival on one device", "MS", {"M 3000 m3", "M 1000 m1", "M 2000 m2", "data", "pause"},
         "^main m1 m2 / m3 /"},
        {"one device, no beginning line", "M", {"M 2000 m2", "M 1000 m1", "pause"}, "m1 m2 /"},
    };
    for (const auto& c : cases) {
        Engine engine(c.devices);
        std::string got;
        size_t seen = 0;
        for (const std::string& step : c.steps) {
            if (step == "data" || step == "pause") {
                step == "data" ? engine.cat.print_ready() : engine.cat.print_all();
                engine.cat.flush_output();
                std::string sent = engine.sent();
                got += tokens(sent.substr(seen)) + "/ ";
                seen = sent.size();
                continue;
            }
            std::istringstream in(step);
            std::string device, message;
            int ms;
            in >> device >> ms >> message;
            std::string raw = entry(ms, message);
            ASSERT_EQ(engine.cat.take_entry(engine.device(device == "S"), raw.data(), raw.size()), 1);
        }
        EXPECT_EQ(got, std::string(c.expect) + " ") << c.name;
        EXPECT_EQ(engine.cat.queued_count, 0) << c.name;
    }
}

// A lone main entry while system streams on: at 10,000 held entries it is
// released, the backlog drains in order, and each overload adds one marker,
// dated now: last when the entries are older than the clock, first when the
// clock has stepped back behind them. In a child with a time limit (and a file
// size limit), as a collector that loops on its marker never ends.
TEST(LogCatMerge, EachOverloadReleasesTheHeldEntryWithOneMarkerWhateverTheClock) {
    const uint32_t now = static_cast<uint32_t>(time(nullptr));
    for (uint32_t base : {now - 86400, now + 3600}) {
        const bool stepped_back = base > now;
        pid_t pid = fork();
        if (pid == 0) {
            alarm(20);
            struct rlimit size = {1 << 23, 1 << 23};
            setrlimit(RLIMIT_FSIZE, &size);
            Engine engine("MS");
            for (int round = 0; round < 2; round++) {
                std::string raw = entry(round * 100000, "m" + std::to_string(round), base);
                engine.cat.take_entry(engine.device(0), raw.data(), raw.size());
                for (int i = 0; i < 10000; i++) {
                    raw = entry(round * 100000 + 1000 + i, "s" + std::to_string(i), base);
                    engine.cat.take_entry(engine.device(1), raw.data(), raw.size());
                    engine.cat.print_ready();
                }
                engine.cat.print_all();
            }
            _exit(0);
        }
        std::string expect;
        for (int round = 0; round < 2; round++) {
            expect += round == 0 ? "^main " : "";
            expect += stepped_back ? "trigger log " : "";
            expect += "m" + std::to_string(round) + " " + (round == 0 ? "^system " : "");
            for (int i = 0; i < 10000; i++) expect += "s" + std::to_string(i) + " ";
            expect += stepped_back ? "" : "trigger log ";
        }
        EXPECT_TRUE(exits_with(pid, 0, 30000)) << "the stream stopped moving, base " << base;
        EXPECT_TRUE(tokens(read_file(kOut)) == expect) << "base " << base;
    }
}

// As at 10,000 entries, entries of the longest payload are released with a
// marker once they take more than the byte budget, and not before.
TEST(LogCatMerge, ByteBudgetReleasesTheHeldEntryWithAMarker) {
    Engine engine("MS");
    std::string raw = entry(1000, "first");
    engine.cat.take_entry(engine.device(0), raw.data(), raw.size());
    std::string expect = "^main first ^system ";
    for (int i = 0; engine.sent().empty(); i++) {
        ASSERT_LT(i, 9999) << "not released by the bytes";
        std::string message = "s" + std::to_string(i) + std::string(4000, 'x');
        raw = entry(2000 + i, message);
        engine.cat.take_entry(engine.device(1), raw.data(), raw.size());
        bool over = engine.cat.queued_bytes > OVERLOAD_BYTES;
        engine.cat.print_ready();
        engine.cat.flush_output();
        ASSERT_EQ(engine.sent().empty(), !over) << "entry " << i;
        if (!over) expect += message + " ";
    }
    EXPECT_EQ(tokens(engine.sent()), expect);
    engine.cat.print_all();
    EXPECT_NE(lines_of(kOut).back().find("    0     0 W ORU     : trigger log"), std::string::npos)
        << lines_of(kOut).back();
}

// With a per-pid budget: "pid bytes ms" entries, each kept (+) or dropped (-);
// "? ms" lists the summaries due then as "pid:entries:bytes:tag".
TEST(FloodGuard, DropsOnlyTheWriterPastItsBudgetAndTellsOnceASecond) {
    const struct {
        const char* name;
        long budget;
        std::vector<std::string> steps;
    } cases[] = {
        {"off", 0, {"7 4000 0 +", "7 4000 0 +", "7 4000 0 +", "? 2000 "}},
        {"burst, then the rate",
         1024,
         {"7 1000 0 +", "7 1000 0 +", "7 1000 0 -", "8 1000 0 +", "7 100 0 -", "? 999 ", "7 1000 1000 +",
          "? 1000 7:2:1100:f7 ", "? 1500 ", "7 1000 1200 -", "? 2199 ", "? 2200 7:1:1000:f7 "}},
        {"a bucket fills to the burst only",
         1024,
         {"9 10 0 +", "9 10 1000 +", "9 2039 1000 -", "9 2048 60000 +", "9 10 60000 -"}},
    };
    for (const auto& c : cases) {
        FloodGuard guard;
        guard.set_budget(c.budget);
        for (const std::string& step : c.steps) {
            std::istringstream in(step);
            if (step[0] == '?') {
                std::string at;
                in >> at >> at;
                std::string got;
                FloodDrops d;
                while (guard.next_summary(std::stoll(at) * 1000, &d))
                    got += std::to_string(d.pid) + ":" + std::to_string(d.entries) + ":" + std::to_string(d.bytes) +
                           ":" + d.tag + " ";
                EXPECT_EQ("? " + at + " " + got, step) << c.name;
                continue;
            }
            long pid, bytes, ms;
            std::string kept;
            in >> pid >> bytes >> ms >> kept;
            std::string tag = "f" + std::to_string(pid);
            EXPECT_EQ(guard.admit(pid, tag.c_str(), bytes, ms * 1000LL), kept == "+") << c.name << ": " << step;
        }
    }
}

// An app floods main while another writes main and system: the other's
// entries all go out, the flood's excess is told in one summary line.
TEST(LogCatMerge, FloodOptionKeepsEveryOtherWritersEntries) {
    Engine engine("MS");
    engine.cat.flood.set_budget(4096);
    std::string expect;
    for (int i = 0; i < 40; i++) {
        std::string raw = entry(1000 + i, "flood" + std::string(1000, 'x'), 0, 666);
        engine.cat.take_entry(engine.device(0), raw.data(), raw.size());
        std::string message = "other" + std::to_string(i);
        raw = entry(1000 + i, message, 0, 200 + i % 2);
        engine.cat.take_entry(engine.device(i % 2), raw.data(), raw.size());
        engine.cat.print_ready();
    }
    engine.cat.print_all();
    engine.cat.report_drops(true);
    engine.cat.flush_output();
    std::string others, summary;
    int floods = 0;
    for (const std::string& line : lines_of(kOut)) {
        if (line.find(": other") != std::string::npos) others += line.substr(line.find(": other") + 2) + " ";
        if (line.find(": flood") != std::string::npos) floods++;
        if (line.find("TavloLogD: dropped") != std::string::npos) summary += line + "\n";
    }
    for (int i = 0; i < 40; i++) expect += "other" + std::to_string(i) + " ";
    EXPECT_EQ(others, expect);
    EXPECT_GT(floods, 0);
    EXPECT_LT(floods, 40);
    EXPECT_NE(summary.find(" W TavloLogD: dropped " + std::to_string(40 - floods) + " entries ("), std::string::npos)
        << summary;
    EXPECT_NE(summary.find(" of pid 666 tag t: past its budget of 4 KB/s"), std::string::npos) << summary;
    EXPECT_EQ(count_of(summary, "\n"), 1u) << summary;
}

// The loop on two datagram socket pairs: whatever made it end, everything it
// had read is sent first.
TEST(LogCatEnds, SendsWhatItReadBeforeItEnds) {
    const struct {
        const char* name;
        bool close_system, stop_word, signal, unrenderable;
        int status, reason;
    } cases[] = {
        {"end of stream", true, false, false, false, 1, REASON_READ},
        {"stop word", false, true, false, false, 0, REASON_NONE},
        {"stop signal", false, false, true, false, 0, REASON_SIGNAL},
        {"rendering fails", false, false, false, true, 1, REASON_OUTPUT},
    };
    for (const auto& c : cases) {
        RunBlock run;
        run.reset();
        control_stop(run.block) = c.stop_word;
        int main_pair[2], system_pair[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_SEQPACKET, 0, main_pair), 0);
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_SEQPACKET, 0, system_pair), 0);
        // The main entry is alone and older: the loop holds it back.
        for (auto [fd, raw] : {std::pair(main_pair[1], entry(1000, "m1")), std::pair(system_pair[1], entry(2000, "s1"))})
            ASSERT_EQ(write(fd, raw.data(), raw.size()), static_cast<ssize_t>(raw.size()));
        std::string last = entry(3000, "unrenderable");
        if (c.unrenderable) {
            ASSERT_EQ(write(system_pair[1], last.data(), last.size()), static_cast<ssize_t>(last.size()));
        }
        if (c.close_system) close(system_pair[1]);
        pid_t pid = fork();
        if (pid == 0) {
            Engine engine("");
            engine.cat.shm_fd = run.fd;
            install_stop_signal(&engine.cat);
            if (!attach_control_block(&engine.cat)) _exit(99);
            engine.cat.add_device("/dev/log/main", false, LOG_ID_MAIN, main_pair[0]);
            engine.cat.add_device("/dev/log/system", false, LOG_ID_SYSTEM, system_pair[0]);
            sigset_t usr1;  // a stop signal, pending until the loop waits
            sigemptyset(&usr1);
            sigaddset(&usr1, SIGUSR1);
            if (c.signal && sigprocmask(SIG_BLOCK, &usr1, nullptr) == 0) raise(SIGUSR1);
            engine.cat.read_log_lines();
        }
        EXPECT_TRUE(exits_with(pid, c.status)) << c.name;
        EXPECT_EQ(run.block->slots[SLOT_MAIN].exited, 1) << c.name;
        EXPECT_EQ(run.block->slots[SLOT_MAIN].reason, c.reason) << c.name;
        EXPECT_EQ(tokens(read_file(kOut)), "^main m1 ^system s1 ") << c.name;
        for (int fd : {main_pair[0], main_pair[1], system_pair[0], system_pair[1]}) close(fd);
    }
}

TEST(LogCatEnds, ADeviceThatCannotBeOpenedEndsItWithReasonOpen) {
    RunBlock run;
    run.reset();
    LogCat::device_root = "/tmp/no_logger/";
    pid_t pid = fork();
    if (pid == 0) LogCat("radio_log").run("radio_log", "radio", run.fd);
    EXPECT_TRUE(exits_with(pid, 1));
    EXPECT_EQ(run.block->slots[SLOT_RADIO].exited, 1);
    EXPECT_EQ(run.block->slots[SLOT_RADIO].reason, REASON_OPEN);
}

// One read of at most size bytes: its length, or -errno.
ssize_t read_entry(int fd, size_t size) {
    char buf[5120];
    ssize_t n = read(fd, buf, size);
    return n < 0 ? -errno : n;
}

bool readable(int fd) {
    struct pollfd p = {fd, POLLIN, 0};
    return poll(&p, 1, 0) == 1;
}

class LoggerDevice : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_TRUE(start_logger_devices("--size 8192"));
    }
};

TEST_F(LoggerDevice, ReadAndPollFollowUnreadEntries) {
    // Each step: write text (when given), then poll, then one read of size.
    struct Step {
        const char* text;
        bool readable;
        size_t size;
        long result;  // length or -errno
    } steps[] = {
        {nullptr, false, 5120, -EAGAIN}, {"first", true, 24, -EINVAL}, {"second!", true, 5120, 25},  // one entry a read
        {nullptr, true, 26, -EINVAL},    {nullptr, true, 27, 27},      {nullptr, false, 5120, -EAGAIN},
    };
    int fd = open("/dev/log/radio", O_RDONLY | O_NONBLOCK);
    for (const Step& s : steps) {
        SCOPED_TRACE(s.result);
        if (s.text != nullptr) {
            ASSERT_EQ(1, logger_write("radio", s.text, strlen(s.text)));
        }
        EXPECT_EQ(s.readable, readable(fd));
        EXPECT_EQ(s.result, read_entry(fd, s.size));
    }
    close(fd);
}

}  // namespace
