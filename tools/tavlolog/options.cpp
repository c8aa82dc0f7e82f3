#include "tools/tavlolog/options.h"

#include <getopt.h>

#include <cstdarg>
#include <cstdlib>
#include <cstring>

namespace tavlolog {

namespace {

int usage_error(std::string* out, const char* fmt, ...) {
    char text[512];
    va_list args;
    va_start(args, fmt);
    vsnprintf(text, sizeof(text), fmt, args);
    va_end(args);
    *out = text;
    return 2;
}

}  // namespace

extern const char kHelp[];
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


int parse_options(int argc, char** argv, Options* o, std::string* error_out) {
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
    Filter& filter = o->filter;
    optind = 0;  // a full restart of getopt: the tests parse many command lines
    for (int c; (c = getopt_long(argc, argv, "S:U:p:t:g:s:b:o:jfh", options, nullptr)) != -1;) {
        std::string error;
        char* end;
        switch (c) {
            case 'S':
                if (!parse_time_arg(optarg, &filter.since)) return usage_error(error_out, "--since: \"%s\" is not a time", optarg);
                break;
            case 'U':
                if (!parse_time_arg(optarg, &filter.until)) return usage_error(error_out, "--until: \"%s\" is not a time", optarg);
                break;
            case 'p':
                if (!parse_priority(optarg, &filter.prio_min, &filter.prio_max))
                    return usage_error(error_out, "--priority: \"%s\" is not a priority", optarg);
                filter.has_priority = true;
                break;
            case 't': filter.tags.push_back(optarg); break;
            case OPT_PID: {
                long pid = strtol(optarg, &end, 10);
                if (end == optarg || *end != '\0' || pid < 0 || pid > INT32_MAX)
                    return usage_error(error_out, "--pid: \"%s\" is not a pid", optarg);
                filter.pids.push_back(static_cast<int32_t>(pid));
                break;
            }
            case 'g':
                if (!filter.set_grep(optarg, &error)) return usage_error(error_out, "--grep: %s", error.c_str());
                break;
            case 's':
                if (!parse_sources(optarg, &filter.sources)) return usage_error(error_out, "--source: \"%s\" names no source", optarg);
                break;
            case 'b': {
                filter.has_boot = true;
                long boot = strtol(optarg, &end, 10);
                if (end != optarg && *end == '\0' && boot <= 0 && boot > -100000) {
                    filter.boot = static_cast<int>(boot);
                } else if (optarg[0] != '\0') {
                    filter.boot_name = optarg;
                } else {
                    return usage_error(error_out, "--boot: \"%s\" is no boot", optarg);
                }
                break;
            }
            case 'o':
                if (strcmp(optarg, "json") == 0) o->json = true;
                else if (strcmp(optarg, "text") != 0) return usage_error(error_out, "--output: \"%s\" is not text or json", optarg);
                break;
            case 'j': o->json = true; break;
            case OPT_SUMMARY: o->summary = true; break;
            case OPT_GAP:
                o->gap = strtol(optarg, &end, 10);
                if (end == optarg || *end != '\0' || o->gap < 1) return usage_error(error_out, "--gap: \"%s\" is not a number of seconds", optarg);
                break;
            case OPT_HTML: o->html = optarg; break;
            case 'f': o->follow = true; break;
            case OPT_NO_PAGER: o->pager = false; break;
            case OPT_COLOR:
                if (strcmp(optarg, "auto") == 0) o->colour = -1;
                else if (strcmp(optarg, "always") == 0) o->colour = 1;
                else if (strcmp(optarg, "never") == 0) o->colour = 0;
                else return usage_error(error_out, "--color: \"%s\" is not auto, always or never", optarg);
                break;
            case 'h': return 1;
            default: return usage_error(error_out, "%s", "unknown option");
        }
    }
    if ((o->json ? 1 : 0) + (o->summary ? 1 : 0) + (o->html ? 1 : 0) > 1)
        return usage_error(error_out, "%s", "--json, --summary and --html are one output each: choose one");
    if (o->follow && (o->summary || o->html)) return usage_error(error_out, "%s", "--follow shows entries: not with --summary or --html");

    for (int i = optind; i < argc; i++) o->paths.push_back(argv[i]);
    if (o->paths.empty()) o->paths.push_back(".");
    return 0;
}

}  // namespace tavlolog
