// The emulated phone itself: its tools, boot options and isolation, restart,
// reboot and power-off, the kernel log and the rights of the daemon's identity.
#include <dirent.h>
#include <limits.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <fstream>
#include <sstream>

#include "tests/integration/log_daemon.h"

namespace {

// The daemon's identity after start-up, which keeps CAP_SYSLOG for the kernel log.
std::vector<std::string> as_daemon(const std::string& command) {
    return {"setpriv", "--reuid", "2000", "--regid", "1000", "--groups", "1000,1001,1007,1015,9998,2001,1028,1023",
            "--inh-caps", "+syslog", "--ambient-caps", "+syslog", "--", "sh", "-c", command};
}

std::string read_link(const std::string& path) {
    char buf[PATH_MAX];
    ssize_t n = readlink(path.c_str(), buf, sizeof(buf) - 1);
    return n > 0 ? std::string(buf, static_cast<size_t>(n)) : std::string();
}

int processes_in_pid_namespace(const std::string& ns_link) {
    int n = 0;
    DIR* proc = opendir("/proc");
    while (struct dirent* entry = proc ? readdir(proc) : nullptr)
        n += entry->d_name[0] >= '0' && entry->d_name[0] <= '9' && read_link(std::string("/proc/") + entry->d_name + "/ns/pid") == ns_link;
    if (proc) closedir(proc);
    return n;
}

// The nanoseconds of the oldest entry of /dev/log/main (-1 when none).
long first_entry_nsec(EmuPhone& phone) {
    std::string out;
    phone.exec({"sh", "-c", "dd if=/dev/log/main bs=5120 count=1 iflag=nonblock 2>/dev/null | od -An -tu4 -j16 -N4"}, &out);
    return out.empty() ? -1 : atol(out.c_str());
}

// The phone with the default options has the system log and the Bluetooth
// service, and stamps log entries to the phone kernel's 10-ms tick; the other
// has neither service, stamps to the nanosecond, and does not see the first
// one's socket.
TEST(Emulator, TwoPhonesRunTheirToolsWithTheirOwnOptionsAndDoNotSeeEachOther) {
    EmuPhone a, b;
    ASSERT_TRUE(a.boot());
    ASSERT_TRUE(b.boot({"--no-system-log", "--no-btlog", "--logger-size", "4", "--logger-fine-clock"}));
    EXPECT_NE(a.host_init_pid(), b.host_init_pid());
    std::string out;
    EXPECT_EQ(7, a.exec({"sh", "-c", "getprop ro.build.type; getprop no.such.prop fallback; setprop debug.emu.a 42; "
                                     "getprop debug.emu.a; setprop ro.build.type eng || getprop ro.build.type; "
                                     "test -e /dev/log/system && grep -c @btlog /proc/net/unix; exit 7"}, &out));
    EXPECT_EQ("user\nfallback\n42\nuser\n1\n", out);
    EXPECT_EQ(0, b.exec({"sh", "-c", "getprop debug.emu.a; test -e /dev/log/system || grep -c @btlog /proc/net/unix; true"}, &out));
    EXPECT_EQ("\n0\n", out);
    // Of two 3016-byte entries a 4 KB buffer keeps one; dd ends with EAGAIN.
    b.exec({"sh", "-c", "t=$(printf %2990s | tr ' ' x); log $t && log $t && "
                        "dd if=/dev/log/main of=/dev/null bs=5120 iflag=nonblock 2>&1"}, &out);
    EXPECT_TRUE(contains(out, "3016 bytes")) << out;
    ASSERT_EQ(0, a.exec({"log", "tick"}));
    EXPECT_EQ(0, first_entry_nsec(a) % 10000000);
    EXPECT_GT(first_entry_nsec(b) % 10000000, 0);
}

TEST(Emulator, DaemonRestartsRebootKeepsPersistentStateAndPowerOffLeavesNothing) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    pid_t first = phone.daemon_pid();
    ASSERT_EQ(0, phone.exec({"sh", "-c", "setprop persist.emu.kept 'still here' && setprop debug.emu.dropped gone && "
                                         "echo data > /data/emu_file && kill -9 " + std::to_string(first)}));
    // One read: the pid file of the killed daemon may vanish between two.
    ASSERT_TRUE(EmuPhone::wait_for([&] {
        pid_t now = phone.daemon_pid();
        return now > 0 && now != first;
    }));
    EXPECT_TRUE(contains(phone.read_file("/dev/emu/init.log"), "exit tavlo_log_d pid " + std::to_string(first) + ": killed by signal 9"));

    ASSERT_TRUE(phone.stop() && phone.boot());
    EXPECT_EQ("still here", phone.getprop("persist.emu.kept"));
    EXPECT_EQ("", phone.getprop("debug.emu.dropped"));
    EXPECT_EQ("data\n", phone.read_file("/data/emu_file"));

    pid_t init = phone.host_init_pid();
    std::string ns = read_link("/proc/" + std::to_string(init) + "/ns/pid");
    ASSERT_FALSE(ns.empty());
    // A reader blocked on a logger device must not hold the power-off up.
    auto sleeper = phone.spawn({"cat", "/dev/log/main"});
    ASSERT_TRUE(EmuPhone::wait_for([&] { return processes_in_pid_namespace(ns) >= 3; }));
    ASSERT_TRUE(phone.stop());
    EXPECT_FALSE(phone.running());
    EXPECT_NE(0, kill(init, 0));
    // Killed with the phone's init, its processes are gone once reaped.
    EXPECT_NE(-1, sleeper->wait());
    EXPECT_TRUE(EmuPhone::wait_for([&] { return processes_in_pid_namespace(ns) == 0; }));
    std::stringstream mounts;
    mounts << std::ifstream("/proc/self/mountinfo").rdbuf();
    EXPECT_FALSE(contains(mounts.str(), phone.image_dir()));
    EXPECT_NE(0, phone.exec({"true"}));
}

TEST(Emulator, KmsgHandsOutWholeLinesAndTheDaemonsIdentityReachesOnlyWhatItMust) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::string out;
    EXPECT_EQ(0, phone.exec({"stat", "-c", "%F %a %u %g", "/proc/kmsg"}, &out));
    EXPECT_EQ("regular empty file 440 0 1000\n", out);
    // Reads of 255 bytes, as the kernel collector's, each by a reader of its
    // own: whole lines while they fit, a longer line in pieces, and what one
    // reader took no other sees.
    const std::string a = "<6>" + std::string(96, 'a') + "\n";
    ASSERT_TRUE(phone.feed("kmsg", a + a + a + "<6>" + std::string(296, 'b') + "\n<6>end of lines\n"));
    EXPECT_EQ(0, phone.exec(as_daemon("for i in 1 2 3 4; do dd if=/proc/kmsg bs=255 count=1 2>/dev/null | wc -c; done; "
                                      "dd if=/proc/kmsg bs=255 count=1 iflag=nonblock 2>&1 | grep -c unavailable"), &out));
    EXPECT_EQ("200\n100\n255\n61\n1\n", out);
    // More than a pipe holds goes in without a reader, unchanged.
    std::string burst;
    for (int i = 0; burst.size() < 200000; i++) burst += "<6>line " + std::to_string(i) + "\n";
    ASSERT_TRUE(phone.feed("kmsg", burst));
    EXPECT_EQ(0, phone.exec({"head", "-c", std::to_string(burst.size()), "/proc/kmsg"}, &out));
    EXPECT_TRUE(out == burst) << "read " << out.size() << " of " << burst.size() << " bytes";
    // With nothing written, a reader waits instead of seeing end of file.
    EXPECT_EQ(124, phone.exec({"timeout", "0.5", "cat", "/proc/kmsg"}, &out));

    const struct {
        const char* command;
        bool allowed;
    } cases[] = {
        {"mkdir /data/log_temp /data/misc/probe && mkdir -p /mnt/sdcard/qrvlog/tavlolog", true},
        {"touch /mnt/sdcard2/probe && echo line >> /dev/emu/wlog", true},
        {"oru -m 3 && grep -qx -- '-m 3' /dev/emu/oru_calls", true},
        {"setprop debug.TQ.running 1 && [ $(getprop debug.TQ.running) = 1 ]", true},
        {"setprop debug.emu.by_root daemon", true},  // set by root first
        {"setprop persist.emu.by_daemon 1", false},
        {"ls /data/property", false},
        {"touch /system/etc/probe", false},
        {"echo 1 > /sys/class/BOOT/BOOT/boot/boot_mode", false},
        {"exec 3</proc/kmsg", true},
        {"setpriv --ambient-caps -syslog -- sh -c 'exec 3</proc/kmsg'", false},  // without CAP_SYSLOG
    };
    ASSERT_EQ(0, phone.exec({"setprop", "debug.emu.by_root", "root"}));
    for (const auto& c : cases) EXPECT_EQ(c.allowed, phone.exec(as_daemon(c.command)) == 0) << c.command;
}

}  // namespace
