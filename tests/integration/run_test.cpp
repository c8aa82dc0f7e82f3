// Logging runs of the real daemon end to end: every byte of every collector
// lands once in its file, a stop in a steady stream loses and repeats nothing,
// rotation, and the ways a run ends by itself.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <atomic>
#include <sstream>
#include <thread>

#include "tests/integration/log_daemon.h"

namespace {

const std::string H = kFileHeader;

std::string odd_bytes() {
    // Lines longer than one read of the collector, every byte value, and a
    // last line without its line feed.
    std::string data = "<6>[    0.000000] first line\n" + std::string(300, 'L') + "\n";
    for (int c = 0; c < 256; c++) data += static_cast<char>(c);
    return data + "\n" + std::string(1000, 'M') + "\n<3>no line feed at the end";
}

const std::string kRotation = numbered_lines("rotation", 0, 26000);  // about eight files' worth

SCENARIOS(Run, {
    {"KernelLogHoldsTheHeaderAndExactlyTheBytesWritten", {}, {},
     {{"ctl", "start"}, {"kmsg", odd_bytes()}, {"has", "$RUN/kernel_log", "at the end"}, {"ctl", "stop"},
      {"is", "$RUN/kernel_log", H + odd_bytes()}}},
    // The last line written can fill a file: it then ends kernel_log.1.
    {"RotationKeepsFiveGenerations", {}, {},
     {{"ctl", "AndroidLog=0 BTLog=0 logsize=1 start"}, {"prop", "debug.TQ.logsize", "204"}, {"kmsg", kRotation},
      {"sh", "cd $(getprop debug.TQ.realpath) && until cat kernel_log.1 kernel_log 2>/dev/null | grep -qxF '" +
                 kRotation.substr(kRotation.size() - 64, 63) + "'; do sleep 0.05; done; echo in", "in\n"},
      {"ctl", "stop"}, {"has", "$RUN/kernel_log.4", H}, {"gone", "$RUN/kernel_log.5"}}},
    // Killed from outside, a collector leaves no reason and no warning is
    // given; asked to stop by its own signal, it leaves reason 0, which is.
    {"CollectorDeathStopsTheRunAndTellsEveryClient", {}, {},
     {{"ctl", "AndroidLog=0 BTLog=0"}, {"listen", "starter", "start"}, {"listen", "bystander"}, {"mark"},
      {"kmsg", "before the death\n"}, {"has", "$MARK/kernel_log", "before the death"},
      {"sh", kill_kernel_collector("KILL")}, {"hear", "starter", "tqlog_stopped"},
      {"hear", "bystander", "tqlog_stopped"}, {"hist", "tavlolog stop done"}, {"prop", "debug.TQ.running", "0"},
      {"hist", "kLog dies unexpectly", "1"}, {"hist", "all chil processes die", "1"},
      {"hist", "oru warning comes", "0"}, {"is", "$MARK/kernel_log", H + "before the death\n"},
      {"alive", "starter"}, {"alive", "bystander"}, {"ctl", "start"}, {"kmsg", "after the death\n"},
      {"has", "$RUN/kernel_log", "after the death\n"}, {"sh", kill_kernel_collector("USR1")},
      {"hist", "oru warning comes,type is 0\n"}, {"hist", "all chil processes die", "2"}}},
    // One collector killed from outside: the run goes on without it, and the
    // status shows it down within a second.
    {"OneCollectorsDeathShowsInTheStatus", {}, {},
     {{"ctl", "start"}, {"prop", "debug.TQ.collectors", "main=up,radio=up,events=up,kernel=up,bt=up"},
      {"sh", std::string("kill -9 $(grep -o 'M([0-9]*)' ") + kHistory + " | tail -n 1 | tr -dc 0-9); " +
                 "for i in $(seq 20); do getprop debug.TQ.collectors | grep -q main=down && break; sleep 0.05; done; " +
                 "tavlologctl status | grep collectors",
       "collectors: main down, radio up, events up, kernel up, bt up\n"},
      {"hist", "mLog dies unexpectly", "1"}, {"prop", "debug.TQ.running", "1"}, {"kmsg", "still recorded\n"},
      {"has", "$RUN/kernel_log", "still recorded"}, {"ctl", "stop"},
      {"sh", "tavlologctl status | grep collectors", "collectors: none\n"}}},
    // Five megabytes take the 14 MB card below its 10 MiB reserve.
    {"LowCardStopsTheRunAndTellsEveryClient", {}, {"--sdcard-size", "14"},
     {{"ctl", "AndroidLog=0 BTLog=0"}, {"listen", "starter", "start"}, {"listen", "bystander"},
      {"sh", "dd if=/dev/zero of=/mnt/sdcard/filler bs=1M count=5 2>/dev/null"}, {"kmsg", "after the fill\n"},
      {"hear", "starter", "storage_full"}, {"hear", "bystander", "storage_full"}, {"hist", "tavlolog stop done"},
      {"prop", "debug.TQ.running", "0"}, {"hist", "/mnt/sdcard is almost full or unavailable!!"},
      {"hist", "no space to write log"}, {"alive", "starter"}, {"ctl", "stop"}}},
    {"RemovedRunFolderStopsTheRunAndTellsEveryClient", {}, {},
     {{"ctl", "AndroidLog=0 BTLog=0"}, {"listen", "starter", "start"}, {"listen", "bystander"},
      {"kmsg", "before the removal\n"}, {"has", "$RUN/kernel_log", "before the removal"},
      {"sh", "rm -r $(getprop debug.TQ.realpath)"}, {"kmsg", "after the removal\n"},
      {"hear", "starter", "log_folder_lost"}, {"hear", "bystander", "log_folder_lost"},
      {"hist", "tavlolog stop done"}, {"prop", "debug.TQ.running", "0"}, {"hist", "kernel_log not exist:2"},
      {"ctl", "start"}, {"has", "$RUN/kernel_log", H}}},
});

// Feeds numbered lines into the kernel log at a steady pace, about 16 a
// millisecond (a busy kernel, not a flood). Each line is one write, whole in
// the FIFO or not at all; while nobody reads, it waits for room.
class SteadyWriter {
  public:
    static constexpr int kLength = 48;
    explicit SteadyWriter(int fd) : thread_([this, fd] { feed(fd); }) {}
    ~SteadyWriter() { finish(); }
    int lines() const { return lines_; }
    int finish() {  // the lines written, -1 after a failed write
        stop_ = true;
        if (thread_.joinable()) thread_.join();
        return failed_ ? -1 : lines_.load();
    }

  private:
    void feed(int fd) {
        for (; !stop_; usleep(1000)) {
            for (int burst = 0; burst < 16 && !stop_; burst++) {
                std::string line = numbered_lines("steady", lines_, 1, kLength);
                ssize_t n = write(fd, line.data(), line.size());
                struct pollfd pfd = {fd, POLLOUT, 0};
                if (n == kLength) lines_++;
                else if (n < 0 && (errno == EAGAIN || errno == EINTR)) poll(&pfd, 1, 10);
                else return (void)(failed_ = true);
            }
        }
    }
    std::atomic<bool> stop_{false}, failed_{false};
    std::atomic<int> lines_{0};
    std::thread thread_;
};

std::string body(const std::string& file) {
    EXPECT_EQ(0u, file.find(H)) << "no header";
    return file.compare(0, H.size(), H) == 0 ? file.substr(H.size()) : std::string();
}

TEST(LogRun, StopInASteadyStreamLosesAndRepeatsNothing) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(ctl(phone, "AndroidLog=0 BTLog=0 start"));
    std::string first = run_folder(phone) + "kernel_log";
    int fd = open(phone.host_path("/dev/emu/kmsg").c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    SteadyWriter writer(fd);
    ASSERT_TRUE(EmuPhone::wait_for([&] { return phone.read_file(first).size() > 20000; }));
    size_t sent_before_stop = static_cast<size_t>(writer.lines()) * SteadyWriter::kLength;
    EXPECT_TRUE(ctl(phone, "stop"));
    int lines = writer.finish();
    close(fd);
    ASSERT_GE(lines, 0);

    // Whatever was in the kernel log when the stop was sent is in the file.
    const std::string stream = numbered_lines("steady", 0, lines, SteadyWriter::kLength);
    std::string first_file = phone.read_file(first), first_body = body(first_file);
    EXPECT_EQ(0, stream.compare(0, first_body.size(), first_body));
    EXPECT_GE(first_body.size(), sent_before_stop);

    // Each read of the kernel log is whole lines, so the first file ends at a
    // line's end; the rest waits in the kernel log for the next run. In the
    // same second the next run reuses the folder.
    EXPECT_TRUE(!first_body.empty() && first_body.back() == '\n') << "the first file ends inside a line";
    ASSERT_TRUE(ctl(phone, "start"));
    std::string second = run_folder(phone) + "kernel_log";
    size_t skip = second == first ? first_file.size() : 0;
    EXPECT_TRUE(EmuPhone::wait_for([&] {
        return phone.read_file(second).size() >= skip + H.size() + stream.size() - first_body.size();
    }));
    ASSERT_TRUE(ctl(phone, "stop"));
    EXPECT_TRUE(same_bytes(first_body + body(phone.read_file(second).substr(skip)), stream));
    EXPECT_EQ(1, count(phone.read_file("/dev/emu/init.log"), "start tavlo_log_d pid "));
}

// "MM-DD HH:MM:SS.mmm  pid  tid P tag: message", as the platform library renders it.
bool is_threadtime(const std::string& line) {
    int f[8], used = 0;
    char priority;
    return sscanf(line.c_str(), "%2d-%2d %2d:%2d:%2d.%3d %d %d %c %n", &f[0], &f[1], &f[2], &f[3], &f[4], &f[5],
                  &f[6], &f[7], &priority, &used) == 9 &&
           used > 0 && strchr("VDIWEF", priority) != nullptr && line.find(": ", used) != std::string::npos;
}

std::string numbered(const std::string& word, int n) {
    std::string text;
    for (int i = 0; i < n; i++) text += word + " " + std::to_string(i) + "\n";
    return text;
}

TEST(AllCollectors, EveryEntryLandsOnceInItsFileAndTheStopTakesThemAll) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(ctl(phone, "start"));
    std::string folder = run_folder(phone), text = history(phone);
    int pids[5] = {};
    size_t at = text.rfind(" M(");
    ASSERT_NE(std::string::npos, at);
    sscanf(text.c_str() + at, " M(%d),R(%d),E(%d),K(%d),B(%d)", &pids[0], &pids[1], &pids[2], &pids[3], &pids[4]);
    for (int pid : pids) EXPECT_GT(pid, 0) << text.substr(at, 60);

    // Kernel and Bluetooth bytes pass through relays of the phone: wait for them.
    std::string bt;
    for (int i = 0; i < 600; i++) bt.push_back(static_cast<char>(i % 256));
    ASSERT_TRUE(phone.feed("btlog", bt) && phone.feed("kmsg", "<6>kernel line\n"));
    EXPECT_TRUE(EmuPhone::wait_for([&] {
        return phone.read_file(folder + "bt_log").size() > bt.size() &&
               contains(phone.read_file(folder + "kernel_log"), "kernel line");
    }));
    // The Android entries are written right before the stop.
    const struct {
        std::vector<std::string> args;
        std::string input;
    } writes[] = {
        {{"log", "-t", "demo", "hello"}, ""},
        {{"log", "-b", "system", "-t", "sys"}, numbered("system", 300)},
        {{"log", "-t", "num"}, numbered("main", 300)},
        {{"log", "-b", "radio", "-t", "rad"}, numbered("radio", 100)},
        {{"log", "-b", "events", "-t", "1000001", "i:42"}, ""},
        {{"log", "-b", "events", "-t", "1000003", "i:3", "s:lbl"}, ""},
    };
    for (const auto& w : writes) ASSERT_EQ(0, phone.exec(w.args, nullptr, w.input)) << w.args[1];
    ASSERT_TRUE(ctl(phone, "stop"));

    std::string main_log = body(phone.read_file(folder + "main_log")), previous;
    EXPECT_EQ(0u, main_log.find("--------- beginning of /dev/log/main\n"));
    EXPECT_EQ(1, count(main_log, "--------- beginning of /dev/log/system\n"));
    std::istringstream in(main_log);
    for (std::string line; std::getline(in, line);) {
        if (line.rfind("--------- beginning of ", 0) == 0) continue;
        EXPECT_TRUE(is_threadtime(line)) << line;
        EXPECT_LE(previous, line.substr(0, 18)) << "out of time order: " << line;
        previous = line.substr(0, 18);
    }
    EXPECT_EQ(1, count(main_log, " I demo    : hello\n"));
    std::string radio_log = body(phone.read_file(folder + "radio_log"));
    const struct {
        const std::string* log;
        const char* word;
        int n;
    } streams[] = {{&main_log, "main", 300}, {&main_log, "system", 300}, {&radio_log, "radio", 100}};
    for (const auto& s : streams)
        for (int i = 0; i < s.n; i++) EXPECT_EQ(1, count(*s.log, std::string(": ") + s.word + " " + std::to_string(i) + "\n")) << s.word << i;
    std::string events_log = body(phone.read_file(folder + "events_log"));
    EXPECT_EQ(1, count(events_log, " I tavlo_demo_int: 42\n")) << events_log;
    EXPECT_EQ(1, count(events_log, " I tavlo_demo_list: [3,lbl]\n")) << events_log;
    EXPECT_TRUE(same_bytes(body(phone.read_file(folder + "bt_log")), bt));
    EXPECT_EQ("<6>kernel line\n", body(phone.read_file(folder + "kernel_log")));
    EXPECT_FALSE(contains(history(phone), "dies unexpectly")) << history(phone);
    EXPECT_EQ(1, count(phone.read_file("/dev/emu/init.log"), "start tavlo_log_d pid "));
}

}  // namespace
