// tavlolog: one merged, time-ordered view of every log of a run folder.
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "tools/tavlolog/options.h"
#include "tools/tavlolog/output.h"
#include "tools/tavlolog/run_folder.h"
#include "tools/tavlolog/timeline.h"
#include "tools/tavlolog/warnings.h"

using namespace tavlolog;

namespace {

volatile sig_atomic_t g_stop = 0;
void on_signal(int) { g_stop = 1; }

}  // namespace

int main(int argc, char** argv) {
    Options o;
    std::string error;
    int rc = parse_options(argc, argv, &o, &error);
    if (rc == 1) {
        fputs(kHelp, stdout);
        return 0;
    }
    if (rc != 0) {
        fprintf(stderr, "tavlolog: %s\nTry 'tavlolog --help'.\n", error.c_str());
        return 2;
    }
    Filter& filter = o.filter;
    std::vector<std::string>& paths = o.paths;
    std::vector<std::string> runs = find_runs(paths);
    if (runs.empty()) {
        fprintf(stderr, "tavlolog: no run folder in %s\n", paths.size() == 1 ? paths[0].c_str() : "the folders given");
        return 1;
    }
    if (filter.needs_end()) filter.resolve(last_instant(runs));

    bool tty = isatty(STDOUT_FILENO);
    FILE* out = stdout;
    FILE* pager_pipe = nullptr;
    if (!o.html && !o.json && !o.follow && o.pager && tty) {
        const char* cmd = getenv("PAGER");
        if (cmd == nullptr || *cmd == '\0') cmd = "less";
        // As journalctl: quit when it fits the screen, keep colours, no line wrap.
        setenv("LESS", "FRSXMK", 0);
        pager_pipe = popen(cmd, "w");
        if (pager_pipe != nullptr) out = pager_pipe;
    }
    bool colour_on = o.colour == 1 || (o.colour == -1 && tty);

    std::unique_ptr<Sink> sink;
    bool html_ok = true;
    if (o.html) {
        std::string title = runs.size() == 1 ? runs[0] : std::to_string(runs.size()) + " runs from " + runs[0];
        sink = make_html_output(o.html, title.c_str(), &html_ok);
        if (!sink) {
            fprintf(stderr, "tavlolog: %s cannot be written: %s\n", o.html, strerror(errno));
            return 1;
        }
    } else if (o.summary) {
        sink = make_summary(out, o.gap);
    } else if (o.json) {
        sink = make_json_output(out);
    } else {
        sink = make_text_output(out, colour_on);
    }

    FollowOptions fo;
    fo.follow = o.follow;
    if (o.follow) {
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
    if (o.html) {
        if (!html_ok) {
            fprintf(stderr, "tavlolog: %s could not be written\n", o.html);
            return 1;
        }
        fprintf(stderr, "tavlolog: the HTML report is %s\n", o.html);
    }
    return failed ? 1 : 0;
}
