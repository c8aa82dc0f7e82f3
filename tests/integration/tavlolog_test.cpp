// tavlolog on a run recorded by the daemon of an emulated phone: lines written
// at known instants on every source come out merged in the order of their
// instants, kernel lines placed through the boot start the run recorded.
#include <stdlib.h>
#include <time.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <filesystem>
#include <regex>
#include <string>
#include <vector>

#include "tests/chromium.h"
#include "tests/integration/log_daemon.h"
#include "tools/tavlolog/output.h"
#include "tools/tavlolog/run_folder.h"
#include "tools/tavlolog/timeline.h"

namespace {

struct Seen {
    char source;
    int64_t instant;
    std::string tag, text;
};

struct Collect : tavlolog::Sink {
    std::vector<Seen> seen;
    size_t entries = 0;
    size_t per_source[tavlolog::SRC_COUNT] = {};
    std::vector<std::string> messages;
    void entry(const tavlolog::Entry& e) override {
        entries++;
        per_source[e.source]++;
        messages.emplace_back(e.message);
        if (e.kind == tavlolog::KIND_LINE)
            seen.push_back({tavlolog::SOURCE_LETTER[e.source], e.has_instant ? e.instant_ns : -1, std::string(e.tag),
                            std::string(e.message)});
    }
};

// A run recorded on a phone with lines written at known instants on every source.
struct Recorded {
    std::string folder;                           // on the host
    int64_t base = 0;                             // the first line's instant
    std::vector<std::pair<int64_t, char>> want;   // each line's instant and source
};

void record_run(EmuPhone& phone, Recorded* run) {
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(ctl(phone, "start"));
    std::string folder = run_folder(phone);
    ASSERT_TRUE(EmuPhone::wait_for([&] { return contains(phone.read_file(folder + "properties"), "boot_wallclock"); }));
    int64_t wallclock;
    ASSERT_TRUE(tavlolog::parse_wallclock(phone.getprop("debug.TQ.boot_wallclock"), &wallclock));

    // Instants 7 ms apart from a second ahead; each source gets every fifth, and
    // each buffer is written as a batch, so only the instants give the order.
    const char* const order = "MSREK";
    struct timespec now;
    clock_gettime(CLOCK_REALTIME, &now);
    const int64_t base = (static_cast<int64_t>(now.tv_sec) + 1) * 1000000000;
    run->base = base;
    const int kLines = 20;
    std::vector<std::pair<int64_t, char>>& want = run->want;
    std::string kmsg;
    for (const char* s = order; *s; s++) {
        for (int i = static_cast<int>(s - order); i < kLines; i += 5) {
            int64_t at = base + int64_t{i} * 7000000;
            want.push_back({at, *s == 'S' ? 'M' : *s});  // main_log does not tell system lines apart
            std::string header = "1,1," + std::to_string(at / 1000000000) + "," + std::to_string(at % 1000000000);
            std::string text = "n=" + std::to_string(i);
            if (*s == 'K') {
                int64_t up = at - wallclock;
                char line[80];
                snprintf(line, sizeof(line), "<6>[%5lld.%06lld] %s\n", static_cast<long long>(up / 1000000000),
                         static_cast<long long>(up % 1000000000 / 1000), text.c_str());
                kmsg += line;
            } else if (*s == 'E') {
                ASSERT_EQ(0, phone.exec({"log", "-b", "events", "-t", "1000004", "-H", header, "l:" + std::to_string(i)}));
            } else {
                const char* buffer = *s == 'M' ? "main" : *s == 'S' ? "system" : "radio";
                ASSERT_EQ(0, phone.exec({"log", "-b", buffer, "-t", "seq", "-H", header, text}));
            }
        }
    }
    ASSERT_TRUE(phone.feed("kmsg", kmsg) && phone.feed("btlog", "bt first\nbt second\n"));
    ASSERT_TRUE(EmuPhone::wait_for([&] {
        return contains(phone.read_file(folder + "kernel_log"), "n=19") &&
               contains(phone.read_file(folder + "bt_log"), "bt second") &&
               count(phone.read_file(folder + "main_log"), " seq ") + count(phone.read_file(folder + "radio_log"), " seq ") == 12 &&
               count(phone.read_file(folder + "events_log"), "tavlo_demo_long") == 4;
    }));
    ASSERT_TRUE(ctl(phone, "stop"));
    std::sort(want.begin(), want.end());
    run->folder = phone.host_path(folder);
}

TEST(TavlologOnARecordedRun, MergesEveryLineInTheOrderOfItsInstant) {
    EmuPhone phone;
    Recorded run;
    ASSERT_NO_FATAL_FAILURE(record_run(phone, &run));
    const std::vector<std::pair<int64_t, char>>& want = run.want;
    std::vector<std::string> runs = tavlolog::find_runs({run.folder});
    ASSERT_EQ(1u, runs.size());
    tavlolog::Filter all;
    Collect got;
    tavlolog::read_timeline(runs, all, &got);
    std::vector<std::pair<int64_t, char>> written;
    std::vector<std::string> bt;
    for (const Seen& s : got.seen) {
        if (s.source == 'B') bt.push_back(s.text);
        else if (s.tag == "seq" || s.tag == "tavlo_demo_long" || (s.source == 'K' && s.text.rfind("n=", 0) == 0))
            written.push_back({s.instant, s.source});
    }
    std::string shown;
    for (const Seen& s : got.seen) shown += std::string(1, s.source) + " " + std::to_string(s.instant) + " " + s.tag + ": " + s.text + "\n";
    ASSERT_EQ(want.size(), written.size()) << shown;
    for (size_t i = 0; i < want.size(); i++) {
        EXPECT_EQ(want[i].second, written[i].second) << "entry " << i << "\n" << shown;
        // Kernel times are written to the microsecond.
        // In integers: a double near 1.8e18 nanoseconds is exact to 256 only.
        EXPECT_LT(llabs(want[i].first - written[i].first), 1000) << "entry " << i;
    }
    EXPECT_EQ((std::vector<std::string>{"bt first", "bt second"}), bt);

    // The JSON Lines: one object per entry, the written instants in RFC 3339.
    char path[] = "/tmp/tavlolog_json.XXXXXX";
    int fd = mkstemp(path);
    ASSERT_GE(fd, 0);
    FILE* out = fdopen(fd, "w");
    {
        std::unique_ptr<tavlolog::Sink> json = tavlolog::make_json_output(out);
        tavlolog::read_timeline(runs, all, json.get());
    }
    fclose(out);
    std::string text;
    FILE* in = fopen(path, "r");
    char line[8192];
    size_t lines = 0;
    while (fgets(line, sizeof(line), in)) {
        lines++;
        EXPECT_EQ('{', line[0]);
        EXPECT_EQ(std::string("}\n"), std::string(line + strlen(line) - 2));
        text += line;
    }
    fclose(in);
    unlink(path);
    EXPECT_EQ(got.entries, lines);
    time_t first = static_cast<time_t>(run.base / 1000000000);
    struct tm tm;
    gmtime_r(&first, &tm);
    char stamp[64];
    strftime(stamp, sizeof(stamp), "\"time\":\"%Y-%m-%dT%H:%M:%S.000000000Z\"", &tm);
    EXPECT_TRUE(contains(text, std::string(stamp) + ",\"inherited\":false,\"uptime\":null,\"source\":\"main\"")) << stamp;
}

// The program's HTML report of that run, as a user opens it: every entry and
// lane there, and a search from the URL fragment narrows the list.
TEST(TavlologOnARecordedRun, ItsHtmlReportShowsEveryEntryAndLaneInChromium) {
    std::string why;
    const std::string browser = chromium(&why);
    if (browser.empty()) GTEST_SKIP() << why;
    EmuPhone phone;
    Recorded run;
    ASSERT_NO_FATAL_FAILURE(record_run(phone, &run));
    const std::filesystem::path out = std::filesystem::path(TAVLO_BUILD_DIR) / "test-output" / "tavlolog_run";
    std::filesystem::create_directories(out);
    const std::filesystem::path page = out / "report.html", png = out / "report.png";
    std::filesystem::remove(png);
    const std::string cmd = std::string(TAVLO_BUILD_DIR) + "/tools/tavlolog/tavlolog --html " +
                            shell_quoted(page) + " " + shell_quoted(run.folder);
    ASSERT_EQ(0, system(cmd.c_str())) << cmd;

    // What the reader finds in the folder is what the page must show.
    Collect got;
    tavlolog::read_timeline(tavlolog::find_runs({run.folder}), tavlolog::Filter(), &got);
    const std::string query = "n=1";  // n=1, n=10 ... n=19 but the events lines (values "l:13", "l:18")
    long found = 0;
    for (std::string m : got.messages) {
        std::transform(m.begin(), m.end(), m.begin(), [](unsigned char c) { return std::tolower(c); });
        found += contains(m, query);
    }
    ASSERT_GE(found, 9);

    std::string dom = load_in_chromium(browser, page, "", "--screenshot=" + shell_quoted(png), out);
    ASSERT_TRUE(contains(dom, "data-ready=\"1\"")) << dom.substr(0, 4000);
    EXPECT_EQ(static_cast<long>(got.entries), page_number(dom, "data-total"));
    EXPECT_EQ(static_cast<long>(got.entries), page_number(dom, "data-shown"));
    for (int s = 0; s < tavlolog::SRC_COUNT; s++) {
        // The lane's label: its letter, its name and how many entries it shows.
        const std::string lane = std::string("data-src=\"") + tavlolog::SOURCE_LETTER[s] + "\"";
        std::smatch m;
        ASSERT_TRUE(std::regex_search(dom, m, std::regex(lane + "[^>]*>.*?<span>([0-9,]+)</span>"))) << lane;
        EXPECT_EQ(std::to_string(got.per_source[s]), m[1].str()) << lane;
    }
    EXPECT_TRUE(std::filesystem::exists(png));

    dom = load_in_chromium(browser, page, "q=n%3D1", "", out);
    EXPECT_EQ(found, page_number(dom, "data-shown"));
    EXPECT_TRUE(contains(dom, ">n=14<")) << dom.substr(0, 4000);
    EXPECT_FALSE(contains(dom, ">n=2<"));
}

}  // namespace
