// The platform log writer, and the emulated phone's system properties as the daemon reads them.
#include <thread>

#include "common/wlog.h"
#include "platform/property_area.h"
#include "test_util.h"

namespace {

using Lines = std::vector<std::string>;
const char kLog[] = "/dev/emu/wlog";

// "P TAG: message" of each line "MM-DD HH:MM:SS.mmm  PID  TID P TAG     : message"
// once its shape, pid and tid are checked (any pid when pid is 0); "torn: line" otherwise.
Lines wlog_lines(pid_t pid = getpid(), pid_t tid = gettid()) {
    Lines out;
    for (const std::string& line : lines_of(kLog)) {
        int mo, d, h, mi, s, ms, p, t, n = 0;
        char prio;
        bool ok = sscanf(line.c_str(), "%2d-%2d %2d:%2d:%2d.%3d %5d %5d %c %n", &mo, &d, &h, &mi, &s, &ms, &p, &t,
                         &prio, &n) == 9 && n == 33 && (pid == 0 || (p == pid && t == tid));
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

TEST(Wlog, OneWholeLinePerTextLineWithoutControlBytes) {
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
        std::string all = read_file(kLog);
        EXPECT_LE(all.size(), 1024u);
        ASSERT_EQ(wlog_lines().size(), 1u);
        std::string message = wlog_lines()[0].substr(7);
        EXPECT_EQ(message, euros.substr(0, pad + (message.size() - pad) / 3 * 3)) << pad;
        EXPECT_GT(message.size(), 900u);
    }
}

TEST(Wlog, KeepsErrnoAndNeverMakesTheLog) {
    write_file(kLog, "", 0666);
    errno = ENOSPC;
    WLOG(TAG_MAIN, WLOG_ERROR, "failure %s", strerror(errno));
    EXPECT_EQ(errno, ENOSPC);
    ASSERT_EQ(rename(kLog, "/dev/emu/wlog.away"), 0);
    EXPECT_EQ(__wlog_buf_printf(0, nullptr), -1);
    wlog(WLOG_INFO, "dropped");
    EXPECT_FALSE(exists(kLog));
    ASSERT_EQ(rename("/dev/emu/wlog.away", kLog), 0);
    EXPECT_EQ(wlog_lines(), Lines{"E TavloLogD: failure No space left on device"});
}

// Threads and processes log long lines at once: every line comes out whole.
TEST(Wlog, ConcurrentWritersNeverInterleave) {
    write_file(kLog, "", 0666);
    auto writer = [](char letter) {
        for (int i = 0; i < 300; i++) wlog(WLOG_DEBUG, std::string(700, letter));
    };
    std::vector<pid_t> children;
    for (char letter : {'p', 'q'}) {
        pid_t pid = fork();
        if (pid == 0) {
            std::thread t(writer, letter + 2);
            writer(letter);
            t.join();
            _exit(0);
        }
        children.push_back(pid);
    }
    std::vector<std::thread> threads;
    for (char letter : {'a', 'b', 'c'}) threads.emplace_back(writer, letter);
    for (auto& t : threads) t.join();
    for (pid_t pid : children) EXPECT_TRUE(exits_with(pid, 0, 30000));
    Lines lines = wlog_lines(0);
    EXPECT_EQ(lines.size(), 7u * 300);
    for (const std::string& line : lines)
        ASSERT_EQ(line, "D Tag: " + std::string(700, line.back())) << "a torn line";
}

class Properties : public ::testing::Test {
  protected:
    void SetUp() override {
        for (const char* dir : {PROPERTY_AREA_DIR, PROPERTY_PERSIST_DIR})
            for (const std::string& name : files_in(dir)) unlink((std::string(dir) + "/" + name).c_str());
    }
};

TEST_F(Properties, ValuesAndDefaultsAreCutNeverOverrun) {
    EXPECT_EQ(property_set("debug.v", std::string(91, 'x').c_str()), 0);
    EXPECT_LT(property_set("debug.v", std::string(92, 'y').c_str()), 0);
    EXPECT_EQ(property("debug.v"), std::string(91, 'x')) << "a refused set changes nothing";
    write_file(PROPERTY_AREA_DIR "/debug.big", std::string(300, 'z'), 0664);  // written by hand
    write_file(PROPERTY_AREA_DIR "/debug.nul", std::string("ab\0cd", 5), 0664);
    EXPECT_EQ(property_set("debug.empty", ""), 0);
    const std::string d200(200, 'd'), z91(91, 'z'), d91(91, 'd');
    const struct {
        const char *key, *def, *value;
    } cases[] = {{"debug.big", nullptr, z91.c_str()}, {"debug.missing", d200.c_str(), d91.c_str()},
                 {"debug.missing", nullptr, ""},
                 {"debug.empty", "dflt", "dflt"},  // as libcutils: empty yields the default
                 {"debug.nul", nullptr, "ab"}};
    for (const auto& c : cases) {
        char value[PROPERTY_VALUE_MAX + 8];
        memset(value, '#', sizeof(value));
        EXPECT_EQ(property_get(c.key, value, c.def), static_cast<int>(strlen(c.value))) << c.key;
        EXPECT_STREQ(value, c.value) << c.key;
        EXPECT_EQ(value[PROPERTY_VALUE_MAX], '#') << c.key;
    }
}

}  // namespace
