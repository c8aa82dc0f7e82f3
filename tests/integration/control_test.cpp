// The control socket of the real daemon, driven from inside the phone: the
// start and stop commands and what they publish, a message without its
// terminating byte, configuration messages and when they take effect, the
// ten client slots and the peers that are refused.
#include <time.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"
#include "tests/integration/log_daemon.h"

namespace {

TEST(ControlCommands, StartAndStopPublishTheRunAndRepeatsChangeNothing) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_EQ("0", phone.getprop("debug.TQ.running"));

    std::string out;
    EXPECT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    EXPECT_EQ("1", phone.getprop("debug.TQ.running"));
    // The default configuration: 300 MB over five files of five log types.
    EXPECT_EQ("12288", phone.getprop("debug.TQ.logsize"));
    std::string folder = run_folder(phone);
    ASSERT_EQ(0u, folder.compare(0, sizeof(kCardRoot) - 1, kCardRoot)) << folder;
    EXPECT_TRUE(is_run_folder_name(folder.substr(sizeof(kCardRoot) - 1))) << folder;
    EXPECT_TRUE(phone.file_exists(folder + "kernel_log"));
    EXPECT_TRUE(contains(phone.read_file(folder + "tqlog_history"), "kernel_log, fd = "));
    ASSERT_EQ(1u, run_folders(phone).size());

    // A start while running answers the same and starts nothing.
    EXPECT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    EXPECT_TRUE(contains(history(phone), "tqlog already running, why send start"));
    EXPECT_EQ(1, count(history(phone), "start tavlolog\n"));
    EXPECT_EQ(folder, run_folder(phone));
    EXPECT_EQ(1u, run_folders(phone).size());
    EXPECT_EQ(1, count(history(phone), " M("));

    EXPECT_EQ(0, ctl(phone, {"stop"}, &out));
    EXPECT_EQ("stop,1\n", out);
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    EXPECT_EQ(1, count(history(phone), "tavlolog stop done"));
    EXPECT_FALSE(contains(history(phone), "tavlolog already stopped, ignore this stop"));

    // A stop while stopped is answered as done and only recorded.
    EXPECT_EQ(0, ctl(phone, {"stop"}, &out));
    EXPECT_EQ("stop,1\n", out);
    EXPECT_EQ(1, count(history(phone), "tavlolog already stopped, ignore this stop"));
    EXPECT_EQ(1, count(history(phone), "tavlolog stop done"));
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

TEST(ControlCommands, StartFailsWhenItsFolderCannotBeMade) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    // A file where the folder of all runs belongs.
    ASSERT_EQ(0, phone.exec({"touch", "/mnt/sdcard/qrvlog"}));
    std::string out;
    EXPECT_EQ(1, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,0\n", out);
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    std::string text = history(phone);
    EXPECT_TRUE(contains(text, "fails at last")) << text;
    EXPECT_FALSE(contains(text, " M(")) << text;
    EXPECT_TRUE(phone.read_file("/dev/emu/oru_calls").empty());

    ASSERT_EQ(0, phone.exec({"rm", "/mnt/sdcard/qrvlog"}));
    EXPECT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    EXPECT_EQ("1", phone.getprop("debug.TQ.running"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

struct RotationSizeCase {
    const char* name;
    std::vector<std::string> settings;
    const char* logsize;  // debug.TQ.logsize in KB
};

void PrintTo(const RotationSizeCase& c, std::ostream* os) { *os << c.name; }

class ControlRotationSize : public ::testing::TestWithParam<RotationSizeCase> {};

TEST_P(ControlRotationSize, IsTheRunSizeSharedByItsFiles) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, GetParam().settings));
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ(GetParam().logsize, phone.getprop("debug.TQ.logsize"));
    EXPECT_EQ("1", phone.getprop("debug.TQ.running"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

INSTANTIATE_TEST_SUITE_P(
    Sizes, ControlRotationSize,
    ::testing::Values(
        RotationSizeCase{"AllTypes60MB", {"logsize=60"}, "2457"},
        RotationSizeCase{"KernelOnly60MB", {"logsize=60", "AndroidLog=0", "BTLog=0"}, "12288"},
        RotationSizeCase{"KernelOnly1MB", {"logsize=1", "AndroidLog=0", "BTLog=0"}, "204"}),
    [](const ::testing::TestParamInfo<RotationSizeCase>& info) { return info.param.name; });

TEST(ControlCommands, MessageWithoutTerminatorLosesItsLastByte) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::string config = phone.read_file(kConfig);

    std::string out;
    EXPECT_EQ(0, ctl(phone, {"--raw", "start"}, &out));
    EXPECT_EQ("star,1\n", out);
    std::string text = history(phone);
    EXPECT_TRUE(contains(text, "recv 'star' from client")) << text;
    EXPECT_TRUE(contains(text, "star is not a valid configure")) << text;
    EXPECT_FALSE(contains(text, "start tavlolog"));
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    EXPECT_TRUE(run_folders(phone).empty());
    EXPECT_EQ(config, phone.read_file(kConfig));

    // With its terminator the same word is a command again.
    EXPECT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    EXPECT_EQ("1", phone.getprop("debug.TQ.running"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

TEST(ControlCommands, ConfigurationIsStoredAndAppliesFromTheNextStart) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, {"AndroidLog=0", "BTLog=0"}));
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    std::string first = run_folder(phone);
    ASSERT_TRUE(phone.write_kmsg("before the change\n"));
    ASSERT_TRUE(EmuPhone::wait_for([&] {
        return contains(phone.read_file(first + "kernel_log"), "before the change\n");
    }));

    // The group prefix form names the same key as the plain one.
    EXPECT_TRUE(configure(phone, {"KernelLog=0", "sublog_BTLog=1"}));
    std::string config = phone.read_file(kConfig);
    EXPECT_TRUE(contains(config, "\nKernelLog=0\n")) << config;
    EXPECT_TRUE(contains(config, "\nBTLog=1\n")) << config;
    EXPECT_FALSE(contains(config, "sublog")) << config;

    // The running run keeps its kernel collector.
    ASSERT_TRUE(phone.write_kmsg("during the run\n"));
    EXPECT_TRUE(EmuPhone::wait_for([&] {
        return contains(phone.read_file(first + "kernel_log"), "during the run\n");
    }));
    EXPECT_EQ("1", phone.getprop("debug.TQ.running"));

    ASSERT_EQ(0, ctl(phone, {"stop"}, &out));
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    int pids[5];
    ASSERT_TRUE(collector_pids(phone, pids));
    EXPECT_EQ(0, pids[3]) << "a kernel collector runs although KernelLog=0";
    std::string second = history_since_last(phone, "start tavlolog\n");
    EXPECT_TRUE(contains(second, "bt_log, fd = ")) << second;
    EXPECT_FALSE(contains(second, "kernel_log, fd = ")) << second;
    // Only the Bluetooth type is on now: its five files share the 300 MB.
    EXPECT_EQ("61440", phone.getprop("debug.TQ.logsize"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

TEST(ControlCommands, FastPowerOffKeepsLoggingIntoDataAndClosesEveryClient) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, {"AndroidLog=0", "BTLog=0"}));
    auto starter = connect_listener(phone, "deep_start");
    ASSERT_TRUE(starter);
    EXPECT_EQ("deep_start,1\n", starter->output());
    // The configuration changes after the reply.
    EXPECT_TRUE(EmuPhone::wait_for(
        [&] { return contains(phone.read_file(kConfig), "autostart=1\n"); }));
    auto bystander = connect_listener(phone);
    ASSERT_TRUE(bystander);
    std::string folder = run_folder(phone);
    ASSERT_TRUE(phone.write_kmsg("before the power-off\n"));
    ASSERT_TRUE(EmuPhone::wait_for([&] {
        return contains(phone.read_file(folder + "kernel_log"), "before the power-off\n");
    }));

    std::string out;
    EXPECT_EQ(0, ctl(phone, {"HBR_SHUTDOWN"}, &out));
    EXPECT_EQ("HBR_SHUTDOWN,1\n", out);
    // Nobody is to give commands any more: every connection is closed.
    EXPECT_EQ(0, starter->wait(5000));
    EXPECT_EQ(0, bystander->wait(5000));
    EXPECT_EQ("1", phone.getprop("debug.TQ.running"));
    EXPECT_EQ("/data/log_hbr/", run_folder(phone));
    // 60 MB for the kernel log's five files.
    EXPECT_EQ("12288", phone.getprop("debug.TQ.logsize"));

    // The same collector goes on, into /data, where the logs survive the power-off.
    ASSERT_TRUE(phone.write_kmsg("during the power-off\n"));
    EXPECT_TRUE(EmuPhone::wait_for([&] {
        return phone.read_file("/data/log_hbr/kernel_log") ==
               std::string(kFileHeader) + "during the power-off\n";
    }));
    EXPECT_EQ(std::string(kFileHeader) + "before the power-off\n",
              phone.read_file(folder + "kernel_log"));

    // A power-off that was not followed through: deep_stop ends logging at boot too.
    EXPECT_EQ(0, ctl(phone, {"deep_stop"}, &out));
    EXPECT_EQ("deep_stop,1\n", out);
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    EXPECT_TRUE(EmuPhone::wait_for(
        [&] { return contains(phone.read_file(kConfig), "autostart=0\n"); }));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

TEST(ControlCommands, CopyStartsARunThenMovesItOnceWithItsCollector) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, {"AndroidLog=0", "BTLog=0"}));
    std::string out;
    EXPECT_EQ(0, ctl(phone, {"copy"}, &out));
    EXPECT_EQ("copy,1\n", out);
    time_t started = time(nullptr);
    EXPECT_TRUE(contains(history(phone), "start tavlolog when recv copy"));
    ASSERT_TRUE(EmuPhone::wait_for([&] { return phone.getprop("debug.TQ.running") == "1"; }));
    std::string first = run_folder(phone);
    ASSERT_TRUE(phone.write_kmsg("in the first folder\n"));
    ASSERT_TRUE(EmuPhone::wait_for([&] {
        return contains(phone.read_file(first + "kernel_log"), "in the first folder\n");
    }));

    // Folder names go by the second: the move needs a later one.
    ASSERT_TRUE(EmuPhone::wait_for([&] { return time(nullptr) > started; }, 2000));
    EXPECT_EQ(0, ctl(phone, {"copy"}, &out));
    EXPECT_EQ("copy,1\n", out);
    EXPECT_TRUE(contains(history(phone), "copy to sdcard!"));
    std::string second = run_folder(phone);
    EXPECT_NE(first, second);
    ASSERT_TRUE(phone.write_kmsg("in the second folder\n"));
    EXPECT_TRUE(EmuPhone::wait_for([&] {
        return phone.read_file(second + "kernel_log") ==
               std::string(kFileHeader) + "in the second folder\n";
    }));
    EXPECT_EQ(std::string(kFileHeader) + "in the first folder\n",
              phone.read_file(first + "kernel_log"));
    // The collector of the run went on: no second one was forked.
    EXPECT_EQ(1, count(history(phone), " M("));

    EXPECT_EQ(0, ctl(phone, {"copy"}, &out));
    EXPECT_EQ("copy,1\n", out);
    EXPECT_TRUE(contains(history(phone), "has copyed to sd,ignore this 'copy'"));
    EXPECT_EQ(second, run_folder(phone));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

// The tavlologctl client must see a closed connection, and the daemon
// must have taken no command from it.
void expect_closed_without_effect(EmuPhone& phone, int rc, const std::string& out) {
    EXPECT_EQ(2, rc) << out;
    EXPECT_EQ("", out);
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));
    EXPECT_FALSE(contains(history(phone), "recv 'start'"));
}

TEST(ControlClients, TenAreServedAndTheEleventhIsClosedAtOnce) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::vector<std::unique_ptr<EmuProcess>> listeners;
    for (int i = 0; i < 10; i++) {
        listeners.push_back(connect_listener(phone));
        ASSERT_TRUE(listeners.back()) << "listener " << i;
    }
    EXPECT_EQ(10, count(history(phone), "new client,fd:"));

    std::string out;
    int rc = ctl(phone, {"start"}, &out);
    expect_closed_without_effect(phone, rc, out);
    EXPECT_TRUE(contains(history(phone), "no free slot for client uid 0 pid ")) << history(phone);
    EXPECT_EQ(10, count(history(phone), "new client,fd:"));

    // A client that leaves frees its slot for the next one.
    listeners[3]->kill();
    ASSERT_TRUE(wait_history(phone, "exception when handle message, close client"));
    EXPECT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    EXPECT_EQ("1", phone.getprop("debug.TQ.running"));
    // The others are still connected: the stop that a dying run broadcasts reaches them.
    for (size_t i = 0; i < listeners.size(); i++) {
        if (i == 3) continue;
        EXPECT_EQ(-1, listeners[i]->wait(0)) << "listener " << i << " ended";
    }
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

struct PeerCase {
    const char* uid;
    bool trusted;
};

TEST(ControlClients, OnlyPrivilegedUsersAreServed) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    // A configuration message that changes nothing: a served peer gets its reply.
    const PeerCase cases[] = {{"12345", false}, {"10000", false}, {"9999", false},
                              {"1000", true},   {"2000", true},   {"0", true}};
    for (const PeerCase& c : cases) {
        SCOPED_TRACE(std::string("uid ") + c.uid);
        std::string out;
        int rc = phone.exec({"setpriv", std::string("--reuid=") + c.uid,
                             std::string("--regid=") + c.uid, "--clear-groups", "tavlologctl",
                             "logsize=300"},
                            &out);
        std::string refused = std::string("refuse client uid ") + c.uid + " pid ";
        if (c.trusted) {
            EXPECT_EQ(0, rc);
            EXPECT_EQ("logsize=300,1\n", out);
            EXPECT_FALSE(contains(history(phone), refused));
        } else {
            EXPECT_EQ(2, rc);
            EXPECT_EQ("", out);
        }
    }
    // Refusals are recorded within a limit: the first, then a summary.
    EXPECT_EQ(1, count(history(phone), "refuse client uid "));
    EXPECT_TRUE(contains(history(phone), "refuse client uid 12345 pid "));
    // A refused start changes nothing.
    std::string out;
    int rc = phone.exec({"setpriv", "--reuid=12345", "--regid=12345", "--clear-groups",
                         "tavlologctl", "start"},
                        &out);
    expect_closed_without_effect(phone, rc, out);
    EXPECT_TRUE(run_folders(phone).empty());
    EXPECT_EQ(3, count(history(phone), "recv 'logsize=300'"));
    EXPECT_TRUE(wait_history(phone, "3 more refused control clients not recorded"));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

}  // namespace
