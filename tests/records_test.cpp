// The daemon's own records on the phone's real paths: the history log, its rate
// limit, the platform log writer, and the hazards of a multi-threaded, forking
// daemon; and the property stand-in's default.
#include "storage/history_log.h"

#include <limits.h>

#include <atomic>
#include <thread>

#include "record/record.h"
#include "record/record_limit.h"
#include "storage/safe_file.h"
#include "test_util.h"

namespace {

using Lines = std::vector<std::string>;
const char kRunFolder[] = "/data/run/APLog_2026_0304_070649/";
const std::string kRunFile = std::string(kRunFolder) + "tqlog_history";
const char kLog[] = "/dev/emu/wlog";

// "YYYY:MM:DD HH:MM:SS " of the local time t.
std::string stamp(time_t t) {
    struct tm tm;
    char out[32];
    strftime(out, sizeof(out), "%Y:%m:%d %H:%M:%S ", localtime_r(&t, &tm));
    return out;
}

// The messages of a history file, after checking each line's timestamp.
Lines messages_of(const std::string& path) {
    Lines out;
    for (const std::string& line : lines_of(path)) {
        int f[6], n = 0;
        EXPECT_TRUE(sscanf(line.c_str(), "%4d:%2d:%2d %2d:%2d:%2d %n", &f[0], &f[1], &f[2], &f[3], &f[4], &f[5], &n) == 6 && n == 20) << line;
        out.push_back(line.substr(std::min<size_t>(20, line.size())));
    }
    return out;
}

class HistoryLogTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        umask(0);  // as the daemon: modes are exactly those given at creation
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/* && : > /dev/emu/wlog && "
                         "mkdir -p /data/misc/tqlog /data/run/APLog_2026_0304_070649"), 0);
    }
};

TEST_F(HistoryLogTest, LevelChoosesTheFiles) {
    const struct {
        int level;
        const char* run_folder;  // "": no run
        bool in_run_file, in_central;
    } cases[] = {
        {0, kRunFolder, false, true}, {1, kRunFolder, true, false}, {2, kRunFolder, true, true},
        {1, "", false, true},         {3, kRunFolder, false, false}, {-1, kRunFolder, false, false},
        {1, "/data/run/gone/", false, false},  // a vanished run folder is not made again
        {2, "/data/run/gone/", false, true},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::to_string(c.level) + " " + c.run_folder);
        unlink(kRunFile.c_str());
        unlink(kHistory);
        ASSERT_EQ(property_set("debug.TQ.realpath", c.run_folder), 0);
        history_log(c.level, "record at level %d", c.level);
        Lines expected = {"record at level " + std::to_string(c.level)};
        EXPECT_EQ(messages_of(kRunFile), c.in_run_file ? expected : Lines());
        EXPECT_EQ(messages_of(kHistory), c.in_central ? expected : Lines());
    }
    EXPECT_FALSE(exists("/data/run/gone"));
}

// One line per record: the local time, then the message cut to fit 254
// characters, its control bytes shown as '?' so that no text can forge lines.
TEST_F(HistoryLogTest, RecordIsOneStampedLine) {
    const std::string m300(300, 'm');
    const struct {
        std::string message, line;
    } cases[] = {
        {"", ""},
        {m300, m300.substr(0, 234)},
        {"stop\n2026:01:01 00:00:00 forged\r\x1b\tx", "stop?2026:01:01 00:00:00 forged??\tx"},
        {"listen socket 'tavlologd' error\n", "listen socket 'tavlologd' error"},  // ends its own line
    };
    for (const auto& c : cases) {
        unlink(kHistory);
        time_t before = time(nullptr);
        history_log(0, "%s", c.message.c_str());
        std::string all = read_file(kHistory);
        ASSERT_GE(all.size(), 20u);
        EXPECT_EQ(all.substr(20), c.line + "\n");
        EXPECT_TRUE(stamp(before) <= all.substr(0, 20) && all.substr(0, 20) <= stamp(time(nullptr))) << all;
    }
}

// A full file becomes the previous generation; what another process planted
// in a history file's or folder's place is never written through.
TEST_F(HistoryLogTest, FilesAreBoundedAndNeverFollowLinks) {
    ASSERT_EQ(property_set("debug.TQ.realpath", kRunFolder), 0);
    const std::string full(1 << 20, 'x');
    for (const std::string& file : {std::string(kHistory), kRunFile}) write_file(file, full);
    history_log(2, "next");
    for (const std::string& file : {std::string(kHistory), kRunFile}) {
        EXPECT_EQ(read_file(file + ".1"), full) << file;
        EXPECT_EQ(messages_of(file), Lines{"next"});
        ASSERT_EQ(unlink(file.c_str()) + symlink("/data/target", file.c_str()), 0);
    }
    write_file("/data/target", "secret\n");
    history_log(2, "through a link?");
    EXPECT_EQ(read_file("/data/target"), "secret\n");

    ASSERT_EQ(system("rm -rf /data/misc/tqlog && mkdir /data/elsewhere && ln -s /data/elsewhere /data/misc/tqlog"), 0);
    history_log(0, "into a linked folder?");
    EXPECT_TRUE(files_in("/data/elsewhere").empty());
}

// Folders are made again with their parents and modes (the history's whatever the umask).
TEST_F(HistoryLogTest, FoldersAreMadeWithTheirModes) {
    umask(022);
    ASSERT_EQ(system("rm -rf /data/misc"), 0);
    history_log(0, "first");
    EXPECT_EQ(make_dir_recursive(("/data/" + std::string(300, 'p')).c_str()), 0) << "refused rather than cut";
    for (const char* path : {"/data/misc", "/data/misc/tqlog"}) EXPECT_EQ(mode_of(path), 0775u) << path;
    EXPECT_EQ(mode_of(kHistory), 0664u);
    EXPECT_EQ(messages_of(kHistory), (Lines{"first", "mkdir fail(File name too long)"}));
}

// A thread blocks in open() on a FIFO standing for the run-folder property
// while it holds the history lock; a child forked meanwhile must still record,
// stamped with the local time without the C library's time-zone lock.
TEST_F(HistoryLogTest, ForkedChildRecordsWhileAThreadHoldsTheLock) {
    setenv("TZ", "XST-5:30", 1);  // an offset with minutes makes a wrong conversion show
    tzset();
    history_log(0, "parent before");
    const char kProperty[] = "/dev/emu/properties/debug.TQ.realpath";
    ASSERT_EQ(mkfifo(kProperty, 0666), 0);
    std::atomic<pid_t> tid{0};
    std::thread writer([&tid] {
        tid = gettid();
        history_log(2, "parent record");
    });
    // In open(): openat is 257 on x86-64, open 2.
    auto in_open = [&] {
        std::string s = read_file("/proc/self/task/" + std::to_string(tid) + "/syscall");
        return tid != 0 && (s.rfind("257 ", 0) == 0 || s.rfind("2 ", 0) == 0);
    };
    ASSERT_TRUE(wait_for(in_open, 5000));
    pid_t child = fork();
    if (child == 0) {
        history_log(0, "child record");
        _exit(0);
    }
    bool child_done = exits_with(child, 0, 10000);
    write_file(kProperty, kRunFolder);  // lets the writer go on
    writer.join();
    history_log(0, "parent after");
    unsetenv("TZ");
    tzset();
    EXPECT_TRUE(child_done) << "the child deadlocked on the inherited lock";
    EXPECT_EQ(messages_of(kRunFile), Lines{"parent record"});
    ASSERT_EQ(messages_of(kHistory), (Lines{"parent before", "child record", "parent record", "parent after"}));
    Lines lines = lines_of(kHistory);
    EXPECT_TRUE(lines[0].substr(0, 20) <= lines[1].substr(0, 20) && lines[1].substr(0, 20) <= lines[3].substr(0, 20));
}

// Threads and processes record long lines at once, in the history and the
// platform log: every line comes out whole.
TEST_F(HistoryLogTest, ConcurrentWritersNeverInterleave) {
    ASSERT_EQ(property_set("debug.TQ.realpath", kRunFolder), 0);
    auto writer = [](char c) {
        for (int i = 0; i < 1000; i++) {
            history_log(2, "%s", std::string(200, c).c_str());
            WLOG(TAG_DEBUG, WLOG_DEBUG, "%s", std::string(700, c).c_str());
        }
    };
    pid_t child = fork();
    if (child == 0) {
        writer('p');
        _exit(0);
    }
    std::thread a(writer, 'a'), b(writer, 'b');
    a.join();
    b.join();
    ASSERT_TRUE(exits_with(child, 0, 30000));
    for (const std::string& path : {std::string(kHistory), kRunFile}) {
        Lines messages = messages_of(path);
        EXPECT_EQ(messages.size(), 3000u) << path;
        for (const std::string& m : messages) ASSERT_EQ(m, std::string(200, m[0])) << path << ": a torn record";
    }
    Lines wlog = lines_of(kLog);
    EXPECT_EQ(wlog.size(), 3000u);
    for (const std::string& line : wlog) ASSERT_EQ(line.substr(line.find(": ") + 2), std::string(700, line.back())) << "torn";
}

// The first record passes; later ones in its window are counted and summed up
// in one record once the window is over; threads within one window lose no count.
TEST(RecordLimit, FirstRecordThenOneSummaryPerWindow) {
    SKIP_OUTSIDE_PHONE();
    RecordLimit limit = RECORD_LIMIT(TAG_MAIN, "test records");
    EXPECT_TRUE(record_limit_pass(&limit));
    for (int i = 0; i < 3; i++) EXPECT_FALSE(record_limit_pass(&limit));
    EXPECT_GT(record_limit_flush(&limit), 0);
    EXPECT_TRUE(history_messages().empty());
    limit.next_ms = 0;  // the window is over
    EXPECT_EQ(record_limit_flush(&limit), -1);
    EXPECT_FALSE(record_limit_pass(&limit)) << "the summary opens a window";
    limit.next_ms = 0;
    EXPECT_TRUE(record_limit_pass(&limit));
    EXPECT_EQ(history_messages(), (Lines{"3 more test records not recorded", "1 more test records not recorded"}));

    limit.next_ms = LLONG_MAX;
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; t++)
        threads.emplace_back([&] {
            for (int i = 0; i < 10000; i++) EXPECT_FALSE(record_limit_pass(&limit));
        });
    for (std::thread& t : threads) t.join();
    EXPECT_EQ(limit.held.load(), 40000);
}

// "P TAG: message" of each line "MM-DD HH:MM:SS.mmm  PID  TID P TAG     : message"
// once its shape, pid and tid are checked; "torn: line" otherwise.
Lines wlog_lines() {
    Lines out;
    for (const std::string& line : lines_of(kLog)) {
        int mo, d, h, mi, s, ms, p, t, n = 0;
        char prio;
        bool ok = sscanf(line.c_str(), "%2d-%2d %2d:%2d:%2d.%3d %5d %5d %c %n", &mo, &d, &h, &mi, &s, &ms, &p, &t,
                         &prio, &n) == 9 && n == 33 && p == getpid() && t == gettid();
        size_t colon = line.find(": ", n);
        if (!ok || colon == std::string::npos) {
            out.push_back("torn: " + line);
            continue;
        }
        std::string tag = line.substr(n, colon - n);
        out.push_back(std::string(1, prio) + " " + tag.substr(0, tag.find_last_not_of(' ') + 1) + line.substr(colon));
    }
    return out;
}

void wlog(int priority, const std::string& message) {
    const struct wlog_record rec = {"Tag", "%s", priority};
    __wlog_buf_printf(0, &rec, message.c_str());
}

TEST(Wlog, OneWholeLinePerTextLineWithoutControlBytesNorErrnoChange) {
    write_file(kLog, "", 0666);
    time_t before = time(nullptr);
    WLOG(TAG_DEBUG, WLOG_INFO, "hello %d %s", 42, "world");
    wlog(WLOG_ERROR, "a\n\nb\n\n");  // a final line feed adds no empty line
    wlog(7, "esc\x1b[31mred\rcr\ttab\x7f");
    EXPECT_EQ(wlog_lines(), (Lines{"I TavloLogD/DEBUG: hello 42 world", "E Tag: a", "E Tag: ", "E Tag: b",
                                   "V Tag: esc\\x1b[31mred\\x0dcr\ttab\\x7f"}));
    struct tm tm;  // the local time of the call
    char stamp[32];
    strftime(stamp, sizeof(stamp), "%m-%d %H:%M:%S", localtime_r(&before, &tm));
    EXPECT_GE(read_file(kLog).substr(0, 14), stamp);

    // A long message is cut to one line, never within a UTF-8 character.
    for (size_t pad = 0; pad < 4; pad++) {
        write_file(kLog, "", 0666);
        std::string euros(pad, 'p');
        for (int i = 0; i < 600; i++) euros += "\xe2\x82\xac";
        wlog(WLOG_INFO, euros + "\nTAIL");
        Lines lines = wlog_lines();
        ASSERT_EQ(lines.size(), 1u);
        std::string message = lines[0].substr(7);
        EXPECT_TRUE(message.size() > 900 && read_file(kLog).size() <= 1024u) << message.size();
        EXPECT_EQ(message, euros.substr(0, pad + (message.size() - pad) / 3 * 3)) << pad;
    }
    // Without the log nothing is made, and errno is kept for the caller's message.
    ASSERT_EQ(unlink(kLog), 0);
    errno = ENOSPC;
    EXPECT_EQ(__wlog_buf_printf(0, nullptr), -1);
    wlog(WLOG_INFO, "dropped");
    EXPECT_EQ(errno, ENOSPC);
    EXPECT_FALSE(exists(kLog));
}

// As libcutils: an empty value yields the caller's default.
TEST(Properties, EmptyValueYieldsTheDefault) {
    ASSERT_EQ(property_set("debug.empty", ""), 0);
    char value[PROPERTY_VALUE_MAX];
    EXPECT_EQ(property_get("debug.empty", value, "dflt"), 4);
    EXPECT_STREQ(value, "dflt");
}

}  // namespace
