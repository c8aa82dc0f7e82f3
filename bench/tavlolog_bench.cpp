// tavlolog's speed and memory on a generated run folder:
//
//   BUILD/bench/tavlolog_bench [MEGABYTES]      (default 1024; TAVLO_BENCH_DIR: where to build it)
//
// The folder has all five log types, five generations each, realistic line
// lengths and tag spread, and a held boot (*.boot). The program merges it to
// /dev/null as text and as JSON; each is timed against `LC_ALL=C grep -c .`
// over the same files in the same run (the files are read once first, so all
// runs find them in the page cache), and its peak resident memory is taken.
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <random>
#include <string>
#include <vector>

namespace {

const int64_t kBootWallclock = 1767225600;  // 2026-01-01 00:00:00 UTC

struct Type {
    const char* name;
    double share;
};
const Type kTypes[] = {{"main_log", 0.40}, {"kernel_log", 0.25}, {"radio_log", 0.12}, {"events_log", 0.13},
                       {"bt_log", 0.10}};

std::mt19937_64 rng(20260101);

std::string word(size_t n) {
    static const char letters[] = "abcdefghijklmnopqrstuvwxyz     ";
    std::string s(n, ' ');
    for (char& c : s) c = letters[rng() % (sizeof(letters) - 1)];
    return s;
}

// About 300 tags, a few of them busy (as on a phone: a handful make most lines).
std::vector<std::string> make_tags() {
    std::vector<std::string> tags;
    for (int i = 0; i < 300; i++) tags.push_back(i < 10 ? "Busy" + std::to_string(i) : "Tag" + word(4 + rng() % 10));
    return tags;
}

size_t pick_tag() {
    uint64_t r = rng() % 100;
    return r < 60 ? rng() % 10 : 10 + rng() % 290;
}

// One line of the type at the instant (nanoseconds since boot = since kBootWallclock).
void append_line(std::string& out, const char* type, int64_t ns, const std::vector<std::string>& tags) {
    char head[96];
    size_t len = 20 + (rng() % 100 < 80 ? rng() % 100 : rng() % 400);
    if (strcmp(type, "kernel_log") == 0) {
        snprintf(head, sizeof(head), "<%d>[%5lld.%06lld] ", static_cast<int>(rng() % 8),
                 static_cast<long long>(ns / 1000000000), static_cast<long long>(ns % 1000000000 / 1000));
        out += head;
        out += word(len);
    } else if (strcmp(type, "bt_log") == 0) {
        out += "btif_" + word(len);
    } else {
        time_t t = static_cast<time_t>(kBootWallclock + ns / 1000000000);
        struct tm tm;
        gmtime_r(&t, &tm);
        snprintf(head, sizeof(head), "%02d-%02d %02d:%02d:%02d.%03lld %5d %5d %c ", tm.tm_mon + 1, tm.tm_mday, tm.tm_hour,
                 tm.tm_min, tm.tm_sec, static_cast<long long>(ns % 1000000000 / 1000000),
                 static_cast<int>(100 + rng() % 3000), static_cast<int>(100 + rng() % 5000), "VDIWEF"[rng() % 6]);
        out += head;
        const std::string& tag = tags[pick_tag()];
        out += tag;
        if (tag.size() < 8) out.append(8 - tag.size(), ' ');
        out += ": ";
        out += word(len);
    }
    out += '\n';
}

// Writes `bytes` of the type into its pieces (oldest first), lines spread over the span.
void write_type(const std::string& dir, const char* type, const std::vector<std::string>& pieces, int64_t bytes,
                int64_t start_ns, int64_t span_ns, const std::vector<std::string>& tags) {
    int64_t per_piece = bytes / static_cast<int64_t>(pieces.size());
    int64_t lines_total = bytes / 90 + 1, line = 0;
    std::string buf;
    for (const std::string& piece : pieces) {
        FILE* f = fopen((dir + piece).c_str(), "w");
        if (piece.find(".boot") != std::string::npos) fputs("TavloLog in Normal\n", f);
        fputs("-----timezone: GMT\n", f);
        int64_t written = 0;
        while (written < per_piece) {
            buf.clear();
            // In double: span_ns * line overflows 64 bits past a few hundred thousand lines.
            while (buf.size() < 65536)
                append_line(buf, type,
                            start_ns + static_cast<int64_t>(static_cast<double>(span_ns) *
                                                            static_cast<double>(line++) /
                                                            static_cast<double>(lines_total)),
                            tags);
            fwrite(buf.data(), 1, buf.size(), f);
            written += static_cast<int64_t>(buf.size());
        }
        fclose(f);
    }
}

double now_s() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

// Runs argv with stdout to `out`: wall seconds, peak RSS in KiB. (grep's output
// goes to a file: writing to /dev/null, GNU grep stops at the first match.)
double run(const std::vector<std::string>& args, long* rss_kb, const char* out = "/dev/null") {
    double t0 = now_s();
    pid_t pid = fork();
    if (pid == 0) {
        int null = open(out, O_WRONLY | O_CREAT | O_TRUNC, 0600);
        dup2(null, 1);
        std::vector<char*> argv;
        for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
        argv.push_back(nullptr);
        setenv("LC_ALL", "C", 1);
        execvp(argv[0], argv.data());
        _exit(127);
    }
    int status;
    struct rusage ru;
    wait4(pid, &status, 0, &ru);
    if (rss_kb) *rss_kb = ru.ru_maxrss;
    if (!WIFEXITED(status) || (WEXITSTATUS(status) != 0 && WEXITSTATUS(status) != 1))
        fprintf(stderr, "%s ended with status %d\n", args[0].c_str(), status);
    return now_s() - t0;
}

}  // namespace

int main(int argc, char** argv) {
    int64_t mb = argc > 1 ? atoll(argv[1]) : 1024;
    std::string self(argv[0]);
    std::string tool = self.substr(0, self.rfind('/') + 1) + "../tools/tavlolog/tavlolog";
    const char* base = getenv("TAVLO_BENCH_DIR");
    std::string root = std::string(base ? base : "/tmp") + "/tavlolog_bench." + std::to_string(getpid());
    std::string dir = root + "/APLog_2026_0101_000000/";
    mkdir(root.c_str(), 0755);
    mkdir(dir.c_str(), 0755);
    FILE* props = fopen((dir + "properties").c_str(), "w");
    fprintf(props, "<< system properties >>\n[debug.TQ.boot_wallclock]: [%lld.000000000]\n",
            static_cast<long long>(kBootWallclock));
    fclose(props);

    std::vector<std::string> tags = make_tags();
    int64_t total = mb * 1024 * 1024;
    int64_t held = total / 20;  // the held boot: 5 %
    const int64_t hour = int64_t{3600} * 1000000000;
    for (const Type& t : kTypes) {
        std::string n = t.name;
        write_type(dir, t.name, {n + ".boot"}, static_cast<int64_t>(static_cast<double>(held) * t.share), 0, hour / 4,
                   tags);
        write_type(dir, t.name, {n + ".4", n + ".3", n + ".2", n + ".1", n},
                   static_cast<int64_t>(static_cast<double>(total - held) * t.share), hour / 4, 10 * hour, tags);
    }
    std::vector<std::string> files;
    int64_t bytes = 0;
    for (const Type& t : kTypes) {
        for (const char* suffix : {".boot", ".4", ".3", ".2", ".1", ""}) {
            std::string path = dir + t.name + suffix;
            struct stat st;
            stat(path.c_str(), &st);
            bytes += st.st_size;
            files.push_back(path);
        }
    }
    std::vector<std::string> grep = {"grep", "-c", "."};
    grep.insert(grep.end(), files.begin(), files.end());
    std::string counts = root + "/grep.out";
    run(grep, nullptr, counts.c_str());  // into the page cache
    double mbytes = static_cast<double>(bytes) / 1048576.0;
    long rss;
    double g = run(grep, &rss, counts.c_str());
    printf("run folder: %.0f MB in %zu files (%s)\n", mbytes, files.size(), dir.c_str());
    printf("%-28s %7.2f s %8.0f MB/s  RSS %6ld KiB\n", "LC_ALL=C grep -c .", g, mbytes / g, rss);
    for (const char* mode : {"text", "json"}) {
        double t = run({tool, "--no-pager", "-o", mode, dir}, &rss);
        printf("tavlolog -o %-16s %7.2f s %8.0f MB/s  RSS %6ld KiB  %.2f of grep's speed\n", mode, t, mbytes / t, rss,
               g / t);
    }
    if (getenv("TAVLO_BENCH_KEEP") == nullptr) {
        std::string rm = "rm -rf '" + root + "'";
        if (system(rm.c_str()) != 0) fprintf(stderr, "%s failed\n", rm.c_str());
    }
    return 0;
}
