// An emulated phone for integration tests: a fresh device image in a temporary
// folder, booted with tools/tavlo-emu, driven from the host. Every helper polls
// with short intervals instead of sleeping a fixed time.
//
//   EmuPhone phone;
//   phone.write_image_file("/system/etc/qrvlog-config.prop", "qrvlog_path=/data\n");
//   ASSERT_TRUE(phone.boot());
//   std::string out;
//   EXPECT_EQ(0, phone.exec({"getprop", "debug.TQ.running"}, &out));
#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

struct BootOptions {
    std::string boot_mode = "0";          // content of the boot-mode file; "none": no file
    int sdcard_mb = 0;                    // > 0: /mnt/sdcard is a tmpfs of that size
    int data_mb = 0;                      // > 0: /data is a tmpfs of that size (not kept at stop)
    bool real_kmsg = false;               // the host kernel's /proc/kmsg instead of the FIFO
    std::string ext_sdcard;               // steps of the kelm boot's storage tool ("after 3 link")
    std::vector<std::string> build_prop;  // lines added to /system/build.prop (later ones win)
    bool system_log = true;               // false: no /dev/log/system
    bool btlog = true;                    // false: no Bluetooth log service at boot
    int logger_kb = 0;                    // > 0: size of each logger buffer
};

// A process running inside the phone, with its stdin and stdout connected to
// the test; stderr goes to the test's stderr. Ending the handle kills it.
class EmuProcess {
  public:
    EmuProcess(pid_t pid, int stdin_fd, int stdout_fd);
    ~EmuProcess();
    EmuProcess(const EmuProcess&) = delete;
    EmuProcess& operator=(const EmuProcess&) = delete;

    bool write(const std::string& bytes);
    void close_stdin();
    // Reads stdout until it holds needle (true) or timeout_ms pass or it ends
    // (false). Everything read so far is in output().
    bool read_until(const std::string& needle, int timeout_ms = 5000);
    const std::string& output() const { return output_; }
    // Exit status (128 + signal when killed), or -1 when it still runs after timeout_ms.
    int wait(int timeout_ms = 5000);
    void kill();

  private:
    pid_t pid_;  // host pid of the tavlo-emu exec that runs it
    int stdin_fd_;
    int stdout_fd_;
    int status_ = -1;
    std::string output_;
};

class EmuPhone {
  public:
    EmuPhone();   // makes an empty image folder under /tmp
    ~EmuPhone();  // stops the phone and removes the image (kept with TAVLO_KEEP_IMAGES=1)
    EmuPhone(const EmuPhone&) = delete;
    EmuPhone& operator=(const EmuPhone&) = delete;

    const std::string& image_dir() const { return dir_; }

    // Writes a file at a device path (/data/..., /system/..., /mnt/sdcard/...),
    // creating its folders; before boot this seeds the image.
    bool write_image_file(const std::string& device_path, const std::string& content,
                          mode_t mode = 0644);

    // Boots and returns once the daemon is ready; false when it was not (the
    // reason is on stderr, the phone's logs in image_dir()/.emu/).
    bool boot(const BootOptions& options = BootOptions());
    bool stop();
    bool reboot();  // stop, then boot with the same options
    bool running() const;

    // Runs args inside the phone as root and returns its exit status (128 +
    // signal when killed, -1 when it could not run or outlived timeout_ms).
    int exec(const std::vector<std::string>& args, std::string* out = nullptr,
             const std::string& input = std::string(), int timeout_ms = 60000);
    // Starts args inside the phone and returns at once.
    std::unique_ptr<EmuProcess> spawn(const std::vector<std::string>& args);

    // The host path where a device path can be read and written: inside the
    // image, or through the phone's root for tmpfs folders and the rest of its
    // file tree. Empty when there is none.
    std::string host_path(const std::string& device_path) const;
    bool read_file(const std::string& device_path, std::string* out) const;
    std::string read_file(const std::string& device_path) const;  // "" when unreadable
    bool file_exists(const std::string& device_path) const;

    // Feeds bytes to the phone's /proc/kmsg; false when not booted or the
    // FIFO stays full for timeout_ms.
    bool write_kmsg(const std::string& bytes, int timeout_ms = 5000);
    // Feeds bytes to the Bluetooth log service (they wait while it is down).
    bool write_btlog(const std::string& bytes, int timeout_ms = 5000);

    pid_t daemon_pid() const;     // inside the phone; -1 when none runs
    pid_t host_init_pid() const;  // host pid of the phone's init; -1 when off
    // The property's value as property_get sees it (empty when unset).
    std::string getprop(const std::string& name) const;

    // Polls pred every few milliseconds until it holds (true) or timeout_ms pass.
    static bool wait_for(const std::function<bool()>& pred, int timeout_ms = 10000);

  private:
    int run_emu(const std::vector<std::string>& args);
    bool write_feed(const char* fifo, const std::string& bytes, int timeout_ms);

    std::string dir_;
    BootOptions options_;
    bool booted_ = false;
};
