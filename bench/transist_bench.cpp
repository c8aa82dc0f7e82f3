// Throughput of the transist on the emulated phone's /data.
//
//   tools/tavlo-emu sandbox BUILD/bench/transist_bench [total_MB [rotate_KB [send_bytes]]]
//
// (a) five client streams fed at full speed through "log_socket" into rotating
//     files of a run folder; timed from the first byte to the end of the stop,
//     when every byte is in the files and they are synced and closed; then
//     every byte of every stream is checked, in order, against its sequence.
//     Once with send_bytes per send (4 KB unless given), once with line-sized
//     sends of 128 bytes.
// (b) the same bytes written to five files by a plain loop of 4 KB writes,
//     synced and closed: what the disk takes at best.
// (c) the kernel collector's path from a FIFO standing in for /proc/kmsg, read
//     by the real collector process of a real run into "kernel_log".
//
// Generations that rotation would delete (X.4 replaced) are kept aside by a
// renameat() hook below, so that the check sees every byte ever written.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cutils/sockets.h>

#include <algorithm>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "collectors/kmsg_cat.h"
#include "common/io_util.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "core/run_host.h"
#include "record/record.h"
#include "storage/history_log.h"
#include "transist/transist.h"

namespace {

const int STREAMS = LOG_TYPE_COUNT;
const int LINE = 128;  // every generated line has this length, line feed included
const char RUN_A[] = "/data/bench/a/";
const char RUN_B[] = "/data/bench/b/";
const char RUN_C[] = "/data/bench/c/";
const char KMSG_FIFO[] = "/tmp/bench_kmsg";

std::mutex gone_lock;
std::map<std::string, int> gone_count;  // per file name: generations kept aside

double now_s() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec + ts.tv_nsec / 1e9;
}

double process_cpu_s() {
    rusage ru;
    getrusage(RUSAGE_SELF, &ru);
    return ru.ru_utime.tv_sec + ru.ru_utime.tv_usec / 1e6 + ru.ru_stime.tv_sec +
           ru.ru_stime.tv_usec / 1e6;
}

// Line `seq` of a stream: letter, sequence number, filler, line feed.
void make_line(char letter, long seq, char* out) {
    int n = snprintf(out, LINE, "%c %010ld ", letter, seq);
    for (int i = n; i < LINE - 1; i++) out[i] = static_cast<char>('a' + (seq + i) % 26);
    out[LINE - 1] = '\n';
}

// Fills buf with the stream's bytes from offset on (len a multiple of LINE,
// offset too).
void make_bytes(char letter, long offset, char* buf, size_t len) {
    for (size_t at = 0; at < len; at += LINE) {
        make_line(letter, (offset + static_cast<long>(at)) / LINE, buf + at);
    }
}

// One sender: connects, names its type, waits for the start, streams.
bool run_client(char letter, long bytes, size_t send_size, int go_fd) {
    int fd = socket_local_client(LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    if (fd < 0 || write_fully(fd, &letter, 1) != 1) return false;
    struct pollfd start = {go_fd, POLLIN, 0};
    while (poll(&start, 1, -1) < 0 && errno == EINTR) {
    }
    std::vector<char> buf(send_size);
    bool ok = true;
    for (long at = 0; at < bytes && ok; at += static_cast<long>(send_size)) {
        size_t n = static_cast<size_t>(std::min<long>(static_cast<long>(send_size), bytes - at));
        make_bytes(letter, at, buf.data(), n);
        ok = write_fully(fd, buf.data(), n) == static_cast<ssize_t>(n);
    }
    close(fd);
    return ok;
}

// Reads the stream's files oldest first (kept-aside generations, X.4 .. X.1,
// X), skips each header line and compares every byte with the sequence.
bool verify_stream(const char* folder, int type, long bytes, std::string* why) {
    char letter = LOG_TYPE_LETTERS[type];
    std::string base = std::string(folder) + log_type_name(type);
    std::vector<std::string> files;
    int gone = gone_count[base];
    for (int i = 1; i <= gone; i++) {
        char name[64];
        snprintf(name, sizeof(name), ".gone.%06d", i);
        files.push_back(base + name);
    }
    for (int gen = 4; gen >= 1; gen--) {
        std::string name = base + "." + std::to_string(gen);
        if (access(name.c_str(), F_OK) == 0) files.push_back(name);
    }
    files.push_back(base);

    long offset = 0;
    std::vector<char> got(1 << 20), want(1 << 20);
    for (const std::string& name : files) {
        FILE* f = fopen(name.c_str(), "r");
        if (f == nullptr) {
            *why = name + " missing";
            return false;
        }
        char header[128];
        if (fgets(header, sizeof(header), f) == nullptr || strncmp(header, "-----timezone: ", 15)) {
            *why = name + " has no header";
            fclose(f);
            return false;
        }
        size_t n;
        while ((n = fread(got.data(), 1, got.size(), f)) > 0) {
            // Compare from the line containing offset on.
            long line_start = offset / LINE * LINE;
            size_t skip = static_cast<size_t>(offset - line_start);
            size_t span = (skip + n + LINE - 1) / LINE * LINE;
            if (span > want.size()) want.resize(span);
            make_bytes(letter, line_start, want.data(), span);
            if (offset + static_cast<long>(n) > bytes ||
                memcmp(got.data(), want.data() + skip, n) != 0) {
                *why = name + ": wrong bytes near stream offset " + std::to_string(offset);
                fclose(f);
                return false;
            }
            offset += static_cast<long>(n);
        }
        fclose(f);
    }
    if (offset != bytes) {
        *why = std::to_string(offset) + " of " + std::to_string(bytes) + " bytes";
        return false;
    }
    return true;
}

struct Result {
    double seconds = 0;
    double cpu = 0;  // process CPU seconds (the senders of (a) are another process)
    double stop_ms = 0;
    bool ok = true;
    std::string why;
};

// The senders run in a process of their own, so that this process's CPU time
// is the transist's: subtracting the senders' thread times from it gave
// figures below zero.
Result bench_transist(long per_stream, int rotate_kb, size_t send_size) {
    Result r;
    LogController* controller = new LogController();  // lives as long as the process
    for (int& on : controller->log_on) on = 1;
    controller->log_path_state = LOG_PATH_HELD_IN_DATA;  // a run in /data
    transist_create(run_host(controller), {RUN_A, "", {true, true, true, true, true}, rotate_kb});

    int go[2];
    if (pipe(go) != 0) {
        r.ok = false;
        r.why = "no pipe";
        return r;
    }
    fflush(stdout);
    pid_t senders = fork();
    if (senders == 0) {
        close(go[1]);
        bool ok[STREAMS];
        std::vector<std::thread> threads;
        for (int t = 0; t < STREAMS; t++) {
            threads.emplace_back([&, t] { ok[t] = run_client(LOG_TYPE_LETTERS[t], per_stream, send_size, go[0]); });
        }
        for (std::thread& t : threads) t.join();
        _exit(std::all_of(ok, ok + STREAMS, [](bool b) { return b; }) ? 0 : 1);
    }
    close(go[0]);
    usleep(100000);  // all connected and registered
    double cpu0 = process_cpu_s();
    double t0 = now_s();
    close(go[1]);  // the start
    int status = 0;
    waitpid(senders, &status, 0);
    double t_stop = now_s();
    stop_requested = true;
    transist_wake();
    pthread_join(read_thread_id, nullptr);
    pthread_join(write_thread_id, nullptr);
    stop_requested = false;
    double t1 = now_s();
    r.seconds = t1 - t0;
    r.stop_ms = (t1 - t_stop) * 1000;
    r.cpu = process_cpu_s() - cpu0;
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        r.ok = false;
        r.why = "a client could not send";
    }
    for (int t = 0; t < STREAMS && r.ok; t++) {
        std::string why;
        if (!verify_stream(RUN_A, t, per_stream, &why)) {
            r.ok = false;
            r.why = std::string(log_type_name(t)) + ": " + why;
        }
    }
    return r;
}

Result bench_plain(long per_stream) {
    Result r;
    const size_t chunk = 4096;
    int fds[STREAMS];
    for (int t = 0; t < STREAMS; t++) {
        std::string name = std::string(RUN_B) + log_type_name(t);
        fds[t] = open(name.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_APPEND | O_CLOEXEC, 0600);
        if (fds[t] < 0) {
            r.ok = false;
            r.why = name + ": " + strerror(errno);
            return r;
        }
    }
    std::vector<char> buf(chunk);
    double cpu0 = process_cpu_s();
    double t0 = now_s();
    for (long at = 0; at < per_stream; at += static_cast<long>(chunk)) {
        size_t n = static_cast<size_t>(std::min<long>(static_cast<long>(chunk), per_stream - at));
        for (int t = 0; t < STREAMS; t++) {
            // Generated as the clients of (a) do, so both sides pay for it.
            make_bytes(LOG_TYPE_LETTERS[t], at, buf.data(), n);
            if (write_fully(fds[t], buf.data(), n) != static_cast<ssize_t>(n)) r.ok = false;
        }
    }
    for (int fd : fds) {
        fsync(fd);
        close(fd);
    }
    r.seconds = now_s() - t0;
    r.cpu = process_cpu_s() - cpu0;
    if (!r.ok) r.why = "a write failed";
    return r;
}

// CPU seconds a process has used so far (utime + stime of /proc/<pid>/stat).
double pid_cpu_s(pid_t pid) {
    std::string path = "/proc/" + std::to_string(pid) + "/stat";
    FILE* f = fopen(path.c_str(), "r");
    if (f == nullptr) return 0;
    char buf[1024];
    size_t n = fread(buf, 1, sizeof(buf) - 1, f);
    fclose(f);
    buf[n] = '\0';
    const char* p = strrchr(buf, ')');
    unsigned long utime = 0, stime = 0;
    if (p == nullptr || sscanf(p + 2, "%*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %lu %lu",
                               &utime, &stime) != 2) {
        return 0;
    }
    return static_cast<double>(utime + stime) / static_cast<double>(sysconf(_SC_CLK_TCK));
}

// (c) The kernel collector's path: a FIFO standing in for /proc/kmsg, fed at
// full speed, read by the real kernel collector process of a real run (start
// and stop as the daemon does them) into "kernel_log".
bool bench_kernel_fifo(long bytes, Result* out) {
    unlink(KMSG_FIFO);
    if (mkfifo(KMSG_FIFO, 0600) != 0) return false;
    KmsgCat::kmsg_path = KMSG_FIFO;
    // Held open read-write so that the collector never sees end of file.
    int hold = open(KMSG_FIFO, O_RDWR | O_CLOEXEC);
    if (hold < 0) return false;

    LogController* controller = new LogController();  // lives as long as the process
    controller->log_on[LOG_KERNEL] = 1;
    controller->log_file_num = 5;
    controller->boot_mode = 1;  // no exception-engine switch
    controller->log_path_state = LOG_PATH_HELD_IN_DATA;
    snprintf(controller->run_folder, sizeof(controller->run_folder), "%s", RUN_C);
    controller->rotate_size_kb = calc_rotate_size(controller, 60);
    fflush(stdout);  // the forked collector must not print this program's buffer again
    start_logging(controller);

    double cpu0 = process_cpu_s();
    double t0 = now_s();
    std::vector<char> buf(4096);
    bool ok = true;
    for (long at = 0; at < bytes && ok; at += static_cast<long>(buf.size())) {
        size_t n = static_cast<size_t>(std::min<long>(static_cast<long>(buf.size()), bytes - at));
        make_bytes('K', at, buf.data(), n);
        ok = write_fully(hold, buf.data(), n) == static_cast<ssize_t>(n);
    }
    // Everything fed must have been read by the collector before the stop.
    for (int unread = 1; unread > 0;) {
        if (ioctl(hold, FIONREAD, &unread) != 0) break;
        if (unread > 0) usleep(1000);
    }
    double collector_cpu = pid_cpu_s(controller->collector_pid[LOG_KERNEL]);
    stop_logging(controller);
    out->seconds = now_s() - t0;
    // The feeding loop runs in this process too; it is about what (b) spends.
    out->cpu = process_cpu_s() - cpu0 + collector_cpu;
    close(hold);
    std::string why;
    out->ok = ok && verify_stream(RUN_C, LOG_KERNEL, bytes, &why);
    out->why = ok ? why : "feeding the FIFO failed";
    return true;
}

void print_row(const char* what, long total, const Result& r) {
    double mb = total / 1048576.0;
    char cpu[32];
    // A CPU time below zero is a measuring fault, not a figure.
    if (r.cpu >= 0) snprintf(cpu, sizeof(cpu), "%8.2f", r.cpu * 100 / mb);
    else snprintf(cpu, sizeof(cpu), "%8s", "n/a");
    printf("%-38s %8.1f MB/s %8.2f s %s CPU s/100MB   %s\n", what, mb / r.seconds, r.seconds, cpu,
           r.ok ? "content ok" : ("FAILED: " + r.why).c_str());
}

}  // namespace

// Keeps the generation that a rotation is about to delete (the rename onto
// X.4), so that the content check can see every byte. The transist renames
// within the run folder's descriptor; its calls resolve to this definition in
// this program only, which renames with the system call itself.
extern "C" int renameat(int from_dir, const char* from, int to_dir, const char* to) {
    size_t n = strlen(to);
    if (n > 2 && strcmp(to + n - 2, ".4") == 0 && faccessat(to_dir, to, F_OK, 0) == 0) {
        char link[32], folder[PATH_LEN];
        snprintf(link, sizeof(link), "/proc/self/fd/%d", to_dir);
        ssize_t len = to_dir == AT_FDCWD ? -1 : readlink(link, folder, sizeof(folder) - 1);
        folder[len > 0 ? len : 0] = '\0';
        std::string base = (len > 0 ? std::string(folder) + "/" : std::string()) + std::string(to, n - 2);
        int seq;
        {
            std::lock_guard<std::mutex> hold(gone_lock);
            seq = ++gone_count[base];
        }
        char kept[PATH_LEN + 32];
        snprintf(kept, sizeof(kept), "%s.gone.%06d", base.c_str(), seq);
        syscall(SYS_renameat2, to_dir, to, AT_FDCWD, kept, 0);
    }
    return static_cast<int>(syscall(SYS_renameat2, from_dir, from, to_dir, to, 0));
}

int main(int argc, char** argv) {
    record_set_history_sink(history_vlog);  // as the daemon records
    long total_mb = argc > 1 ? atol(argv[1]) : 100;
    int rotate_kb = argc > 2 ? atoi(argv[2]) : 2457;
    size_t send_size = argc > 3 ? static_cast<size_t>(atol(argv[3])) : 4096;
    if (total_mb <= 0 || rotate_kb <= 0 || send_size < LINE || send_size % LINE != 0) {
        fprintf(stderr, "usage: %s [total_MB>0 [rotate_KB>0 [send_bytes, multiple of %d]]]\n",
                argv[0], LINE);
        return 2;
    }
    if (access("/dev/emu", F_OK) != 0) {
        fprintf(stderr, "run me in the emulated phone: tools/tavlo-emu sandbox %s\n", argv[0]);
        return 2;
    }
    long per_stream = total_mb * 1048576 / STREAMS / LINE * LINE;
    long total = per_stream * STREAMS;
    if (system("rm -rf /data/bench && mkdir -p /data/bench/a /data/bench/b /data/bench/c") != 0) {
        return 1;
    }

    printf("transist bench: %ld MB in %d streams, rotation %d KB, %zu-byte sends, files in /data\n",
           total / 1048576, STREAMS, rotate_kb, send_size);
    Result a = bench_transist(per_stream, rotate_kb, send_size);
    rusage ru;
    getrusage(RUSAGE_SELF, &ru);
    long peak_kb = ru.ru_maxrss;
    Result b = bench_plain(per_stream);

    print_row("(a) transist, first byte to stop done", total, a);
    Result lines;
    if (send_size != LINE) {
        gone_count.clear();
        if (system("rm -rf /data/bench/a && mkdir -p /data/bench/a") != 0) return 1;
        lines = bench_transist(per_stream, rotate_kb, LINE);
        print_row("(a) the same with 128-byte sends", total, lines);
    }
    print_row("(b) plain 4 KB write loop", total, b);
    Result c;
    long kernel_bytes = total / LINE * LINE;
    if (bench_kernel_fifo(kernel_bytes, &c)) {
        print_row("(c) kernel collector from FIFO", total, c);
    } else {
        printf("%-38s not measured yet (kernel collector path)\n", "(c) kernel collector from FIFO");
    }
    printf("(a)/(b) throughput ratio: %.2f (aim >= 0.50)\n", b.seconds / a.seconds);
    if (send_size != LINE) {
        printf("(a) with 128-byte sends: %.2f CPU s/100MB (aim <= 0.30), %.2f times the %zu-byte sends'\n",
               lines.cpu * 100 / (total / 1048576.0), lines.cpu / a.cpu, send_size);
    }
    if (c.seconds > 0) printf("(c) kernel path: %.2f CPU s/100MB (aim <= 2.00)\n", c.cpu * 100 / (total / 1048576.0));
    if (c.seconds > 0) printf("(c)/(b) throughput ratio: %.2f\n", b.seconds / c.seconds);
    printf("(a) stop, clients done to threads joined: %.0f ms\n", a.stop_ms);
    printf("peak RSS during (a): %.1f MB\n", peak_kb / 1024.0);
    printf("CPU: (a) the transist's threads (senders excluded); (b) the loop, making the bytes "
           "included\n");
    if (system("rm -rf /data/bench") != 0) return 1;
    return a.ok && b.ok && lines.ok && c.ok ? 0 : 1;
}
