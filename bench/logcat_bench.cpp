// The Android collector's costs, in a throwaway phone (the logger devices and
// the Bluetooth service are started here, as the phone's init does):
//
//   tools/tavlo-emu sandbox BUILD/bench/logcat_bench [entries [idle_seconds [parts]]]
//
// parts: the letters of the parts to run (all of them by default), e.g. "d"
// while working on the engine.
//
// (d) the collector's engine fed from memory: main and system entries merged,
//     formatted through the platform library and sent through "log_socket"
//     into main_log; against the library's android_log_formatLogLine alone on
//     the same entries (the limit).
// (e) end to end: a writer process puts entries into /dev/log/main and
//     /dev/log/system until all are in main_log of a real run; the daemon's
//     CPU (the main collector and the transist's threads) and the logger
//     stand-in's, per 100,000 entries.
// (f) resident memory of an Android collector process holding entries up to
//     the overload (10,000 entries, or the byte budget), with typical and with
//     the longest entries.
// (g) wake-ups per second of a run's threads and collector processes with no
//     log traffic.
// (h) a hostile app floods /dev/log/main with 4 KB entries while another
//     writes numbered entries to main and system; with the per-pid budget off
//     and on, how many of the numbered entries main_log and its generations
//     keep, and how the flood was kept and summarised.
// Every line that reaches main_log is checked: each entry once, in order.
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "collectors/kmsg_cat.h"
#include "collectors/log_cat.h"
#include "core/log_controller.h"
#include "collectors/flood_guard.h"
#include "core/logging_run.h"
#include "core/run_host.h"
#include "platform/properties.h"
#include "platform/logger_write.h"
#include "record/record.h"
#include "storage/history_log.h"
#include "transist/log_files.h"
#include "transist/transist.h"
#include "transist/transist_state.h"

namespace {

const char RUN_D[] = "/data/bench/d/";
const char RUN_E[] = "/data/bench/e/";
const char RUN_G[] = "/data/bench/g/";
const char RUN_H[] = "/data/bench/h/";
const int NO_ROTATION_KB = 1 << 20;

double now_s() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

double rusage_s(const rusage& ru) {
    return static_cast<double>(ru.ru_utime.tv_sec + ru.ru_stime.tv_sec) +
           static_cast<double>(ru.ru_utime.tv_usec + ru.ru_stime.tv_usec) / 1e6;
}

double self_cpu_s() {
    rusage ru;
    getrusage(RUSAGE_SELF, &ru);
    return rusage_s(ru);
}

std::string read_text(const std::string& path) {
    std::string out;
    FILE* f = fopen(path.c_str(), "r");
    char buf[4096];
    for (size_t n; f != nullptr && (n = fread(buf, 1, sizeof(buf), f)) > 0;) out.append(buf, n);
    if (f != nullptr) fclose(f);
    return out;
}

// utime + stime of a task's stat file.
double stat_cpu_s(const std::string& stat_path) {
    std::string text = read_text(stat_path);
    size_t paren = text.rfind(')');
    unsigned long utime = 0, stime = 0;
    if (paren == std::string::npos ||
        sscanf(text.c_str() + paren + 2, "%*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %lu %lu", &utime,
               &stime) != 2)
        return 0;
    return static_cast<double>(utime + stime) / static_cast<double>(sysconf(_SC_CLK_TCK));
}

std::vector<std::string> tasks_of(pid_t pid) {
    std::vector<std::string> tids;
    std::string dir = "/proc/" + std::to_string(pid) + "/task";
    DIR* d = opendir(dir.c_str());
    while (dirent* e = d ? readdir(d) : nullptr)
        if (e->d_name[0] != '.') tids.push_back(dir + "/" + e->d_name);
    if (d) closedir(d);
    return tids;
}

// CPU seconds of this process's transist threads (named for top and /proc).
double transist_cpu_s() {
    double sum = 0;
    for (const std::string& task : tasks_of(getpid())) {
        std::string comm = read_text(task + "/comm");
        if (comm == "tavlo.reader\n" || comm == "tavlo.writer\n") sum += stat_cpu_s(task + "/stat");
    }
    return sum;
}

// Voluntary and involuntary context switches of the given tasks: each wake-up
// of a sleeping thread ends in one.
long switches(const std::vector<std::string>& tasks) {
    long sum = 0;
    for (const std::string& task : tasks) {
        std::string status = read_text(task + "/status");
        for (const char* key : {"voluntary_ctxt_switches:", "nonvoluntary_ctxt_switches:"}) {
            size_t at = status.find(key);
            if (at != std::string::npos) sum += atol(status.c_str() + at + strlen(key));
        }
    }
    return sum;
}

long status_kb(const char* key) {
    std::string status = read_text("/proc/self/status");
    size_t at = status.find(key);
    return at == std::string::npos ? -1 : atol(status.c_str() + at + strlen(key));
}

pid_t pid_named(const char* comm) {
    DIR* d = opendir("/proc");
    pid_t found = -1;
    while (dirent* e = d ? readdir(d) : nullptr) {
        if (e->d_name[0] < '1' || e->d_name[0] > '9') continue;
        if (read_text(std::string("/proc/") + e->d_name + "/comm") == std::string(comm) + "\n") found = atoi(e->d_name);
    }
    if (d) closedir(d);
    return found;
}

// Entry i of a stream alternating main (even) and system (odd), one
// microsecond apart, its message numbered and padded to about 80 bytes.
std::string bench_message(int i) {
    char text[96];
    snprintf(text, sizeof(text), "bench line %07d the quick brown fox jumps over the lazy dog %07d", i, i);
    return text;
}

std::string legacy_entry(int i, size_t message_len = 0) {
    std::string message = bench_message(i);
    if (message_len > message.size()) message.resize(message_len, 'x');
    std::vector<char> raw(LOGGER_READ_MAX);
    size_t n = make_legacy_text_entry(raw.data(), 1234, 1234 + i % 2, 1700000000 + i / 1000000,
                                      static_cast<uint32_t>(i % 1000000) * 1000, 4, "bench", message.c_str());
    return std::string(raw.data(), n);
}

// main_log holds the n numbered entries once each, in order, after its two
// "beginning of" lines.
bool check_main_log(const char* folder, int n, std::string* why) {
    std::string text = read_text(std::string(folder) + "main_log");
    int next = 0, beginnings = 0;
    for (size_t at = text.find('\n') + 1, end; at < text.size(); at = end + 1) {
        end = text.find('\n', at);
        if (end == std::string::npos) end = text.size();
        std::string line = text.substr(at, end - at);
        if (line.rfind("--------- beginning of ", 0) == 0) {
            beginnings++;
            continue;
        }
        size_t mark = line.find("bench line ");
        if (mark == std::string::npos || atoi(line.c_str() + mark + 11) != next) {
            *why = "entry " + std::to_string(next) + " missing or out of order: " + line.substr(0, 120);
            return false;
        }
        next++;
    }
    if (next != n || beginnings != 2) {
        *why = std::to_string(next) + " of " + std::to_string(n) + " entries, " + std::to_string(beginnings) +
               " beginning lines";
        return false;
    }
    return true;
}

LogController* bench_controller(const char* folder, bool android, bool kernel, bool bt) {
    LogController* controller = new LogController();  // lives as long as the process
    controller->log_on[LOG_MAIN] = controller->log_on[LOG_RADIO] = controller->log_on[LOG_EVENTS] = android;
    controller->log_on[LOG_KERNEL] = kernel;
    controller->log_on[LOG_BT] = bt;
    controller->log_file_num = 25;
    controller->boot_mode = 1;  // no exception-engine switch
    controller->log_path_state = LOG_PATH_HELD_IN_DATA;
    controller->rotate_size_kb = NO_ROTATION_KB;
    snprintf(controller->run_folder, sizeof(controller->run_folder), "%s", folder);
    return controller;
}

void stop_run(LogController* controller) {
    stop_logging(controller);
    signal(SIGCHLD, SIG_DFL);  // the stop ignores it; this program waits for its children
}

// (f) in a child of its own: the peak resident memory of an engine holding a
// lone main entry and system entries up to the overload.
void memory_at_overload(size_t message_len, long* base_kb, long* peak_kb, long* held) {
    int report[2];
    if (pipe(report) != 0) return;
    pid_t pid = fork();
    if (pid == 0) {
        LogCat cat("main_log");
        cat.transist_fd = open("/dev/null", O_WRONLY | O_CLOEXEC);
        cat.set_output_format();
        LogDevice* main_dev = cat.add_device("/dev/log/main", false, LOG_ID_MAIN, -1);
        LogDevice* system_dev = cat.add_device("/dev/log/system", false, LOG_ID_SYSTEM, -1);
        long kb[3] = {status_kb("VmRSS:"), 0, 0};
        std::string raw = legacy_entry(0, message_len);
        cat.take_entry(main_dev, raw.data(), raw.size());
        for (int i = 1; !cat.overloaded; i++) {
            raw = legacy_entry(i, message_len);
            cat.take_entry(system_dev, raw.data(), raw.size());
            if (!cat.overloaded) cat.print_ready();
        }
        kb[1] = status_kb("VmRSS:");
        kb[2] = cat.queued_count;
        cat.print_all();
        if (write(report[1], kb, sizeof(kb)) != sizeof(kb)) _exit(1);
        _exit(0);
    }
    close(report[1]);
    long kb[3] = {-1, -1, -1};
    if (read(report[0], kb, sizeof(kb)) != sizeof(kb)) kb[0] = kb[1] = kb[2] = -1;
    close(report[0]);
    waitpid(pid, nullptr, 0);
    *base_kb = kb[0];
    *peak_kb = kb[1];
    *held = kb[2];
}

double thread_cpu_s() {
    timespec ts;
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

struct Engine {
    double rate = 0, limit = 0, limit_cpu = 0, engine_cpu = 0, transist_cpu = 0;
    bool ok = false;
    std::string why;
};

// (d) the engine in a child process, as a collector; the transist here.
Engine engine_from_memory(int n) {
    Engine r;
    // The entries lie one after another, as a device hands them out: a string
    // of its own each, scattered over the heap, made every entry a cache and
    // TLB miss that the engine paid and the limit below did not.
    std::string stream;
    std::vector<size_t> at(static_cast<size_t>(n) + 1, 0);
    for (int i = 0; i < n; i++) {
        stream += legacy_entry(i);
        at[i + 1] = stream.size();
    }
    auto entry = [&](int i) { return stream.data() + at[i]; };
    auto entry_size = [&](int i) { return at[i + 1] - at[i]; };

    // The limit: the library's formatting alone, the entries parsed beforehand.
    AndroidLogFormat* format = android_log_format_new();
    android_log_setPrintFormat(format, FORMAT_THREADTIME);
    std::vector<QueuedEntry*> adapted;
    std::vector<AndroidLogEntry> parsed(static_cast<size_t>(n));
    for (int i = 0; i < n; i++) {
        adapted.push_back(adapt_legacy_entry(entry(i), entry_size(i), LOG_ID_MAIN));
        android_log_processLogBuffer(&adapted.back()->entry, &parsed[i]);
    }
    // Measured before and after the engine, and the two averaged: on a shared
    // machine the load changes from one second to the next.
    auto format_alone = [&] {
        double cpu_start = thread_cpu_s();
        for (const AndroidLogEntry& line : parsed) {
            char buf[512];
            size_t len;
            char* text = android_log_formatLogLine(format, buf, sizeof(buf), &line, &len);
            if (text != buf) free(text);
        }
        return thread_cpu_s() - cpu_start;
    };
    double t0 = now_s();
    r.limit_cpu = format_alone();
    r.limit = n / (now_s() - t0);

    LogController* controller = bench_controller(RUN_D, true, false, false);
    transist_create(run_host(controller), {RUN_D, "", {true, true, true, false, false}, NO_ROTATION_KB});
    // The engine's CPU is its thread's from the first entry to the last send,
    // as the limit's is: the child's whole lifetime would add what fork and
    // exit cost a process that inherited this one's tens of megabytes.
    int report[2];
    if (pipe(report) != 0) return r;
    double cpu0 = self_cpu_s();
    t0 = now_s();
    pid_t pid = fork();
    if (pid == 0) {
        close(report[0]);
        LogCat cat("main_log");
        cat.set_output_format();
        LogDevice* devices[2] = {cat.add_device("/dev/log/main", false, LOG_ID_MAIN, -1),
                                 cat.add_device("/dev/log/system", false, LOG_ID_SYSTEM, -1)};
        connect_transist(&cat);
        double cpu_start = thread_cpu_s();
        // As the reading loop: one entry of each device a pass.
        for (int i = 0; i < n; i++) {
            cat.take_entry(devices[i % 2], entry(i), entry_size(i));
            if (i % 2 == 1) cat.print_ready();
        }
        cat.print_all();
        double cpu = thread_cpu_s() - cpu_start;
        _exit(write(report[1], &cpu, sizeof(cpu)) == sizeof(cpu) ? 0 : 1);
    }
    close(report[1]);
    if (read(report[0], &r.engine_cpu, sizeof(r.engine_cpu)) != sizeof(r.engine_cpu)) r.engine_cpu = -1;
    close(report[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    stop_requested = true;
    transist_wake();
    pthread_join(read_thread_id, nullptr);
    pthread_join(write_thread_id, nullptr);
    stop_requested = false;
    r.rate = n / (now_s() - t0);
    r.transist_cpu = self_cpu_s() - cpu0;
    r.limit_cpu = (r.limit_cpu + format_alone()) / 2;
    for (QueuedEntry* e : adapted) free_queued_entry(e);
    android_log_format_free(format);
    r.ok = WIFEXITED(status) && WEXITSTATUS(status) == 0 && check_main_log(RUN_D, n, &r.why);
    return r;
}

struct EndToEnd {
    double rate = 0, collector_cpu = 0, transist_cpu = 0, logger_cpu = 0, writer_cpu = 0;
    bool ok = false;
    std::string why;
};

// Lines in main_log so far.
int main_log_lines(const char* folder) {
    std::string text = read_text(std::string(folder) + "main_log");
    int lines = 0;
    for (char c : text) lines += c == '\n';
    return lines;
}

// (e) a writer process into /dev/log/main and /dev/log/system, a real run.
EndToEnd end_to_end(int n, pid_t logger) {
    EndToEnd r;
    LogController* controller = bench_controller(RUN_E, true, false, false);
    start_logging(controller);
    while (log_files[LOG_MAIN].sock < 0) usleep(1000);  // the collector is connected
    double collector0 = stat_cpu_s("/proc/" + std::to_string(controller->collector_pid[LOG_MAIN]) + "/stat");
    double transist0 = transist_cpu_s(), logger0 = stat_cpu_s("/proc/" + std::to_string(logger) + "/stat");
    double t0 = now_s();
    pid_t writer = fork();
    if (writer == 0) {
        for (int i = 0; i < n; i++) {
            uint8_t payload[256];
            size_t len = logger_text_payload(4, "bench", bench_message(i).c_str(), payload, sizeof(payload));
            if (!logger_write(i % 2 ? "system" : "main", payload, len)) _exit(1);
        }
        _exit(0);
    }
    int status = 0;
    rusage written;
    wait4(writer, &status, 0, &written);
    r.writer_cpu = rusage_s(written);
    // Header, two beginning lines, the entries; the writer is asked to flush
    // now rather than at its next interval.
    double last_progress = now_s();
    for (int lines = 0, seen = 0; (lines = main_log_lines(RUN_E)) < n + 3 && now_s() - last_progress < 10;) {
        if (lines != seen) last_progress = now_s();
        seen = lines;
        kick_writer();
        usleep(10000);
    }
    r.rate = n / (now_s() - t0);
    r.collector_cpu = stat_cpu_s("/proc/" + std::to_string(controller->collector_pid[LOG_MAIN]) + "/stat") - collector0;
    r.transist_cpu = transist_cpu_s() - transist0;
    r.logger_cpu = stat_cpu_s("/proc/" + std::to_string(logger) + "/stat") - logger0;
    stop_run(controller);
    r.ok = WIFEXITED(status) && WEXITSTATUS(status) == 0 && check_main_log(RUN_E, n, &r.why);
    return r;
}

// Starts the logger devices, empty; ends the earlier ones first. Returns the
// stand-in's pid, or -1.
pid_t start_logger_devices(const char* size_bytes) {
    pid_t old = pid_named("emu_logger");
    if (old > 0) {
        kill(old, SIGTERM);
        while (kill(old, 0) == 0) usleep(1000);
    }
    // Stamps to the nanosecond: (e) checks the entries, alternating between
    // main and system, in the order written, which equal stamps would not keep.
    std::string command = std::string("emu_logger --fine-clock --size ") + size_bytes + " /dev/log";
    return system(command.c_str()) == 0 ? pid_named("emu_logger") : -1;
}

// (g) a run with all five collectors and no traffic, on empty devices.
double idle_wakeups(int seconds, std::string* detail) {
    if (start_logger_devices("262144") < 0) return -1;
    const char kmsg[] = "/tmp/bench_kmsg";
    const char bt_feed[] = "/tmp/bench_btlog";
    unlink(kmsg);
    unlink(bt_feed);
    if (mkfifo(kmsg, 0600) != 0 || mkfifo(bt_feed, 0600) != 0) return -1;
    int hold_kmsg = open(kmsg, O_RDWR | O_CLOEXEC), hold_bt = open(bt_feed, O_RDWR | O_CLOEXEC);
    KmsgCat::kmsg_path = kmsg;
    if (system("emu_btlog start --feed /tmp/bench_btlog") != 0) return -1;

    LogController* controller = bench_controller(RUN_G, true, true, true);
    start_logging(controller);
    sleep(2);  // every collector connected and parked in its wait
    std::vector<std::string> tasks;
    for (const std::string& task : tasks_of(getpid())) {
        std::string comm = read_text(task + "/comm");
        if (comm == "tavlo.reader\n" || comm == "tavlo.writer\n") tasks.push_back(task);
    }
    for (pid_t pid : controller->collector_pid) {
        for (const std::string& task : tasks_of(pid)) tasks.push_back(task);
    }
    std::vector<long> before;
    for (const std::string& task : tasks) before.push_back(switches({task}));
    sleep(static_cast<unsigned>(seconds));
    long total = 0;
    for (size_t i = 0; i < tasks.size(); i++) {
        long delta = switches({tasks[i]}) - before[i];
        total += delta;
        std::string comm = read_text(tasks[i] + "/comm");
        comm.pop_back();
        *detail += " " + comm + " " + std::to_string(delta);
    }
    stop_run(controller);
    close(hold_kmsg);
    close(hold_bt);
    if (system("emu_btlog stop") != 0) *detail += " (emu_btlog stop failed)";
    return static_cast<double>(total) / seconds;
}

struct Flood {
    int witnesses = 0, kept = 0, repeated = 0, flood_lines = 0, summaries = 0, first_lost = -1;
    long dropped = 0;
    double flood_mb = 0;
};

// (h) a run rotating main_log at 2457 KB (five generations), the flood and the
// numbered witnesses written at once for about three seconds.
Flood flood_run(const char* budget_kb) {
    Flood r;
    property_set(PROP_PID_BUDGET, budget_kb);
    // Empty devices: the other run's entries must not be read again.
    if (system("rm -rf /data/bench/h && mkdir -p /data/bench/h") != 0 || start_logger_devices("16777216") < 0) return r;
    LogController* controller = bench_controller(RUN_H, true, false, false);
    controller->rotate_size_kb = 2457;
    start_logging(controller);
    while (log_files[LOG_MAIN].sock < 0) usleep(1000);
    const double seconds = 3;
    int report[2];
    if (pipe(report) != 0) return r;
    pid_t flooder = fork();
    if (flooder == 0) {
        int fd = open("/dev/log/main", O_WRONLY | O_CLOEXEC);
        uint8_t payload[LOGGER_MAX_PAYLOAD];
        std::string message(LOGGER_MAX_PAYLOAD - 16, 'f');
        size_t n = logger_text_payload(4, "flood", message.c_str(), payload, sizeof(payload));
        long bytes = 0;
        for (double end = now_s() + seconds; now_s() < end;) bytes += write(fd, payload, n) > 0 ? static_cast<long>(n) : 0;
        if (write(report[1], &bytes, sizeof(bytes)) != sizeof(bytes)) _exit(1);
        _exit(0);
    }
    pid_t witness = fork();
    if (witness == 0) {
        int i = 0;
        for (double end = now_s() + seconds; now_s() < end; i++) {
            uint8_t payload[256];
            char text[64];
            snprintf(text, sizeof(text), "witness %06d", i);
            size_t len = logger_text_payload(4, "witness", text, payload, sizeof(payload));
            if (!logger_write(i % 2 ? "system" : "main", payload, len)) _exit(255);
            usleep(2000);
        }
        long count = i;
        if (write(report[1], &count, sizeof(count)) != sizeof(count)) _exit(1);
        _exit(0);
    }
    close(report[1]);
    long counts[2] = {0, 0};  // in the order the two finish; the flood's is the larger
    for (long& c : counts)
        if (read(report[0], &c, sizeof(c)) != sizeof(c)) c = 0;
    close(report[0]);
    long flood_bytes = std::max(counts[0], counts[1]);
    r.witnesses = static_cast<int>(std::min(counts[0], counts[1]));
    waitpid(flooder, nullptr, 0);
    int status = 0;
    waitpid(witness, &status, 0);
    r.flood_mb = flood_bytes / 1048576.0;
    // The collector still reads the flood's backlog: wait until main_log has
    // stopped growing for a second.
    std::string main_log = std::string(RUN_H) + "main_log";
    struct stat st = {};
    for (off_t last = -1; stat(main_log.c_str(), &st) == 0 && st.st_size != last;) {
        last = st.st_size;
        kick_writer();
        sleep(1);
        kick_writer();
        usleep(100000);
    }
    stop_run(controller);
    property_set(PROP_PID_BUDGET, "0");
    // Oldest generation first.
    std::string text;
    for (const char* suffix : {".4", ".3", ".2", ".1", ""}) text += read_text(std::string(RUN_H) + "main_log" + suffix);
    std::vector<int> seen;
    for (size_t at = 0, end; at < text.size(); at = end + 1) {
        end = text.find('\n', at);
        if (end == std::string::npos) end = text.size();
        std::string line = text.substr(at, end - at);
        size_t mark = line.find(" witness : witness ");  // threadtime pads the tag to 8
        if (mark != std::string::npos) {
            int i = atoi(line.c_str() + mark + 19);
            if (i >= static_cast<int>(seen.size())) seen.resize(i + 1);
            if (seen[i]++ > 0) r.repeated++;
        } else if (line.find(" flood   : ") != std::string::npos) {
            r.flood_lines++;
        } else if ((mark = line.find("TavloLogD: dropped ")) != std::string::npos) {
            r.summaries++;
            r.dropped += atol(line.c_str() + mark + 19);
        }
    }
    for (int count : seen) r.kept += count > 0;
    r.first_lost = -1;
    for (int i = 0; i < r.witnesses && r.first_lost < 0; i++)
        if (i >= static_cast<int>(seen.size()) || seen[i] == 0) r.first_lost = i;
    return r;
}

}  // namespace

int main(int argc, char** argv) {
    record_set_history_sink(history_vlog);  // as the daemon records
    int n = argc > 1 ? atoi(argv[1]) : 200000;
    int idle_s = argc > 2 ? atoi(argv[2]) : 10;
    const char* parts = argc > 3 ? argv[3] : "defgh";
    auto run = [parts](char part) { return strchr(parts, part) != nullptr; };
    if (n < 2 || idle_s < 1) {
        fprintf(stderr, "usage: %s [entries>=2 [idle_seconds>=1 [parts, e.g. defgh]]]\n", argv[0]);
        return 2;
    }
    if (access("/dev/emu", F_OK) != 0) {
        fprintf(stderr, "run me in the emulated phone: tools/tavlo-emu sandbox %s\n", argv[0]);
        return 2;
    }
    pid_t logger = -1;
    if (system("rm -rf /data/bench && mkdir -p /data/bench/d /data/bench/e /data/bench/g /dev/log") != 0 ||
        (logger = start_logger_devices("16777216")) < 0) {
        fprintf(stderr, "cannot start the logger devices\n");
        return 1;
    }
    printf("logcat bench: %d entries, main and system alternating, files in /data; load average %s", n,
           read_text("/proc/loadavg").c_str());
    fflush(stdout);  // forked children must not print this buffer again

    long base_kb = 0, peak_kb = 0, held = 0, long_base_kb = 0, long_peak_kb = 0, long_held = 0;
    if (run('f')) {
        memory_at_overload(0, &base_kb, &peak_kb, &held);
        memory_at_overload(LOGGER_MAX_PAYLOAD - 16, &long_base_kb, &long_peak_kb, &long_held);
    }
    Engine d;
    if (run('d')) d = engine_from_memory(n);
    EndToEnd e;
    if (run('e')) e = end_to_end(n, logger);
    std::string detail;
    double wakeups = run('g') ? idle_wakeups(idle_s, &detail) : 0;
    Flood off, on;
    if (run('h')) {
        off = flood_run("0");
        on = flood_run("64");
    }

    if (run('d')) {
        printf("(d) engine from memory: %.0f entries/s (wall); CPU: engine %.2f s, transist %.2f s per 100k "
               "entries   %s\n",
               d.rate, d.engine_cpu * 1e5 / n, d.transist_cpu * 1e5 / n, d.ok ? "content ok" : ("FAILED: " + d.why).c_str());
        printf("    per CPU second: engine %.0f entries/s, limit (formatLogLine alone) %.0f entries/s, ratio %.2f "
               "(aim >= 0.80)\n",
               n / d.engine_cpu, n / d.limit_cpu, d.limit_cpu / d.engine_cpu);
    }
    if (run('e')) {
        printf("(e) end to end: %.0f entries/s (wall)\n", e.rate);
        printf("    CPU per 100k entries: daemon %.2f s (collector %.2f, transist %.2f); logger stand-in %.2f s; "
               "writer %.2f s   %s\n",
               (e.collector_cpu + e.transist_cpu) * 1e5 / n, e.collector_cpu * 1e5 / n, e.transist_cpu * 1e5 / n,
               e.logger_cpu * 1e5 / n, e.writer_cpu * 1e5 / n, e.ok ? "content ok" : ("FAILED: " + e.why).c_str());
    }
    if (run('f'))
        printf("(f) collector RSS at the overload: %.1f MB holding %ld entries (%.1f MB before the entries); "
               "with the longest entries %.1f MB holding %ld (aim <= 8 MB each)\n",
               peak_kb / 1024.0, held, base_kb / 1024.0, long_peak_kb / 1024.0, long_held);
    if (run('g'))
        printf("(g) idle run, wake-ups per second: %.2f (aim <= 0.10, once in 10 s) over %d s:%s\n", wakeups, idle_s,
               detail.c_str());
    if (run('h')) {
        for (const Flood* f : {&off, &on}) {
            printf("(h) %s: flood %.0f MB in 4 KB entries; %d of %d numbered entries kept (%d twice); %d flood lines kept, "
                   "%ld dropped, told in %d summary lines; first numbered entry lost: %d\n",
                   f == &off ? "budget off" : "budget 64 KB/s per pid", f->flood_mb, f->kept, f->witnesses, f->repeated,
                   f->flood_lines, f->dropped, f->summaries, f->first_lost);
        }
    }
    if (system("rm -rf /data/bench") != 0) return 1;
    return (!run('d') || d.ok) && (!run('e') || e.ok) ? 0 : 1;
}
