// The emulated phone itself: boot, tools, isolation, power-off, reboot, the
// kernel-log FIFO and the file-system rights the daemon's identity gets.
#include <ctype.h>
#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sched.h>
#include <signal.h>
#include <stddef.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <ostream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"

namespace {

// The daemon's identity after start-up.
const std::vector<std::string> kAsDaemon = {"setpriv", "--reuid", "2000", "--regid", "1000",
                                            "--groups", "1000,1001,1007,1015,9998,2001,1028,1023",
                                            "--"};

std::vector<std::string> as_daemon(const std::string& shell_command) {
    std::vector<std::string> args = kAsDaemon;
    args.insert(args.end(), {"sh", "-c", shell_command});
    return args;
}

// Test names from a case's description: letters and digits only.
template <typename Case>
std::string case_name(const ::testing::TestParamInfo<Case>& info, const char* text) {
    std::string name;
    for (const char* p = text; *p; p++) name += isalnum(static_cast<unsigned char>(*p)) ? *p : '_';
    return (name.empty() ? "empty" : name) + "_" + std::to_string(info.index);
}

bool process_alive(pid_t pid) { return kill(pid, 0) == 0; }

// Every host process whose pid namespace is the given one.
int processes_in_pid_namespace(const std::string& ns_link) {
    int count = 0;
    DIR* proc = opendir("/proc");
    if (proc == nullptr) return -1;
    while (struct dirent* entry = readdir(proc)) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') continue;
        char link[PATH_MAX];
        std::string path = std::string("/proc/") + entry->d_name + "/ns/pid";
        ssize_t n = readlink(path.c_str(), link, sizeof(link) - 1);
        if (n <= 0) continue;
        link[n] = '\0';
        if (ns_link == link) count++;
    }
    closedir(proc);
    return count;
}

std::string read_link(const std::string& path) {
    char buf[PATH_MAX];
    ssize_t n = readlink(path.c_str(), buf, sizeof(buf) - 1);
    if (n <= 0) return std::string();
    buf[n] = '\0';
    return buf;
}

// A host child that joins the phone's network namespace and listens on an
// abstract socket there, as a phone service would. Killed by the caller.
pid_t listen_in_phone(pid_t phone_init, const char* name) {
    int ready[2];
    if (pipe(ready) != 0) return -1;
    pid_t pid = fork();
    if (pid == 0) {
        close(ready[0]);
        std::string ns = "/proc/" + std::to_string(phone_init) + "/ns/net";
        int ns_fd = open(ns.c_str(), O_RDONLY | O_CLOEXEC);
        if (ns_fd < 0 || setns(ns_fd, CLONE_NEWNET) != 0) _exit(1);
        int s = socket(AF_UNIX, SOCK_STREAM, 0);
        struct sockaddr_un addr = {};
        addr.sun_family = AF_UNIX;
        size_t len = strlen(name);
        memcpy(addr.sun_path + 1, name, len);  // abstract: leading NUL
        socklen_t alen = static_cast<socklen_t>(offsetof(struct sockaddr_un, sun_path) + 1 + len);
        if (s < 0 || bind(s, reinterpret_cast<sockaddr*>(&addr), alen) != 0 || listen(s, 1) != 0)
            _exit(1);
        char c = 1;
        if (write(ready[1], &c, 1) != 1) _exit(1);
        for (;;) pause();
    }
    close(ready[1]);
    char c = 0;
    ssize_t n = read(ready[0], &c, 1);
    close(ready[0]);
    if (n != 1) {
        waitpid(pid, nullptr, 0);
        return -1;
    }
    return pid;
}

TEST(EmulatorTest, BootRunsTheDaemonAndTheTools) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    EXPECT_TRUE(phone.running());
    pid_t daemon = phone.daemon_pid();
    ASSERT_GT(daemon, 0);

    std::string out;
    EXPECT_EQ(0, phone.exec({"getprop", "ro.build.type"}, &out));
    EXPECT_EQ("user\n", out);
    EXPECT_EQ(0, phone.exec({"getprop", "no.such.prop", "fallback"}, &out));
    EXPECT_EQ("fallback\n", out);
    EXPECT_EQ(0, phone.exec({"setprop", "debug.emu.answer", "42"}));
    EXPECT_EQ("42", phone.getprop("debug.emu.answer"));
    EXPECT_EQ(0, phone.exec({"getprop"}, &out));
    EXPECT_NE(std::string::npos, out.find("[debug.emu.answer]: [42]\n")) << out;
    EXPECT_NE(0, phone.exec({"setprop", "ro.build.type", "eng"}));
    EXPECT_EQ("user", phone.getprop("ro.build.type"));

    // exec passes the exit status, stdin and the phone's PATH and cwd.
    EXPECT_EQ(7, phone.exec({"sh", "-c", "exit 7"}));
    EXPECT_EQ(0, phone.exec({"sh", "-c", "pwd; echo $PATH"}, &out));
    EXPECT_EQ("/\n/system/bin:/usr/bin:/bin\n", out);
    EXPECT_EQ(0, phone.exec({"cat"}, &out, "through stdin"));
    EXPECT_EQ("through stdin", out);

    // The daemon runs as the phone's pid-namespace process the pid file names.
    EXPECT_EQ(0, phone.exec({"kill", "-0", std::to_string(daemon)}));
    EXPECT_EQ(0, phone.exec({"sh", "-c", "grep -q ' @tavlologd$' /proc/net/unix"}));
}

TEST(EmulatorTest, BuildPropLinesOverrideDefaults) {
    EmuPhone phone;
    BootOptions options;
    options.build_prop = {"ro.build.type=eng", "# a comment", "persist.sys.timezone = Europe/Paris"};
    ASSERT_TRUE(phone.boot(options));
    EXPECT_EQ("eng", phone.getprop("ro.build.type"));
    EXPECT_EQ("Europe/Paris", phone.getprop("persist.sys.timezone"));
    EXPECT_EQ("tavlo-emu", phone.getprop("ro.product.model"));
}

struct BootModeCase {
    const char* option;        // --boot-mode
    bool file_exists;
    const char* file_content;  // what the daemon's read sees
};

void PrintTo(const BootModeCase& c, std::ostream* os) { *os << "boot mode '" << c.option << "'"; }

class BootModeFileTest : public ::testing::TestWithParam<BootModeCase> {};

TEST_P(BootModeFileTest, IsWhatTheOptionSays) {
    const BootModeCase& c = GetParam();
    EmuPhone phone;
    BootOptions options;
    options.boot_mode = c.option;
    ASSERT_TRUE(phone.boot(options));
    std::string out;
    int rc = phone.exec({"cat", "/sys/class/BOOT/BOOT/boot/boot_mode"}, &out);
    if (!c.file_exists) {
        EXPECT_NE(0, rc);
        return;
    }
    EXPECT_EQ(0, rc);
    EXPECT_EQ(c.file_content, out);
    // Read-only, as sysfs is to the daemon.
    EXPECT_NE(0, phone.exec({"sh", "-c", "echo 1 > /sys/class/BOOT/BOOT/boot/boot_mode"}));
}

INSTANTIATE_TEST_SUITE_P(Modes, BootModeFileTest,
                         ::testing::Values(BootModeCase{"0", true, "0\n"},
                                           BootModeCase{"10", true, "10\n"},
                                           BootModeCase{"", true, ""},
                                           BootModeCase{"none", false, ""}),
                         [](const ::testing::TestParamInfo<BootModeCase>& info) {
                             return case_name(info, info.param.option);
                         });

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

    pid_t listener = listen_in_phone(a.host_init_pid(), "emu_isolation_probe");
    ASSERT_GT(listener, 0);
    EXPECT_EQ(0, a.exec({"cat", "/proc/net/unix"}, &out));
    EXPECT_NE(std::string::npos, out.find("@emu_isolation_probe")) << out;
    EXPECT_EQ(0, b.exec({"cat", "/proc/net/unix"}, &out));
    EXPECT_EQ(std::string::npos, out.find("@emu_isolation_probe")) << out;
    kill(listener, SIGKILL);
    waitpid(listener, nullptr, 0);

    // Each phone has its own pid space, with its init as pid 1 and no host process.
    EXPECT_EQ(0, a.exec({"ps", "-o", "comm=", "-p", "1"}, &out));
    EXPECT_EQ("emu_init\n", out);
    EXPECT_EQ(0, b.exec({"ps", "-e", "-o", "comm="}, &out));
    EXPECT_EQ(std::string::npos, out.find("bwrap")) << out;
    EXPECT_EQ(std::string::npos, out.find("emulator_test")) << out;
}

TEST(EmulatorTest, StopLeavesNothingRunning) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    pid_t init = phone.host_init_pid();
    ASSERT_GT(init, 0);
    std::string ns = read_link("/proc/" + std::to_string(init) + "/ns/pid");
    ASSERT_FALSE(ns.empty());
    auto sleeper = phone.spawn({"sleep", "1000"});
    ASSERT_TRUE(sleeper);
    ASSERT_TRUE(EmuPhone::wait_for([&] { return processes_in_pid_namespace(ns) >= 3; }, 5000));

    ASSERT_TRUE(phone.stop());
    EXPECT_FALSE(phone.running());
    EXPECT_FALSE(process_alive(init));
    EXPECT_EQ(0, processes_in_pid_namespace(ns));
    EXPECT_NE(-1, sleeper->wait(5000));  // its exec ended with the phone
    // No mount of the phone is visible on the host.
    std::string mounts;
    {
        char buf[4096];
        int fd = open("/proc/self/mountinfo", O_RDONLY | O_CLOEXEC);
        ssize_t n;
        while (fd >= 0 && (n = read(fd, buf, sizeof(buf))) > 0) mounts.append(buf, n);
        if (fd >= 0) close(fd);
    }
    EXPECT_EQ(std::string::npos, mounts.find(phone.image_dir()));
    EXPECT_NE(0, phone.exec({"true"}));
    EXPECT_TRUE(phone.stop());  // a second stop is harmless
    // The image stays for the next boot.
    EXPECT_TRUE(phone.file_exists("/system/bin/tavlo_log_d"));
}

TEST(EmulatorTest, BootRefusesARunningImage) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    pid_t init = phone.host_init_pid();
    EXPECT_FALSE(phone.boot());
    EXPECT_EQ(init, phone.host_init_pid());
    EXPECT_TRUE(process_alive(init));
}

TEST(EmulatorTest, RebootKeepsPersistentPropertiesAndData) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_EQ(0, phone.exec({"setprop", "persist.emu.kept", "still here"}));
    ASSERT_EQ(0, phone.exec({"setprop", "debug.emu.dropped", "gone"}));
    ASSERT_EQ(0, phone.exec({"sh", "-c", "echo data > /data/emu_file"}));
    pid_t first_daemon = phone.daemon_pid();

    ASSERT_TRUE(phone.reboot());
    EXPECT_EQ("still here", phone.getprop("persist.emu.kept"));
    EXPECT_EQ("", phone.getprop("debug.emu.dropped"));
    EXPECT_EQ("user", phone.getprop("ro.build.type"));
    EXPECT_EQ("data\n", phone.read_file("/data/emu_file"));
    EXPECT_GT(phone.daemon_pid(), 0);
    (void)first_daemon;
}

TEST(EmulatorTest, KmsgCarriesHostBytesAndNeverEnds) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::string out;
    EXPECT_EQ(0, phone.exec({"stat", "-c", "%F %a %u %g", "/proc/kmsg"}, &out));
    EXPECT_EQ("fifo 440 0 1007\n", out);

    ASSERT_TRUE(phone.write_kmsg("<6>[    1.000000] first line\n"));
    // Read as the daemon's identity does: group log, no root rights.
    std::vector<std::string> args = kAsDaemon;
    args.insert(args.end(), {"head", "-c", "29", "/proc/kmsg"});
    EXPECT_EQ(0, phone.exec(args, &out));
    EXPECT_EQ("<6>[    1.000000] first line\n", out);

    // More than a default pipe holds goes in without a reader, unchanged.
    std::string burst;
    for (int i = 0; burst.size() < 200000; i++) burst += "<6>line " + std::to_string(i) + "\n";
    ASSERT_TRUE(phone.write_kmsg(burst));
    EXPECT_EQ(0, phone.exec({"head", "-c", std::to_string(burst.size()), "/proc/kmsg"}, &out));
    EXPECT_TRUE(out == burst) << "read " << out.size() << " of " << burst.size() << " bytes";

    // With nothing written, a reader waits instead of seeing end of file.
    EXPECT_EQ(124, phone.exec({"timeout", "0.5", "cat", "/proc/kmsg"}, &out));
    EXPECT_EQ("", out);
}

TEST(EmulatorTest, KmsgIsClosedWhileThePhoneIsOff) {
    EmuPhone phone;
    EXPECT_FALSE(phone.write_kmsg("x\n", 100));
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(phone.stop());
    EXPECT_FALSE(phone.write_kmsg("x\n", 100));
}

struct AccessCase {
    const char* what;
    const char* command;  // run as the daemon's identity
    bool allowed;
};

void PrintTo(const AccessCase& c, std::ostream* os) { *os << c.what; }


class DaemonIdentityTest : public ::testing::TestWithParam<AccessCase> {};

TEST_P(DaemonIdentityTest, WritesWhereItMustAndNowhereElse) {
    const AccessCase& c = GetParam();
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    // A value root set first, for the replace case.
    ASSERT_EQ(0, phone.exec({"setprop", "debug.emu.by_root", "root"}));
    int rc = phone.exec(as_daemon(c.command));
    if (c.allowed)
        EXPECT_EQ(0, rc) << c.what;
    else
        EXPECT_NE(0, rc) << c.what;
}

INSTANTIATE_TEST_SUITE_P(
    Folders, DaemonIdentityTest,
    ::testing::Values(
        AccessCase{"data", "mkdir /data/log_temp", true},
        AccessCase{"data/misc", "mkdir /data/misc/probe", true},
        AccessCase{"sdcard", "mkdir -p /mnt/sdcard/qrvlog/tavlolog", true},
        AccessCase{"sdcard2", "touch /mnt/sdcard2/probe", true},
        AccessCase{"platform log", "echo line >> /dev/emu/wlog", true},
        AccessCase{"oru", "oru -m 3 && grep -qx -- '-m 3' /dev/emu/oru_calls", true},
        AccessCase{"debug property", "setprop debug.TQ.running 1 && [ $(getprop debug.TQ.running) = 1 ]", true},
        AccessCase{"property root set", "setprop debug.emu.by_root daemon", true},
        AccessCase{"persist property", "setprop persist.emu.by_daemon 1", false},
        AccessCase{"stored properties", "ls /data/property", false},
        AccessCase{"system", "touch /system/etc/probe", false},
        AccessCase{"boot mode", "echo 1 > /sys/class/BOOT/BOOT/boot/boot_mode", false}),
    [](const ::testing::TestParamInfo<AccessCase>& info) { return case_name(info, info.param.what); });

TEST(EmulatorTest, DaemonIsRestartedAfterItEnds) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    pid_t first = phone.daemon_pid();
    ASSERT_GT(first, 0);
    ASSERT_EQ(0, phone.exec({"kill", "-9", std::to_string(first)}));
    ASSERT_TRUE(EmuPhone::wait_for(
        [&] {
            pid_t now = phone.daemon_pid();
            return now > 0 && now != first;
        },
        10000));
    std::string log = phone.read_file("/dev/emu/init.log");
    EXPECT_NE(std::string::npos,
              log.find("exit tavlo_log_d pid " + std::to_string(first) + ": killed by signal 9"))
        << log;
    EXPECT_EQ(0, phone.exec({"kill", "-0", std::to_string(phone.daemon_pid())}));
}

TEST(EmulatorTest, SizeLimitedSdcard) {
    EmuPhone phone;
    BootOptions options;
    options.sdcard_mb = 2;
    ASSERT_TRUE(phone.boot(options));
    EXPECT_EQ(0, phone.exec({"sh", "-c", "echo small > /mnt/sdcard/small"}));
    EXPECT_EQ("small\n", phone.read_file("/mnt/sdcard/small"));
    EXPECT_NE(0, phone.exec({"dd", "if=/dev/zero", "of=/mnt/sdcard/big", "bs=1M", "count=3",
                             "status=none"}));
    std::string big;
    EXPECT_TRUE(phone.read_file("/mnt/sdcard/big", &big));
    EXPECT_GT(big.size(), 0u);
    EXPECT_LE(big.size(), 2u * 1024 * 1024);
    // The card is the phone's own: nothing lands in the image folder.
    struct stat st;
    EXPECT_NE(0, stat((phone.image_dir() + "/sdcard/small").c_str(), &st));
}

TEST(EmulatorTest, SizeLimitedDataStartsFromTheImage) {
    EmuPhone phone;
    ASSERT_TRUE(phone.write_image_file("/data/seeded", "from the image\n"));
    BootOptions options;
    options.data_mb = 4;
    ASSERT_TRUE(phone.boot(options));
    std::string out;
    EXPECT_EQ(0, phone.exec({"cat", "/data/seeded"}, &out));
    EXPECT_EQ("from the image\n", out);
    EXPECT_EQ(0, phone.exec({"stat", "-c", "%a %u %g", "/data"}, &out));
    EXPECT_EQ("771 1000 1000\n", out);
    EXPECT_NE(0, phone.exec({"dd", "if=/dev/zero", "of=/data/big", "bs=1M", "count=5",
                             "status=none"}));
    EXPECT_TRUE(phone.file_exists("/data/big"));
    EXPECT_FALSE(phone.file_exists("/data/nothing"));
}

TEST(EmulatorTest, SpawnedProcessTalksAndDiesWithItsHandle) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    {
        auto cat = phone.spawn({"sh", "-c", "echo ready; exec cat"});
        ASSERT_TRUE(cat);
        ASSERT_TRUE(cat->read_until("ready\n"));
        ASSERT_TRUE(cat->write("ping\n"));
        EXPECT_TRUE(cat->read_until("ping\n"));
        EXPECT_EQ(0, phone.exec({"pgrep", "-x", "cat"}));
    }
    EXPECT_TRUE(EmuPhone::wait_for([&] { return phone.exec({"pgrep", "-x", "cat"}) == 1; }, 5000));

    auto done = phone.spawn({"sh", "-c", "read line; echo got $line; exit 3"});
    ASSERT_TRUE(done);
    ASSERT_TRUE(done->write("x\n"));
    done->close_stdin();
    EXPECT_TRUE(done->read_until("got x\n"));
    EXPECT_EQ(3, done->wait());
}

}  // namespace
