// The emulated phone's init, first process of the phone (started by bwrap as
// root). Like a phone's init it gives the image's folders the owners and modes
// the daemon expects, fills the property area from /system/build.prop and the
// stored persist. properties, and keeps the daemon running: it starts
// /system/bin/tavlo_log_d as root, restarts it when it ends (no sooner than
// 5 s after its previous start, as a phone's init), and reaps every orphan.
// Before the daemon it starts the kernel log at /proc/kmsg, the phone's logger
// devices at /dev/log and the Bluetooth stack's log service (unless the boot
// left them out). SIGTERM
// powers the phone off.
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/limits.h"
#include "common/unique_fd.h"
#include "platform/properties.h"
#include "platform/property_area.h"

static const char kDaemonPath[] = "/system/bin/tavlo_log_d";
static const char kInitLog[] = "/dev/emu/init.log";
static const char kDaemonPidFile[] = "/dev/emu/daemon.pid";
static const char kDataSeed[] = "/dev/.data_seed";  // image's data/ when /data is a tmpfs
// As a phone's init: a service is restarted no sooner than this after its
// previous start, so a daemon that ends at start-up does not spin.
static const int kRestartPeriodMs = 5000;
static const char kExtSdcardSteps[] = "/dev/emu/ext_sdcard";
static const char kExtSdcardTool[] = "/system/bin/ext_sdcard_tool";
static const int kShutdownGraceMs = 1000;

// Android ids the daemon's identity and the folders use.
enum { AID_ROOT = 0, AID_SYSTEM = 1000, AID_LOG = 1007, AID_SDCARD_RW = 1015, AID_MISC = 9998 };

static void init_log(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
static void init_log(const char* fmt, ...) {
    char line[512];
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    struct tm tm;
    localtime_r(&ts.tv_sec, &tm);
    int n = snprintf(line, sizeof(line), "%02d:%02d:%02d.%03d ", tm.tm_hour, tm.tm_min, tm.tm_sec,
                     static_cast<int>(ts.tv_nsec / 1000000));
    va_list ap;
    va_start(ap, fmt);
    vsnprintf(line + n, sizeof(line) - n - 1, fmt, ap);
    va_end(ap);
    size_t len = strlen(line);
    line[len++] = '\n';
    UniqueFd fd(TEMP_FAILURE_RETRY(open(kInitLog, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644)));
    if (fd.ok()) write_fully(fd.get(), line, len);
}

static long long now_ms() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

// mkdir when missing, then owner and mode as a phone's init.rc would set them.
static void prepare_dir(const char* path, mode_t mode, uid_t uid, gid_t gid) {
    if (mkdir(path, mode) != 0 && errno != EEXIST) {
        init_log("mkdir %s failed: %s", path, strerror(errno));
        return;
    }
    if (chown(path, uid, gid) != 0 || chmod(path, mode) != 0)
        init_log("cannot set owner/mode of %s: %s", path, strerror(errno));
}

static void prepare_file(const char* path, mode_t mode) {
    UniqueFd fd(TEMP_FAILURE_RETRY(open(path, O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW, mode)));
    if (!fd.ok() || fchmod(fd.get(), mode) != 0)
        init_log("cannot prepare %s: %s", path, strerror(errno));
}

// Runs argv (a tool of the image or the host) and waits for it.
static int run_tool(const char* const argv[]) {
    pid_t pid = fork();
    if (pid < 0) return -1;
    if (pid == 0) {
        execv(argv[0], const_cast<char* const*>(argv));
        _exit(127);
    }
    int status = 0;
    if (TEMP_FAILURE_RETRY(waitpid(pid, &status, 0)) != pid) return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// The next entry of dir, or null at the end. A listing that fails half-way
// is recorded: it must not pass for a complete one.
static struct dirent* next_entry(DIR* dir, const char* path) {
    errno = 0;
    struct dirent* entry = readdir(dir);
    if (entry == nullptr && errno != 0) init_log("cannot list %s: %s", path, strerror(errno));
    return entry;
}

// Non-persistent properties vanish at each boot.
static void clear_property_area() {
    DIR* dir = opendir(PROPERTY_AREA_DIR);
    if (dir == nullptr) {
        init_log("cannot open %s: %s", PROPERTY_AREA_DIR, strerror(errno));
        return;
    }
    struct dirent* entry;
    while ((entry = next_entry(dir, PROPERTY_AREA_DIR)) != nullptr) {
        if (strcmp(entry->d_name, ".") == 0 || strcmp(entry->d_name, "..") == 0) continue;
        if (unlinkat(dirfd(dir), entry->d_name, 0) != 0)
            init_log("cannot remove property %s: %s", entry->d_name, strerror(errno));
    }
    closedir(dir);
}

static void prepare_folders() {
    // With --data-size /data is an empty tmpfs: start it from the image's data/.
    struct stat st;
    if (stat(kDataSeed, &st) == 0 && S_ISDIR(st.st_mode)) {
        const char* const cp[] = {"/bin/cp", "-a", "/dev/.data_seed/.", "/data/", nullptr};
        if (run_tool(cp) != 0) init_log("copying the image's data/ into /data failed");
    }
    prepare_dir("/data", 0771, AID_SYSTEM, AID_SYSTEM);
    prepare_dir("/data/misc", 01771, AID_SYSTEM, AID_MISC);
    prepare_dir(PROPERTY_PERSIST_DIR, 0700, AID_ROOT, AID_ROOT);
    prepare_dir("/mnt/sdcard", 0775, AID_ROOT, AID_SDCARD_RW);
    prepare_dir("/mnt/sdcard2", 0775, AID_ROOT, AID_SDCARD_RW);
    prepare_dir(PROPERTY_AREA_DIR, 0775, AID_ROOT, AID_SYSTEM);
    clear_property_area();
    prepare_file("/dev/emu/wlog", 0666);
    prepare_file("/dev/emu/oru_calls", 0666);
}

// Cuts spaces and tabs at both ends, in place.
static char* trim_spaces(char* s) {
    while (*s == ' ' || *s == '\t') s++;
    size_t len = strlen(s);
    while (len > 0 && (s[len - 1] == ' ' || s[len - 1] == '\t' || s[len - 1] == '\r' ||
                       s[len - 1] == '\n'))
        s[--len] = '\0';
    return s;
}

// build.prop is read whole before anything is set: as on Android, a later
// line overrides an earlier one of the same key, also for ro. keys, which can
// be set only once.
struct BuildProp {
    char key[PROPERTY_KEY_MAX];
    char value[PROPERTY_VALUE_MAX];
};
static const int kMaxBuildProps = 512;
static BuildProp g_build_props[kMaxBuildProps];

static void load_build_prop(const char* path) {
    FILE* f = fopen(path, "re");
    if (f == nullptr) {
        init_log("no %s: %s", path, strerror(errno));
        return;
    }
    int count = 0;
    char line[512];
    int lineno = 0;
    while (fgets(line, sizeof(line), f) != nullptr) {
        lineno++;
        size_t len = strlen(line);
        if (len == sizeof(line) - 1 && line[len - 1] != '\n') {
            init_log("%s:%d: line too long, ignored", path, lineno);
            int c;
            while ((c = fgetc(f)) != EOF && c != '\n') {
            }
            continue;
        }
        char* s = trim_spaces(line);
        if (*s == '\0' || *s == '#') continue;
        char* eq = strchr(s, '=');
        if (eq == nullptr) {
            init_log("%s:%d: no '=', ignored", path, lineno);
            continue;
        }
        *eq = '\0';
        char* key = trim_spaces(s);
        char* value = trim_spaces(eq + 1);
        if (!property_key_valid(key) || strlen(value) >= PROPERTY_VALUE_MAX) {
            init_log("%s:%d: bad name or value too long, ignored", path, lineno);
            continue;
        }
        int i = 0;
        while (i < count && strcmp(g_build_props[i].key, key) != 0) i++;
        if (i == count) {
            if (count == kMaxBuildProps) {
                init_log("%s:%d: more than %d properties, ignored", path, lineno, kMaxBuildProps);
                continue;
            }
            count++;
            copy_str(g_build_props[i].key, sizeof(g_build_props[i].key), key);
        }
        copy_str(g_build_props[i].value, sizeof(g_build_props[i].value), value);
    }
    fclose(f);
    for (int i = 0; i < count; i++) {
        if (property_set_runtime(g_build_props[i].key, g_build_props[i].value) != 0)
            init_log("cannot set %s: %s", g_build_props[i].key, strerror(errno));
    }
}

static void load_persistent_properties() {
    DIR* dir = opendir(PROPERTY_PERSIST_DIR);
    if (dir == nullptr) {
        init_log("cannot open %s: %s", PROPERTY_PERSIST_DIR, strerror(errno));
        return;
    }
    struct dirent* entry;
    while ((entry = next_entry(dir, PROPERTY_PERSIST_DIR)) != nullptr) {
        const char* key = entry->d_name;
        if (!property_key_valid(key) || strncmp(key, "persist.", 8) != 0) continue;
        char value[PROPERTY_VALUE_MAX];
        UniqueFd fd(TEMP_FAILURE_RETRY(openat(dirfd(dir), key, O_RDONLY | O_CLOEXEC | O_NOFOLLOW)));
        if (!fd.ok()) continue;
        ssize_t n = TEMP_FAILURE_RETRY(read(fd.get(), value, sizeof(value) - 1));
        if (n < 0) continue;
        value[n] = '\0';
        if (property_set_runtime(key, value) != 0)
            init_log("cannot restore %s: %s", key, strerror(errno));
    }
    closedir(dir);
}

// The engineering storage tool of the kelm boot, run in the background with
// the steps tavlo-emu left (e.g. "after 3 link"), when it left any.
static void start_ext_sdcard_tool(const sigset_t* old_mask) {
    char steps[256];
    UniqueFd fd(TEMP_FAILURE_RETRY(open(kExtSdcardSteps, O_RDONLY | O_CLOEXEC)));
    if (!fd.ok()) return;
    ssize_t n = TEMP_FAILURE_RETRY(read(fd.get(), steps, sizeof(steps) - 1));
    if (n <= 0) return;
    steps[n] = '\0';
    const char* argv[32] = {kExtSdcardTool};
    int argc = 1;
    for (char* word = strtok(steps, " \n"); word != nullptr && argc < 31; word = strtok(nullptr, " \n"))
        argv[argc++] = word;
    argv[argc] = nullptr;
    pid_t pid = fork();
    if (pid == 0) {
        sigprocmask(SIG_SETMASK, old_mask, nullptr);
        execv(kExtSdcardTool, const_cast<char* const*>(argv));
        _exit(127);
    }
    if (pid < 0) init_log("cannot start %s: %s", kExtSdcardTool, strerror(errno));
}

// The Bluetooth log service's feed is a FIFO the host writes into. Held open
// for writing, it never shows its reader an end, and the host's writes wait in
// it while the service is down.
static int hold_btlog_feed() {
    struct stat st;
    if (stat("/dev/emu/btlog", &st) != 0 || !S_ISFIFO(st.st_mode)) return -1;
    int fd = TEMP_FAILURE_RETRY(open("/dev/emu/btlog", O_RDWR | O_NONBLOCK | O_CLOEXEC));
    if (fd < 0) {
        init_log("cannot hold /dev/emu/btlog: %s", strerror(errno));
        return -1;
    }
    fcntl(fd, F_SETPIPE_SZ, 1 << 20);
    return fd;
}

// The boot's choices come from tavlo-emu through the environment.
static bool boot_flag(const char* name) {
    const char* value = getenv(name);
    return value != nullptr && strcmp(value, "1") == 0;
}

// The kernel log: /proc/kmsg served as the kernel serves it (emu_kmsg), fed
// by the host through /dev/emu/kmsg; a boot with EMU_REAL_KMSG=1 keeps the
// host kernel's own.
static void start_kernel_log() {
    if (boot_flag("EMU_REAL_KMSG")) return;
    const char* const argv[] = {"/system/bin/emu_kmsg", "/dev/emu/kmsg", "/proc/kmsg", nullptr};
    if (run_tool(argv) != 0) init_log("the kernel log does not serve (see console.log)");
}

// The logger devices, each of EMU_LOGGER_SIZE bytes (default 256 KiB), without
// /dev/log/system when EMU_NO_SYSTEM_LOG=1, stamping entries to the nanosecond
// when EMU_LOGGER_FINE_CLOCK=1. emu_logger returns once they serve.
static void start_logger_devices() {
    prepare_dir("/dev/log", 0755, AID_ROOT, AID_ROOT);
    const char* size = getenv("EMU_LOGGER_SIZE");
    const char* argv[8] = {"/system/bin/emu_logger"};
    int argc = 1;
    if (size != nullptr && *size != '\0') {
        argv[argc++] = "--size";
        argv[argc++] = size;
    }
    if (boot_flag("EMU_NO_SYSTEM_LOG")) argv[argc++] = "--no-system";
    if (boot_flag("EMU_LOGGER_FINE_CLOCK")) argv[argc++] = "--fine-clock";
    argv[argc++] = "/dev/log";
    argv[argc] = nullptr;
    if (run_tool(argv) != 0) init_log("the logger devices do not serve (see console.log)");
}

static void start_btlog_service() {
    if (boot_flag("EMU_NO_BTLOG")) return;
    const char* const argv[] = {"/system/bin/emu_btlog", "start", nullptr};
    if (run_tool(argv) != 0) init_log("the Bluetooth log service does not serve (see console.log)");
}

static void write_daemon_pid(pid_t pid) {
    // Written aside and renamed so that a reader never sees half a number.
    char tmp[PATH_LEN];
    snprintf(tmp, sizeof(tmp), "%s.tmp", kDaemonPidFile);
    char text[32];
    int n = snprintf(text, sizeof(text), "%d\n", static_cast<int>(pid));
    UniqueFd fd(TEMP_FAILURE_RETRY(open(tmp, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644)));
    if (!fd.ok() || write_fully(fd.get(), text, n) != n) return;
    fd.reset();
    rename(tmp, kDaemonPidFile);
}

static pid_t start_daemon(const sigset_t* old_mask) {
    pid_t pid = fork();
    if (pid < 0) {
        init_log("fork failed: %s", strerror(errno));
        return -1;
    }
    if (pid == 0) {
        // A service starts in its own session with default signal handling and
        // a clean environment; its output goes to the phone's console.
        sigprocmask(SIG_SETMASK, old_mask, nullptr);
        setsid();
        int null_fd = open("/dev/null", O_RDONLY);
        if (null_fd >= 0 && null_fd != 0) {
            dup2(null_fd, 0);
            close(null_fd);
        }
        umask(022);
        if (chdir("/") != 0) _exit(127);
        const char* const argv[] = {kDaemonPath, nullptr};
        const char* const envp[] = {"PATH=/system/bin:/usr/bin:/bin", "ANDROID_ROOT=/system",
                                    "ANDROID_DATA=/data", nullptr};
        execve(kDaemonPath, const_cast<char* const*>(argv), const_cast<char* const*>(envp));
        fprintf(stderr, "emu_init: cannot run %s: %s\n", kDaemonPath, strerror(errno));
        _exit(127);
    }
    write_daemon_pid(pid);
    init_log("start tavlo_log_d pid %d", static_cast<int>(pid));
    return pid;
}

static void describe_status(int status, char* out, size_t n) {
    if (WIFEXITED(status))
        snprintf(out, n, "exit status %d", WEXITSTATUS(status));
    else if (WIFSIGNALED(status))
        snprintf(out, n, "killed by signal %d (%s)%s", WTERMSIG(status), strsignal(WTERMSIG(status)),
                 WCOREDUMP(status) ? ", core dumped" : "");
    else
        snprintf(out, n, "status 0x%x", status);
}

// Reaps every ended child; returns 1 when the daemon was one of them.
static int reap_children(pid_t daemon_pid) {
    int daemon_ended = 0;
    for (;;) {
        int status = 0;
        pid_t pid = waitpid(-1, &status, WNOHANG);
        if (pid <= 0) break;
        if (pid == daemon_pid) {
            char text[96];
            describe_status(status, text, sizeof(text));
            init_log("exit tavlo_log_d pid %d: %s", static_cast<int>(pid), text);
            daemon_ended = 1;
        }
    }
    return daemon_ended;
}

// Ends every other process of the phone: politely first, then by force.
static void power_off(pid_t daemon_pid) {
    init_log("power off");
    // kill(-1) reaches the whole phone only when we are its pid 1; anywhere
    // else it would reach the host, so then only the daemon's group is ended.
    bool whole_phone = getpid() == 1;
    if (whole_phone)
        kill(-1, SIGTERM);
    else if (daemon_pid > 0)
        kill(-daemon_pid, SIGTERM);
    long long deadline = now_ms() + kShutdownGraceMs;
    while (now_ms() < deadline) {
        if (waitpid(-1, nullptr, WNOHANG) < 0 && errno == ECHILD) return;
        usleep(10000);
    }
    if (whole_phone)
        kill(-1, SIGKILL);
    else if (daemon_pid > 0)
        kill(-daemon_pid, SIGKILL);
    while (waitpid(-1, nullptr, 0) > 0 || errno == EINTR) {
    }
}

int main() {
    // Whatever the host left open (its lock of the image, for one) is no
    // business of the phone's processes.
    for (int fd = 3; fd < 1024; fd++) close(fd);
    umask(022);
    if (chdir("/") != 0) return 1;
    // Orphans of the phone come to us also when we are not its pid 1.
    prctl(PR_SET_CHILD_SUBREAPER, 1);

    init_log("boot");
    prepare_folders();
    load_build_prop("/system/build.prop");
    load_persistent_properties();
    start_kernel_log();
    int btlog_fd = hold_btlog_feed();
    (void)btlog_fd;  // held until power-off
    start_logger_devices();
    start_btlog_service();

    sigset_t mask;
    sigset_t old_mask;
    sigemptyset(&mask);
    sigaddset(&mask, SIGCHLD);
    sigaddset(&mask, SIGTERM);
    sigaddset(&mask, SIGINT);
    sigaddset(&mask, SIGHUP);
    sigprocmask(SIG_BLOCK, &mask, &old_mask);

    start_ext_sdcard_tool(&old_mask);
    long long started_at = now_ms();
    pid_t daemon_pid = start_daemon(&old_mask);
    long long restart_at = daemon_pid < 0 ? started_at + kRestartPeriodMs : -1;

    for (;;) {
        struct timespec timeout = {1, 0};
        if (restart_at >= 0) {
            long long wait_ms = restart_at - now_ms();
            if (wait_ms < 0) wait_ms = 0;
            timeout.tv_sec = wait_ms / 1000;
            timeout.tv_nsec = (wait_ms % 1000) * 1000000;
        }
        siginfo_t info;
        int sig = sigtimedwait(&mask, &info, &timeout);
        if (sig == SIGTERM || sig == SIGINT || sig == SIGHUP) {
            power_off(daemon_pid);
            return 0;
        }
        // SIGCHLD, a time-out or EINTR: reap in every case, a SIGCHLD can be
        // merged with one that arrived before.
        if (reap_children(daemon_pid)) {
            // As a phone's init: what the service left behind goes with it.
            kill(-daemon_pid, SIGKILL);
            unlink(kDaemonPidFile);
            daemon_pid = -1;
            restart_at = started_at + kRestartPeriodMs;
        }
        if (restart_at >= 0 && now_ms() >= restart_at) {
            started_at = now_ms();
            daemon_pid = start_daemon(&old_mask);
            restart_at = daemon_pid < 0 ? started_at + kRestartPeriodMs : -1;
        }
    }
}
