// The emulated phone itself: boot, isolation, power-off, reboot, the
// kernel-log FIFO and the file-system rights the daemon's identity gets.
#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sched.h>
#include <signal.h>
#include <stddef.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"

namespace {

// The daemon's identity after start-up.
std::vector<std::string> as_daemon(std::vector<std::string> command) {
    std::vector<std::string> args = {"setpriv", "--reuid", "2000", "--regid", "1000", "--groups",
                                     "1000,1001,1007,1015,9998,2001,1028,1023", "--"};
    args.insert(args.end(), command.begin(), command.end());
    return args;
}

std::string read_link(const std::string& path) {
    char buf[PATH_MAX];
    ssize_t n = readlink(path.c_str(), buf, sizeof(buf) - 1);
    return n > 0 ? std::string(buf, n) : std::string();
}

// Every host process whose pid namespace is ns_link.
int processes_in_pid_namespace(const std::string& ns_link) {
    int count = 0;
    DIR* proc = opendir("/proc");
    while (struct dirent* entry = proc ? readdir(proc) : nullptr)
        if (entry->d_name[0] >= '0' && entry->d_name[0] <= '9' &&
            read_link(std::string("/proc/") + entry->d_name + "/ns/pid") == ns_link)
            count++;
    if (proc) closedir(proc);
    return count;
}

// A listening abstract socket made in the phone's network namespace; -1 on failure.
int listen_in_phone(pid_t phone_init, const std::string& name) {
    int home = open("/proc/self/ns/net", O_RDONLY | O_CLOEXEC);
    std::string phone_ns = "/proc/" + std::to_string(phone_init) + "/ns/net";
    int phone = open(phone_ns.c_str(), O_RDONLY | O_CLOEXEC);
    int s = -1;
    if (home >= 0 && phone >= 0 && setns(phone, CLONE_NEWNET) == 0) {
        s = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr = {};
        addr.sun_family = AF_UNIX;
        memcpy(addr.sun_path + 1, name.data(), name.size());
        size_t len = offsetof(struct sockaddr_un, sun_path) + 1 + name.size();
        if (s >= 0 && (bind(s, reinterpret_cast<sockaddr*>(&addr), static_cast<socklen_t>(len)) ||
                       listen(s, 1))) {
            close(s);
            s = -1;
        }
        if (setns(home, CLONE_NEWNET) != 0) abort();
    }
    if (home >= 0) close(home);
    if (phone >= 0) close(phone);
    return s;
}

TEST(EmulatorTest, BootRunsTheDaemonAndTheTools) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    EXPECT_TRUE(phone.running());
    ASSERT_GT(phone.daemon_pid(), 0);

    std::string out;
    EXPECT_EQ(0, phone.exec({"getprop", "ro.build.type"}, &out));
    EXPECT_EQ("user\n", out);
    EXPECT_EQ(0, phone.exec({"getprop", "no.such.prop", "fallback"}, &out));
    EXPECT_EQ("fallback\n", out);
    EXPECT_EQ(0, phone.exec({"setprop", "debug.emu.answer", "42"}));
    EXPECT_EQ("42", phone.getprop("debug.emu.answer"));
    EXPECT_NE(0, phone.exec({"setprop", "ro.build.type", "eng"}));
    EXPECT_EQ("user", phone.getprop("ro.build.type"));
    EXPECT_EQ(7, phone.exec({"sh", "-c", "exit 7"}));
}

TEST(EmulatorTest, TwoPhonesDoNotSeeEachOther) {
    EmuPhone a;
    EmuPhone b;
    ASSERT_TRUE(a.boot());
    ASSERT_TRUE(b.boot());
    EXPECT_NE(a.host_init_pid(), b.host_init_pid());

    ASSERT_EQ(0, a.exec({"setprop", "debug.emu.only_a", "yes"}));
    std::string out;
    EXPECT_EQ(0, b.exec({"getprop", "debug.emu.only_a"}, &out));
    EXPECT_EQ("\n", out);

    int listener = listen_in_phone(a.host_init_pid(), "emu_isolation_probe");
    ASSERT_GE(listener, 0);
    EXPECT_EQ(0, a.exec({"cat", "/proc/net/unix"}, &out));
    EXPECT_NE(std::string::npos, out.find("@emu_isolation_probe")) << out;
    EXPECT_EQ(0, b.exec({"cat", "/proc/net/unix"}, &out));
    EXPECT_EQ(std::string::npos, out.find("@emu_isolation_probe")) << out;
    close(listener);
}

TEST(EmulatorTest, StopLeavesNothingRunning) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    pid_t init = phone.host_init_pid();
    ASSERT_GT(init, 0);
    std::string ns = read_link("/proc/" + std::to_string(init) + "/ns/pid");
    ASSERT_FALSE(ns.empty());
    // A reader blocked on a logger device must not hold the power-off up.
    auto sleeper = phone.spawn({"cat", "/dev/log/main"});
    ASSERT_TRUE(sleeper);
    ASSERT_TRUE(EmuPhone::wait_for([&] { return processes_in_pid_namespace(ns) >= 3; }, 5000));

    ASSERT_TRUE(phone.stop());
    EXPECT_FALSE(phone.running());
    EXPECT_NE(0, kill(init, 0));
    EXPECT_EQ(0, processes_in_pid_namespace(ns));
    EXPECT_NE(-1, sleeper->wait(5000));
    std::stringstream mounts;
    mounts << std::ifstream("/proc/self/mountinfo").rdbuf();
    EXPECT_EQ(std::string::npos, mounts.str().find(phone.image_dir()));
    EXPECT_NE(0, phone.exec({"true"}));
}

// The defaults are what every other phone boots with.
TEST(EmulatorTest, BootOptionsShapeTheLoggerDevicesAndBluetoothService) {
    EmuPhone phone;
    BootOptions options;
    options.system_log = false;
    options.btlog = false;
    options.logger_kb = 4;
    ASSERT_TRUE(phone.boot(options));
    std::string out;
    EXPECT_NE(0, phone.exec({"test", "-e", "/dev/log/system"}));
    EXPECT_EQ(0, phone.exec({"cat", "/proc/net/unix"}, &out));
    EXPECT_EQ(std::string::npos, out.find("@btlog"));
    // Of two 3016-byte entries a 4 KB buffer keeps one; dd ends with EAGAIN.
    std::string text(2990, 'x');
    ASSERT_EQ(0, phone.exec({"sh", "-c", "log " + text + " && log " + text}));
    phone.exec({"sh", "-c", "dd if=/dev/log/main of=/dev/null bs=5120 iflag=nonblock 2>&1"}, &out);
    EXPECT_NE(std::string::npos, out.find("3016 bytes")) << out;
}

TEST(EmulatorTest, RebootKeepsPersistentPropertiesAndData) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_EQ(0, phone.exec({"setprop", "persist.emu.kept", "still here"}));
    ASSERT_EQ(0, phone.exec({"setprop", "debug.emu.dropped", "gone"}));
    ASSERT_EQ(0, phone.exec({"sh", "-c", "echo data > /data/emu_file"}));

    ASSERT_TRUE(phone.reboot());
    EXPECT_EQ("still here", phone.getprop("persist.emu.kept"));
    EXPECT_EQ("", phone.getprop("debug.emu.dropped"));
    EXPECT_EQ("user", phone.getprop("ro.build.type"));
    EXPECT_EQ("data\n", phone.read_file("/data/emu_file"));
    EXPECT_GT(phone.daemon_pid(), 0);
}

TEST(EmulatorTest, KmsgCarriesHostBytesAndNeverEnds) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::string out;
    EXPECT_EQ(0, phone.exec({"stat", "-c", "%F %a %u %g", "/proc/kmsg"}, &out));
    EXPECT_EQ("fifo 440 0 1007\n", out);

    ASSERT_TRUE(phone.write_kmsg("<6>[    1.000000] first line\n"));
    EXPECT_EQ(0, phone.exec(as_daemon({"head", "-c", "29", "/proc/kmsg"}), &out));
    EXPECT_EQ("<6>[    1.000000] first line\n", out);

    // More than a pipe holds goes in without a reader, unchanged.
    std::string burst;
    for (int i = 0; burst.size() < 200000; i++) burst += "<6>line " + std::to_string(i) + "\n";
    ASSERT_TRUE(phone.write_kmsg(burst));
    EXPECT_EQ(0, phone.exec({"head", "-c", std::to_string(burst.size()), "/proc/kmsg"}, &out));
    EXPECT_TRUE(out == burst) << "read " << out.size() << " of " << burst.size() << " bytes";

    // With nothing written, a reader waits instead of seeing end of file.
    EXPECT_EQ(124, phone.exec({"timeout", "0.5", "cat", "/proc/kmsg"}, &out));
    EXPECT_EQ("", out);
}

TEST(EmulatorTest, DaemonIsRestartedAfterItEnds) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    pid_t first = phone.daemon_pid();
    ASSERT_GT(first, 0);
    ASSERT_EQ(0, phone.exec({"kill", "-9", std::to_string(first)}));
    auto restarted = [&] { return phone.daemon_pid() > 0 && phone.daemon_pid() != first; };
    ASSERT_TRUE(EmuPhone::wait_for(restarted, 10000));
    std::string log = phone.read_file("/dev/emu/init.log");
    EXPECT_NE(std::string::npos,
              log.find("exit tavlo_log_d pid " + std::to_string(first) + ": killed by signal 9"))
        << log;
    EXPECT_EQ(0, phone.exec({"kill", "-0", std::to_string(phone.daemon_pid())}));
}

TEST(EmulatorTest, DaemonIdentityWritesWhereItMustAndNowhereElse) {
    struct Case { const char* what; const char* command; bool allowed; };
    const Case cases[] = {
        {"data", "mkdir /data/log_temp", true},
        {"data/misc", "mkdir /data/misc/probe", true},
        {"sdcard", "mkdir -p /mnt/sdcard/qrvlog/tavlolog", true},
        {"sdcard2", "touch /mnt/sdcard2/probe", true},
        {"platform log", "echo line >> /dev/emu/wlog", true},
        {"oru", "oru -m 3 && grep -qx -- '-m 3' /dev/emu/oru_calls", true},
        {"debug property", "setprop debug.TQ.running 1 && [ $(getprop debug.TQ.running) = 1 ]",
         true},
        {"property root set", "setprop debug.emu.by_root daemon", true},
        {"persist property", "setprop persist.emu.by_daemon 1", false},
        {"stored properties", "ls /data/property", false},
        {"system", "touch /system/etc/probe", false},
        {"boot mode", "echo 1 > /sys/class/BOOT/BOOT/boot/boot_mode", false},
    };
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_EQ(0, phone.exec({"setprop", "debug.emu.by_root", "root"}));
    for (const Case& c : cases) {
        int rc = phone.exec(as_daemon({"sh", "-c", c.command}));
        if (c.allowed)
            EXPECT_EQ(0, rc) << c.what;
        else
            EXPECT_NE(0, rc) << c.what;
    }
}

}  // namespace
