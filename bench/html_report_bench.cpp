// The HTML report of a large run (on the host, not in a phone):
//
//   build/bench/html_report_bench [entries [KEEP.html]]   (default 1,000,000)
//
// KEEP.html: the report is also kept there, to look at.
// (a) writing the report: entries per second, bytes per entry, and the
//     writer's resident memory against the reader's 64 MB aim;
// (b) headless Chromium loading it until the first screen is drawn (the page
//     marks <body data-ready>): wall clock of the whole browser run, the
//     page's own time from navigation start to that mark, and the browser's
//     run on an empty page in the same run (its start-up, paid by any page),
//     each against a 10 s limit.
// The generated run: a held boot then the run, the six sources in realistic
// shares, 400 tags, 150 pids, messages of 20 to 200 bytes, 1.8 ms apart.
#include <sys/resource.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <regex>
#include <string>
#include <vector>

#include "tools/tavlolog/html_report.h"

namespace {

using namespace tavlolog;
namespace fs = std::filesystem;

constexpr double LIMIT_S = 10.0;

double now_s() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

long max_rss_kb() {
    rusage ru;
    getrusage(RUSAGE_SELF, &ru);
    return ru.ru_maxrss;
}

// xorshift: the same run every time.
uint64_t rng_state = 0x9E3779B97F4A7C15ull;
uint32_t rnd(uint32_t n) {
    rng_state ^= rng_state << 13;
    rng_state ^= rng_state >> 7;
    rng_state ^= rng_state << 17;
    return static_cast<uint32_t>(rng_state % n);
}

const char* const WORDS[] = {"connect", "wlan0", "state", "changed", "to", "CONNECTED", "battery", "level",
                             "scan", "results", "received", "Displayed", "com.android.settings", "uid", "10087",
                             "timeout", "ms", "ok", "failed", "retry", "handle", "0x7f3a", "SIGNAL_STRENGTH",
                             "rssi=-67", "bound", "service", "activity", "resumed", "ANR", "in", "GC", "freed"};

void fill_entry(Entry& e, uint64_t i, int64_t& t_ns, std::vector<std::string>& tags, std::string& msg,
                uint64_t* offsets, uint64_t held) {
    static const Source share[20] = {SRC_MAIN, SRC_MAIN, SRC_MAIN, SRC_MAIN, SRC_MAIN, SRC_MAIN, SRC_MAIN,
                                     SRC_MAIN, SRC_SYSTEM, SRC_SYSTEM, SRC_SYSTEM, SRC_RADIO, SRC_RADIO,
                                     SRC_RADIO, SRC_EVENTS, SRC_EVENTS, SRC_KERNEL, SRC_KERNEL, SRC_KERNEL, SRC_BT};
    static const int8_t prios[16] = {6, 6, 6, 6, 6, 6, 7, 7, 7, 7, 8, 8, 4, 4, 3, 2};
    static const char* const files[SRC_COUNT] = {"kernel_log", "main_log", "main_log", "radio_log",
                                                 "events_log", "bt_log"};
    if (i == held) t_ns += 90 * 1000000000ll;  // the reboot
    t_ns += 1000000 + rnd(1600000);           // 1.0-2.6 ms apart
    e = Entry{};
    e.instant_ns = t_ns;
    e.has_instant = true;
    e.utc_offset_s = 3600;
    e.source = share[rnd(20)];
    e.kind = KIND_LINE;
    e.priority = e.source == SRC_BT ? static_cast<int8_t>(PRIO_NONE) : prios[rnd(16)];
    const bool android = e.source != SRC_KERNEL && e.source != SRC_BT;
    e.pid = android ? static_cast<int32_t>(300 + rnd(150) * 37) : -1;
    e.tid = android ? e.pid + static_cast<int32_t>(rnd(4) ? 0 : rnd(60)) : -1;
    e.tag = android ? tags[rnd(static_cast<uint32_t>(tags.size()))] : std::string_view();
    msg.clear();
    const size_t want = 20 + rnd(180);
    while (msg.size() < want) {
        msg += WORDS[rnd(sizeof WORDS / sizeof WORDS[0])];
        msg += rnd(5) ? ' ' : ',';
        if (!rnd(6)) msg += std::to_string(rnd(100000)) + " ";
    }
    e.message = msg;
    e.file = files[e.source];
    e.offset = offsets[e.source] += msg.size() + 40;
    e.boot = i < held ? -1 : 0;
    e.boot_name = i < held ? "hbr" : "";
}

bool write_report(const char* path, uint64_t entries) {
    std::vector<std::string> tags;
    for (int k = 0; k < 400; k++) tags.push_back("Tag" + std::to_string(k * 7919 % 100000) + (k % 3 ? "Service" : ""));
    HtmlReport report;
    if (report.open(path, "APLog_2026_0304_070649 (generated)") != 0) {
        perror(path);
        return false;
    }
    int64_t t_ns = 1772604409000000000;
    uint64_t offsets[SRC_COUNT] = {};
    std::string msg;
    Entry e;
    const long rss_before = max_rss_kb();
    const double t0 = now_s();
    for (uint64_t i = 0; i < entries; i++) {
        fill_entry(e, i, t_ns, tags, msg, offsets, entries / 50);
        report.add(e);
    }
    if (report.close() != 0) {
        perror(path);
        return false;
    }
    const double dt = now_s() - t0;
    const double size = static_cast<double>(fs::file_size(path));
    printf("(a) %llu entries written in %.2f s (%.0f entries/s, generation included), %.1f MB, "
           "%.1f bytes per entry\n",
           static_cast<unsigned long long>(entries), dt, static_cast<double>(entries) / dt, size / 1e6,
           size / static_cast<double>(entries));
    printf("    peak resident memory %.1f MB (%.1f MB before writing): %.2f of the 64 MB aim\n",
           static_cast<double>(max_rss_kb()) / 1024, static_cast<double>(rss_before) / 1024,
           static_cast<double>(max_rss_kb()) / 1024 / 64);
    return true;
}

// Runs headless Chromium on URL to its DOM dump; returns the wall time, the DOM in *dom.
double browse(const std::string& url, const std::string& profile, std::string* dom) {
    const std::string cmd = "timeout 120 chromium --headless --disable-gpu --no-sandbox --no-first-run "
                            "--window-size=1280,860 --user-data-dir='" + profile + "' --dump-dom '" + url +
                            "' 2>/dev/null";
    const double t0 = now_s();
    FILE* p = popen(cmd.c_str(), "r");
    if (!p) return -1;
    char buf[65536];
    dom->clear();
    for (size_t n; (n = fread(buf, 1, sizeof buf, p)) > 0;) dom->append(buf, n);
    const int rc = pclose(p);
    return rc == 0 ? now_s() - t0 : -1;
}

}  // namespace

int main(int argc, char** argv) {
    const uint64_t entries = argc > 1 ? strtoull(argv[1], nullptr, 10) : 1000000;
    const fs::path dir = fs::temp_directory_path() / ("html_report_bench." + std::to_string(getpid()));
    fs::create_directories(dir);
    const fs::path page = dir / "report.html", empty = dir / "empty.html";
    int rc = 0;
    if (!write_report(page.c_str(), entries)) {
        rc = 1;
    } else if (system("command -v chromium >/dev/null 2>&1") != 0) {
        printf("(b) skipped: no chromium (tools/install-deps.sh installs it)\n");
    } else {
        FILE* f = fopen(empty.c_str(), "w");
        if (f) fputs("<!DOCTYPE html><title>empty</title><body data-ready=\"1\"></body>", f), fclose(f);
        std::string dom;
        const double base = browse("file://" + empty.string(), (dir / "p0").string(), &dom);
        const double wall = browse("file://" + page.string(), (dir / "p1").string(), &dom);
        std::smatch m;
        const bool ready = std::regex_search(dom, m, std::regex("data-first-draw-ms=\"(\\d+)\""));
        std::smatch parts;
        std::regex_search(dom, parts, std::regex("data-first-data-ms=\"(\\d+)\" data-data-ms=\"(\\d+)\" "
                                                     "data-decode-ms=\"(\\d+)\""));
        std::smatch shown;
        std::regex_search(dom, shown, std::regex("data-shown=\"(\\d+)\""));
        if (wall < 0 || !ready) {
            printf("(b) the report did not load (browser %s)\n", wall < 0 ? "failed" : "ran, page not drawn");
            rc = 1;
        } else {
            const double page_s = std::stod(m[1]) / 1000;
            printf("(b) Chromium, first screen of %s entries drawn: %.2f s wall (%.2f of the %.0f s limit); "
                   "the page's own %.2f s (%.2f); an empty page %.2f s\n",
                   shown.size() > 1 ? shown[1].str().c_str() : "?", wall, wall / LIMIT_S, LIMIT_S, page_s,
                   page_s / LIMIT_S, base);
            if (parts.size() == 4) {
                printf("    in the page: %.2f s to the first data, %.2f s loading the data (%.2f s of it in the "
                       "decoder), %.2f s to draw\n",
                       std::stod(parts[1]) / 1000, (std::stod(parts[2]) - std::stod(parts[1])) / 1000,
                       std::stod(parts[3]) / 1000, page_s - std::stod(parts[2]) / 1000);
            }
        }
    }
    if (argc > 2 && rc == 0) fs::copy_file(page, argv[2], fs::copy_options::overwrite_existing);
    fs::remove_all(dir);
    return rc;
}
