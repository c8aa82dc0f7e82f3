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

namespace {

const char kEmuTool[] = TAVLO_SOURCE_DIR "/tools/tavlo-emu";

long long now_ms() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

int exit_code(int status) {
    if (WIFEXITED(status)) return WEXITSTATUS(status);
    return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : -1;
}

// Starts tools/tavlo-emu with args. With in_fd and out_fd, its stdin and stdout
// are pipes to the test; else stdin is /dev/null and stdout the test's. The
// pipes are close-on-exec so that no other process of the phone holds them.
pid_t start_emu(const std::vector<std::string>& args, int* in_fd = nullptr, int* out_fd = nullptr) {
    int in[2] = {-1, -1}, out[2] = {-1, -1};
    if (in_fd != nullptr && (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0)) return -1;
    std::vector<std::string> strings = {kEmuTool};
    strings.insert(strings.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& s : strings) argv.push_back(&s[0]);
    argv.push_back(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        dup2(in_fd != nullptr ? in[0] : open("/dev/null", O_RDONLY), 0);
        if (out_fd != nullptr) dup2(out[1], 1);
        execv(kEmuTool, argv.data());
        _exit(127);
    }
    if (in_fd != nullptr) {
        close(in[0]);
        close(out[1]);
        *in_fd = in[1];
        *out_fd = out[0];
    }
    return pid;
}

int run_emu(const std::vector<std::string>& args) {
    int status = 0;
    pid_t pid = start_emu(args);
    return pid > 0 && TEMP_FAILURE_RETRY(waitpid(pid, &status, 0)) == pid ? exit_code(status) : -1;
}

bool under(const std::string& path, const std::string& folder) {
    return path.compare(0, folder.size(), folder) == 0 && (path.size() == folder.size() || path[folder.size()] == '/');
}

int remove_entry(const char* path, const struct stat*, int, struct FTW*) { return remove(path), 0; }

}  // namespace

EmuProcess::~EmuProcess() {
    kill();
    if (out_ >= 0) close(out_);
}

bool EmuProcess::write(const std::string& bytes) {
    return in_ >= 0 && write_fully(in_, bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size());
}

void EmuProcess::close_stdin() {
    if (in_ >= 0) close(in_);
    in_ = -1;
}

bool EmuProcess::read_until(const std::string& needle, int timeout_ms) {
    long long deadline = now_ms() + timeout_ms;
    while (needle.empty() || output_.find(needle) == std::string::npos) {
        struct pollfd pfd = {out_, POLLIN, 0};
        long long left = deadline - now_ms();
        if (out_ < 0 || left <= 0) return false;
        int rc = poll(&pfd, 1, static_cast<int>(left));
        if (rc < 0 && errno == EINTR) continue;
        if (rc <= 0) return false;
        char buf[8192];
        ssize_t n = TEMP_FAILURE_RETRY(read(out_, buf, sizeof(buf)));
        if (n <= 0) {
            close(out_);
            out_ = -1;
            return needle.empty() || output_.find(needle) != std::string::npos;
        }
        output_.append(buf, static_cast<size_t>(n));
    }
    return true;
}

int EmuProcess::wait(int timeout_ms) {
    long long deadline = now_ms() + timeout_ms;
    while (pid_ > 0) {
        int status = 0;
        pid_t rc = waitpid(pid_, &status, WNOHANG);
        if (rc == pid_) status_ = exit_code(status);
        if (rc == pid_ || (rc < 0 && errno != EINTR)) pid_ = -1;
        if (pid_ > 0 && now_ms() >= deadline) return -1;
        if (pid_ > 0) usleep(5000);
    }
    return status_;
}

void EmuProcess::kill() {
    close_stdin();
    // The command inside dies with its nsenter (parent-death signal).
    if (pid_ > 0) ::kill(pid_, SIGKILL);
    wait(60000);
}

EmuPhone::EmuPhone() {
    char tmpl[] = "/tmp/tavlo-phone.XXXXXX";
    if (mkdtemp(tmpl) != nullptr) dir_ = tmpl;
    setenv("TAVLO_BUILD_DIR", TAVLO_BUILD_DIR, 0);
    // A command that ends without reading its input must not end the test.
    signal(SIGPIPE, SIG_IGN);
}

EmuPhone::~EmuPhone() {
    if (dir_.empty()) return;
    stop();
    const char* keep = getenv("TAVLO_KEEP_IMAGES");
    if (keep != nullptr && strcmp(keep, "1") == 0)
        fprintf(stderr, "emu_phone: image kept in %s\n", dir_.c_str());
    else
        nftw(dir_.c_str(), remove_entry, 16, FTW_DEPTH | FTW_PHYS);
}

bool EmuPhone::boot(const std::vector<std::string>& options) {
    options_ = options;
    std::vector<std::string> args = {"boot", dir_};
    args.insert(args.end(), options.begin(), options.end());
    return !dir_.empty() && run_emu(args) == 0;
}

bool EmuPhone::stop() {
    struct stat st;
    return stat((dir_ + "/.emu").c_str(), &st) != 0 || run_emu({"stop", dir_}) == 0;
}

int EmuPhone::exec(const std::vector<std::string>& args, std::string* out, const std::string& input,
                   int timeout_ms) {
    std::unique_ptr<EmuProcess> p = spawn(args);
    if (!p) return -1;
    // Inputs are small: they fit in the pipe while the command starts.
    p->write(input);
    p->close_stdin();
    bool ended = p->read_until("", timeout_ms);
    if (out != nullptr) *out = p->output();
    return ended ? p->wait(timeout_ms) : -1;
}

std::unique_ptr<EmuProcess> EmuPhone::spawn(const std::vector<std::string>& args) {
    std::vector<std::string> emu_args = {"exec", dir_};
    emu_args.insert(emu_args.end(), args.begin(), args.end());
    int in_fd = -1, out_fd = -1;
    pid_t pid = start_emu(emu_args, &in_fd, &out_fd);
    if (pid > 0) return std::unique_ptr<EmuProcess>(new EmuProcess(pid, in_fd, out_fd));
    if (in_fd >= 0) close(in_fd), close(out_fd);
    return nullptr;
}

std::string EmuPhone::host_path(const std::string& device_path) const {
    if (device_path.empty() || device_path[0] != '/') return std::string();
    pid_t init = host_init_pid();
    if (init > 0) return "/proc/" + std::to_string(init) + "/root" + device_path;
    static const char* const kMap[][2] = {{"/data", "/data"},         {"/system", "/system"},
                                          {"/mnt/sdcard2", "/sdcard2"}, {"/mnt/sdcard", "/sdcard"},
                                          {"/dev/emu", "/.emu"}};
    for (const auto& m : kMap)
        if (under(device_path, m[0])) return dir_ + m[1] + device_path.substr(strlen(m[0]));
    return std::string();
}

bool EmuPhone::write_image_file(const std::string& device_path, const std::string& content, mode_t mode) {
    std::string path = host_path(device_path);
    for (size_t at = path.find('/', 1); at != std::string::npos; at = path.find('/', at + 1))
        mkdir(path.substr(0, at).c_str(), 0755);
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    if (fd < 0) return false;
    bool ok = write_fully(fd, content.data(), content.size()) == static_cast<ssize_t>(content.size()) &&
              fchmod(fd, mode) == 0;
    close(fd);
    return ok;
}

std::string EmuPhone::read_file(const std::string& device_path) const {
    std::string text;
    int fd = open(host_path(device_path).c_str(), O_RDONLY | O_CLOEXEC);
    char buf[8192];
    for (ssize_t n; fd >= 0 && (n = TEMP_FAILURE_RETRY(read(fd, buf, sizeof(buf)))) > 0;) text.append(buf, static_cast<size_t>(n));
    if (fd >= 0) close(fd);
    return text;
}

bool EmuPhone::file_exists(const std::string& device_path) const {
    struct stat st;
    return lstat(host_path(device_path).c_str(), &st) == 0;
}

bool EmuPhone::feed(const char* fifo, const std::string& bytes, int timeout_ms) {
    // Non-blocking: without the phone's init holding the FIFO, open fails at
    // once instead of waiting for a reader.
    int fd = running() ? open((dir_ + "/.emu/" + fifo).c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC) : -1;
    size_t done = 0;
    long long deadline = now_ms() + timeout_ms;
    while (fd >= 0 && done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n > 0) done += static_cast<size_t>(n);
        if ((n < 0 && errno != EAGAIN && errno != EINTR) || now_ms() >= deadline) break;
        struct pollfd pfd = {fd, POLLOUT, 0};
        if (n <= 0) poll(&pfd, 1, 20);
    }
    if (fd >= 0) close(fd);
    return done == bytes.size();
}

pid_t EmuPhone::daemon_pid() const {
    int pid = atoi(read_file("/dev/emu/daemon.pid").c_str());
    return pid > 0 ? pid : -1;
}

pid_t EmuPhone::host_init_pid() const {
    // tavlo-emu removes the file at power-off; a phone that died keeps it, its pid gone.
    FILE* f = fopen((dir_ + "/.emu/host.pid").c_str(), "re");
    int pid = 0;
    if (f != nullptr && fscanf(f, "%d", &pid) != 1) pid = 0;
    if (f != nullptr) fclose(f);
    return pid > 0 && kill(pid, 0) == 0 ? pid : -1;
}

bool EmuPhone::wait_for(const std::function<bool()>& pred, int timeout_ms) {
    for (long long deadline = now_ms() + timeout_ms; !pred(); usleep(10000))
        if (now_ms() >= deadline) return false;
    return true;
}
