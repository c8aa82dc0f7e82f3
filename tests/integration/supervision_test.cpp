// Supervision of the collectors by the real daemon: a kernel collector that
// dies from outside during a run is recorded with the warning its reason
// calls for, every client hears "tqlog_stopped", the run stops, and the
// daemon goes on serving.
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"
#include "tests/integration/log_daemon.h"

namespace {

struct DeathCase {
    const char* name;
    const char* signal;            // sent from outside with kill
    const char* encrypt_progress;  // vold.encrypt_progress, "" for unset
    std::vector<std::string> records;  // expected in the history
    std::vector<std::string> absent;   // not in the history
};

void PrintTo(const DeathCase& c, std::ostream* os) { *os << c.name; }

class CollectorDeath : public ::testing::TestWithParam<DeathCase> {};

TEST_P(CollectorDeath, StopsTheRunAndTellsEveryClient) {
    const DeathCase& c = GetParam();
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    ASSERT_TRUE(configure(phone, {"AndroidLog=0", "BTLog=0"}));
    if (c.encrypt_progress[0] != '\0') {
        ASSERT_EQ(0, phone.exec({"setprop", "vold.encrypt_progress", c.encrypt_progress}));
    }
    auto starter = connect_listener(phone, "start");
    ASSERT_TRUE(starter);
    auto bystander = connect_listener(phone);
    ASSERT_TRUE(bystander);
    std::string folder = run_folder(phone);
    int pids[5];
    ASSERT_TRUE(collector_pids(phone, pids));
    const int klog = pids[3];
    ASSERT_GT(klog, 0);
    ASSERT_TRUE(phone.write_kmsg("before the death\n"));
    ASSERT_TRUE(EmuPhone::wait_for(
        [&] { return contains(phone.read_file(folder + "kernel_log"), "before the death"); }));

    ASSERT_EQ(0, phone.exec({"kill", std::string("-") + c.signal, std::to_string(klog)}));
    EXPECT_TRUE(starter->read_until("tqlog_stopped")) << starter->output();
    EXPECT_TRUE(bystander->read_until("tqlog_stopped")) << bystander->output();
    EXPECT_TRUE(wait_history(phone, "tavlolog stop done"));
    EXPECT_EQ("0", phone.getprop("debug.TQ.running"));

    std::string text = history(phone);
    EXPECT_TRUE(contains(text, " pid " + std::to_string(klog) + " send sig_chld ")) << text;
    EXPECT_EQ(1, count(text, "kLog dies unexpectly")) << text;
    EXPECT_EQ(1, count(text, "all chil processes die")) << text;
    // Each notice is recorded with the count read, in the history and the platform log alike.
    bool same = false;
    for (const std::string& n : recorded_values(phone, "recv efd_chld ", &same)) EXPECT_NE("0", n);
    EXPECT_TRUE(same) << platform_log(phone);
    for (const std::string& record : c.records) EXPECT_TRUE(contains(text, record)) << record;
    for (const std::string& record : c.absent) EXPECT_FALSE(contains(text, record)) << record;
    // What the collector had forwarded stays in the run's file.
    EXPECT_EQ(std::string(kFileHeader) + "before the death\n",
              phone.read_file(folder + "kernel_log"));

    // The daemon goes on: the clients stay connected and the next run logs.
    EXPECT_EQ(-1, starter->wait(0));
    EXPECT_EQ(-1, bystander->wait(0));
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    EXPECT_EQ("start,1\n", out);
    ASSERT_TRUE(collector_pids(phone, pids));
    EXPECT_GT(pids[3], 0);
    EXPECT_NE(klog, pids[3]);
    std::string next = run_folder(phone) + "kernel_log";
    ASSERT_TRUE(phone.write_kmsg("after the death\n"));
    EXPECT_TRUE(EmuPhone::wait_for(
        [&] { return contains(phone.read_file(next), "after the death\n"); }));
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

// Killed from outside, a collector leaves no reason: no warning is given.
// Asked to stop by its own signal, it leaves reason 0, which is warned about,
// unless the phone is being encrypted.
INSTANTIATE_TEST_SUITE_P(
    Signals, CollectorDeath,
    ::testing::Values(
        DeathCase{"Kill", "KILL", "", {}, {"prop:vold.encrypt_progress", "oru warning comes"}},
        DeathCase{"Term", "TERM", "", {}, {"prop:vold.encrypt_progress", "oru warning comes"}},
        DeathCase{"StopSignal",
                  "USR1",
                  "",
                  {"prop:vold.encrypt_progress,temp:\n", "oru warning comes,type is 0\n",
                   "oru type 0 comes\n"},
                  {"phone is encryping"}},
        DeathCase{"StopSignalWhileEncrypting",
                  "USR1",
                  "30",
                  {"prop:vold.encrypt_progress,temp:30\n",
                   "phone is encryping, will not show red screen:30\n"},
                  {"oru warning comes"}}),
    [](const ::testing::TestParamInfo<DeathCase>& info) { return info.param.name; });

}  // namespace
