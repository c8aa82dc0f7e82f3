// tavlolog's reader: run folders written as data, read through the same
// command line and merge as the program, each entry rendered in one short line.
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "tools/tavlolog/options.h"
#include "tools/tavlolog/output.h"
#include "tools/tavlolog/run_folder.h"
#include "tools/tavlolog/timeline.h"
#include "tools/tavlolog/warnings.h"

using namespace tavlolog;

namespace {

std::string H(const char* zone = "GMT") { return std::string("-----timezone: ") + zone + "\n"; }
std::string line(const char* when, const char* rest) { return std::string(when) + "  100  101 " + rest + "\n"; }
// Midnight of 2026-01-01 UTC as the boot's recorded start.
const std::string kProps = "<< system properties >>\n[debug.TQ.boot_wallclock]: [1767225600.000000000]\n";

struct TempDir {
    std::string path;
    TempDir() {
        char tmpl[] = "/tmp/tavlolog_test.XXXXXX";
        path = mkdtemp(tmpl);
    }
    ~TempDir() { system(("rm -rf '" + path + "'").c_str()); }
};

void write_file(const std::string& path, const std::string& content) {
    if (content == "<dir>") {
        mkdir(path.c_str(), 0755);
        return;
    }
    std::ofstream(path, std::ios::binary | std::ios::app) << content;
}

// "M 2026-01-01T00:00:01.000Z tag: message", "K +10.250000 ...", "B - ...";
// markers #, notes =, hex x, malformed ? with their file@offset.
class Recorder : public Sink {
  public:
    explicit Recorder(bool where = false) : where_(where) {}
    void section(const SectionInfo& s) override {
        std::lock_guard<std::mutex> lock(mutex_);
        if (s.boot != 0) text_ += "-- " + std::to_string(s.boot) + " " + s.name + "\n";
    }
    void entry(const Entry& e) override {
        std::string t(1, SOURCE_LETTER[e.source]);
        t += ' ';
        if (e.has_instant) {
            time_.local(t, e.instant_ns, e.utc_offset_s, 'T', 3);
            char zone[16];
            int a = e.utc_offset_s < 0 ? -e.utc_offset_s : e.utc_offset_s;
            snprintf(zone, sizeof(zone), "%c%02d:%02d", e.utc_offset_s < 0 ? '-' : '+', a / 3600 % 100, a / 60 % 60);
            t += e.utc_offset_s == 0 ? "Z" : zone;
        } else if (e.source == SRC_KERNEL) {
            char up[32];
            snprintf(up, sizeof(up), "+%lld.%06lld", static_cast<long long>(e.instant_ns / 1000000000),
                     static_cast<long long>(e.instant_ns % 1000000000 / 1000));
            t += up;
        } else {
            t += '-';
        }
        t += ' ';
        static const char marks[] = " #=x?";
        if (e.kind != KIND_LINE) t += marks[e.kind];
        if (e.kind == KIND_MALFORMED || e.kind == KIND_HEX || where_)
            t += std::string(e.file) + "@" + std::to_string(e.offset) + " ";
        if (!e.tag.empty()) t += std::string(e.tag) + ": ";
        t += std::string(e.message) + "\n";
        std::lock_guard<std::mutex> lock(mutex_);
        text_ += t;
    }
    std::string text() {
        std::lock_guard<std::mutex> lock(mutex_);
        return text_;
    }

  private:
    bool where_;
    TimeFormat time_;
    std::mutex mutex_;
    std::string text_;
};

struct Case {
    const char* name;
    std::vector<std::pair<std::string, std::string>> files;  // "APLog_.../main_log", content
    std::vector<std::string> args;                          // the command line's options
    std::string want;
    const char* warning = "";  // a warning that must be given
    bool where = false;        // render every entry's file@offset
};

void PrintTo(const Case& c, std::ostream* os) { *os << c.name; }

const char kRun[] = "APLog_2026_0101_000500/";

// A folder for the filter rows: priorities, tags, pids, times and sources mixed.
const std::vector<std::pair<std::string, std::string>> kMixed = {
    {std::string(kRun) + "properties", kProps},
    {std::string(kRun) + "main_log",
     H() + line("01-01 00:01:00.000", "I net     : up") + line("01-01 00:02:00.000", "W net     : slow") +
         "01-01 00:03:00.000     7     7 E wifi    : time out\n" + line("01-01 00:04:00.000", "E net     : timeout")},
    {std::string(kRun) + "radio_log", H() + line("01-01 00:02:30.000", "D ril     : ping")},
    {std::string(kRun) + "kernel_log", H() + "<4>[  150.000000] usb warn\n<6>[  210.000000] usb info\n"},
    {std::string(kRun) + "main_log.hbr", "TavloLog in Normal\n" + H() + line("12-31 23:00:00.000", "E net     : held")},
};

const Case kCases[] = {
    {"TheYearComesFromTheFolderAndTurnsAtNewYear",
     {{"APLog_2026_0101_000500/main_log", H() + line("12-31 23:59:59.000", "I a       : old year") +
                                              line("01-01 00:00:01.000", "I a       : new year")},
      {"APLog_2025_1231_235000/main_log", H() + line("01-01 00:00:02.000", "I a       : next year")}},
     {},
     "M 2026-01-01T00:00:02.000Z a: next year\n"
     "M 2025-12-31T23:59:59.000Z a: old year\nM 2026-01-01T00:00:01.000Z a: new year\n"},
    {"TheHeadersZoneWithItsDaylightSaving",
     {{"APLog_2026_0329_120000/main_log", H("Europe/Berlin") + line("03-29 01:59:59.000", "I a       : winter") +
                                              line("03-29 03:00:00.000", "I a       : summer")},
      {"APLog_2026_0329_120000/radio_log", H("GMT") + line("03-29 00:59:59.500", "I r       : between")}},
     {},
     "M 2026-03-29T01:59:59.000+01:00 a: winter\nR 2026-03-29T00:59:59.500Z r: between\n"
     "M 2026-03-29T03:00:00.000+02:00 a: summer\n"},
    {"AZoneTheHostDoesNotKnowIsUtcWithAWarning",
     {{"APLog_2026_0101_000500/main_log", H("Mars/Olympus") + line("01-01 00:00:01.000", "I a       : red")}},
     {},
     "M 2026-01-01T00:00:01.000Z a: red\n",
     "\"Mars/Olympus\""},
    {"KernelLinesTakeTheBootsRecordedStart",
     {{"APLog_2026_0101_000500/properties", kProps},
      {"APLog_2026_0101_000500/kernel_log", H() + "<3>[   10.250000] k err\n<14>[   11.000000] k user\n"},
      {"APLog_2026_0101_000500/main_log", H() + line("01-01 00:00:10.000", "I a       : before") +
                                              line("01-01 00:00:11.000", "I a       : same as kernel")}},
     {},
     "M 2026-01-01T00:00:10.000Z a: before\nK 2026-01-01T00:00:10.250Z k err\n"
     "K 2026-01-01T00:00:11.000Z k user\nM 2026-01-01T00:00:11.000Z a: same as kernel\n"},
    {"KernelLinesWithoutItFollowInTheirOwnLaneSinceBoot",
     {{"APLog_2026_0101_000500/kernel_log", H() + "<3>[   10.250000] k err\n<6>no time\n"},
      {"APLog_2026_0101_000500/main_log", H() + line("01-01 00:00:11.000", "I a       : main")}},
     {},
     "M 2026-01-01T00:00:11.000Z a: main\nK +10.250000 k err\nK +10.250000 no time\n",
     "time since boot"},
    {"ALineCutByARotationIsJoined",
     {{"APLog_2026_0101_000500/properties", kProps},
      {"APLog_2026_0101_000500/main_log.1", H() + line("01-01 00:00:01.000", "I a       : first") +
                                                "01-01 00:00:02.000  100  101 I a       : cut "},
      {"APLog_2026_0101_000500/main_log", H() + "across\n" + line("01-01 00:00:03.000", "I a       : third")},
      {"APLog_2026_0101_000500/kernel_log.1", H() + "<6>[    2.500000] ker"},
      {"APLog_2026_0101_000500/kernel_log", H() + "nel\n"}},
     {},
     "M 2026-01-01T00:00:01.000Z main_log.1@19 a: first\nM 2026-01-01T00:00:02.000Z main_log.1@66 a: cut across\n"
     "K 2026-01-01T00:00:02.500Z kernel_log.1@19 kernel\nM 2026-01-01T00:00:03.000Z main_log@26 a: third\n",
     "",
     true},
    {"GenerationsOldestFirstAndAMissingOneSaid",
     {{"APLog_2026_0101_000500/main_log", H() + line("01-01 00:00:01.000", "I a       : current")},
      {"APLog_2026_0101_000500/main_log.1", H() + line("01-01 00:00:01.000", "I a       : one")},
      {"APLog_2026_0101_000500/main_log.3", H() + line("01-01 00:00:01.000", "I a       : three")},
      {"APLog_2026_0101_000500/main_log.4", H() + line("01-01 00:00:01.000", "I a       : four")}},
     {},
     "M 2026-01-01T00:00:01.000Z a: four\nM 2026-01-01T00:00:01.000Z a: three\n"
     "M 2026-01-01T00:00:01.000Z a: one\nM 2026-01-01T00:00:01.000Z a: current\n",
     "main_log.2 is missing"},
    {"HeldBootsComeBeforeTheRunOldestFirst",
     {{"APLog_2026_0101_000500/main_log", H() + line("01-01 00:05:00.000", "I a       : run")},
      {"APLog_2026_0101_000500/main_log.boot", "TavloLog in Normal\n" + H() + line("01-01 00:04:00.000", "I a       : boot")},
      // A piece cut inside a line: the next piece's note follows the cut directly.
      {"APLog_2026_0101_000500/main_log.hbr",
       "TavloLog in Normal\n" + H() + line("12-31 22:00:00.000", "I a       : hbr") +
           "12-31 22:00:01.000  100  101 I a       : cuTavloLog in Normal\n" + H() + "t\n"},
      {"APLog_2026_0101_000500/kernel_log.hbr", "TavloLog in Normal\n" + H() + "<6>[    1.000000] old boot\n"}},
     {},
     "-- -2 hbr\nM - =TavloLog in Normal\nM 2025-12-31T22:00:00.000Z a: hbr\n"
     "M 2025-12-31T22:00:00.000Z =TavloLog in Normal\nM 2025-12-31T22:00:01.000Z a: cut\n"
     "K +0.000000 =TavloLog in Normal\nK +1.000000 old boot\n"
     "-- -1 boot\nM - =TavloLog in Normal\nM 2026-01-01T00:04:00.000Z a: boot\nM 2026-01-01T00:05:00.000Z a: run\n"},
    {"EqualInstantsKeepTheOrderOfTheRunsFiles",
     {{"APLog_2026_0101_000500/properties", kProps},
      {"APLog_2026_0101_000500/bt_log", H() + "bt text\n"},
      {"APLog_2026_0101_000500/events_log", H() + line("01-01 00:00:05.000", "I ev      : [1]")},
      {"APLog_2026_0101_000500/radio_log", H() + line("01-01 00:00:05.000", "I r       : radio")},
      {"APLog_2026_0101_000500/main_log", H() + line("01-01 00:00:05.000", "I m       : main")},
      {"APLog_2026_0101_000500/kernel_log", H() + "<6>[    5.000000] kernel\n"}},
     {},
     "K 2026-01-01T00:00:05.000Z kernel\nM 2026-01-01T00:00:05.000Z m: main\nR 2026-01-01T00:00:05.000Z r: radio\n"
     "E 2026-01-01T00:00:05.000Z ev: [1]\nB - bt text\n"},
    {"MainLogsTwoBuffersArePutInOrder",
     {{"APLog_2026_0101_000500/main_log",
       H() + line("01-01 00:00:03.000", "I a       : c") + line("01-01 00:00:01.000", "I a       : a") +
           line("01-01 00:00:02.000", "I a       : b1") + line("01-01 00:00:02.000", "I a       : b2")}},
     {},
     "M 2026-01-01T00:00:01.000Z a: a\nM 2026-01-01T00:00:02.000Z a: b1\nM 2026-01-01T00:00:02.000Z a: b2\n"
     "M 2026-01-01T00:00:03.000Z a: c\n"},
    {"MalformedInputIsShownWhereItIs",
     {{"APLog_2026_0101_000500/main_log",
       H() + "--------- beginning of /dev/log/main\n" + line("01-01 00:00:01.000", "I a       : ok") +
           "\x01\x02 junk\n" + "01-01 00:00:02.000  100  101 I a       : no line feed"},
      {"APLog_2026_0101_000500/main_log.1", "<dir>"},
      {"APLog_2026_0101_000500/bt_log", H() + "text\n" + std::string("\x00\x01\xff\n", 4)}},
     {},
     "M - #--------- beginning of /dev/log/main\nM 2026-01-01T00:00:01.000Z a: ok\n"
     "M 2026-01-01T00:00:01.000Z ?main_log@100 \x01\x02 junk\nM 2026-01-01T00:00:02.000Z a: no line feed\n"
     "B - text\nB - xbt_log@24 [3 bytes] 00 01 ff\n",
     "main_log.1 cannot be read: not a regular file"},
    {"FiltersPriority", kMixed, {"-p", "W"},
     "-- -1 hbr\nM 2025-12-31T23:00:00.000Z net: held\nM 2026-01-01T00:02:00.000Z net: slow\nK 2026-01-01T00:02:30.000Z usb warn\n"
     "M 2026-01-01T00:03:00.000Z wifi: time out\nM 2026-01-01T00:04:00.000Z net: timeout\n"},
    {"FiltersCombined", kMixed, {"-p", "E", "--tag", "net", "--since", "2026-01-01 00:00:00"},
     "M 2026-01-01T00:04:00.000Z net: timeout\n"},
    {"FiltersRelativeTimeAndSource", kMixed, {"--since", "-59s", "-s", "K,main"},
     "K 2026-01-01T00:03:30.000Z usb info\nM 2026-01-01T00:04:00.000Z net: timeout\n"},
    {"FiltersPidAndGrep", kMixed, {"--pid", "7", "--grep", "time ?out"},
     "M 2026-01-01T00:03:00.000Z wifi: time out\n"},
    {"FiltersBootByName", kMixed, {"--boot", "hbr", "-g", "HELD|held"},
     "-- -1 hbr\nM 2025-12-31T23:00:00.000Z net: held\n"},
};

class TavlologRead : public ::testing::TestWithParam<Case> {};

TEST_P(TavlologRead, MergesAsWritten) {
    const Case& c = GetParam();
    TempDir dir;
    for (const auto& f : c.files) {
        std::string path = dir.path + "/" + f.first;
        mkdir(path.substr(0, path.rfind('/')).c_str(), 0755);
        write_file(path, f.second);
    }
    std::vector<std::string> argv_s = {"tavlolog"};
    argv_s.insert(argv_s.end(), c.args.begin(), c.args.end());
    argv_s.push_back(dir.path);
    std::vector<char*> argv;
    for (std::string& s : argv_s) argv.push_back(&s[0]);
    Options options;
    std::string error;
    ASSERT_EQ(0, parse_options(static_cast<int>(argv.size()), argv.data(), &options, &error)) << error;
    set_warnings_quiet(true);
    size_t warned = warnings_given().size();
    std::vector<std::string> runs = find_runs(options.paths);
    if (options.filter.needs_end()) options.filter.resolve(last_instant(runs));
    Recorder recorder(c.where);
    read_timeline(runs, options.filter, &recorder);
    EXPECT_EQ(c.want, recorder.text());
    std::string given;
    for (size_t i = warned; i < warnings_given().size(); i++) given += warnings_given()[i] + "\n";
    if (*c.warning) {
        EXPECT_NE(std::string::npos, given.find(c.warning)) << given;
    }
}

INSTANTIATE_TEST_SUITE_P(Of, TavlologRead, ::testing::ValuesIn(kCases),
                         [](const ::testing::TestParamInfo<Case>& i) { return std::string(i.param.name); });

// The outputs' escaping, around the blocks in which plain text is passed.
TEST(TavlologOutput, EscapesWhatATerminalOrJsonCannotTake) {
    const std::string a15(15, 'a'), a16(16, 'a'), a20(20, 'a');
    const struct {
        std::string message, text, json;
    } rows[] = {
        {a15, a15, a15},
        {a16 + "b", a16 + "b", a16 + "b"},
        {a15 + "\x01", a15 + "\\x01", a15 + "\\u0001"},
        {a16 + "\"" + "bbbbb", a16 + "\"bbbbb", a16 + "\\\"bbbbb"},
        {a20 + "\x1b", a20 + "\\x1b", a20 + "\\u001b"},
        {"\x7f" + a20, "\\x7f" + a20, "\\u007f" + a20},
        {"aaaaaaaaaaaaaa\xc3\xa9" + a15, "aaaaaaaaaaaaaa\xc3\xa9" + a15, "aaaaaaaaaaaaaa\xc3\xa9" + a15},
        {a15 + "\xc3", a15 + "\\xc3", a15 + "\\u00c3"},
        {"tab\t" + a20 + "\\\n", "tab\t" + a20 + "\\\\x0a", "tab\\t" + a20 + "\\\\\\n"},
    };
    for (const auto& row : rows) {
        Entry e{};
        e.instant_ns = 1767225600LL * 1000000000;
        e.has_instant = true;
        e.source = SRC_MAIN;
        e.priority = 6;
        e.pid = 100;
        e.tid = 101;
        e.tag = "tag";
        e.message = row.message;
        e.file = "main_log";
        e.run = "APLog_2026_0101_000500";
        for (bool json : {false, true}) {
            char* text = nullptr;
            size_t size = 0;
            FILE* out = open_memstream(&text, &size);
            std::unique_ptr<Sink> sink = json ? make_json_output(out) : make_text_output(out, false);
            sink->entry(e);
            sink.reset();
            fclose(out);
            std::string got(text, size);
            free(text);
            std::string want = json ? "\"message\":\"" + row.json + "\"," : "  100   101 tag: " + row.text + "\n";
            EXPECT_NE(std::string::npos, got.find(want)) << got;
        }
    }
}

// --follow on a folder the test writes into: a rotation that cuts a line, then
// the run's end and the next run folder beside it.
TEST(TavlologFollow, ReadsOnAcrossARotationAndIntoTheNextRun) {
    TempDir dir;
    std::string run1 = dir.path + "/APLog_2026_0101_000500/", run2 = dir.path + "/APLog_2026_0101_001000/";
    mkdir(run1.c_str(), 0755);
    write_file(run1 + "main_log", H() + line("01-01 00:00:01.000", "I a       : one"));
    Filter all;
    Recorder recorder;
    std::atomic<bool> stop{false};
    FollowOptions follow;
    follow.follow = true;
    follow.poll_ms = 20;
    follow.keep_going = [&] { return !stop; };
    set_warnings_quiet(true);
    std::thread reader([&] { read_timeline({run1}, all, &recorder, follow); });
    auto shows = [&](const std::string& text) {
        for (int i = 0; i < 500; i++) {
            if (recorder.text().find(text) != std::string::npos) return true;
            usleep(10000);
        }
        return false;
    };
    EXPECT_TRUE(shows("a: one\n"));
    write_file(run1 + "main_log", line("01-01 00:00:02.000", "I a       : two") + "01-01 00:00:03.000  100  101 I a   : cut ");
    EXPECT_TRUE(shows("a: two\n"));
    rename((run1 + "main_log").c_str(), (run1 + "main_log.1").c_str());
    write_file(run1 + "main_log", H() + "in two\n" + line("01-01 00:00:04.000", "I a       : four"));
    EXPECT_TRUE(shows("a: four\n"));
    mkdir(run2.c_str(), 0755);
    write_file(run2 + "main_log", H() + line("01-01 00:10:01.000", "I a       : next run"));
    EXPECT_TRUE(shows("a: next run\n"));
    stop = true;
    reader.join();
    EXPECT_EQ("M 2026-01-01T00:00:01.000Z a: one\nM 2026-01-01T00:00:02.000Z a: two\n"
              "M 2026-01-01T00:00:03.000Z a: cut in two\nM 2026-01-01T00:00:04.000Z a: four\n"
              "M 2026-01-01T00:10:01.000Z a: next run\n",
              recorder.text());
}

}  // namespace
