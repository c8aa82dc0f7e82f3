// Logging runs with the real transist and kernel collector; a FIFO stands in for /proc/kmsg.
#include "core/logging_run.h"

#include <limits.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <thread>

#include "collectors/kmsg_cat.h"
#include "config/config_store.h"
#include "core/boot_mode.h"
#include "core/boot_start.h"
#include "core/child_supervision.h"
#include "core/log_controller.h"
#include "test_util.h"
#include "transist/transist.h"

namespace {

const char* const kFifo = "/tmp/kmsg_fifo";

TEST(CalcRotateSize, SplitsTheRunSizeOverItsFiles) {
    const struct {
        int files, megabytes, expect_kb;
    } cases[] = {
        {25, 60, 2457},            // all five collectors
        {5, 60, 12288},            // kernel only
        {15, 1, 68},               // truncated, not rounded
        {5, 4000000, 819200000},
        {1, 3000000, 2147483647},  // would not fit an int: the largest limit instead
        {0, 60, 0},
    };
    for (const auto& c : cases) {
        LogController controller;
        controller.log_file_num = c.files;
        EXPECT_EQ(calc_rotate_size(&controller, c.megabytes), c.expect_kb) << c.files << " " << c.megabytes;
    }
    EXPECT_TRUE(history_has("Invalid log file num:0"));
}

TEST(RunSize, ZeroNegativeOrGarbageGiveTheDefault) {
    const struct {
        const char* value;
        int mb;
    } cases[] = {{"60", 60}, {"200\r", 200}, {"0", 300}, {"-5", 300}, {"abc", 300}, {"12abc", 300}, {"", 300}};
    for (const auto& c : cases) {
        ConfigCache cache;
        config_set_defaults(&cache);
        strcpy(cache.items[2].value, c.value);  // logsize
        LogController controller;
        controller.load_boot_options(cache);
        EXPECT_EQ(controller.logsize, c.mb) << c.value;
    }
    EXPECT_TRUE(history_has("logsize 0 is not a size in MB, 300 used"));
}

// Every missing folder is made with group access whatever the umask; a file
// or a planted link in the way, or a path without room, is refused.
TEST(CreateRunFolder, CreatesEveryMissingFolderWithGroupAccessOrRefuses) {
    umask(077);
    LogController controller;
    write_file("/data/blocker", "");
    ASSERT_EQ(system("mkdir -p /data/elsewhere /mnt/sdcard/qrvlog /mnt/sdcard/other && ln -s /data/elsewhere /mnt/sdcard/qrvlog/next"
                     " && ln -s /data/elsewhere /mnt/sdcard/qrvlog/tavlolog && ln -s /data/elsewhere /mnt/sdcard/other/qrvlog"), 0);
    const std::string too_long = "/data/" + std::string(249, 'y'), too_long_part = too_long.substr(0, 200);
    const struct {
        const char *base, *path;
        int result;
        const char* check;  // a folder that must then have mode 0770, or must not exist
    } cases[] = {
        {"/data", "/data/log_temp", 1, "/data/log_temp/"},
        {"/data", "/data/log_temp/", 1, "/data/log_temp/"},  // existing: still success
        {"/mnt/sdcard/deep", "/mnt/sdcard/deep/a/b/c", 1, "/mnt/sdcard/deep"},
        {"/data", "/data/blocker/run", -1, "/data/blocker/run"},
        {"/mnt/sdcard", "/mnt/sdcard/qrvlog/next/APLog_1/", -1, "/data/elsewhere/APLog_1"},
        // A link planted where the daemon's own folders belong goes, not what it points to.
        {"/mnt/sdcard", "/mnt/sdcard/qrvlog/tavlolog/APLog_2/", 1, "/mnt/sdcard/qrvlog/tavlolog/APLog_2"},
        {"/mnt/sdcard/other/", "/mnt/sdcard/other/qrvlog/tavlolog/APLog_3", 1, "/mnt/sdcard/other/qrvlog/tavlolog"},
        {"/data", too_long.c_str(), -1, too_long_part.c_str()},  // 255 characters: no room for '/' 
    };
    for (const auto& c : cases) {
        EXPECT_EQ(create_run_folder(&controller, c.base, c.path), c.result) << c.path;
        EXPECT_EQ(mode_of(c.check), c.result == 1 ? 0770u : 0u) << c.check;
    }
    EXPECT_EQ(mode_of("/mnt/sdcard/deep/a/b/c"), 0770u);
    EXPECT_TRUE(exists("/data/elsewhere") && files_in("/data/elsewhere").empty());
    EXPECT_TRUE(history_has("/mnt/sdcard/qrvlog/tavlolog is a symbolic link, removed"));
}

// The run's folder is named after its start time; a log path that leaves no
// room for the name gives none, a folder too long for the property clears it.
TEST(RunFolder, NamedAfterTheStartTimeAndPublished) {
    LogController controller;
    strcpy(controller.logpath, "/mnt/sdcard");
    time_t t = time(nullptr);
    compose_run_folder(&controller);
    std::string names;
    for (struct tm tm; t <= time(nullptr); t++) {
        char name[64];
        strftime(name, sizeof(name), "/mnt/sdcard/qrvlog/tavlolog/APLog_%Y_%m%d_%H%M%S/", localtime_r(&t, &tm));
        names += std::string(name) + " ";
    }
    EXPECT_NE(names.find(std::string(controller.run_folder) + " "), std::string::npos) << controller.run_folder;
    strcpy(controller.logpath, ("/mnt/sdcard/" + std::string(230, 'x')).c_str());
    compose_run_folder(&controller);
    EXPECT_STREQ(controller.run_folder, "");
    publish_run_folder(&controller, "/mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/");
    EXPECT_EQ(property(PROP_REALPATH), "/mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/");
    publish_run_folder(&controller, ("/mnt/" + std::string(90, 'd') + "/qrvlog/tavlolog/APLog_2026_0304_070650/").c_str());
    EXPECT_EQ(property(PROP_REALPATH), "") << "the earlier run's folder would receive this run's records";
}

// The first daemon of a boot keeps aside what the boot before held and never
// copied, while /data keeps the holding folder's room; a stray where the
// folder belongs goes; a folder that cannot be made leaves the boot copy
// nothing to wait for unless a previous boot's logs are held.
TEST(StartInTempFolder, KeepsThePreviousBootsHeldLogsAside) {
    SKIP_OUTSIDE_PHONE();
    const std::string held_before = "mkdir /data/log_temp_prev /data/log_temp && touch /data/log_temp_prev/old /data/log_temp/kernel_log";
    const std::string no_inode = "mkdir -p /data/misc/tqlog && touch " + std::string(kHistory) + " && while touch /data/f$((i=i+1)); do :; done";
    const struct {
        const char* mount;  // options of the tmpfs /data
        const char* booted;
        std::string setup;
        int result;
        const char *temp, *prev;  // their files afterwards, "-": no folder
        uint8_t timer;
        const char* record;
    } cases[] = {
        {"size=200m", "0", held_before, 1, "", "kernel_log", 1, "held logs of the previous boot kept in /data/log_temp_prev/"},
        {"size=20m", "0", held_before, 1, "", "-", 1, "held logs of the previous boot dropped, /data has "},
        {"size=200m", "0", "mkdir /data/log_temp && touch /data/log_temp/.x", 1, "", "-", 1, ""},
        {"size=200m", "0", "echo x > /data/log_temp", 1, "", "-", 1, "/data/log_temp is not a folder, will delete it"},
        {"size=200m", "1", "ln -s /nowhere /data/log_temp", 1, "", "-", 1, "/data/log_temp is not a folder, will delete it"},
        {"size=200m,nr_inodes=16", "0", no_inode, 0, "-", "-", 0, "mkdir /data/log_temp/ faild,errno=28"},
        {"size=200m,nr_inodes=16", "0", "mkdir /data/log_temp && touch /data/log_temp/kernel_log && " + no_inode, 0, "-", "kernel_log", 1, ""},
    };
    auto files = [](const std::string& dir) {
        std::string names = exists(dir) ? "" : "-";
        for (const std::string& name : files_in(dir)) names += (names.empty() ? "" : " ") + name;
        return names;
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.setup);
        ASSERT_EQ(0, system(("umount /data 2>/dev/null; mount -t tmpfs -o " + std::string(c.mount) + " tmpfs /data && " + c.setup + " 2>/dev/null; true").c_str()));
        property_set(PROP_BOOTED, c.booted);
        LogController controller;
        controller.boot_mode = 0;
        EXPECT_EQ(c.result, start_in_temp_folder(&controller));
        EXPECT_EQ(c.temp, files("/data/log_temp"));
        EXPECT_EQ(c.prev, files("/data/log_temp_prev"));
        EXPECT_EQ(c.timer, controller.boot_copy_timer);
        EXPECT_TRUE(history_has(c.record)) << c.record;
    }
    system("umount /data");
}

TEST(SignalChild, NeverSignalsTheDaemonsOwnGroup) {
    // kill(0, ...) would reach this process: SIGUSR1 would end the test.
    signal_child(0, SIGUSR1);
    signal_child(-1, SIGUSR1);
}

// Only the first character counts; odd content is recorded with what was read.
TEST(BootMode, FirstCharacterOfTheFile) {
    const struct {
        const char* content;  // nullptr: no file
        int mode;
        const char* record;  // "": nothing recorded
    } cases[] = {
        {"0", 0, ""},
        {"1\n", 1, ""},
        {"7", 7, ""},
        {"10", 1, "boot mode file /tmp/boot_mode holds 2 odd byte(s), boot mode 1"},
        {"x", 0, "boot mode file /tmp/boot_mode holds 1 odd byte(s), boot mode 0"},
        {"", 0, "boot mode file /tmp/boot_mode holds 0 odd byte(s), boot mode 0"},
        {"\xff\xfe binary", 0, "boot mode file /tmp/boot_mode holds 8 odd byte(s), boot mode 0"},
        {nullptr, -1, "Failed to open boot mode file /tmp/boot_mode"},
    };
    for (const auto& c : cases) {
        unlink(kHistory);
        unlink("/tmp/boot_mode");
        if (c.content != nullptr) write_file("/tmp/boot_mode", c.content);
        EXPECT_EQ(read_boot_mode("/tmp/boot_mode"), c.mode) << c.record;
        EXPECT_TRUE(c.record[0] ? history_has(c.record) : read_file(kHistory).empty()) << read_file(kHistory);
    }
}

class RunTest : public ::testing::Test {
  protected:
    void SetUp() override {
        unlink(kFifo);
        ASSERT_EQ(mkfifo(kFifo, 0600), 0);
        KmsgCat::kmsg_path = kFifo;
        source_ = open(kFifo, O_RDWR);  // never blocks, and the source always has a writer
        ASSERT_GE(source_, 0);
        controller_.boot_mode = 1;  // no exception-engine switch
        controller_.kernel_log = 1;
        controller_.log_file_num = 5;
        strcpy(controller_.logpath, "/data");  // where the writer measures free space
        ASSERT_EQ(create_run_folder(&controller_, "/data", "/data/run_test/"), 1);
        strcpy(controller_.run_folder, "/data/run_test/");
        controller_.rotate_size_kb = calc_rotate_size(&controller_, 60);
        property_set(PROP_REALPATH, controller_.run_folder);
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, client_), 0);
        controller_.clients[0].fd = client_[0];  // a control client, to hear broadcasts
    }
    void TearDown() override {
        if (property(PROP_RUNNING) == "1") stop_logging(&controller_);
        controller_.clients[0].fd = -1;
        for (int fd : {source_, client_[0], client_[1]}) close(fd);
    }
    void feed(const std::string& text) {
        ASSERT_EQ(write(source_, text.data(), text.size()), static_cast<ssize_t>(text.size()));
    }
    // Until the collector has taken everything out of the FIFO.
    bool wait_source_drained() {
        return wait_for([&] {
            int queued = 0;
            return ioctl(source_, FIONREAD, &queued) == 0 && queued == 0;
        }, 5000);
    }

    LogController controller_;
    int source_ = -1, client_[2] = {-1, -1};
};

TEST_F(RunTest, StopKeepsEverythingTheCollectorSent) {
    start_logging(&controller_);
    EXPECT_EQ(property(PROP_RUNNING), "1");
    EXPECT_EQ(property(PROP_LOGSIZE), "12288");
    ASSERT_GT(controller_.klog_pid, 0);
    std::string sent;
    for (int i = 0; i < 400; i++) sent += "<6>[" + std::to_string(i) + ".000000] a line of the kernel log, some padding\n";
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
    stop_logging(&controller_);
    late.join();
    ASSERT_TRUE(wait_source_drained()) << "the collector ended before the late words came";
    sent += last;

    EXPECT_EQ(property(PROP_RUNNING), "0");
    EXPECT_EQ(controller_.klog_pid, 0);
    EXPECT_EQ(controller_.shm, nullptr);
    std::string body = read_file("/data/run_test/kernel_log");
    EXPECT_TRUE(body == "-----timezone: GMT\n" + sent) << body.size() << " of " << sent.size() << " bytes";
    EXPECT_NE(kill(collector, 0), 0) << "the stop left a collector behind";
}

// A collector that died just before the stop, its notice not handled yet.
TEST_F(RunTest, StopRecordsACollectorThatDiedJustBefore) {
    start_logging(&controller_);
    pid_t collector = controller_.klog_pid;
    ASSERT_EQ(kill(collector, SIGKILL), 0);
    siginfo_t info;
    ASSERT_EQ(waitid(P_PID, collector, &info, WEXITED | WNOWAIT), 0);  // dead, not reaped
    stop_logging(&controller_);
    EXPECT_TRUE(has_record(" pid " + std::to_string(collector) + " send sig_chld "));
}

std::string fd_target(pid_t pid, int fd) {
    char target[PATH_MAX] = {};
    std::string link = "/proc/" + std::to_string(pid) + "/fd/" + std::to_string(fd);
    return readlink(link.c_str(), target, sizeof(target) - 1) < 0 ? "" : target;
}

// The collector must not keep the run's files, the listening sockets or the
// clients' connections open: they would outlive the daemon's own close.
TEST_F(RunTest, CollectorKeepsNoneOfTheDaemonsDescriptors) {
    start_logging(&controller_);
    feed("x\n");
    ASSERT_TRUE(wait_source_drained());
    std::string held = "\n";
    for (int fd = 0; fd < 1024; fd++) held += fd_target(controller_.klog_pid, fd) + "\n";
    for (int fd : {transist_listen_fd, client_[0], log_files[LOG_KERNEL].fd}) {
        std::string target = fd_target(getpid(), fd);
        ASSERT_NE(target, "");
        EXPECT_EQ(held.find("\n" + target + "\n"), std::string::npos) << target;
    }
    EXPECT_NE(held.find("socket:"), std::string::npos) << "no descriptors seen";
}

// A run held in /data while the card is gone: until the writer has ended it
// checks /data, and a notice sent during the stop does not outlive it.
TEST_F(RunTest, StopLeavesNoFalseOrStaleStorageNotice) {
    strcpy(controller_.logpath, "/mnt/no_card");
    controller_.log_path_state = 0;
    start_logging(&controller_);
    pid_t slow = fork();  // ignores the stop request: the stop waits its full second
    if (slow == 0) {
        signal(SIGUSR1, SIG_IGN);
        pause();
        _exit(0);
    }
    controller_.mlog_pid = slow;
    controller_.shm->slots[SLOT_MAIN].exited = 0;
    uint64_t notice = 1001;
    ASSERT_EQ(write(efd_thread, &notice, sizeof(notice)), 8);
    stop_logging(&controller_);
    EXPECT_FALSE(history_has("no space to write log"));
    EXPECT_EQ(read(efd_thread, &notice, sizeof(notice)), -1) << "a stale notice would stop the next run";
}

// A collector that cannot open its source ends with its reason; being the
// last one, its death stops the run and every client hears of it.
TEST_F(RunTest, CollectorThatCannotOpenItsSourceStopsTheRun) {
    KmsgCat::kmsg_path = "/tmp/no_such_kmsg";
    start_logging(&controller_);
    struct pollfd p = {efd_chld, POLLIN, 0};  // the SIGCHLD notice, as the control loop waits for it
    uint64_t count;
    ASSERT_TRUE(wait_for([&] { return poll(&p, 1, 0) == 1; }, 5000));
    ASSERT_EQ(read(efd_chld, &count, sizeof(count)), 8);
    check_children(&controller_);
    EXPECT_TRUE(history_has("oru warning comes,type is 10"));
    EXPECT_EQ(property(PROP_RUNNING), "0");
    char buf[64] = {};
    EXPECT_GT(recv(client_[1], buf, sizeof(buf) - 1, MSG_DONTWAIT), 0);
    EXPECT_STREQ(buf, "tqlog_stopped");
}

}  // namespace
