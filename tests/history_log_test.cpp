// The history log on the phone's real paths, and the hazards of a multi-threaded, forking daemon.
#include "storage/history_log.h"

#include <atomic>
#include <thread>

#include "test_util.h"

namespace {

const char kRunFolder[] = "/data/run/APLog_2026_0304_070649/";
const char kRunFile[] = "/data/run/APLog_2026_0304_070649/tqlog_history";
const char kPlatformLog[] = "/dev/emu/wlog";

// "YYYY:MM:DD HH:MM:SS " at the start of line.
bool has_stamp(const std::string& line) {
    static const char shape[] = "dddd:dd:dd dd:dd:dd ";
    if (line.size() < 20) return false;
    for (size_t i = 0; i < 20; i++)
        if (shape[i] == 'd' ? !isdigit(static_cast<unsigned char>(line[i])) : line[i] != shape[i]) return false;
    return true;
}

// The messages of a history file, after checking each line's timestamp.
std::vector<std::string> messages_of(const char* path) {
    std::vector<std::string> out;
    for (const std::string& line : lines_of(path)) {
        EXPECT_TRUE(has_stamp(line)) << line;
        out.push_back(line.size() >= 20 ? line.substr(20) : "");
    }
    return out;
}

using Messages = std::vector<std::string>;

class HistoryLogTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        umask(0);  // as the daemon: modes are exactly those given at creation
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/* && : > /dev/emu/wlog && "
                         "mkdir -p /data/misc/tqlog /data/run/APLog_2026_0304_070649"),
                  0);
    }
    void set_run_folder(const char* folder) { ASSERT_EQ(property_set("debug.TQ.realpath", folder), 0); }
};

TEST_F(HistoryLogTest, LevelChoosesTheFiles) {
    const struct {
        int level;
        const char* run_folder;  // "": no run
        bool in_run_file, in_central;
    } cases[] = {
        {0, kRunFolder, false, true}, {0, "", false, true},  {1, kRunFolder, true, false},
        {1, "", false, true},         {2, kRunFolder, true, true}, {2, "", false, true},
        {3, kRunFolder, false, false}, {-1, kRunFolder, false, false},
        {1, "/data/run/gone/", false, false},  // a vanished run folder is not recreated
        {2, "/data/run/gone/", false, true},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::to_string(c.level) + " " + c.run_folder);
        unlink(kRunFile);
        unlink(kHistory);
        set_run_folder(c.run_folder);
        history_log(c.level, "record at level %d", c.level);
        Messages expected = {"record at level " + std::to_string(c.level)};
        EXPECT_EQ(messages_of(kRunFile), c.in_run_file ? expected : Messages());
        EXPECT_EQ(messages_of(kHistory), c.in_central ? expected : Messages());
        if (c.in_run_file && c.in_central) {
            EXPECT_EQ(read_file(kRunFile), read_file(kHistory));
        }
    }
    EXPECT_FALSE(exists("/data/run/gone"));
}

TEST_F(HistoryLogTest, LineIsTimestampMessageAndNewline) {
    time_t before = time(nullptr);
    history_log(0, "start %s", "tavlolog");
    time_t after = time(nullptr);
    std::string all = read_file(kHistory);
    ASSERT_EQ(all.size(), 20u + 14u + 1u);
    EXPECT_EQ(all.substr(20), "start tavlolog\n");
    // The local time of the call, colons in the date too.
    bool matched = false;
    for (time_t t = before; t <= after && !matched; t++) {
        struct tm tm;
        localtime_r(&t, &tm);
        char stamp[32];
        strftime(stamp, sizeof(stamp), "%Y:%m:%d %H:%M:%S ", &tm);
        matched = all.compare(0, 20, stamp) == 0;
    }
    EXPECT_TRUE(matched) << all;

    unlink(kHistory);  // an empty message still gets its timestamp
    history_log(0, "%s", "");
    all = read_file(kHistory);
    ASSERT_EQ(all.size(), 21u);
    EXPECT_TRUE(has_stamp(all));
    EXPECT_EQ(all[20], '\n');

    unlink(kHistory);  // 300 characters: 234 of them fit a line of 254
    std::string long_message(300, 'm');
    history_log(0, "%s", long_message.c_str());
    all = read_file(kHistory);
    ASSERT_EQ(all.size(), 255u);
    EXPECT_EQ(all.substr(20), long_message.substr(0, 234) + "\n");
}

TEST_F(HistoryLogTest, ControlBytesCannotForgeLines) {
    history_log(0, "recv '%s' from client %d", "stop\n2026:01:01 00:00:00 forged\r\x1b", 3);
    EXPECT_EQ(messages_of(kHistory), Messages{"recv 'stop?2026:01:01 00:00:00 forged?\?' from client 3"});
    unlink(kHistory);  // a message that ends its own line keeps its text
    history_log(0, "listen socket 'tavlologd' error\n");
    EXPECT_EQ(messages_of(kHistory), Messages{"listen socket 'tavlologd' error"});
}

// A full file becomes the previous generation; what another process planted
// in a history file's or folder's place is never written through.
TEST_F(HistoryLogTest, FilesAreBoundedAndNeverFollowLinks) {
    set_run_folder(kRunFolder);
    const std::string full(1 << 20, 'x');
    for (const char* file : {kHistory, kRunFile}) write_file(file, full);
    history_log(2, "next");
    for (const char* file : {kHistory, kRunFile}) {
        EXPECT_EQ(read_file(std::string(file) + ".1"), full) << file;
        EXPECT_EQ(messages_of(file), Messages{"next"});
    }

    write_file("/data/target", "secret\n", 0600);
    for (const char* file : {kHistory, kRunFile}) ASSERT_EQ(unlink(file) + symlink("/data/target", file), 0);
    history_log(2, "through a link?");
    EXPECT_EQ(read_file("/data/target"), "secret\n");
    EXPECT_EQ(mode_of("/data/target"), 0600u);

    ASSERT_EQ(system("rm -rf /data/misc/tqlog && mkdir /data/elsewhere && ln -s /data/elsewhere /data/misc/tqlog"), 0);
    history_log(0, "into a linked folder?");
    EXPECT_TRUE(files_in("/data/elsewhere").empty());
    EXPECT_NE(read_file(kPlatformLog).find("create dir /data/misc/tqlog failed(Too many levels of symbolic links)"),
              std::string::npos);
}

TEST_F(HistoryLogTest, DeletedFolderIsRecreatedWithItsModes) {
    umask(022);  // whatever it is
    history_log(0, "first");
    EXPECT_EQ(mode_of(kHistory), 0664u);
    ASSERT_EQ(system("rm -rf /data/misc"), 0);
    history_log(0, "second");
    EXPECT_EQ(mode_of("/data/misc"), 0775u);
    EXPECT_EQ(mode_of("/data/misc/tqlog"), 0775u);
    EXPECT_EQ(mode_of(kHistory), 0664u);
    EXPECT_EQ(messages_of(kHistory), Messages{"second"});
    chmod(kHistory, 0600);  // the mode is set once per folder, not on every record
    history_log(0, "third");
    EXPECT_EQ(mode_of(kHistory), 0600u);
    unlink(kHistory);  // but a new file is never made with more
    history_log(0, "fourth");
    EXPECT_EQ(mode_of(kHistory), 0664u);
}

TEST_F(HistoryLogTest, MakeDirRecursive) {
    // Missing parents are made; "create dir" is logged for the full path first.
    EXPECT_EQ(make_dir_recursive("/data/a/b/c"), 1);
    for (const char* dir : {"/data/a", "/data/a/b", "/data/a/b/c"}) EXPECT_EQ(mode_of(dir), 0775u) << dir;
    Messages created;
    for (const std::string& line : lines_of(kPlatformLog))
        if (line.find("create dir ") != std::string::npos) created.push_back(line.substr(line.find("create dir ")));
    EXPECT_EQ(created, (Messages{"create dir /data/a/b/c", "create dir /data/a/b", "create dir /data/a"}));
    EXPECT_EQ(read_file(kHistory), "");

    EXPECT_EQ(make_dir_recursive("/data/run"), 0);  // an existing path is a failure
    EXPECT_EQ(messages_of(kHistory), Messages{"mkdir fail(File exists)"});
    EXPECT_NE(read_file(kPlatformLog).find("TavloLogD/Util: mkdir fail(File exists)"), std::string::npos);

    unlink(kHistory);  // refused rather than cut
    EXPECT_EQ(make_dir_recursive(("/data/" + std::string(300, 'p')).c_str()), 0);
    EXPECT_EQ(errno, ENAMETOOLONG);
    EXPECT_EQ(messages_of(kHistory), Messages{"mkdir fail(File name too long)"});
}

// True when thread tid sits in open() (openat is 257 on x86-64, open 2).
bool thread_blocked_in_open(pid_t tid) {
    std::string s = read_file("/proc/self/task/" + std::to_string(tid) + "/syscall");
    return s.rfind("257 ", 0) == 0 || s.rfind("2 ", 0) == 0;
}

// A writer blocks in open() on a FIFO standing for the run-folder property
// while it holds the history lock; a child forked meanwhile must still be able to record.
TEST_F(HistoryLogTest, ForkedChildDoesNotInheritAHeldLock) {
    const char kProperty[] = "/dev/emu/properties/debug.TQ.realpath";
    ASSERT_EQ(mkfifo(kProperty, 0666), 0);
    std::atomic<pid_t> writer_tid{0};
    std::thread writer([&writer_tid] {
        writer_tid = gettid();
        history_log(2, "parent record");
    });
    ASSERT_TRUE(wait_for([&] { return writer_tid != 0 && thread_blocked_in_open(writer_tid); }, 5000))
        << "writer never reached the FIFO";

    pid_t child = fork();
    if (child == 0) {
        history_log(0, "child record");
        _exit(0);
    }
    ASSERT_GT(child, 0);
    bool child_done = exits_with(child, 0, 10000);
    int fifo = open(kProperty, O_WRONLY);  // releases the parent's writer
    ASSERT_EQ(write(fifo, kRunFolder, strlen(kRunFolder)), static_cast<ssize_t>(strlen(kRunFolder)));
    close(fifo);
    writer.join();
    EXPECT_TRUE(child_done) << "child deadlocked on the inherited history lock";
    EXPECT_EQ(messages_of(kRunFile), Messages{"parent record"});
    EXPECT_EQ(messages_of(kHistory), (Messages{"child record", "parent record"}));
}

TEST_F(HistoryLogTest, ForkedChildStampsLocalTimeWithoutTheCLibrary) {
    setenv("TZ", "XST-5:30", 1);  // an offset with minutes makes a wrong conversion show
    tzset();
    history_log(0, "parent before");
    pid_t child = fork();
    if (child == 0) {
        history_log_after_fork();  // the explicit call of a fork wrapper is harmless
        history_log(0, "child");
        _exit(0);
    }
    EXPECT_TRUE(exits_with(child, 0));
    history_log(0, "parent after");
    EXPECT_EQ(messages_of(kHistory), (Messages{"parent before", "child", "parent after"}));
    std::vector<std::string> lines = lines_of(kHistory);
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_LE(lines[0].substr(0, 19), lines[1].substr(0, 19));
    EXPECT_LE(lines[1].substr(0, 19), lines[2].substr(0, 19));
    unsetenv("TZ");
    tzset();
}

TEST_F(HistoryLogTest, RecordsOfManyProcessesNeverInterleave) {
    set_run_folder(kRunFolder);
    constexpr int kChildren = 4, kRecords = 200;
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
    for (pid_t pid : children) ASSERT_TRUE(exits_with(pid, 0, 30000));
    for (const char* path : {kHistory, kRunFile}) {
        std::vector<std::string> lines = lines_of(path);
        ASSERT_EQ(lines.size(), static_cast<size_t>(kChildren * kRecords)) << path;
        std::vector<int> next(kChildren, 0);
        for (const std::string& line : lines) {
            // A whole record: stamp, "<child> <index> " and 200 of the child's letter.
            ASSERT_TRUE(has_stamp(line)) << path << ": " << line;
            int c = -1, i = -1, consumed = 0;
            ASSERT_EQ(sscanf(line.c_str() + 20, "%d %d %n", &c, &i, &consumed), 2) << line;
            ASSERT_TRUE(c >= 0 && c < kChildren) << line;
            EXPECT_EQ(line.substr(20 + static_cast<size_t>(consumed)), std::string(200, static_cast<char>('a' + c)));
            EXPECT_EQ(i, next[c]++) << "each process's records stay in their order";
        }
    }
}

}  // namespace
