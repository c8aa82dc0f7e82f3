// A logging run of the real daemon end to end: what lands in the run folder,
// rotation into five generations, a stop in the middle of a steady stream,
// the exception engine's mode around a run, and the two ways a run ends by
// itself: a full storage card and a removed run folder.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdlib.h>
#include <sys/statfs.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"
#include "tests/integration/log_daemon.h"

namespace {

// The kernel collector alone: the other collectors would only add processes.
const std::vector<std::string> kKernelOnly = {"AndroidLog=0", "BTLog=0"};

long long now_ms() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

unsigned long long free_bytes(const std::string& host_path) {
    struct statfs st;
    if (statfs(host_path.c_str(), &st) != 0) return 0;
    return static_cast<unsigned long long>(st.f_bavail) * static_cast<unsigned long long>(st.f_bsize);
}

// Every "recv efd_thread" the daemon recorded is a nonzero multiple of the
// writer's notice (it may signal again while the run stops), and the platform
// log shows the same sums as the history.
void expect_writer_notices(const EmuPhone& phone, int notice) {
    bool same = false;
    std::vector<std::string> sums = recorded_values(phone, "recv efd_thread ", &same);
    EXPECT_TRUE(same) << platform_log(phone);
    EXPECT_FALSE(sums.empty()) << history(phone);
    for (const std::string& sum : sums) {
        EXPECT_NE("0", sum);
        EXPECT_EQ(0, atoi(sum.c_str()) % notice) << sum;
    }
}

TEST(LogRun, KernelLogHoldsTheHeaderAndExactlyTheBytesWritten) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    std::string folder = run_folder(phone);
    ASSERT_TRUE(is_run_folder_name(folder.substr(sizeof(kCardRoot) - 1))) << folder;

    // Lines longer than one read of the collector, every byte value, and a
    // last line without its line feed.
    std::string data = "<6>[    0.000000] first line\n";
    data += std::string(300, 'L') + "\n";
    for (int c = 0; c < 256; c++) data += static_cast<char>(c);
    data += "\n" + std::string(1000, 'M') + "\n<3>no line feed at the end";
    ASSERT_TRUE(phone.write_kmsg(data));
    std::string expected = kFileHeader + data;
    EXPECT_TRUE(EmuPhone::wait_for(
        [&] { return phone.read_file(folder + "kernel_log").size() >= expected.size(); }));
    ASSERT_EQ(0, ctl(phone, {"stop"}, &out));
    EXPECT_TRUE(same_bytes(phone.read_file(folder + "kernel_log"), expected));

    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

TEST(LogRun, RotationKeepsFiveGenerationsOfTheNewestBytes) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::vector<std::string> settings = kKernelOnly;
    settings.push_back("logsize=1");
    ASSERT_TRUE(configure(phone, settings));
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    ASSERT_EQ("204", phone.getprop("debug.TQ.logsize"));
    std::string folder = run_folder(phone);
    std::string current = folder + "kernel_log";

    // About eight files' worth: the oldest generations must go.
    std::string stream = numbered_lines("rotation", 0, 26000, 64);
    ASSERT_TRUE(phone.write_kmsg(stream, 30000));
    std::string last_line = stream.substr(stream.size() - 64);
    EXPECT_TRUE(EmuPhone::wait_for(
        [&] { return is_suffix(last_line, phone.read_file(current)); }, 20000));
    ASSERT_EQ(0, ctl(phone, {"stop"}, &out));

    EXPECT_FALSE(phone.file_exists(current + ".5"));
    std::string kept;
    // A file rotates after the write that takes it past 204 KB, by at most one
    // queue node (65535 bytes).
    const size_t min_rotated = 205 * 1024;
    const size_t max_rotated = min_rotated + 65535;
    for (int generation = 4; generation >= 0; generation--) {
        std::string name = generation ? current + "." + std::to_string(generation) : current;
        SCOPED_TRACE(name);
        std::string file;
        ASSERT_TRUE(phone.read_file(name, &file));
        bool has_header = false;
        std::string body = body_of(file, &has_header);
        EXPECT_TRUE(has_header);
        if (generation > 0) {
            EXPECT_GE(body.size(), min_rotated);
            EXPECT_LT(body.size(), max_rotated);
        }
        kept += body;
    }
    // Read in order from the oldest generation on, they are the stream's end.
    EXPECT_TRUE(is_suffix(kept, stream)) << kept.size() << " bytes kept of " << stream.size();
    EXPECT_LT(kept.size(), stream.size());
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

// Feeds numbered lines into the phone's kernel log at a steady pace until
// stopped. Each line is one write, whole in the FIFO or not at all.
class SteadyWriter {
  public:
    static constexpr int kLineLength = 48;

    explicit SteadyWriter(const std::string& fifo) : fifo_(fifo) {}
    ~SteadyWriter() { stop(); }

    bool start() {
        fd_ = open(fifo_.c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC);
        if (fd_ < 0) return false;
        thread_ = std::thread([this] { feed(); });
        return true;
    }
    void stop() {
        stop_ = true;
        if (thread_.joinable()) thread_.join();
        if (fd_ >= 0) close(fd_);
        fd_ = -1;
    }
    int lines() const { return lines_; }
    bool failed() const { return failed_; }

  private:
    void feed() {
        while (!stop_) {
            // About 16 lines a millisecond: a busy kernel, not a flood.
            for (int burst = 0; burst < 16 && !stop_; burst++) {
                std::string line = numbered_lines("steady", lines_, 1, kLineLength);
                ssize_t n = write(fd_, line.data(), line.size());
                if (n == static_cast<ssize_t>(line.size())) {
                    lines_++;
                } else if (n < 0 && (errno == EAGAIN || errno == EINTR)) {
                    // Nobody reads (the run stopped): wait for room, or for the end.
                    struct pollfd pfd = {fd_, POLLOUT, 0};
                    poll(&pfd, 1, 10);
                } else {
                    failed_ = true;
                    return;
                }
            }
            usleep(1000);
        }
    }

    std::string fifo_;
    int fd_ = -1;
    std::thread thread_;
    std::atomic<bool> stop_{false};
    std::atomic<int> lines_{0};
    std::atomic<bool> failed_{false};
};

TEST(LogRun, StopInASteadyStreamLosesAndRepeatsNothing) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, kKernelOnly));
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    std::string first = run_folder(phone) + "kernel_log";

    SteadyWriter writer(phone.host_path("/dev/emu/kmsg"));
    ASSERT_TRUE(writer.start());
    ASSERT_TRUE(EmuPhone::wait_for([&] { return phone.read_file(first).size() > 20000; }));

    int sent_before_stop = writer.lines();
    long long t0 = now_ms();
    int rc = ctl(phone, {"stop"}, &out);
    long long stop_ms = now_ms() - t0;
    writer.stop();
    ASSERT_FALSE(writer.failed());
    EXPECT_EQ(0, rc);
    EXPECT_EQ("stop,1\n", out);
    // The collector is asked first and killed after 0.9 s at most.
    EXPECT_LT(stop_ms, 3000);

    const std::string stream = numbered_lines("steady", 0, writer.lines(), SteadyWriter::kLineLength);
    std::string first_file = phone.read_file(first);
    std::string first_body = body_of(first_file);
    EXPECT_TRUE(is_prefix(first_body, stream)) << first_body.size() << " bytes";
    // Whatever was in the kernel log when the stop was sent is in the file.
    EXPECT_GE(first_body.size(), static_cast<size_t>(sent_before_stop) * SteadyWriter::kLineLength);

    // The rest waits in the kernel log; the next run takes it from where the
    // first one stopped. The collector forwards its reads as they come, and a
    // FIFO (unlike the kernel's log, which hands out whole records) ends a
    // read anywhere: the first file may end inside a line that the next run's
    // file completes. In the same second the next run reuses the folder.
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    std::string second = run_folder(phone) + "kernel_log";
    size_t skip = second == first ? first_file.size() : 0;
    size_t rest = stream.size() - first_body.size();
    EXPECT_TRUE(EmuPhone::wait_for([&] {
        return phone.read_file(second).size() >= skip + sizeof(kFileHeader) - 1 + rest;
    }));
    ASSERT_EQ(0, ctl(phone, {"stop"}, &out));
    std::string second_body = body_of(phone.read_file(second).substr(skip));
    EXPECT_TRUE(same_bytes(first_body + second_body, stream));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

struct OruCase {
    const char* name;
    std::vector<std::string> build_prop;
    const char* after_start;  // content of the oru stand-in's call record
    const char* after_stop;
};

void PrintTo(const OruCase& c, std::ostream* os) { *os << c.name; }

class LogRunOru : public ::testing::TestWithParam<OruCase> {};

TEST_P(LogRunOru, ModeFollowsTheBuild) {
    const OruCase& c = GetParam();
    EmuPhone phone;
    BootOptions options;
    options.build_prop = c.build_prop;
    ASSERT_TRUE(phone.boot(options));
    EXPECT_EQ("", phone.read_file("/dev/emu/oru_calls"));
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ(c.after_start, phone.read_file("/dev/emu/oru_calls"));
    ASSERT_EQ(0, ctl(phone, {"stop"}, &out));
    EXPECT_EQ(c.after_stop, phone.read_file("/dev/emu/oru_calls"));
    bool switched = c.after_start[0] != '\0';
    EXPECT_EQ(switched, contains(history(phone), "init oru mode:"));
    EXPECT_EQ(switched, contains(history(phone), "deinit oru mode:"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

INSTANTIATE_TEST_SUITE_P(
    Builds, LogRunOru,
    ::testing::Values(OruCase{"UserCustomer", {}, "-m 3\n", "-m 3\n-m 4\n"},
                      OruCase{"UserInternal", {"ro.oru.build.info=internal"}, "-m 1\n",
                              "-m 1\n-m 2\n"},
                      OruCase{"Eng", {"ro.build.type=eng"}, "", ""}),
    [](const ::testing::TestParamInfo<OruCase>& info) { return info.param.name; });

TEST(LogRunEnds, WhenTheCardRunsLowEveryClientHearsStorageFull) {
    EmuPhone phone;
    BootOptions options;
    options.sdcard_mb = 14;
    ASSERT_TRUE(phone.boot(options));
    ASSERT_GT(free_bytes(phone.host_path("/mnt/sdcard")), 10ull << 20);
    ASSERT_TRUE(configure(phone, kKernelOnly));
    auto starter = connect_listener(phone, "start");
    ASSERT_TRUE(starter);
    EXPECT_EQ("start,1\n", starter->output());
    auto bystander = connect_listener(phone);
    ASSERT_TRUE(bystander);
    std::string folder = run_folder(phone);

    // Six megabytes take the card below 10 MiB free. Once the run stops nobody
    // reads any more, so the writing ends there.
    const std::string stream = numbered_lines("fill", 0, 6 * 16384, 64);
    for (size_t at = 0; at < stream.size() && phone.getprop("debug.TQ.running") == "1";
         at += 256 * 1024) {
        if (!phone.write_kmsg(stream.substr(at, 256 * 1024), 3000)) break;
    }
    EXPECT_TRUE(starter->read_until("storage_full", 10000)) << starter->output();
    EXPECT_TRUE(bystander->read_until("storage_full", 10000)) << bystander->output();
    EXPECT_TRUE(wait_history(phone, "tavlolog stop done"));
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    std::string text = history(phone);
    EXPECT_TRUE(contains(text, "/mnt/sdcard is almost full or unavailable!!")) << text;
    EXPECT_TRUE(contains(text, "no space to write log")) << text;
    expect_writer_notices(phone, 1001);
    EXPECT_TRUE(is_prefix(body_of(phone.read_file(folder + "kernel_log")), stream));
    // The daemon still serves its clients.
    EXPECT_EQ(-1, starter->wait(0));
    std::string out;
    EXPECT_EQ(0, ctl(phone, {"stop"}, &out));
    EXPECT_EQ("stop,1\n", out);
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

TEST(LogRunEnds, WhenTheRunFolderIsRemovedEveryClientHearsFolderLost) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, kKernelOnly));
    auto starter = connect_listener(phone, "start");
    ASSERT_TRUE(starter);
    auto bystander = connect_listener(phone);
    ASSERT_TRUE(bystander);
    std::string folder = run_folder(phone);
    ASSERT_TRUE(phone.write_kmsg("before the removal\n"));
    ASSERT_TRUE(EmuPhone::wait_for(
        [&] { return contains(phone.read_file(folder + "kernel_log"), "before the removal"); }));

    ASSERT_EQ(0, phone.exec({"rm", "-r", folder}));
    ASSERT_TRUE(phone.write_kmsg("after the removal\n"));
    EXPECT_TRUE(starter->read_until("log_folder_lost", 10000)) << starter->output();
    EXPECT_TRUE(bystander->read_until("log_folder_lost", 10000)) << bystander->output();
    EXPECT_TRUE(wait_history(phone, "tavlolog stop done"));
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    std::string text = history(phone);
    EXPECT_TRUE(contains(text, "log files " + folder + "kernel_log not exist:2")) << text;
    expect_writer_notices(phone, 1002);
    EXPECT_FALSE(phone.file_exists(folder));

    // The next start makes its folder again.
    std::string out;
    EXPECT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    EXPECT_TRUE(phone.file_exists(run_folder(phone) + "kernel_log"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

}  // namespace
