// Helpers shared by the unit tests, which run in a throwaway phone: its device paths are safe to write.
#pragma once

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <semaphore.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cutils/ashmem.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <string>
#include <vector>

#include "collectors/control_block.h"
#include "platform/properties.h"
#include "record/record.h"
#include "storage/history_log.h"

// The code under test records into the history, as the daemon's start-up sets it up.
[[maybe_unused]] static const bool history_sink_installed = (record_set_history_sink(history_vlog), true);

constexpr char kHistory[] = "/data/misc/tqlog/tqlog_history";

inline bool exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// For fixtures that wipe /data: never on the host, only in a throwaway phone.
#define SKIP_OUTSIDE_PHONE() \
    if (!exists("/dev/emu/properties")) GTEST_SKIP() << "runs only inside the emulated phone"

// The whole file, or "" when it cannot be opened.
inline std::string read_file(const std::string& path) {
    std::string out;
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    char buf[65536];
    for (ssize_t n; fd >= 0 && (n = read(fd, buf, sizeof(buf))) > 0;) out.append(buf, static_cast<size_t>(n));
    if (fd >= 0) close(fd);
    return out;
}

inline void write_file(const std::string& path, const std::string& content, mode_t mode = 0600) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
    ASSERT_GE(fd, 0) << path;
    ASSERT_EQ(write(fd, content.data(), content.size()), static_cast<ssize_t>(content.size())) << path;
    close(fd);
}

inline std::vector<std::string> lines_of(const std::string& path) {
    std::vector<std::string> out;
    std::string all = read_file(path);
    for (size_t start = 0, end; start < all.size(); start = end + 1) {
        end = std::min(all.find('\n', start), all.size());
        out.push_back(all.substr(start, end - start));
    }
    return out;
}

inline size_t count_of(const std::string& text, const std::string& what) {
    size_t count = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) count++;
    return count;
}

inline bool history_has(const std::string& text) { return read_file(kHistory).find(text) != std::string::npos; }

// Messages of the central history, without their 20-character timestamps.
inline std::vector<std::string> history_messages() {
    std::vector<std::string> out;
    for (const std::string& line : lines_of(kHistory)) out.push_back(line.size() >= 20 ? line.substr(20) : "<short>" + line);
    return out;
}

inline bool has_record(const std::string& message) {
    std::vector<std::string> all = history_messages();
    return std::find(all.begin(), all.end(), message) != all.end();
}

// Polls cond every 10 ms for at most ms milliseconds.
inline bool wait_for(const std::function<bool()>& cond, int ms) {
    for (int waited = 0; !cond(); waited += 10) {
        if (waited >= ms) return false;
        usleep(10000);
    }
    return true;
}

inline std::string property(const char* key, const char* def = "") {
    char value[PROPERTY_VALUE_MAX];
    property_get(key, value, def);
    return value;
}

inline std::vector<std::string> files_in(const std::string& dir) {
    std::vector<std::string> out;
    DIR* d = opendir(dir.c_str());
    while (dirent* e = d ? (errno = 0, readdir(d)) : nullptr)
        if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) out.push_back(e->d_name);
    if (d && errno != 0) ADD_FAILURE() << "listing " << dir << " failed: " << strerror(errno);
    if (d) closedir(d);
    std::sort(out.begin(), out.end());
    return out;
}

inline mode_t mode_of(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0;
}

inline ino_t inode_of(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

// Runs a shell command line; returns its exit status and its output.
inline int run_shell(const std::string& command, std::string* out, bool with_stderr = true) {
    FILE* pipe = popen((command + (with_stderr ? " 2>&1" : " 2>/dev/null")).c_str(), "r");
    char buf[512];
    for (out->clear(); pipe && fgets(buf, sizeof(buf), pipe);) *out += buf;
    int status = pipe ? pclose(pipe) : -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Wait status of child pid within ms milliseconds, or -1 after killing it.
inline int wait_exit(pid_t pid, int ms = 5000) {
    int status = -1;
    if (wait_for([&] { return waitpid(pid, &status, WNOHANG) == pid; }, ms)) return status;
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    return -1;
}

// True when child pid ends with exit status code within ms milliseconds.
inline bool exits_with(pid_t pid, int code, int ms = 5000) {
    int status = wait_exit(pid, ms);
    return status != -1 && WIFEXITED(status) && WEXITSTATUS(status) == code;
}

// A run's control block with its semaphore, made as the controller makes them.
struct RunBlock {
    int fd = ashmem_create_region(CONTROL_BLOCK_NAME, CONTROL_BLOCK_SIZE);
    ControlBlock* block = static_cast<ControlBlock*>(
        fd < 0 ? MAP_FAILED : mmap(nullptr, CONTROL_BLOCK_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0));
    sem_t* sem = block == MAP_FAILED ? nullptr : control_sem(block);

    bool ok() const { return fd >= 0 && block != MAP_FAILED; }
    // A fresh run's block: all clear, no reasons, the semaphore free.
    void reset() { ASSERT_EQ(control_block_init(block), 0); }
    ~RunBlock() {
        if (block != MAP_FAILED) munmap(block, CONTROL_BLOCK_SIZE);
        if (fd >= 0) close(fd);
    }
};

// The phone's logger devices at /dev/log, started anew with emu_logger's options; true once they serve.
inline bool start_logger_devices(const std::string& options = "") {
    std::string out;
    run_shell("umount -l /dev/log 2>/dev/null; mkdir -p /dev/log", &out);
    return run_shell("emu_logger " + options + " /dev/log", &out) == 0;
}
