#include "tests/integration/emu_phone.h"

#include <errno.h>
#include <fcntl.h>
#include <ftw.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include "common/io_util.h"

extern char** environ;

namespace {

const char kEmuTool[] = TAVLO_SOURCE_DIR "/tools/tavlo-emu";
const char kDefaultBuildProp[] = "ro.build.type=user\nro.product.model=tavlo-emu\n";

long long now_ms() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

int exit_code(int status) {
    if (WIFEXITED(status)) return WEXITSTATUS(status);
    if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
    return -1;
}

// Starts tools/tavlo-emu with args. *in_fd / *out_fd (when given) receive the
// write end of its stdin and the read end of its stdout; otherwise stdin is
// /dev/null and stdout is the test's. All descriptors are close-on-exec so
// that no other phone process keeps them open.
pid_t start_emu(const std::vector<std::string>& args, int* in_fd, int* out_fd) {
    int in_pipe[2] = {-1, -1};
    int out_pipe[2] = {-1, -1};
    if (in_fd != nullptr && pipe2(in_pipe, O_CLOEXEC) != 0) return -1;
    if (out_fd != nullptr && pipe2(out_pipe, O_CLOEXEC) != 0) {
        if (in_fd != nullptr) {
            close(in_pipe[0]);
            close(in_pipe[1]);
        }
        return -1;
    }
    // Built before fork: the child only calls async-signal-safe functions.
    std::vector<std::string> env_strings;
    bool has_build_dir = false;
    for (char** e = environ; *e != nullptr; e++) {
        if (strncmp(*e, "TAVLO_BUILD_DIR=", 16) == 0) has_build_dir = true;
        env_strings.push_back(*e);
    }
    if (!has_build_dir) env_strings.push_back(std::string("TAVLO_BUILD_DIR=") + TAVLO_BUILD_DIR);
    std::vector<char*> envp;
    for (auto& s : env_strings) envp.push_back(&s[0]);
    envp.push_back(nullptr);
    std::vector<std::string> argv_strings;
    argv_strings.push_back(kEmuTool);
    argv_strings.insert(argv_strings.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& s : argv_strings) argv.push_back(&s[0]);
    argv.push_back(nullptr);

    pid_t pid = fork();
    if (pid == 0) {
        int null_fd = open("/dev/null", O_RDONLY);
        dup2(in_fd != nullptr ? in_pipe[0] : null_fd, 0);
        if (out_fd != nullptr) dup2(out_pipe[1], 1);
        execve(kEmuTool, argv.data(), envp.data());
        _exit(127);
    }
    if (in_fd != nullptr) {
        close(in_pipe[0]);
        *in_fd = pid > 0 ? in_pipe[1] : (close(in_pipe[1]), -1);
    }
    if (out_fd != nullptr) {
        close(out_pipe[1]);
        *out_fd = pid > 0 ? out_pipe[0] : (close(out_pipe[0]), -1);
    }
    return pid;
}

int remove_entry(const char* path, const struct stat*, int, struct FTW*) {
    remove(path);
    return 0;
}

bool mkdirs(const std::string& path) {
    for (size_t pos = 1; pos <= path.size(); pos++) {
        if (pos != path.size() && path[pos] != '/') continue;
        std::string part = path.substr(0, pos);
        if (mkdir(part.c_str(), 0755) != 0 && errno != EEXIST) return false;
    }
    return true;
}

bool under(const std::string& path, const std::string& folder) {
    return path == folder || (path.compare(0, folder.size(), folder) == 0 && path[folder.size()] == '/');
}

std::string read_host_file(const std::string& path, bool* ok) {
    std::string text;
    *ok = false;
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return text;
    char buf[8192];
    for (;;) {
        ssize_t n = RETRY_EINTR(read(fd, buf, sizeof(buf)));
        if (n < 0) {
            close(fd);
            return text;
        }
        if (n == 0) break;
        text.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    *ok = true;
    return text;
}

}  // namespace

// ---------------------------------------------------------------- EmuProcess

EmuProcess::EmuProcess(pid_t pid, int stdin_fd, int stdout_fd)
    : pid_(pid), stdin_fd_(stdin_fd), stdout_fd_(stdout_fd) {}

EmuProcess::~EmuProcess() {
    kill();
    if (stdout_fd_ >= 0) close(stdout_fd_);
}

bool EmuProcess::write(const std::string& bytes) {
    if (stdin_fd_ < 0) return false;
    return write_fully(stdin_fd_, bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size());
}

void EmuProcess::close_stdin() {
    if (stdin_fd_ >= 0) close(stdin_fd_);
    stdin_fd_ = -1;
}

bool EmuProcess::read_until(const std::string& needle, int timeout_ms) {
    long long deadline = now_ms() + timeout_ms;
    while (output_.find(needle) == std::string::npos) {
        if (stdout_fd_ < 0) return false;
        long long left = deadline - now_ms();
        if (left <= 0) return false;
        struct pollfd pfd = {stdout_fd_, POLLIN, 0};
        int rc = poll(&pfd, 1, static_cast<int>(left));
        if (rc < 0 && errno == EINTR) continue;
        if (rc <= 0) return false;
        char buf[4096];
        ssize_t n = RETRY_EINTR(read(stdout_fd_, buf, sizeof(buf)));
        if (n <= 0) {
            close(stdout_fd_);
            stdout_fd_ = -1;
            return output_.find(needle) != std::string::npos;
        }
        output_.append(buf, static_cast<size_t>(n));
    }
    return true;
}

int EmuProcess::wait(int timeout_ms) {
    if (pid_ <= 0) return status_;
    long long deadline = now_ms() + timeout_ms;
    for (;;) {
        int status = 0;
        pid_t rc = waitpid(pid_, &status, WNOHANG);
        if (rc == pid_) {
            status_ = exit_code(status);
            pid_ = -1;
            return status_;
        }
        if (rc < 0 && errno != EINTR) {
            pid_ = -1;
            return status_;
        }
        if (now_ms() >= deadline) return -1;
        usleep(5000);
    }
}

void EmuProcess::kill() {
    close_stdin();
    if (pid_ > 0) {
        // The command inside dies with its nsenter (parent-death signal).
        ::kill(pid_, SIGKILL);
        int status = 0;
        if (RETRY_EINTR(waitpid(pid_, &status, 0)) == pid_) status_ = exit_code(status);
        pid_ = -1;
    }
}

// ------------------------------------------------------------------ EmuPhone

EmuPhone::EmuPhone() {
    char tmpl[] = "/tmp/tavlo-phone.XXXXXX";
    if (mkdtemp(tmpl) != nullptr) dir_ = tmpl;
}

EmuPhone::~EmuPhone() {
    if (dir_.empty()) return;
    stop();
    const char* keep = getenv("TAVLO_KEEP_IMAGES");
    if (keep != nullptr && strcmp(keep, "1") == 0) {
        fprintf(stderr, "emu_phone: image kept in %s\n", dir_.c_str());
        return;
    }
    nftw(dir_.c_str(), remove_entry, 16, FTW_DEPTH | FTW_PHYS);
}

int EmuPhone::run_emu(const std::vector<std::string>& args) {
    pid_t pid = start_emu(args, nullptr, nullptr);
    if (pid < 0) return -1;
    int status = 0;
    if (RETRY_EINTR(waitpid(pid, &status, 0)) != pid) return -1;
    return exit_code(status);
}

bool EmuPhone::write_image_file(const std::string& device_path, const std::string& content,
                                mode_t mode) {
    std::string path = host_path(device_path);
    if (path.empty()) return false;
    size_t slash = path.rfind('/');
    if (slash != std::string::npos && slash > 0 && !mkdirs(path.substr(0, slash))) return false;
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    if (fd < 0) return false;
    bool ok = write_fully(fd, content.data(), content.size()) ==
                  static_cast<ssize_t>(content.size()) &&
              fchmod(fd, mode) == 0;
    close(fd);
    return ok;
}

bool EmuPhone::boot(const BootOptions& options) {
    if (dir_.empty()) return false;
    options_ = options;
    std::string build_prop = kDefaultBuildProp;
    for (const auto& line : options.build_prop) build_prop += line + "\n";
    if (!write_image_file("/system/build.prop", build_prop)) return false;

    std::vector<std::string> args = {"boot", dir_, "--boot-mode", options.boot_mode};
    if (options.real_kmsg) args.push_back("--real-kmsg");
    if (options.sdcard_mb > 0) {
        args.push_back("--sdcard-size");
        args.push_back(std::to_string(options.sdcard_mb));
    }
    if (options.data_mb > 0) {
        args.push_back("--data-size");
        args.push_back(std::to_string(options.data_mb));
    }
    if (!options.system_log) args.push_back("--no-system-log");
    if (!options.btlog) args.push_back("--no-btlog");
    if (options.logger_kb > 0) {
        args.push_back("--logger-size");
        args.push_back(std::to_string(options.logger_kb));
    }
    if (!options.ext_sdcard.empty()) {
        args.push_back("--ext-sdcard");
        args.push_back(options.ext_sdcard);
    }
    booted_ = run_emu(args) == 0;
    return booted_;
}

bool EmuPhone::stop() {
    if (dir_.empty()) return false;
    booted_ = false;
    struct stat st;
    if (stat((dir_ + "/.emu").c_str(), &st) != 0) return true;  // never booted
    return run_emu({"stop", dir_}) == 0;
}

bool EmuPhone::reboot() {
    BootOptions options = options_;
    return stop() && boot(options);
}

bool EmuPhone::running() const { return host_init_pid() > 0; }

int EmuPhone::exec(const std::vector<std::string>& args, std::string* out, const std::string& input,
                   int timeout_ms) {
    std::vector<std::string> emu_args = {"exec", dir_};
    emu_args.insert(emu_args.end(), args.begin(), args.end());
    int in_fd = -1;
    int out_fd = -1;
    pid_t pid = start_emu(emu_args, &in_fd, &out_fd);
    if (pid < 0) return -1;
    if (out != nullptr) out->clear();
    if (input.empty()) {
        close(in_fd);
        in_fd = -1;
    } else {
        fcntl(in_fd, F_SETFL, O_NONBLOCK);
    }
    // Feed stdin and drain stdout together: either pipe can fill up.
    size_t written = 0;
    long long deadline = now_ms() + timeout_ms;
    bool timed_out = false;
    while (out_fd >= 0 || in_fd >= 0) {
        struct pollfd pfds[2];
        int n = 0;
        if (out_fd >= 0) pfds[n++] = {out_fd, POLLIN, 0};
        if (in_fd >= 0) pfds[n++] = {in_fd, POLLOUT, 0};
        long long left = deadline - now_ms();
        if (left <= 0) {
            timed_out = true;
            break;
        }
        int rc = poll(pfds, n, static_cast<int>(left));
        if (rc < 0 && errno != EINTR) break;
        for (int i = 0; i < n && rc > 0; i++) {
            if (pfds[i].revents == 0) continue;
            if (pfds[i].fd == out_fd) {
                char buf[8192];
                ssize_t got = RETRY_EINTR(read(out_fd, buf, sizeof(buf)));
                if (got <= 0) {
                    close(out_fd);
                    out_fd = -1;
                } else if (out != nullptr) {
                    out->append(buf, static_cast<size_t>(got));
                }
            } else {
                ssize_t put = RETRY_EINTR(::write(in_fd, input.data() + written, input.size() - written));
                if (put > 0) written += static_cast<size_t>(put);
                if (put < 0 && errno != EAGAIN) written = input.size();
                if (written == input.size()) {
                    close(in_fd);
                    in_fd = -1;
                }
            }
        }
    }
    if (in_fd >= 0) close(in_fd);
    if (out_fd >= 0) close(out_fd);
    if (timed_out) kill(pid, SIGKILL);
    int status = 0;
    if (RETRY_EINTR(waitpid(pid, &status, 0)) != pid) return -1;
    return timed_out ? -1 : exit_code(status);
}

std::unique_ptr<EmuProcess> EmuPhone::spawn(const std::vector<std::string>& args) {
    std::vector<std::string> emu_args = {"exec", dir_};
    emu_args.insert(emu_args.end(), args.begin(), args.end());
    int in_fd = -1;
    int out_fd = -1;
    pid_t pid = start_emu(emu_args, &in_fd, &out_fd);
    if (pid < 0) return nullptr;
    return std::unique_ptr<EmuProcess>(new EmuProcess(pid, in_fd, out_fd));
}

std::string EmuPhone::host_path(const std::string& device_path) const {
    if (dir_.empty() || device_path.empty() || device_path[0] != '/') return std::string();
    pid_t init = host_init_pid();
    std::string via_root = init > 0 ? "/proc/" + std::to_string(init) + "/root" + device_path : "";
    // Size-limited folders are tmpfs mounts that exist only inside the phone.
    if ((options_.data_mb > 0 && under(device_path, "/data")) ||
        (options_.sdcard_mb > 0 && under(device_path, "/mnt/sdcard")))
        if (!via_root.empty()) return via_root;
    static const struct {
        const char* device;
        const char* image;
    } kMap[] = {{"/data", "/data"},         {"/system", "/system"}, {"/mnt/sdcard2", "/sdcard2"},
                {"/mnt/sdcard", "/sdcard"}, {"/dev/emu", "/.emu"},
                {"/proc/last_kmsg", "/.emu/last_kmsg"}, {"/proc/last_kmsg2", "/.emu/last_kmsg2"}};
    for (const auto& m : kMap) {
        if (under(device_path, m.device))
            return dir_ + m.image + device_path.substr(strlen(m.device));
    }
    return via_root;
}

bool EmuPhone::read_file(const std::string& device_path, std::string* out) const {
    std::string path = host_path(device_path);
    bool ok = false;
    std::string text = path.empty() ? std::string() : read_host_file(path, &ok);
    if (out != nullptr) *out = text;
    return ok;
}

std::string EmuPhone::read_file(const std::string& device_path) const {
    std::string text;
    read_file(device_path, &text);
    return text;
}

bool EmuPhone::file_exists(const std::string& device_path) const {
    std::string path = host_path(device_path);
    struct stat st;
    return !path.empty() && lstat(path.c_str(), &st) == 0;
}

bool EmuPhone::write_kmsg(const std::string& bytes, int timeout_ms) { return write_feed("kmsg", bytes, timeout_ms); }

bool EmuPhone::write_btlog(const std::string& bytes, int timeout_ms) { return write_feed("btlog", bytes, timeout_ms); }

bool EmuPhone::write_feed(const char* fifo, const std::string& bytes, int timeout_ms) {
    if (!running()) return false;
    // Non-blocking: without the phone's init holding the FIFO, open fails at
    // once instead of waiting for a reader forever.
    int fd = open((dir_ + "/.emu/" + fifo).c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) return false;
    size_t done = 0;
    long long deadline = now_ms() + timeout_ms;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n > 0) {
            done += static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno != EAGAIN && errno != EINTR) break;
        if (now_ms() >= deadline) break;
        struct pollfd pfd = {fd, POLLOUT, 0};
        poll(&pfd, 1, 20);
    }
    close(fd);
    return done == bytes.size();
}

pid_t EmuPhone::daemon_pid() const {
    std::string text = read_file("/dev/emu/daemon.pid");
    int pid = atoi(text.c_str());
    return pid > 0 ? pid : -1;
}

pid_t EmuPhone::host_init_pid() const {
    if (dir_.empty()) return -1;
    bool ok = false;
    std::string text = read_host_file(dir_ + "/.emu/host.pid", &ok);
    int pid = ok ? atoi(text.c_str()) : 0;
    if (pid <= 0) return -1;
    // Still this image's phone: its /dev/emu is our .emu folder.
    struct stat mine;
    struct stat theirs;
    std::string emu = "/proc/" + std::to_string(pid) + "/root/dev/emu";
    if (stat((dir_ + "/.emu").c_str(), &mine) != 0 || stat(emu.c_str(), &theirs) != 0 ||
        mine.st_dev != theirs.st_dev || mine.st_ino != theirs.st_ino)
        return -1;
    return pid;
}

std::string EmuPhone::getprop(const std::string& name) const {
    if (name.empty() || name.find('/') != std::string::npos || name[0] == '.') return std::string();
    return read_file("/dev/emu/properties/" + name);
}

bool EmuPhone::wait_for(const std::function<bool()>& pred, int timeout_ms) {
    long long deadline = now_ms() + timeout_ms;
    for (;;) {
        if (pred()) return true;
        if (now_ms() >= deadline) return false;
        usleep(10000);
    }
}
