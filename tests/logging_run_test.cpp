// Logging run start and stop, run folders, rotation size, the exception-engine
// switch and the supervision of the collectors, with the real transist and the
// real kernel collector reading a FIFO that stands in for /proc/kmsg.
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <string>
#include <thread>

#include "collectors/control_block.h"
#include "collectors/kmsg_cat.h"
#include "core/child_supervision.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "transist/transist.h"
#include "platform/properties.h"
#include "platform/property_area.h"

namespace {

const char* const kHistory = "/data/misc/tqlog/tqlog_history";
const char* const kFifo = "/tmp/kmsg_fifo";

std::string read_file(const std::string& path) {
    std::string out;
    int fd = open(path.c_str(), O_RDONLY);
    if (fd < 0) return out;
    char buf[4096];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) out.append(buf, static_cast<size_t>(n));
    close(fd);
    return out;
}

bool history_has(const std::string& text) { return read_file(kHistory).find(text) != std::string::npos; }

std::string property(const char* key) {
    char value[PROPERTY_VALUE_MAX];
    property_get(key, value, "");
    return value;
}

double seconds_since(const timespec& start) {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec - start.tv_sec) + (now.tv_nsec - start.tv_nsec) / 1e9;
}

// A log file's content after the writer's one-line timezone header.
std::string log_body(const char* path) {
    std::string text = read_file(path);
    if (text.compare(0, 14, "-----timezone:") != 0) return "(no header) " + text;
    return text.substr(text.find('\n') + 1);
}

// ---- rotation size ----

struct RotateCase {
    int files;
    int megabytes;
    int expect_kb;
};

TEST(CalcRotateSize, SplitsTheRunSizeOverItsFiles) {
    const RotateCase cases[] = {
        {25, 60, 2457},    // all five collectors
        {5, 60, 12288},    // kernel only
        {15, 1, 68},       // truncated, not rounded
        {20, 0, 0},
        {5, 4000000, 819200000},
        {1, 3000000, 2147483647},  // would not fit an int: the largest limit instead
    };
    for (const RotateCase& c : cases) {
        LogController controller;
        controller.log_file_num = c.files;
        EXPECT_EQ(calc_rotate_size(&controller, c.megabytes), c.expect_kb) << c.files << " " << c.megabytes;
    }
}

TEST(CalcRotateSize, NoFilesIsRecordedAndGivesZero) {
    LogController controller;
    controller.log_file_num = 0;
    EXPECT_EQ(calc_rotate_size(&controller, 60), 0);
    EXPECT_TRUE(history_has("Invalid log file num:0"));
}

// ---- run folders ----

TEST(ComposeRunFolder, NamesTheFolderAfterTheStartTime) {
    LogController controller;
    strcpy(controller.logpath, "/mnt/sdcard");
    compose_run_folder(&controller);
    std::string folder = controller.run_folder;
    const std::string root = "/mnt/sdcard/qrvlog/tavlolog/";
    ASSERT_EQ(folder.compare(0, root.size(), root), 0) << folder;
    std::string name = folder.substr(root.size());
    EXPECT_EQ(name.size(), strlen("APLog_2026_0304_070649/")) << name;
    struct tm when = {};
    const char* rest = strptime(name.c_str(), "APLog_%Y_%m%d_%H%M%S/", &when);
    ASSERT_NE(rest, nullptr) << name;
    EXPECT_EQ(*rest, '\0') << name;
    time_t now = time(nullptr);
    struct tm local;
    localtime_r(&now, &local);
    EXPECT_EQ(when.tm_year, local.tm_year);
    EXPECT_TRUE(history_has("full path is:" + folder));
}

TEST(ComposeRunFolder, ALogPathThatLeavesNoRoomGivesNoFolder) {
    LogController controller;
    std::string longpath = "/mnt/sdcard/" + std::string(230, 'x');
    strcpy(controller.logpath, longpath.c_str());
    compose_run_folder(&controller);
    EXPECT_STREQ(controller.run_folder, "");
    EXPECT_EQ(create_run_folder(&controller, controller.logpath, controller.run_folder), -1);
}

bool is_dir_with_mode(const char* path, mode_t mode) {
    struct stat st;
    return stat(path, &st) == 0 && S_ISDIR(st.st_mode) && (st.st_mode & 07777) == mode;
}

TEST(CreateRunFolder, CreatesEveryMissingFolderWithGroupAccess) {
    umask(0);
    LogController controller;
    struct Case {
        const char* base;
        const char* path;
        const char* created;  // last folder, with its slash
    };
    const Case cases[] = {
        {"/data", "/data/log_temp", "/data/log_temp/"},
        {"/mnt/sdcard", "/mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/",
         "/mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/"},
        {"/mnt/sdcard/deep", "/mnt/sdcard/deep/a/b/c", "/mnt/sdcard/deep/a/b/c/"},
        {"/data", "/data/log_temp", "/data/log_temp/"},  // existing: still success
    };
    for (const Case& c : cases) {
        EXPECT_EQ(create_run_folder(&controller, c.base, c.path), 1) << c.path;
        EXPECT_TRUE(is_dir_with_mode(c.created, 0770)) << c.created;
        EXPECT_TRUE(history_has(std::string("mkdir ") + c.created + " success")) << c.created;
    }
    EXPECT_TRUE(is_dir_with_mode("/mnt/sdcard/deep", 0770));
    EXPECT_TRUE(is_dir_with_mode("/mnt/sdcard/qrvlog", 0770));
}

TEST(CreateRunFolder, RefusesWhatCannotBeMade) {
    LogController controller;
    int fd = open("/data/blocker", O_CREAT | O_WRONLY, 0600);
    ASSERT_GE(fd, 0);
    close(fd);
    EXPECT_EQ(create_run_folder(&controller, "/data", "/data/blocker/run"), -1);
    EXPECT_TRUE(history_has("mkdir /data/blocker/run fails, errno:Not a directory(20)"));
    EXPECT_TRUE(history_has("mkdir /data/blocker/run/ fails at last"));

    std::string too_long = "/data/" + std::string(249, 'y');  // 255 characters, no room for '/'
    EXPECT_EQ(create_run_folder(&controller, "/data", too_long.c_str()), -1);
    struct stat st;
    EXPECT_NE(stat(too_long.substr(0, 200).c_str(), &st), 0);
    EXPECT_TRUE(history_has("refused: longer than 255 characters"));
}

// ---- exception engine ----

// A fake `oru` first on PATH records each call; the build flags are loaded
// once per process, so every case runs in a child of its own.
TEST(PublishRunFolder, AFolderTooLongForThePropertyClearsIt) {
    publish_run_folder("/mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/");
    EXPECT_EQ(property("debug.TQ.realpath"), "/mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/");
    std::string long_folder = "/mnt/" + std::string(90, 'd') + "/qrvlog/tavlolog/APLog_2026_0304_070650/";
    publish_run_folder(long_folder.c_str());
    // The earlier run's folder must not receive this run's history records.
    EXPECT_EQ(property("debug.TQ.realpath"), "");
    EXPECT_TRUE(history_has("set debug.TQ.realpath to " + long_folder + " failed"));
}

TEST(OruMode, RunsTheEngineCommandsOnlyOffEngBuilds) {
    mkdir("/tmp/fakebin", 0755);
    FILE* script = fopen("/tmp/fakebin/oru", "w");
    ASSERT_NE(script, nullptr);
    fputs("#!/bin/sh\necho \"$*\" >> /tmp/oru_calls\n", script);
    fclose(script);
    chmod("/tmp/fakebin/oru", 0755);
    std::string path = std::string("/tmp/fakebin:") + getenv("PATH");
    setenv("PATH", path.c_str(), 1);

    struct Case {
        const char* build_type;
        const char* build_info;  // nullptr: unset
        const char* calls;
        bool recorded;
    };
    const Case cases[] = {
        {"user", nullptr, "-m 3\n-m 4\n", true},
        {"userdebug", "customer", "-m 3\n-m 4\n", true},
        {"user", "factory", "-m 1\n-m 2\n", true},
        {"eng", nullptr, "", false},
        {"eng", "factory", "", false},
    };
    for (const Case& c : cases) {
        // The emulated phone keeps each property in a file; ro.* are set once,
        // so each case starts from a clean slate.
        unlink(PROPERTY_AREA_DIR "/ro.build.type");
        unlink(PROPERTY_AREA_DIR "/ro.oru.build.info");
        unlink("/tmp/oru_calls");
        unlink(kHistory);
        ASSERT_EQ(property_set("ro.build.type", c.build_type), 0);
        if (c.build_info != nullptr) {
            ASSERT_EQ(property_set("ro.oru.build.info", c.build_info), 0);
        }
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            oru_mode_on();
            oru_mode_off();
            _exit(0);
        }
        int status;
        waitpid(pid, &status, 0);
        EXPECT_EQ(read_file("/tmp/oru_calls"), c.calls) << c.build_type;
        EXPECT_EQ(history_has("init oru mode:"), c.recorded) << c.build_type;
        EXPECT_EQ(history_has("deinit oru mode:"), c.recorded) << c.build_type;
    }
}

// ---- signals ----

TEST(SignalChild, NeverSignalsTheDaemonsOwnGroup) {
    // kill(0, ...) would reach this process: SIGUSR1 would end the test.
    signal_child(0, SIGUSR1);
    signal_child(-1, SIGUSR1);
    SUCCEED();
}

// ---- whole runs ----

class RunTest : public ::testing::Test {
  protected:
    void SetUp() override {
        unlink(kFifo);
        ASSERT_EQ(mkfifo(kFifo, 0600), 0);
        KmsgCat::kmsg_path = kFifo;
        // Read-write: never blocks, and the source always has a writer.
        source_ = open(kFifo, O_RDWR);
        ASSERT_GE(source_, 0);

        controller_.boot_mode = 1;  // no exception-engine switch
        controller_.kernel_log = 1;
        controller_.log_file_num = 5;
        strcpy(controller_.logpath, "/data");  // where the writer measures free space
        ASSERT_EQ(create_run_folder(&controller_, "/data", "/data/run_test/"), 1);
        strcpy(controller_.run_folder, "/data/run_test/");
        controller_.rotate_size_kb = calc_rotate_size(&controller_, 60);
        property_set(PROP_REALPATH, controller_.run_folder);
    }
    void TearDown() override {
        if (is_running()) stop_logging(&controller_);
        close(source_);
    }
    void feed(const std::string& text) {
        ASSERT_EQ(write(source_, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    // Until the collector has taken everything out of the FIFO.
    bool wait_source_drained() {
        for (int i = 0; i < 500; i++) {
            int queued = 0;
            if (ioctl(source_, FIONREAD, &queued) == 0 && queued == 0) return true;
            usleep(10000);
        }
        return false;
    }

    LogController controller_;
    int source_ = -1;
};

TEST_F(RunTest, StopKeepsEverythingTheCollectorSent) {
    start_logging(&controller_);
    EXPECT_EQ(property(PROP_RUNNING), "1");
    EXPECT_EQ(property(PROP_LOGSIZE), "12288");
    ASSERT_GT(controller_.klog_pid, 0);
    char pids[64];
    snprintf(pids, sizeof(pids), "M(0),R(0),E(0),K(%d),B(0)", controller_.klog_pid);
    EXPECT_TRUE(history_has(pids));

    std::string sent;
    for (int i = 0; i < 400; i++) {
        char line[128];
        snprintf(line, sizeof(line), "<6>[%5d.000000] line %d of the kernel log, some padding here\n", i, i);
        sent += line;
    }
    feed(sent);
    ASSERT_TRUE(wait_source_drained());

    // Words the collector reads and sends after the stop began, before its
    // stop signal: they must reach the file too.
    const std::string last = "<6>[  999.000000] last words\n";
    std::thread late([&] {
        usleep(30000);
        feed(last);
    });
    pid_t collector = controller_.klog_pid;
    timespec start;
    clock_gettime(CLOCK_MONOTONIC, &start);
    stop_logging(&controller_);
    double took = seconds_since(start);
    late.join();
    EXPECT_LT(took, 3.0);
    ASSERT_TRUE(wait_source_drained()) << "the collector ended before the late words came";
    sent += last;

    EXPECT_EQ(property(PROP_RUNNING), "0");
    EXPECT_EQ(controller_.klog_pid, 0);
    EXPECT_EQ(controller_.shm, nullptr);
    EXPECT_TRUE(log_body("/data/run_test/kernel_log") == sent)
        << log_body("/data/run_test/kernel_log").size() << " of " << sent.size() << " bytes";
    EXPECT_TRUE(history_has("read thread exit "));
    EXPECT_TRUE(history_has("write thread exit "));
    EXPECT_TRUE(history_has("tavlolog stop done"));
    // The stop did not leave a collector behind.
    EXPECT_NE(kill(collector, 0), 0);
}

std::string fd_target(pid_t pid, int fd) {
    char link[64], target[PATH_MAX] = {};
    snprintf(link, sizeof(link), "/proc/%d/fd/%d", pid, fd);
    if (readlink(link, target, sizeof(target) - 1) < 0) return "";
    return target;
}

// The collector must not keep the run's files, the listening sockets or the
// clients' connections open: they would outlive the daemon's own close.
TEST_F(RunTest, CollectorKeepsNoneOfTheDaemonsDescriptors) {
    int client[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, client), 0);
    controller_.clients[0].fd = client[0];
    start_logging(&controller_);
    ASSERT_GT(controller_.klog_pid, 0);
    feed("x\n");
    ASSERT_TRUE(wait_source_drained());

    const std::string forbidden[] = {
        fd_target(getpid(), transist_listen_fd),
        fd_target(getpid(), client[0]),
        fd_target(getpid(), log_files[LOG_KERNEL].fd),
    };
    for (const std::string& target : forbidden) ASSERT_NE(target, "");
    int open_count = 0;
    for (int fd = 0; fd < 1024; fd++) {
        std::string target = fd_target(controller_.klog_pid, fd);
        if (target.empty()) continue;
        open_count++;
        for (const std::string& bad : forbidden) EXPECT_NE(target, bad) << "fd " << fd;
    }
    EXPECT_GT(open_count, 0);
    stop_logging(&controller_);
    controller_.clients[0].fd = -1;
    close(client[0]);
    close(client[1]);
}

TEST_F(RunTest, SwitchMovesTheRunningFilesToTheNewFolder) {
    start_logging(&controller_);
    feed("first\n");
    ASSERT_TRUE(wait_source_drained());
    ASSERT_EQ(create_run_folder(&controller_, "/data", "/data/run_moved/"), 1);
    controller_.rotate_size_kb = 512;
    switch_run_folder(&controller_, "/data/run_moved/");
    EXPECT_EQ(property(PROP_REALPATH), "/data/run_moved/");
    EXPECT_EQ(property(PROP_LOGSIZE), "512");
    feed("second\n");
    ASSERT_TRUE(wait_source_drained());
    stop_logging(&controller_);
    EXPECT_EQ(log_body("/data/run_test/kernel_log") + log_body("/data/run_moved/kernel_log"),
              "first\nsecond\n");
    EXPECT_NE(log_body("/data/run_moved/kernel_log").find("second\n"), std::string::npos);
}

TEST_F(RunTest, StopWithNoCollectorToWaitForIsQuick) {
    controller_.kernel_log = 0;
    controller_.android_log = 1;
    controller_.bt_log = 1;
    start_logging(&controller_);
    EXPECT_TRUE(history_has("M(0),R(0),E(0),K(0),B(0)"));
    EXPECT_TRUE(history_has("no collector for main_log,radio_log,events_log in this build"));
    EXPECT_TRUE(history_has("no collector for bt_log in this build"));
    timespec start;
    clock_gettime(CLOCK_MONOTONIC, &start);
    stop_logging(&controller_);
    EXPECT_LT(seconds_since(start), 1.0);  // one poll, not nine
    EXPECT_TRUE(history_has("tavlolog stop done"));
}

TEST_F(RunTest, SecondStopOnlyRecords) {
    controller_.log_path_state = 1;
    stop_logging(&controller_);
    EXPECT_EQ(controller_.log_path_state, -1);
    EXPECT_TRUE(history_has("tavlolog already stopped, ignore this stop"));
    EXPECT_FALSE(history_has("tavlolog stop done"));
}

TEST_F(RunTest, StartSwitchesTheEngineOnNormalBoots) {
    unlink("/tmp/oru_calls");
    mkdir("/tmp/fakebin", 0755);
    FILE* script = fopen("/tmp/fakebin/oru", "w");
    ASSERT_NE(script, nullptr);
    fputs("#!/bin/sh\necho \"$*\" >> /tmp/oru_calls\n", script);
    fclose(script);
    chmod("/tmp/fakebin/oru", 0755);
    std::string path = std::string("/tmp/fakebin:") + getenv("PATH");
    setenv("PATH", path.c_str(), 1);
    controller_.boot_mode = 0;
    controller_.kernel_log = 0;
    start_logging(&controller_);
    stop_logging(&controller_);
    EXPECT_EQ(read_file("/tmp/oru_calls"), "-m 3\n");  // the stop itself does not switch back
}

// Waits for the SIGCHLD notice, as the control loop does.
bool wait_child_notice() {
    struct pollfd p = {efd_chld, POLLIN, 0};
    int ready;
    do {
        ready = poll(&p, 1, 5000);  // the SIGCHLD itself interrupts it
    } while (ready < 0 && errno == EINTR);
    if (ready != 1) return false;
    uint64_t count;
    return read(efd_chld, &count, sizeof(count)) == sizeof(count);
}

TEST_F(RunTest, CollectorKilledFromOutsideStopsTheRunAndTellsTheClients) {
    int client[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, client), 0);
    controller_.clients[3].fd = client[0];

    start_logging(&controller_);
    pid_t pid = controller_.klog_pid;
    ASSERT_GT(pid, 0);
    feed("alive\n");
    ASSERT_TRUE(wait_source_drained());
    kill(pid, SIGKILL);
    ASSERT_TRUE(wait_child_notice());
    check_children(&controller_);

    char reaped[64];
    snprintf(reaped, sizeof(reaped), " pid %d send sig_chld ", pid);
    EXPECT_TRUE(history_has(reaped));
    EXPECT_TRUE(history_has("kLog dies unexpectly"));
    EXPECT_FALSE(history_has("oru warning comes"));  // killed: no reason left, no warning
    EXPECT_TRUE(history_has("all chil processes die"));
    EXPECT_EQ(controller_.klog_pid, 0);
    EXPECT_EQ(property(PROP_RUNNING), "0");
    EXPECT_TRUE(history_has("tavlolog stop done"));
    char buf[64] = {};
    EXPECT_GT(recv(client[1], buf, sizeof(buf) - 1, MSG_DONTWAIT), 0);
    EXPECT_STREQ(buf, "tqlog_stopped");
    EXPECT_EQ(log_body("/data/run_test/kernel_log"), "alive\n");
    close(client[0]);
    close(client[1]);
}

TEST_F(RunTest, CollectorThatCannotOpenItsSourceIsReportedWithItsReason) {
    KmsgCat::kmsg_path = "/tmp/no_such_kmsg";
    start_logging(&controller_);
    ASSERT_TRUE(wait_child_notice());
    check_children(&controller_);
    EXPECT_TRUE(history_has("kLog dies unexpectly"));
    EXPECT_TRUE(history_has("oru warning comes,type is 10"));
    EXPECT_TRUE(history_has("all chil processes die"));
    EXPECT_EQ(property(PROP_RUNNING), "0");
}

TEST_F(RunTest, CheckWithNoCollectorChangesNothing) {
    controller_.kernel_log = 0;
    start_logging(&controller_);
    check_children(&controller_);
    EXPECT_TRUE(history_has("all processes die, no need to check"));
    EXPECT_EQ(property(PROP_RUNNING), "1");
}

}  // namespace
