// An emulated phone for integration tests: a fresh image folder under /tmp,
// booted, driven and powered off with tools/tavlo-emu. Every wait polls with
// short intervals instead of sleeping a fixed time.
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

// A process running inside the phone, its stdin and stdout connected to the
// test (stderr is the test's). Ending the handle kills it.
class EmuProcess {
  public:
    EmuProcess(pid_t pid, int stdin_fd, int stdout_fd) : pid_(pid), in_(stdin_fd), out_(stdout_fd) {}
    ~EmuProcess();
    EmuProcess(const EmuProcess&) = delete;
    EmuProcess& operator=(const EmuProcess&) = delete;

    bool write(const std::string& bytes);
    void close_stdin();
    // Reads stdout until it holds needle ("": until it ends); false when
    // timeout_ms pass or it ends first. What was read is in output().
    bool read_until(const std::string& needle, int timeout_ms = 10000);
    const std::string& output() const { return output_; }
    // Exit status (128 + signal when killed), or -1 while it still runs after timeout_ms.
    int wait(int timeout_ms = 5000);
    void kill();

  private:
    pid_t pid_;  // host pid of the `tavlo-emu exec` that runs it
    int in_, out_;
    int status_ = -1;
    std::string output_;
};

class EmuPhone {
  public:
    EmuPhone();   // makes an empty image folder
    ~EmuPhone();  // powers off and removes the image (kept with TAVLO_KEEP_IMAGES=1)
    EmuPhone(const EmuPhone&) = delete;
    EmuPhone& operator=(const EmuPhone&) = delete;

    // `tavlo-emu boot` with these options ("--boot-mode 7", "--sdcard-size 2", ...):
    // true once the daemon serves, or has given up start-up.
    bool boot(const std::vector<std::string>& options = {});
    bool stop();
    bool running() const { return host_init_pid() > 0; }

    // Runs args inside the phone as root: exit status (128 + signal when
    // killed, -1 when it could not run or outlived timeout_ms).
    int exec(const std::vector<std::string>& args, std::string* out = nullptr,
             const std::string& input = std::string(), int timeout_ms = 60000);
    std::unique_ptr<EmuProcess> spawn(const std::vector<std::string>& args);

    // Where the host reaches a device path: through the running phone's root,
    // else inside the image (/data, /system, /mnt/sdcard, /mnt/sdcard2, /dev/emu).
    std::string host_path(const std::string& device_path) const;
    bool write_image_file(const std::string& device_path, const std::string& content,
                          mode_t mode = 0644);
    std::string read_file(const std::string& device_path) const;  // "" when unreadable
    bool file_exists(const std::string& device_path) const;
    // Feeds the phone's /proc/kmsg ("kmsg") or Bluetooth log service ("btlog");
    // false when the phone is off or the feed stays full for timeout_ms.
    bool feed(const char* fifo, const std::string& bytes, int timeout_ms = 5000);

    pid_t daemon_pid() const;     // inside the phone; -1 when none runs
    pid_t host_init_pid() const;  // -1 when the phone is off
    std::string getprop(const std::string& name) const { return read_file("/dev/emu/properties/" + name); }
    const std::string& image_dir() const { return dir_; }

    // Polls pred every few milliseconds until it holds (true) or timeout_ms pass.
    static bool wait_for(const std::function<bool()>& pred, int timeout_ms = 10000);

  private:
    std::string dir_;
    std::vector<std::string> options_;
};
