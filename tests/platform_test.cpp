// The platform log writer, and the emulated phone's system properties as the daemon reads them.
#include "common/wlog.h"
#include "test_util.h"

namespace {

using Lines = std::vector<std::string>;
const char kLog[] = "/dev/emu/wlog";

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
        Lines lines = wlog_lines();
        ASSERT_EQ(lines.size(), 1u);
        std::string message = lines[0].substr(7);
        EXPECT_TRUE(message.size() > 900 && read_file(kLog).size() <= 1024u) << message.size();
        EXPECT_EQ(message, euros.substr(0, pad + (message.size() - pad) / 3 * 3)) << pad;
    }
}

TEST(Wlog, KeepsErrnoAndNeverMakesTheLog) {
    ASSERT_EQ(rename(kLog, "/dev/emu/wlog.away"), 0);
    errno = ENOSPC;
    EXPECT_EQ(__wlog_buf_printf(0, nullptr), -1);
    wlog(WLOG_INFO, "dropped");
    EXPECT_EQ(errno, ENOSPC);
    EXPECT_FALSE(exists(kLog));
    ASSERT_EQ(rename("/dev/emu/wlog.away", kLog), 0);
}

// As libcutils: an empty value yields the caller's default.
TEST(Properties, EmptyValueYieldsTheDefault) {
    ASSERT_EQ(property_set("debug.empty", ""), 0);
    char value[PROPERTY_VALUE_MAX];
    EXPECT_EQ(property_get("debug.empty", value, "dflt"), 4);
    EXPECT_STREQ(value, "dflt");
}

}  // namespace
