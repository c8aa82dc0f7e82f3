// tavlolog: one merged, time-ordered view of every log of a run folder.
#include <getopt.h>
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "tools/tavlolog/filter.h"
#include "tools/tavlolog/output.h"
#include "tools/tavlolog/run_folder.h"
#include "tools/tavlolog/timeline.h"
#include "tools/tavlolog/warnings.h"

using namespace tavlolog;

namespace {

const char kHelp[] =
    "Usage: tavlolog [OPTIONS] [FOLDER...]\n"
    "\n"
    "Shows every log of a tavlo_log_d run folder as one time-ordered stream: the kernel log (K),\n"
    "the Android main (M), system (S), radio (R) and events (E) logs and the Bluetooth log (B),\n"
    "all their rotated generations oldest first, the held logs of earlier boots (*.boot, *.hbr,\n"
    "*.kelm_boot, *.otherboot, ...) before the run. Nothing in the folder is changed.\n"
    "\n"
    "FOLDER is a run folder (APLog_%Y_%m%d_%H%M%S), a folder of them (qrvlog/tavlolog/) or the log\n"
    "path above it; several are read one after the other in the order of their times. Default: .\n"
    "\n"
    "Filters (they combine; applied while the logs are merged):\n"
    "  -S, --since=TIME      entries at or after TIME\n"
    "  -U, --until=TIME      entries at or before TIME\n"
    "                        TIME: \"2026-03-04 07:06:49[.123]\" in the phone's own local time,\n"
    "                        \"2026-03-04T06:06:49Z\" or \"...+01:00\" an instant, \"@SECONDS\" since the\n"
    "                        epoch, or \"-10min\", \"-2h\", \"-30s\", \"-1d\" from the end of the run(s).\n"
    "                        Entries without an instant (Bluetooth bytes, kernel lines whose boot\n"
    "                        start is unknown) are left out by a time filter.\n"
    "  -p, --priority=PRIO   PRIO and more severe: one scale for Android letters and kernel levels:\n"
    "                        0 emerg, 1 alert, 2 crit/F, 3 err/E, 4 warning/W, 5 notice, 6 info/I,\n"
    "                        7 debug/D, 8 verbose/V; a range FROM..TO (\"E..I\"). Entries without a\n"
    "                        priority (markers, notes, Bluetooth, malformed lines) are left out.\n"
    "  -t, --tag=TAG         entries with exactly this tag (repeatable)\n"
    "      --pid=PID         entries of this process (repeatable)\n"
    "  -g, --grep=REGEX      messages matching the POSIX extended regular expression; without\n"
    "                        capital letters it ignores case\n"
    "  -s, --source=LIST     sources: letters (\"KM\") or names (\"kernel,main,system,radio,events,bt\")\n"
    "  -b, --boot=BOOT       one boot: 0 the run, -1 the held boot before it, -2 ..., or a held\n"
    "                        boot's name (\"boot\", \"hbr\", \"kelm_boot\", \"otherboot\", \"run\")\n"
    "\n"
    "Output (default: text, through the pager when the terminal is too short for it):\n"
    "  -o, --output=FORMAT   text or json\n"
    "  -j, --json            JSON Lines, one object per entry (fields in the README)\n"
    "      --summary         counts per source and priority, first and last instants, busiest tags\n"
    "                        and pids, gaps, overload markers, held boots, crashes and other problems\n"
    "      --gap=SECONDS     the summary's gaps: longer than this (default 60)\n"
    "      --html=FILE       write a self-contained HTML report of the entries to FILE\n"
    "  -f, --follow          keep reading the run as it is written: new lines within a second, across\n"
    "                        rotations, and into the next run folder when the run ends (Ctrl-C ends)\n"
    "      --no-pager        never start the pager ($PAGER, else less)\n"
    "      --color=WHEN      colour by priority: auto (on a terminal), always, never\n"
    "  -h, --help            this text\n"
    "\n"
    "Text lines: local time of the phone (to the microsecond), source letter, priority (Android letter\n"
    "or kernel level), pid, tid, tag: message. Malformed lines and Bluetooth bytes that are not text\n"
    "are shown with their file and byte offset. Warnings about the folder go to standard error.\n"
    "\n"
    "Kernel lines get wall-clock instants from the property debug.TQ.boot_wallclock in the run's\n"
    "properties (the daemon records when the boot clock read zero); without it they are shown after\n"
    "the other lines of their boot with their time since boot.\n"
    "\n"
    "Exit status: 0, 1 when no run folder was found or the output failed, 2 on a usage error.\n";

volatile sig_atomic_t g_stop = 0;
void on_signal(int) { g_stop = 1; }

int usage_error(const char* fmt, const char* value) {
    fprintf(stderr, "tavlolog: ");
    fprintf(stderr, fmt, value);
    fprintf(stderr, "\nTry 'tavlolog --help'.\n");
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    enum { OPT_PID = 1000, OPT_SUMMARY, OPT_GAP, OPT_HTML, OPT_NO_PAGER, OPT_COLOR };
    static const option options[] = {
        {"since", required_argument, nullptr, 'S'},   {"until", required_argument, nullptr, 'U'},
        {"priority", required_argument, nullptr, 'p'}, {"tag", required_argument, nullptr, 't'},
        {"pid", required_argument, nullptr, OPT_PID},  {"grep", required_argument, nullptr, 'g'},
        {"source", required_argument, nullptr, 's'},  {"boot", required_argument, nullptr, 'b'},
        {"output", required_argument, nullptr, 'o'},  {"json", no_argument, nullptr, 'j'},
        {"summary", no_argument, nullptr, OPT_SUMMARY}, {"gap", required_argument, nullptr, OPT_GAP},
        {"html", required_argument, nullptr, OPT_HTML}, {"follow", no_argument, nullptr, 'f'},
        {"no-pager", no_argument, nullptr, OPT_NO_PAGER}, {"color", required_argument, nullptr, OPT_COLOR},
        {"colour", required_argument, nullptr, OPT_COLOR}, {"help", no_argument, nullptr, 'h'},
        {nullptr, 0, nullptr, 0},
    };
    Filter filter;
    bool json = false, summary = false, follow = false, pager = true;
    int colour = -1;  // auto
    long gap = 60;
    const char* html = nullptr;
    for (int c; (c = getopt_long(argc, argv, "S:U:p:t:g:s:b:o:jfh", options, nullptr)) != -1;) {
        std::string error;
        char* end;
        switch (c) {
            case 'S':
                if (!parse_time_arg(optarg, &filter.since)) return usage_error("--since: \"%s\" is not a time", optarg);
                break;
            case 'U':
                if (!parse_time_arg(optarg, &filter.until)) return usage_error("--until: \"%s\" is not a time", optarg);
                break;
            case 'p':
                if (!parse_priority(optarg, &filter.prio_min, &filter.prio_max))
                    return usage_error("--priority: \"%s\" is not a priority", optarg);
                filter.has_priority = true;
                break;
            case 't': filter.tags.push_back(optarg); break;
            case OPT_PID: {
                long pid = strtol(optarg, &end, 10);
                if (end == optarg || *end != '\0' || pid < 0 || pid > INT32_MAX)
                    return usage_error("--pid: \"%s\" is not a pid", optarg);
                filter.pids.push_back(static_cast<int32_t>(pid));
                break;
            }
            case 'g':
                if (!filter.set_grep(optarg, &error)) return usage_error("--grep: %s", error.c_str());
                break;
            case 's':
                if (!parse_sources(optarg, &filter.sources)) return usage_error("--source: \"%s\" names no source", optarg);
                break;
            case 'b': {
                filter.has_boot = true;
                long boot = strtol(optarg, &end, 10);
                if (end != optarg && *end == '\0' && boot <= 0 && boot > -100000) {
                    filter.boot = static_cast<int>(boot);
                } else if (optarg[0] != '\0') {
                    filter.boot_name = optarg;
                } else {
                    return usage_error("--boot: \"%s\" is no boot", optarg);
                }
                break;
            }
            case 'o':
                if (strcmp(optarg, "json") == 0) json = true;
                else if (strcmp(optarg, "text") != 0) return usage_error("--output: \"%s\" is not text or json", optarg);
                break;
            case 'j': json = true; break;
            case OPT_SUMMARY: summary = true; break;
            case OPT_GAP:
                gap = strtol(optarg, &end, 10);
                if (end == optarg || *end != '\0' || gap < 1) return usage_error("--gap: \"%s\" is not a number of seconds", optarg);
                break;
            case OPT_HTML: html = optarg; break;
            case 'f': follow = true; break;
            case OPT_NO_PAGER: pager = false; break;
            case OPT_COLOR:
                if (strcmp(optarg, "auto") == 0) colour = -1;
                else if (strcmp(optarg, "always") == 0) colour = 1;
                else if (strcmp(optarg, "never") == 0) colour = 0;
                else return usage_error("--color: \"%s\" is not auto, always or never", optarg);
                break;
            case 'h': fputs(kHelp, stdout); return 0;
            default: fprintf(stderr, "Try 'tavlolog --help'.\n"); return 2;
        }
    }
    if ((json ? 1 : 0) + (summary ? 1 : 0) + (html ? 1 : 0) > 1)
        return usage_error("%s", "--json, --summary and --html are one output each: choose one");
    if (follow && (summary || html)) return usage_error("%s", "--follow shows entries: not with --summary or --html");

    std::vector<std::string> paths;
    for (int i = optind; i < argc; i++) paths.push_back(argv[i]);
    if (paths.empty()) paths.push_back(".");
    std::vector<std::string> runs = find_runs(paths);
    if (runs.empty()) {
        fprintf(stderr, "tavlolog: no run folder in %s\n", paths.size() == 1 ? paths[0].c_str() : "the folders given");
        return 1;
    }
    if (filter.needs_end()) filter.resolve(last_instant(runs));

    bool tty = isatty(STDOUT_FILENO);
    FILE* out = stdout;
    FILE* pager_pipe = nullptr;
    if (!html && !json && !follow && pager && tty) {
        const char* cmd = getenv("PAGER");
        if (cmd == nullptr || *cmd == '\0') cmd = "less";
        // As journalctl: quit when it fits the screen, keep colours, no line wrap.
        setenv("LESS", "FRSXMK", 0);
        pager_pipe = popen(cmd, "w");
        if (pager_pipe != nullptr) out = pager_pipe;
    }
    bool colour_on = colour == 1 || (colour == -1 && tty);

    std::unique_ptr<Sink> sink;
    bool html_ok = true;
    if (html) {
        std::string title = runs.size() == 1 ? runs[0] : std::to_string(runs.size()) + " runs from " + runs[0];
        sink = make_html_output(html, title.c_str(), &html_ok);
        if (!sink) {
            fprintf(stderr, "tavlolog: %s cannot be written: %s\n", html, strerror(errno));
            return 1;
        }
    } else if (summary) {
        sink = make_summary(out, gap);
    } else if (json) {
        sink = make_json_output(out);
    } else {
        sink = make_text_output(out, colour_on);
    }

    FollowOptions fo;
    fo.follow = follow;
    if (follow) {
        struct sigaction sa = {};
        sa.sa_handler = on_signal;
        sigaction(SIGINT, &sa, nullptr);
        sigaction(SIGTERM, &sa, nullptr);
        fo.keep_going = [] { return g_stop == 0; };
    }
    read_timeline(runs, filter, sink.get(), fo);
    sink.reset();
    bool failed = ferror(out) != 0 || fflush(out) != 0;
    if (pager_pipe != nullptr) pclose(pager_pipe);
    if (html) {
        if (!html_ok) {
            fprintf(stderr, "tavlolog: %s could not be written\n", html);
            return 1;
        }
        fprintf(stderr, "tavlolog: the HTML report is %s\n", html);
    }
    return failed ? 1 : 0;
}
