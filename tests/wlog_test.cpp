// The platform log writer: one threadtime-shaped line per message, appended
// whole to /dev/emu/wlog (runs in a throwaway phone).
#include "common/wlog.h"

#include <errno.h>
#include <fcntl.h>
#include <ctype.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

namespace {

const char kLog[] = "/dev/emu/wlog";

std::string read_log() {
    std::string text;
    int fd = open(kLog, O_RDONLY);
    if (fd < 0) return text;
    char buf[65536];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) text.append(buf, n);
    close(fd);
    return text;
}

std::vector<std::string> read_lines() {
    std::vector<std::string> lines;
    std::string text = read_log();
    size_t start = 0;
    while (start < text.size()) {
        size_t end = text.find('\n', start);
        if (end == std::string::npos) {
            lines.push_back(text.substr(start) + "<no newline>");
            break;
        }
        lines.push_back(text.substr(start, end - start));
        start = end + 1;
    }
    return lines;
}

// The message part of a line: everything after "TAG: ".
std::string message_of(const std::string& line) {
    size_t at = line.find(": ");
    return at == std::string::npos ? std::string() : line.substr(at + 2);
}

// The fields of "MM-DD HH:MM:SS.mmm  PID  TID P TAG: message".
struct Line {
    int month, day, hour, minute, second;
    int pid, tid;
    char priority;
    std::string tag;  // without the padding
    std::string message;
};

bool parse_line(const std::string& text, Line* out) {
    static const char kStamp[] = "dd-dd dd:dd:dd.ddd ";
    if (text.size() < sizeof(kStamp)) return false;
    for (size_t i = 0; i + 1 < sizeof(kStamp); i++) {
        bool digit = isdigit(static_cast<unsigned char>(text[i])) != 0;
        if (kStamp[i] == 'd' ? !digit : text[i] != kStamp[i]) return false;
    }
    int consumed = 0;
    int ms = 0;
    if (sscanf(text.c_str(), "%2d-%2d %2d:%2d:%2d.%3d %d %d %c %n", &out->month, &out->day,
               &out->hour, &out->minute, &out->second, &ms, &out->pid, &out->tid, &out->priority,
               &consumed) != 9 ||
        consumed == 0)
        return false;
    std::string rest = text.substr(static_cast<size_t>(consumed));
    size_t colon = rest.find(": ");
    if (colon == std::string::npos) return false;
    out->tag = rest.substr(0, colon);
    while (!out->tag.empty() && out->tag.back() == ' ') out->tag.pop_back();
    out->message = rest.substr(colon + 2);
    return true;
}

class WlogTest : public ::testing::Test {
  protected:
    void SetUp() override {
        int fd = open(kLog, O_WRONLY | O_CREAT | O_TRUNC, 0666);
        ASSERT_GE(fd, 0);
        close(fd);
    }
};

TEST_F(WlogTest, LineHasTheThreadtimeShape) {
    WLOG(TAG_DEBUG, WLOG_INFO, "hello %d %s", 42, "world");
    std::vector<std::string> lines = read_lines();
    ASSERT_EQ(1u, lines.size());
    Line l;
    ASSERT_TRUE(parse_line(lines[0], &l)) << lines[0];
    EXPECT_EQ(getpid(), l.pid);
    EXPECT_EQ(gettid(), l.tid);
    EXPECT_EQ('I', l.priority);
    EXPECT_EQ("TavloLogD/DEBUG", l.tag);
    EXPECT_EQ("hello 42 world", l.message);
    // The stamp is the local time of now (the date is computed by hand).
    time_t now = time(nullptr);
    struct tm tm;
    localtime_r(&now, &tm);
    tm.tm_mon = l.month - 1;
    tm.tm_mday = l.day;
    tm.tm_hour = l.hour;
    tm.tm_min = l.minute;
    tm.tm_sec = l.second;
    tm.tm_isdst = -1;
    EXPECT_LE(llabs(static_cast<long long>(difftime(mktime(&tm), now))), 5) << lines[0];
}

struct PriorityCase {
    int priority;
    char letter;
};

TEST_F(WlogTest, PriorityLetters) {
    const PriorityCase cases[] = {{WLOG_DEBUG, 'D'}, {WLOG_INFO, 'I'}, {WLOG_WARN, 'W'},
                                  {WLOG_ERROR, 'E'}, {2, 'V'},         {7, 'V'},
                                  {-1, 'V'}};
    for (const auto& c : cases) {
        const struct wlog_record rec = {"Tag", "p", c.priority};
        __wlog_buf_printf(0, &rec);
    }
    std::vector<std::string> lines = read_lines();
    ASSERT_EQ(sizeof(cases) / sizeof(cases[0]), lines.size());
    for (size_t i = 0; i < lines.size(); i++) {
        SCOPED_TRACE(lines[i]);
        EXPECT_NE(std::string::npos, lines[i].find(std::string(" ") + cases[i].letter + " Tag     : p"));
    }
}

struct ShapeCase {
    const char* format;
    std::vector<std::string> messages;  // one per line
};

TEST_F(WlogTest, NewlinesAndControlBytes) {
    const ShapeCase cases[] = {
        {"ends with newline\n", {"ends with newline"}},
        {"two newlines\n\n", {"two newlines"}},
        {"first\nsecond", {"first", "second"}},
        {"a\n\nb\n", {"a", "", "b"}},
        {"", {""}},
        {"esc\x1b[31mred\rcr\ttab\x7f", {"esc\\x1b[31mred\\x0dcr\ttab\\x7f"}},
    };
    for (const auto& c : cases) {
        SetUp();
        const struct wlog_record rec = {TAG_MAIN, c.format, WLOG_INFO};
        __wlog_buf_printf(0, &rec);
        std::vector<std::string> lines = read_lines();
        std::vector<std::string> messages;
        for (const auto& l : lines) messages.push_back(message_of(l));
        EXPECT_EQ(c.messages, messages) << "format: " << c.format;
    }
}

TEST_F(WlogTest, LongMessagesAreCutToOneWholeLine) {
    std::string big(5000, 'x');
    big += "TAIL";
    WLOG(TAG_MAIN, WLOG_WARN, "%s", big.c_str());
    std::string text = read_log();
    ASSERT_FALSE(text.empty());
    EXPECT_LE(text.size(), 1024u);
    EXPECT_EQ('\n', text.back());
    EXPECT_EQ(1, std::count(text.begin(), text.end(), '\n'));
    std::string msg = message_of(text.substr(0, text.size() - 1));
    EXPECT_GT(msg.size(), 900u);
    EXPECT_EQ(std::string(msg.size(), 'x'), msg);

    // A cut never leaves half of a UTF-8 character.
    for (size_t pad = 0; pad < 4; pad++) {
        SetUp();
        std::string utf8(pad, 'p');
        for (int i = 0; i < 600; i++) utf8 += "\xe2\x82\xac";  // the euro sign, 3 bytes
        WLOG(TAG_MAIN, WLOG_INFO, "%s", utf8.c_str());
        std::string line = read_log();
        ASSERT_EQ('\n', line.back());
        std::string m = message_of(line.substr(0, line.size() - 1));
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
    struct stat st;
    EXPECT_NE(0, stat(kLog, &st));  // never created by the writer
    ASSERT_EQ(0, rename("/dev/emu/wlog.away", kLog));
    EXPECT_EQ(-1, __wlog_buf_printf(0, nullptr));
    const struct wlog_record no_format = {TAG_MAIN, nullptr, WLOG_INFO};
    EXPECT_EQ(-1, __wlog_buf_printf(0, &no_format));
    const struct wlog_record no_tag = {nullptr, "no tag", WLOG_INFO};
    EXPECT_GT(__wlog_buf_printf(0, &no_tag), 0);
    EXPECT_EQ(2u, read_lines().size());
}

// Threads and forked processes log long lines at once; every line must come
// out whole: one writer's full payload behind one prefix.
TEST_F(WlogTest, ConcurrentWritersNeverInterleave) {
    const int kLinesPerWriter = 300;
    auto writer = [&](char letter) {
        std::string payload(700, letter);
        for (int i = 0; i < kLinesPerWriter; i++)
            WLOG(TAG_TRANSIST, WLOG_DEBUG, "%c%04d %s", letter, i, payload.c_str());
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
    for (pid_t pid : children) {
        int status = 0;
        ASSERT_EQ(pid, waitpid(pid, &status, 0));
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }

    std::vector<std::string> lines = read_lines();
    EXPECT_EQ(7u * kLinesPerWriter, lines.size());
    int bad = 0;
    for (const auto& line : lines) {
        Line l;
        bool ok = parse_line(line, &l) && l.priority == 'D' && l.tag == "TavloLogD/Transist";
        if (ok) {
            const std::string& msg = l.message;
            char letter = msg.empty() ? 0 : msg[0];
            ok = msg.size() == 1 + 4 + 1 + 700 && msg.substr(6) == std::string(700, letter);
        }
        if (!ok && bad++ < 3) ADD_FAILURE() << "torn line: " << line.substr(0, 120);
    }
    EXPECT_EQ(0, bad);
}

}  // namespace
