// Start-up of the real daemon on the emulated phone: identity and capabilities,
// the start banner and boot mode in the central history, the configuration it
// creates or loads, and what it does with odd input at start.
#include <sys/stat.h>
#include <unistd.h>

#include <ostream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/log_daemon.h"

namespace {

const char kDefaults[] = "/system/etc/qrvlog-config.prop";

const char kDefaultConfig[] =
    "autostart=0\nlogpath=internal_sd\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=1\n"
    "totallogsize=600\n";

// Seeds a file of the daemon's own folder before the first boot, owned as the
// daemon would have created it.
bool seed_daemon_file(EmuPhone& phone, const char* device_path, const std::string& content) {
    if (!phone.write_image_file(device_path, content, 0600)) return false;
    std::string file = phone.host_path(device_path);
    std::string dir = file.substr(0, file.rfind('/'));
    return chown(dir.c_str(), 2000, 1000) == 0 && chmod(dir.c_str(), 0700) == 0 &&
           chown(file.c_str(), 2000, 1000) == 0;
}

// The value of one "Name:\t..." line of /proc/<pid>/status inside the phone.
std::string status_field(EmuPhone& phone, const std::string& field) {
    std::string out;
    std::string pid = std::to_string(phone.daemon_pid());
    phone.exec({"sh", "-c", "grep '^" + field + ":' /proc/" + pid + "/status | cut -f2-"}, &out);
    while (!out.empty() && (out.back() == '\n' || out.back() == ' ')) out.pop_back();
    return out;
}

TEST(Startup, FreshPhoneGetsBannerBootModeAndDefaultConfiguration) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());

    std::string history = phone.read_file(kHistory);
    EXPECT_TRUE(contains(history, " ****** TQLOG START *******\n")) << history;
    EXPECT_TRUE(contains(history, " boot mode: 0\n")) << history;
    EXPECT_LT(history.find("TQLOG START"), history.find("boot mode: 0"));
    EXPECT_TRUE(contains(history, "boot:0,path:/mnt/sdcard,size:300,Tsize:600,A:1,K:1,B:1"));

    EXPECT_EQ(phone.read_file(kConfig), kDefaultConfig);
    struct stat st;
    ASSERT_EQ(stat(phone.host_path(kConfig).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0600u);
    ASSERT_EQ(stat(phone.host_path(kHistory).c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0664u);

    std::string out;
    EXPECT_EQ(phone.exec({"getprop", "debug.TQ.running"}, &out), 0);
    EXPECT_EQ(out, "0\n");
}

TEST(Startup, DaemonKeepsOnlyItsIdentityAndTheSyslogCapability) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_GT(phone.daemon_pid(), 0);

    EXPECT_EQ(status_field(phone, "Uid"), "2000\t2000\t2000\t2000");
    EXPECT_EQ(status_field(phone, "Gid"), "1000\t1000\t1000\t1000");
    // The kernel lists supplementary groups sorted.
    EXPECT_EQ(status_field(phone, "Groups"), "1000 1001 1007 1015 1023 1028 2001 9998");
    EXPECT_EQ(status_field(phone, "CapEff"), "0000000400000000");
    EXPECT_EQ(status_field(phone, "CapPrm"), "0000000400000000");
}

TEST(Startup, FirstBootTranslatesTheSystemDefaults) {
    EmuPhone phone;
    ASSERT_TRUE(phone.write_image_file(kDefaults,
                                       "# maker defaults\n"
                                       "com.quorvex.log.tavlo.enabled=true\n"
                                       "com.quorvex.log.tavlo.maxsize=500\n"
                                       "qrvlog_path = external_sd\n"
                                       "some.other.key=1\n"));
    ASSERT_TRUE(phone.boot());
    EXPECT_EQ(phone.read_file(kConfig),
              "autostart=1\nlogpath=external_sd\nlogsize=500\nAndroidLog=1\nKernelLog=1\nBTLog=1\n"
              "totallogsize=600\n");
    EXPECT_TRUE(contains(phone.read_file(kHistory), "boot:1,path:/mnt/sdcard2,size:500"));
}

TEST(Startup, RebootLoadsTheStoredConfigurationInsteadOfTheDefaults) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(phone.stop());
    ASSERT_TRUE(phone.write_image_file(kConfig,
                                       "logsize=120\nKernelLog=0\nlogpath=/data\n", 0600));
    ASSERT_TRUE(phone.write_image_file(kDefaults, "com.quorvex.log.tavlo.maxsize=999\n"));
    ASSERT_TRUE(phone.boot());

    std::string history = phone.read_file(kHistory);
    EXPECT_EQ(count(history, "****** TQLOG START *******"), 2);
    EXPECT_EQ(count(history, "boot mode: 0"), 2);
    EXPECT_TRUE(contains(history, "boot:0,path:/data,size:120,Tsize:600,A:1,K:0,B:1")) << history;
}

struct BootModeCase {
    const char* file;  // content of the boot-mode file, "none" for no file
    const char* record;
};

// Names the case in test output instead of dumping its bytes.
void PrintTo(const BootModeCase& c, std::ostream* os) { *os << '"' << c.file << '"'; }

class StartupBootMode : public ::testing::TestWithParam<BootModeCase> {};

TEST_P(StartupBootMode, IsRecordedInTheCentralHistory) {
    EmuPhone phone;
    BootOptions options;
    options.boot_mode = GetParam().file;
    ASSERT_TRUE(phone.boot(options));
    std::string history = phone.read_file(kHistory);
    EXPECT_TRUE(contains(history, GetParam().record)) << history;
}

INSTANTIATE_TEST_SUITE_P(
    Modes, StartupBootMode,
    ::testing::Values(
        BootModeCase{"1", " boot mode: 1\n"}, BootModeCase{"7", " boot mode: 7\n"},
        BootModeCase{"10", " boot mode: 1\n"}, BootModeCase{"x", " boot mode: 0\n"},
        BootModeCase{"none", "Failed to open boot mode file /sys/class/BOOT/BOOT/boot/boot_mode"},
        BootModeCase{"none", " boot mode: -1\n"}),
    [](const ::testing::TestParamInfo<BootModeCase>& info) {
        return "case" + std::to_string(info.index);
    });

TEST(Startup, GarbageConfigurationLeavesTheDaemonRunningWithSaneOptions) {
    EmuPhone phone;
    std::string garbage = "logsize=77\n\x01\x02\xff=\xfe\n=\n==\n   \n";
    garbage += "KernelLog=" + std::string(300, '9') + "\n";
    garbage += std::string(3000, 'x') + "=1\n";
    garbage += "BTLog=" + std::string(2000, '0') + "\n";
    garbage += std::string("AndroidLog=0\0\0binary\n", 22);
    ASSERT_TRUE(seed_daemon_file(phone, kConfig, garbage));
    ASSERT_TRUE(phone.write_image_file(kDefaults, std::string(5000, '\xff')));
    ASSERT_TRUE(phone.boot());

    std::string history = phone.read_file(kHistory);
    // The readable lines count; overlong values are refused, not cut into other
    // numbers, and a line holding a NUL byte is not trusted.
    EXPECT_TRUE(contains(history, "boot:0,path:/mnt/sdcard,size:77,Tsize:600,A:1,K:1,B:1"))
        << history;
    EXPECT_TRUE(contains(history, "value of KernelLog too long, ignored"));
    EXPECT_TRUE(contains(history, "hold a NUL byte, ignored"));
    EXPECT_GT(phone.daemon_pid(), 0);
    std::string out;
    EXPECT_EQ(phone.exec({"getprop", "debug.TQ.running"}, &out), 0);
    EXPECT_EQ(out, "0\n");
}

TEST(Startup, AsAnotherUserRecordsItAndGoesOn) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    // A second daemon, started as the shell user: it records that it is not root,
    // goes on to the banner and the boot mode, then finds "tavlologd" taken and waits for it.
    auto second = phone.spawn({"setpriv", "--reuid", "2000", "--regid", "1000", "--clear-groups",
                               "/system/bin/tavlo_log_d"});
    EXPECT_TRUE(wait_history(phone, "create socket 'tavlologd' failed"));
    std::string history = phone.read_file(kHistory);
    EXPECT_TRUE(contains(history, "[== First Log ==] tavlo_log_d is not in root user")) << history;
    EXPECT_EQ(count(history, "****** TQLOG START *******"), 2);
    EXPECT_TRUE(contains(phone.read_file("/dev/emu/wlog"),
                         "TavloLogD/DEBUG: [== First Log ==] tavlo_log_d is not in root user"));
    second->kill();
}

// A daemon killed during a run: the one init starts next neither sees a live
// run nor writes into the dead run's folder.
TEST(Startup, RestartForgetsTheDeadRun) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, {"logpath=/data"}));
    ASSERT_EQ(ctl(phone, {"start"}), 0);
    std::string folder = run_folder(phone);
    ASSERT_FALSE(folder.empty());
    ASSERT_EQ(phone.exec({"kill", "-9", std::to_string(phone.daemon_pid())}), 0);
    ASSERT_TRUE(wait_history(phone, "****** TQLOG START *******", 2));
    ASSERT_TRUE(wait_history(phone, "boot:0,path:/data", 2));
    EXPECT_EQ(phone.getprop("debug.TQ.realpath"), "");
    EXPECT_EQ(phone.getprop("debug.TQ.running"), "0");
    EXPECT_FALSE(contains(phone.read_file(folder + "tqlog_history"), "boot:0,path:/data"));
}

}  // namespace
