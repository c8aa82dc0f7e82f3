// The history log on the emulated phone's real paths: which files a level
// reaches, the line format byte for byte, re-creation of the folder, and the
// two hazards of a multi-threaded, forking daemon (re-entry, inherited lock).
#include "storage/history_log.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "common/limits.h"
#include "platform/properties.h"

namespace {

const char kCentral[] = "/data/misc/tqlog/tqlog_history";
const char kRunFolder[] = "/data/run/APLog_2026_0304_070649/";
const char kRunFile[] = "/data/run/APLog_2026_0304_070649/tqlog_history";
const char kPlatformLog[] = "/dev/emu/wlog";

std::string read_file(const char* path) {
    std::string out;
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) return out;
    char buf[4096];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) out.append(buf, static_cast<size_t>(n));
    close(fd);
    return out;
}

std::vector<std::string> lines_of(const char* path) {
    std::vector<std::string> out;
    std::string all = read_file(path);
    size_t start = 0;
    while (start < all.size()) {
        size_t end = all.find('\n', start);
        if (end == std::string::npos) end = all.size();
        out.push_back(all.substr(start, end - start));
        start = end + 1;
    }
    return out;
}

// "YYYY:MM:DD HH:MM:SS " at the start of line.
bool has_stamp(const std::string& line) {
    static const char shape[] = "dddd:dd:dd dd:dd:dd ";
    if (line.size() < 20) return false;
    for (size_t i = 0; i < 20; i++) {
        bool ok = shape[i] == 'd' ? (line[i] >= '0' && line[i] <= '9') : line[i] == shape[i];
        if (!ok) return false;
    }
    return true;
}

// The message of a history line, after checking its timestamp.
std::string message_of(const std::string& line) {
    EXPECT_TRUE(has_stamp(line)) << line;
    return line.size() >= 20 ? line.substr(20) : "";
}

mode_t mode_of(const char* path) {
    struct stat st;
    return stat(path, &st) == 0 ? (st.st_mode & 07777) : 0;
}

class HistoryLogTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (access("/dev/emu/properties", F_OK) != 0) GTEST_SKIP() << "runs only inside the emulated phone";
        // As the daemon: modes are exactly those given at creation.
        umask(0);
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/* && : > /dev/emu/wlog"), 0);
        ASSERT_EQ(system("mkdir -p /data/misc/tqlog /data/run/APLog_2026_0304_070649"), 0);
    }

    void set_run_folder(const char* folder) { ASSERT_EQ(property_set("debug.TQ.realpath", folder), 0); }
};

struct LevelCase {
    const char* name;
    int level;
    bool run_folder_set;
    bool in_run_file;
    bool in_central;
};

void PrintTo(const LevelCase& c, std::ostream* os) { *os << c.name; }

class HistoryLevelTest : public HistoryLogTest, public ::testing::WithParamInterface<LevelCase> {};

TEST_P(HistoryLevelTest, LevelChoosesTheFiles) {
    const LevelCase& c = GetParam();
    if (c.run_folder_set) set_run_folder(kRunFolder);
    history_log(c.level, "record at level %d", c.level);
    std::string expected = "record at level " + std::to_string(c.level);
    std::vector<std::string> run = lines_of(kRunFile);
    std::vector<std::string> central = lines_of(kCentral);
    ASSERT_EQ(run.size(), c.in_run_file ? 1u : 0u);
    ASSERT_EQ(central.size(), c.in_central ? 1u : 0u);
    if (c.in_run_file) {
        EXPECT_EQ(message_of(run[0]), expected);
    }
    if (c.in_central) {
        EXPECT_EQ(message_of(central[0]), expected);
    }
    if (c.in_run_file && c.in_central) {
        EXPECT_EQ(run[0], central[0]);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Levels, HistoryLevelTest,
    ::testing::Values(LevelCase{"ZeroDuringRun", 0, true, false, true},
                      LevelCase{"ZeroWithoutRun", 0, false, false, true},
                      LevelCase{"OneDuringRun", 1, true, true, false},
                      LevelCase{"OneWithoutRun", 1, false, false, true},
                      LevelCase{"TwoDuringRun", 2, true, true, true},
                      LevelCase{"TwoWithoutRun", 2, false, false, true},
                      LevelCase{"Three", 3, true, false, false},
                      LevelCase{"Negative", -1, true, false, false}),
    [](const ::testing::TestParamInfo<LevelCase>& info) { return info.param.name; });

TEST_F(HistoryLogTest, LevelOneWithAVanishedRunFolderIsLost) {
    set_run_folder("/data/run/gone/");
    history_log(1, "lost");
    EXPECT_EQ(read_file(kCentral), "");
    EXPECT_NE(access("/data/run/gone", F_OK), 0);
    history_log(2, "kept");
    ASSERT_EQ(lines_of(kCentral).size(), 1u);
    EXPECT_EQ(message_of(lines_of(kCentral)[0]), "kept");
}

TEST_F(HistoryLogTest, LineIsTimestampMessageAndNewline) {
    time_t before = time(nullptr);
    history_log(0, "start %s", "tavlolog");
    time_t after = time(nullptr);
    std::string all = read_file(kCentral);
    ASSERT_EQ(all.size(), 20u + 14u + 1u);
    EXPECT_EQ(all.substr(20), "start tavlolog\n");
    // The timestamp is the local time of the call, colons in the date too.
    bool matched = false;
    for (time_t t = before; t <= after && !matched; t++) {
        struct tm tm;
        localtime_r(&t, &tm);
        char stamp[32];
        strftime(stamp, sizeof(stamp), "%Y:%m:%d %H:%M:%S ", &tm);
        matched = all.compare(0, 20, stamp) == 0;
    }
    EXPECT_TRUE(matched) << all;
}

TEST_F(HistoryLogTest, LongMessageIsCutAt254Characters) {
    std::string long_message(300, 'm');
    history_log(0, "%s", long_message.c_str());
    std::string all = read_file(kCentral);
    ASSERT_EQ(all.size(), 255u);
    EXPECT_EQ(all.back(), '\n');
    EXPECT_EQ(all.substr(20, 234), long_message.substr(0, 234));
}

TEST_F(HistoryLogTest, EmptyMessageStillWritesTheTimestamp) {
    const char* empty = "";
    history_log(0, "%s", empty);
    std::string all = read_file(kCentral);
    ASSERT_EQ(all.size(), 21u);
    EXPECT_EQ(all[19], ' ');
    EXPECT_EQ(all[20], '\n');
}

TEST_F(HistoryLogTest, ControlBytesCannotForgeLines) {
    history_log(0, "recv '%s' from client %d", "stop\n2026:01:01 00:00:00 forged\r\x1b", 3);
    std::vector<std::string> lines = lines_of(kCentral);
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(message_of(lines[0]), "recv 'stop?2026:01:01 00:00:00 forged?\?' from client 3");
}

TEST_F(HistoryLogTest, DeletedFolderIsRecreatedWithItsModes) {
    history_log(0, "first");
    EXPECT_EQ(mode_of(kCentral), 0664u);
    ASSERT_EQ(system("rm -rf /data/misc"), 0);
    history_log(0, "second");
    EXPECT_EQ(mode_of("/data/misc"), 0775u);
    EXPECT_EQ(mode_of("/data/misc/tqlog"), 0775u);
    EXPECT_EQ(mode_of(kCentral), 0664u);
    ASSERT_EQ(lines_of(kCentral).size(), 1u);
    EXPECT_EQ(message_of(lines_of(kCentral)[0]), "second");
    // The mode is set once per folder, not on every record.
    chmod(kCentral, 0600);
    history_log(0, "third");
    EXPECT_EQ(mode_of(kCentral), 0600u);
}

TEST_F(HistoryLogTest, UncreatableFolderDropsTheRecordWithoutDeadlock) {
    // /data/misc as a plain file: the folder cannot be made, and the failure
    // of make_dir_recursive happens while the history lock is held.
    ASSERT_EQ(system("rm -rf /data/misc && touch /data/misc"), 0);
    set_run_folder(kRunFolder);
    // Detached: a deadlocked writer must fail the test, not hang it.
    auto finished = std::make_shared<std::promise<void>>();
    std::future<void> done = finished->get_future();
    std::thread([finished] {
        history_log(2, "under a broken folder");
        finished->set_value();
    }).detach();
    ASSERT_EQ(done.wait_for(std::chrono::seconds(10)), std::future_status::ready) << "history_log deadlocked";
    std::vector<std::string> run = lines_of(kRunFile);
    ASSERT_EQ(run.size(), 1u);
    EXPECT_EQ(message_of(run[0]), "under a broken folder");
    std::string platform = read_file(kPlatformLog);
    EXPECT_NE(platform.find("TavloLogD/Util: mkdir fail(Not a directory)"), std::string::npos) << platform;
    EXPECT_NE(platform.find("TavloLogD/mlog: create dir /data/misc/tqlog failed(Not a directory)"),
              std::string::npos)
        << platform;
}

TEST_F(HistoryLogTest, RunFolderComesFromTheProperty) {
    char out[PATH_LEN];
    memset(out, 'x', sizeof(out));
    EXPECT_EQ(get_run_folder(out), nullptr);
    EXPECT_EQ(out[0], 'x') << "out must stay untouched";
    set_run_folder(kRunFolder);
    EXPECT_EQ(get_run_folder(out), out);
    EXPECT_STREQ(out, kRunFolder);
}

TEST_F(HistoryLogTest, MakeDirRecursiveCreatesMissingParentsOutermostLoggedFirst) {
    EXPECT_EQ(make_dir_recursive("/data/a/b/c"), 1);
    EXPECT_EQ(mode_of("/data/a"), 0775u);
    EXPECT_EQ(mode_of("/data/a/b"), 0775u);
    EXPECT_EQ(mode_of("/data/a/b/c"), 0775u);
    std::string platform = read_file(kPlatformLog);
    size_t full = platform.find("create dir /data/a/b/c\n");
    size_t parent = platform.find("create dir /data/a/b\n");
    size_t grandparent = platform.find("create dir /data/a\n");
    ASSERT_NE(full, std::string::npos) << platform;
    ASSERT_NE(parent, std::string::npos) << platform;
    ASSERT_NE(grandparent, std::string::npos) << platform;
    EXPECT_LT(full, parent);
    EXPECT_LT(parent, grandparent);
    EXPECT_EQ(read_file(kCentral), "");
}

TEST_F(HistoryLogTest, MakeDirRecursiveOnAnExistingPathFails) {
    EXPECT_EQ(make_dir_recursive("/data/run"), 0);
    std::vector<std::string> lines = lines_of(kCentral);
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(message_of(lines[0]), "mkdir fail(File exists)");
    EXPECT_NE(read_file(kPlatformLog).find("TavloLogD/Util: mkdir fail(File exists)"), std::string::npos);
}

TEST_F(HistoryLogTest, MakeDirRecursiveRefusesAPathItWouldHaveToCut) {
    std::string path = "/data/" + std::string(300, 'p');
    EXPECT_EQ(make_dir_recursive(path.c_str()), 0);
    EXPECT_EQ(errno, ENAMETOOLONG);
    ASSERT_EQ(lines_of(kCentral).size(), 1u);
    EXPECT_EQ(message_of(lines_of(kCentral)[0]), "mkdir fail(File name too long)");
}

// A writer of the run file blocks in open() on a FIFO while it holds the
// history lock; the test waits until the thread sits in that open.
bool thread_blocked_in_open(pid_t tid) {
    char path[64];
    snprintf(path, sizeof(path), "/proc/self/task/%d/syscall", static_cast<int>(tid));
    std::string s = read_file(path);
    // openat is 257 on x86-64, open is 2.
    return s.rfind("257 ", 0) == 0 || s.rfind("2 ", 0) == 0;
}

TEST_F(HistoryLogTest, ForkedChildDoesNotInheritAHeldLock) {
    ASSERT_EQ(mkfifo(kRunFile, 0666), 0);
    set_run_folder(kRunFolder);
    std::atomic<pid_t> writer_tid{0};
    std::thread writer([&writer_tid] {
        writer_tid = gettid();
        history_log(2, "parent record");
    });
    for (int i = 0; i < 5000 && !(writer_tid != 0 && thread_blocked_in_open(writer_tid)); i++) usleep(1000);
    ASSERT_TRUE(thread_blocked_in_open(writer_tid)) << "writer never reached the FIFO";

    pid_t child = fork();
    if (child == 0) {
        history_log(0, "child record");
        _exit(0);
    }
    ASSERT_GT(child, 0);
    int status = -1;
    pid_t waited = 0;
    for (int i = 0; i < 10000 && waited == 0; i++) {
        waited = waitpid(child, &status, WNOHANG);
        if (waited == 0) usleep(1000);
    }
    if (waited == 0) {
        kill(child, SIGKILL);
        waitpid(child, &status, 0);
    }
    // Release the parent's writer.
    int fifo = open(kRunFile, O_RDONLY | O_CLOEXEC);
    std::string from_fifo;
    char buf[512];
    ssize_t n;
    while ((n = read(fifo, buf, sizeof(buf))) > 0) from_fifo.append(buf, static_cast<size_t>(n));
    close(fifo);
    writer.join();

    ASSERT_NE(waited, 0) << "child deadlocked on the inherited history lock";
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    EXPECT_NE(from_fifo.find("parent record\n"), std::string::npos);
    std::vector<std::string> central = lines_of(kCentral);
    ASSERT_EQ(central.size(), 2u);
    EXPECT_EQ(message_of(central[0]), "child record");
    EXPECT_EQ(message_of(central[1]), "parent record");
}

TEST_F(HistoryLogTest, ForkedChildStampsLocalTimeWithoutTheCLibrary) {
    // An offset with minutes makes a wrong conversion show.
    setenv("TZ", "XST-5:30", 1);
    tzset();
    history_log(0, "parent before");
    pid_t child = fork();
    if (child == 0) {
        history_log_after_fork();  // the explicit call of a fork wrapper is harmless
        history_log(0, "child");
        _exit(0);
    }
    int status;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    history_log(0, "parent after");
    std::vector<std::string> lines = lines_of(kCentral);
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_EQ(message_of(lines[1]), "child");
    EXPECT_LE(lines[0].substr(0, 19), lines[1].substr(0, 19));
    EXPECT_LE(lines[1].substr(0, 19), lines[2].substr(0, 19));
    unsetenv("TZ");
    tzset();
}

TEST_F(HistoryLogTest, RecordsOfManyProcessesNeverInterleave) {
    set_run_folder(kRunFolder);
    constexpr int kChildren = 4;
    constexpr int kRecords = 200;
    std::vector<pid_t> children;
    for (int c = 0; c < kChildren; c++) {
        pid_t pid = fork();
        if (pid == 0) {
            std::string filler(200, static_cast<char>('a' + c));
            for (int i = 0; i < kRecords; i++) history_log(2, "%d %d %s", c, i, filler.c_str());
            _exit(0);
        }
        ASSERT_GT(pid, 0);
        children.push_back(pid);
    }
    for (pid_t pid : children) {
        int status;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    for (const char* path : {kCentral, kRunFile}) {
        std::vector<std::string> lines = lines_of(path);
        ASSERT_EQ(lines.size(), static_cast<size_t>(kChildren * kRecords)) << path;
        std::vector<int> next(kChildren, 0);
        for (const std::string& line : lines) {
            // A whole record: stamp, "<child> <index> " and 200 of the child's letter.
            ASSERT_TRUE(has_stamp(line)) << path << ": " << line;
            int c = -1;
            int i = -1;
            int consumed = 0;
            ASSERT_EQ(sscanf(line.c_str() + 20, "%d %d %n", &c, &i, &consumed), 2) << line;
            ASSERT_TRUE(c >= 0 && c < kChildren) << line;
            EXPECT_EQ(line.substr(20 + static_cast<size_t>(consumed)), std::string(200, static_cast<char>('a' + c)))
                << path << ": " << line;
            // Each process's records stay in their own order.
            EXPECT_EQ(i, next[c]++);
        }
    }
}

}  // namespace
