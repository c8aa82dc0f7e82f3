// The HTML report: hostile text escaped byte for byte, and the page itself
// loaded in headless Chromium with filters from its URL fragment.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "tools/tavlolog/html_report.h"
#include "tools/tavlolog/report_text.h"

using namespace tavlolog;
namespace fs = std::filesystem;

namespace {

const char HOSTILE[] =
    "</script><script>alert(1)</script><script>document.body.dataset.pwned=1</script>"
    "<!--<script> \xff\xc3 nul\x00 sep\xe2\x80\xa8 end";

TEST(ReportText, MakesHostileTextSafeAndVisible) {
    struct Row {
        std::string in, js, html;
    } rows[] = {
        {"</script><!--", "\\x3c/script>\\x3c!--", "&lt;/script&gt;&lt;!--"},
        {"a\"b\\c'&", "a\\\"b\\\\c'&", "a&quot;b\\c&#39;&amp;"},
        {std::string("\0\n\r\x1b\x7f", 5), "\u2400\u240a\u240d\u241b\u2421", "\u2400\u240a\u240d\u241b\u2421"},
        {"a\tb", "a\\tb", "a\tb"},
        {"\u2028\u2029", "\\u2028\\u2029", "\u2028\u2029"},
        {"\xff|\xc3|\xc0\xaf|\xed\xa0\x80|\xf4\x90\x80\x80|\xe2\x82",
         "\ufffd|\ufffd|\ufffd\ufffd|\ufffd\ufffd\ufffd|\ufffd\ufffd\ufffd\ufffd|\ufffd\ufffd",
         "\ufffd|\ufffd|\ufffd\ufffd|\ufffd\ufffd\ufffd|\ufffd\ufffd\ufffd\ufffd|\ufffd\ufffd"},
        {"\u00e9\u20ac\U0001F600\U0010FFFF", "\u00e9\u20ac\U0001F600\U0010FFFF", "\u00e9\u20ac\U0001F600\U0010FFFF"},
    };
    for (const Row& r : rows) {
        std::string js, html;
        append_js_text(js, r.in);
        append_html_text(html, r.in);
        EXPECT_EQ(js, r.js) << r.in;
        EXPECT_EQ(html, r.html) << r.in;
    }
}

// A run in time order: a held boot, then the run with every source, a line
// of a boot without wall-clock time and a hostile app's line.
struct Line {
    int64_t ms;  // after the run's first instant; since boot when !instant
    bool instant;
    Source src;
    Kind kind;
    int prio, pid, tid;
    const char* tag;
    std::string msg;
    const char* file;
    int boot;
    const char* boot_name;
};
const Line RUN[] = {
    {0, true, SRC_MAIN, KIND_NOTE, PRIO_NONE, -1, -1, "", "TavloLog in Normal", "main_log.hbr", -1, "hbr"},
    {10, true, SRC_KERNEL, KIND_LINE, 6, -1, -1, "", "Booting Linux on physical CPU 0x0", "kernel_log.hbr", -1, "hbr"},
    {500, true, SRC_MAIN, KIND_LINE, 3, 812, 830, "AndroidRuntime", "FATAL EXCEPTION: main", "main_log.hbr", -1, "hbr"},
    {60000, true, SRC_MAIN, KIND_MARKER, PRIO_NONE, -1, -1, "", "--------- beginning of main", "main_log", 0, ""},
    {60010, true, SRC_MAIN, KIND_LINE, 6, 1000, 1012, "ActivityManager", "Displayed com.android.settings/.Settings: +412ms", "main_log", 0, ""},
    {60020, true, SRC_SYSTEM, KIND_LINE, 4, 1000, 1040, "PackageManager", "Package com.example.spy has no signature", "main_log", 0, ""},
    {60300, true, SRC_RADIO, KIND_LINE, 7, 1523, 1523, "RILJ", "[0042]> SIGNAL_STRENGTH", "radio_log", 0, ""},
    {61000, true, SRC_EVENTS, KIND_LINE, 6, 1000, 1000, "am_proc_start", "[0,4242,10087,com.example.app,activity]", "events_log", 0, ""},
    {61200, true, SRC_KERNEL, KIND_LINE, 4, -1, -1, "", "wlan0: link down", "kernel_log", 0, ""},
    {61300, true, SRC_MAIN, KIND_LINE, 6, 1000, 1090, "WifiStateMachine", "WIFI connected to tavlo-net", "main_log", 0, ""},
    {62000, true, SRC_BT, KIND_LINE, PRIO_NONE, -1, -1, "", "HCI: LE Advertising Report", "bt_log", 0, ""},
    {62000, true, SRC_BT, KIND_HEX, PRIO_NONE, -1, -1, "", "[6 bytes] 04 3e 0c 02 01 00", "bt_log", 0, ""},
    {63000, true, SRC_MAIN, KIND_MALFORMED, PRIO_NONE, -1, -1, "", "03-04 07:07 garbled\x01", "main_log", 0, ""},
    {64000, true, SRC_MAIN, KIND_LINE, 3, 4242, 4242, "chatty", std::string(HOSTILE, sizeof HOSTILE - 1), "main_log", 0, ""},
    {65000, true, SRC_RADIO, KIND_LINE, 6, 1523, 1530, "wifi", "Wifi scan: 3 networks", "radio_log", 0, ""},
    {1234, false, SRC_KERNEL, KIND_LINE, 6, -1, -1, "", "wlan1: firmware loaded", "kernel_log.1", 0, ""},
};
constexpr int64_t RUN_START_NS = 1772604409000000000;  // 2026-03-04 06:06:49 UTC

fs::path out_dir() {
    fs::path d = fs::path(TEST_OUTPUT_DIR) / "html_report";
    fs::create_directories(d);
    return d;
}

void write_report(const fs::path& path) {
    HtmlReport report;
    ASSERT_EQ(report.open(path.c_str(), "APLog_2026_0304_070649 <b>&"), 0);
    uint64_t offset = 0;
    for (const Line& l : RUN) {
        Entry e{};
        e.instant_ns = (l.instant ? RUN_START_NS : 0) + l.ms * 1000000;
        e.has_instant = l.instant;
        e.utc_offset_s = 3600;
        e.source = l.src;
        e.kind = l.kind;
        e.priority = static_cast<int8_t>(l.prio);
        e.pid = l.pid;
        e.tid = l.tid;
        e.tag = l.tag;
        e.message = l.msg;
        e.file = l.file;
        e.offset = offset += 80;
        e.boot = l.boot;
        e.boot_name = l.boot_name;
        report.add(e);
    }
    ASSERT_EQ(report.close(), 0);
}

std::string chromium() {
    for (const char* name : {"chromium", "chromium-browser", "google-chrome"}) {
        std::string cmd = std::string("command -v ") + name + " >/dev/null 2>&1";
        if (system(cmd.c_str()) == 0) return name;
    }
    return "";
}

std::string quoted(const std::string& s) {
    std::string q = "'";
    for (char c : s) q += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return q + "'";
}

// Loads the report in headless Chromium and returns the DOM once its scripts ran.
std::string load(const std::string& browser, const fs::path& page, const std::string& fragment,
                 const std::string& extra) {
    const fs::path profile = out_dir() / "profile";
    std::string cmd = "timeout 60 " + browser +
                      " --headless --disable-gpu --no-sandbox --no-first-run --hide-scrollbars"
                      " --window-size=1280,860 --virtual-time-budget=1000 --user-data-dir=" +
                      quoted(profile) + " " + extra + " " + quoted("file://" + page.string() + "#" + fragment) +
                      " 2>>" + quoted(out_dir() / "chromium.log");
    std::string dom;
    FILE* p = popen(cmd.c_str(), "r");
    if (!p) return dom;
    char buf[65536];
    for (size_t n; (n = fread(buf, 1, sizeof buf, p)) > 0;) dom.append(buf, n);
    pclose(p);
    return dom;
}

int shown(const std::string& dom) {
    std::smatch m;
    return std::regex_search(dom, m, std::regex("data-shown=\"(\\d+)\"")) ? std::stoi(m[1]) : -1;
}

TEST(HtmlReport, LoadsInChromiumWithLanesBootsAndFilters) {
    const std::string browser = chromium();
    if (browser.empty()) GTEST_SKIP() << "no chromium (tools/install-deps.sh installs it)";
    const fs::path page = out_dir() / "report.html";
    write_report(page);

    struct Case {
        std::string fragment;
        int shown;
        std::vector<std::string> present, absent;
    } cases[] = {
        {"", 16,
         {"data-total=\"16\"", "data-src=\"K\"", "data-src=\"M\"", "data-src=\"S\"", "data-src=\"R\"",
          "data-src=\"E\"", "data-src=\"B\"", "data-src=\"K0\"", ">boot -1 \u00b7 hbr</option>", ">run</option>",
          "APLog_2026_0304_070649 &lt;b&gt;&amp;", "class=\"c-m\">Displayed com.android.settings/.Settings: +412ms<",
          "03-04 07:07:51.000", "[    1.234000]"},
         {}},
        {"q=alert(1)", 1,
         {"class=\"c-m\">&lt;/script&gt;&lt;script&gt;alert(1)&lt;/script&gt;&lt;script&gt;document.body.dataset."
          "pwned=1&lt;/script&gt;&lt;!--&lt;script&gt; \ufffd\ufffd nul\u2400 sep\u2028 end<"},
         {"data-pwned"}},
        {"q=WIFI", 2, {"WIFI connected to tavlo-net", "Wifi scan: 3 networks"}, {}},
        {"re=1&q=%5Ewlan%5B0-9%5D%3A", 2, {"wlan0: link down", "wlan1: firmware loaded"}, {}},
        {"src=KM&p=W", 3, {"FATAL EXCEPTION: main", "wlan0: link down"}, {"no signature"}},
        {"tag=ActivityManager,WifiStateMachine&pid=1000", 2, {"Displayed com.android", "WIFI connected"}, {}},
        {"boot=-1", 3, {"TavloLog in Normal", "Booting Linux"}, {"beginning of main"}},
    };
    // The first case also leaves a screenshot of the whole run, for the eye.
    const fs::path png = out_dir() / "report.png";
    fs::remove(png);
    for (const Case& c : cases) {
        const std::string extra = c.fragment.empty() ? "--screenshot=" + quoted(png) : "";
        const std::string dom = load(browser, page, c.fragment, "--dump-dom " + extra);
        ASSERT_NE(dom.find("data-ready=\"1\""), std::string::npos) << c.fragment << "\n" << dom.substr(std::min(dom.size(), dom.find("<body")), 2000);
        EXPECT_EQ(shown(dom), c.shown) << c.fragment;
        for (const std::string& s : c.present) EXPECT_NE(dom.find(s), std::string::npos) << c.fragment << ": " << s;
        for (const std::string& s : c.absent) EXPECT_EQ(dom.find(s), std::string::npos) << c.fragment << ": " << s;
    }
    EXPECT_TRUE(fs::exists(png));
}

}  // namespace
