// The platform log writer: one whole threadtime-shaped line per message in /dev/emu/wlog.
#include "common/wlog.h"

#include <thread>

#include "test_util.h"

namespace {

const char kLog[] = "/dev/emu/wlog";

// The fields of "MM-DD HH:MM:SS.mmm  PID  TID P TAG: message" after the stamp.
struct Line {
    int pid = 0, tid = 0;
    char priority = 0;
    std::string tag, message;  // the tag without its padding
};

bool parse_line(const std::string& text, Line* out) {
    static const char kStamp[] = "dd-dd dd:dd:dd.ddd ";
    const size_t stamp_len = sizeof(kStamp) - 1;
    for (size_t i = 0; i < stamp_len; i++)
        if (i >= text.size() || (kStamp[i] == 'd' ? !isdigit(static_cast<unsigned char>(text[i])) : text[i] != kStamp[i]))
            return false;
    int consumed = 0;
    if (sscanf(text.c_str() + stamp_len, "%d %d %c %n", &out->pid, &out->tid, &out->priority, &consumed) != 3 ||
        consumed == 0)
        return false;
    std::string rest = text.substr(stamp_len + static_cast<size_t>(consumed));
    size_t colon = rest.find(": ");
    if (colon == std::string::npos) return false;
    out->tag = rest.substr(0, rest.find_last_not_of(' ', colon - 1) + 1);
    out->message = rest.substr(colon + 2);
    return true;
}

// The messages of the log's lines (everything after "TAG: "); a last line
// without its newline is marked.
std::vector<std::string> messages() {
    std::vector<std::string> out;
    std::string text = read_file(kLog);
    for (const std::string& line : lines_of(kLog)) {
        size_t at = line.find(": ");
        out.push_back(at == std::string::npos ? std::string() : line.substr(at + 2));
    }
    if (!text.empty() && text.back() != '\n') out.back() += "<no newline>";
    return out;
}

class WlogTest : public ::testing::Test {
  protected:
    void SetUp() override { write_file(kLog, "", 0666); }
};

TEST_F(WlogTest, LineHasTheThreadtimeShape) {
    time_t before = time(nullptr);
    WLOG(TAG_DEBUG, WLOG_INFO, "hello %d %s", 42, "world");
    std::vector<std::string> lines = lines_of(kLog);
    ASSERT_EQ(1u, lines.size());
    Line l;
    ASSERT_TRUE(parse_line(lines[0], &l)) << lines[0];
    EXPECT_EQ(getpid(), l.pid);
    EXPECT_EQ(gettid(), l.tid);
    EXPECT_EQ('I', l.priority);
    EXPECT_EQ("TavloLogD/DEBUG", l.tag);
    EXPECT_EQ("hello 42 world", l.message);
    bool now = false;  // the stamp is the local time of the call
    for (time_t t = before; t <= time(nullptr) && !now; t++) {
        struct tm tm;
        char stamp[32];
        strftime(stamp, sizeof(stamp), "%m-%d %H:%M:%S.", localtime_r(&t, &tm));
        now = lines[0].compare(0, strlen(stamp), stamp) == 0;
    }
    EXPECT_TRUE(now) << lines[0];
}

TEST_F(WlogTest, PriorityLetters) {
    const std::pair<int, char> cases[] = {{WLOG_DEBUG, 'D'}, {WLOG_INFO, 'I'}, {WLOG_WARN, 'W'}, {WLOG_ERROR, 'E'},
                                          {2, 'V'},          {7, 'V'},         {-1, 'V'}};
    for (const auto& c : cases) {
        const struct wlog_record rec = {"Tag", "p", c.first};
        __wlog_buf_printf(0, &rec);
    }
    std::vector<std::string> lines = lines_of(kLog);
    ASSERT_EQ(7u, lines.size());
    for (size_t i = 0; i < lines.size(); i++)
        EXPECT_NE(std::string::npos, lines[i].find(std::string(" ") + cases[i].second + " Tag     : p")) << lines[i];
}

TEST_F(WlogTest, NewlinesAndControlBytes) {
    const struct {
        const char* format;
        std::vector<std::string> messages;  // one per line
    } cases[] = {
        {"ends with newline\n", {"ends with newline"}},
        {"two newlines\n\n", {"two newlines"}},
        {"a\n\nb\n", {"a", "", "b"}},
        {"", {""}},
        {"esc\x1b[31mred\rcr\ttab\x7f", {"esc\\x1b[31mred\\x0dcr\ttab\\x7f"}},
    };
    for (const auto& c : cases) {
        SetUp();
        const struct wlog_record rec = {TAG_MAIN, c.format, WLOG_INFO};
        __wlog_buf_printf(0, &rec);
        EXPECT_EQ(c.messages, messages()) << "format: " << c.format;
    }
}

TEST_F(WlogTest, LongMessagesAreCutToOneWholeLine) {
    WLOG(TAG_MAIN, WLOG_WARN, "%s", (std::string(5000, 'x') + "TAIL").c_str());
    std::string text = read_file(kLog);
    EXPECT_LE(text.size(), 1024u);
    EXPECT_EQ(1, std::count(text.begin(), text.end(), '\n'));
    ASSERT_EQ(1u, messages().size());
    std::string msg = messages()[0];
    EXPECT_GT(msg.size(), 900u);
    EXPECT_EQ(std::string(msg.size(), 'x'), msg);

    // A cut never leaves half of a UTF-8 character.
    for (size_t pad = 0; pad < 4; pad++) {
        SetUp();
        std::string utf8(pad, 'p');
        for (int i = 0; i < 600; i++) utf8 += "\xe2\x82\xac";  // the euro sign, 3 bytes
        WLOG(TAG_MAIN, WLOG_INFO, "%s", utf8.c_str());
        ASSERT_EQ(1u, messages().size());
        std::string m = messages()[0];
        ASSERT_GE(m.size(), pad);
        EXPECT_EQ(0u, (m.size() - pad) % 3) << "pad " << pad;
        EXPECT_EQ('\xac', m.back()) << "pad " << pad;
    }
}

TEST_F(WlogTest, KeepsErrnoAndSurvivesAMissingLog) {
    errno = ENOSPC;
    WLOG(TAG_MAIN, WLOG_ERROR, "failure %s", strerror(errno));
    EXPECT_EQ(ENOSPC, errno);
    ASSERT_EQ(0, rename(kLog, "/dev/emu/wlog.away"));
    errno = EACCES;
    const struct wlog_record rec = {TAG_MAIN, "dropped", WLOG_INFO};
    EXPECT_EQ(-1, __wlog_buf_printf(0, &rec));
    EXPECT_EQ(EACCES, errno);
    EXPECT_FALSE(exists(kLog)) << "never created by the writer";
    ASSERT_EQ(0, rename("/dev/emu/wlog.away", kLog));
    EXPECT_EQ(1u, lines_of(kLog).size());
}

// Threads and forked processes log long lines at once; every line must come
// out whole: one writer's full payload behind one prefix.
TEST_F(WlogTest, ConcurrentWritersNeverInterleave) {
    const int kLinesPerWriter = 300;
    auto writer = [&](char letter) {
        std::string payload(700, letter);
        for (int i = 0; i < kLinesPerWriter; i++) WLOG(TAG_TRANSIST, WLOG_DEBUG, "%c%04d %s", letter, i, payload.c_str());
    };
    std::vector<pid_t> children;
    for (char letter : {'p', 'q'}) {
        pid_t pid = fork();
        if (pid == 0) {
            std::thread t([&] { writer(static_cast<char>(letter + 2)); });  // 'r', 's'
            writer(letter);
            t.join();
            _exit(0);
        }
        ASSERT_GT(pid, 0);
        children.push_back(pid);
    }
    std::vector<std::thread> threads;
    for (char letter : {'a', 'b', 'c'}) threads.emplace_back([&, letter] { writer(letter); });
    for (auto& t : threads) t.join();
    for (pid_t pid : children) EXPECT_TRUE(exits_with(pid, 0, 30000));

    std::vector<std::string> lines = lines_of(kLog);
    EXPECT_EQ(7u * kLinesPerWriter, lines.size());
    int bad = 0;
    for (const auto& line : lines) {
        Line l;
        bool ok = parse_line(line, &l) && l.priority == 'D' && l.tag == "TavloLogD/Transist" &&
                  l.message.size() == 1 + 4 + 1 + 700 && l.message.substr(6) == std::string(700, l.message[0]);
        if (!ok && bad++ < 3) ADD_FAILURE() << "torn line: " << line.substr(0, 120);
    }
    EXPECT_EQ(0, bad);
}

}  // namespace
