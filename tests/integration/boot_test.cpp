// Recording from boot on the emulated phone: the boot-mode paths, the held
// logs and their way onto the card, as scenarios of steps run by one driver.
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/log_daemon.h"

namespace {

// "boot" mode: reboot in that boot mode; "kmsg" text: feed the kernel log;
// "ctl" command reply; "history" text: wait until recorded; "has" path text:
// wait until the file holds text; "gone" path: wait until it is gone; "lacks"
// path text. In paths $RUN is the run folder, $LAST the newest card folder.
struct Step {
    Step(const char* o, std::string x, std::string y = "", int ms = 40000) : op(o), a(x), b(y), wait_ms(ms) {}
    std::string op, a, b;
    int wait_ms;
};

struct Scenario {
    const char* name;
    std::vector<std::pair<std::string, std::string>> files;  // seeded into the image: path, content
    BootOptions options;
    std::vector<Step> steps;
};

void PrintTo(const Scenario& s, std::ostream* os) { *os << s.name; }

BootOptions mode(const char* boot_mode, int sdcard_mb = 0, int data_mb = 0, const char* ext_sdcard = "") {
    BootOptions o;
    o.boot_mode = boot_mode, o.sdcard_mb = sdcard_mb, o.data_mb = data_mb, o.ext_sdcard = ext_sdcard;
    return o;
}

const std::string N = "TavloLog in Normal\n";
const std::pair<std::string, std::string> kOn = {"/system/etc/qrvlog-config.prop", "com.quorvex.log.tavlo.enabled=true\n"};
const std::string kBig(3 << 20, 'x');

std::string expand(EmuPhone& phone, const std::string& path) {
    if (path[0] != '$') return path;
    std::string folder = run_folder(phone);
    if (path[1] == 'L') phone.exec({"sh", "-c", "ls -d " + std::string(kCardRoot) + "*/ | tail -n 1 | tr -d '\\n'"}, &folder);
    // The kelm boot's card is behind a link that the host cannot follow.
    if (folder.compare(0, 22, "/data/ext_sdcard_tool/") == 0) folder = "/mnt/sdcard2/" + folder.substr(22);
    return folder + path.substr(path.find('/') + 1);
}

class BootScenario : public ::testing::TestWithParam<Scenario> {};

TEST_P(BootScenario, Runs) {
    EmuPhone phone;
    for (const auto& f : GetParam().files) ASSERT_TRUE(phone.write_image_file(f.first, f.second));
    BootOptions options = GetParam().options;
    ASSERT_TRUE(phone.boot(options));
    int boots = 1;
    for (const Step& step : GetParam().steps) {
        SCOPED_TRACE(step.op + " " + step.a.substr(0, 60) + " " + step.b.substr(0, 60));
        auto file_has = [&] { return contains(phone.read_file(expand(phone, step.a)), step.b); };
        std::string out;
        if (step.op == "boot") {
            options.boot_mode = step.a;
            ASSERT_TRUE(phone.stop() && phone.boot(options));
            boots++;
        } else if (step.op == "kmsg") {
            ASSERT_TRUE(phone.write_kmsg(step.a + "\n"));
        } else if (step.op == "ctl") {
            // The boot path serves clients only once it is through.
            phone.exec({"sh", "-c", "until grep -q @tavlologd /proc/net/unix; do sleep 0.05; done"}, nullptr, "", 40000);
            ctl(phone, {step.a}, &out);
            ASSERT_EQ(step.b + "\n", out);
        } else if (step.op == "history") {
            ASSERT_TRUE(wait_history(phone, step.a, 1, step.wait_ms)) << history(phone);
        } else if (step.op == "has") {
            ASSERT_TRUE(EmuPhone::wait_for(file_has, step.wait_ms)) << phone.read_file(expand(phone, step.a)).substr(0, 400);
        } else if (step.op == "gone") {
            ASSERT_TRUE(EmuPhone::wait_for([&] { return !phone.file_exists(step.a); }, step.wait_ms));
        } else {
            ASSERT_FALSE(file_has());
        }
    }
    EXPECT_EQ(boots, daemon_starts(phone)) << "the daemon ended during the test";
}

INSTANTIATE_TEST_SUITE_P(
    Boot, BootScenario,
    ::testing::Values(
        Scenario{"CopyMovesTheRunAndTheHeldLogs", {kOn}, {},
                 {{"kmsg", "held line"}, {"has", "/data/log_temp/kernel_log", "held line"}, {"ctl", "copy", "copy,1"},
                  {"has", "$RUN/kernel_log.boot", N + kFileHeader + "held line\n"},
                  {"has", "$RUN/properties", "<< /data/misc/tqlog/tqlog_config >>:\nautostart=1\n"},
                  {"has", "$RUN/properties", "<< system properties >>\n"}, {"gone", "/data/log_temp"},
                  {"has", "/data/misc/tqlog/inter_sd_folder", "APLog_"}}},
        Scenario{"DataPathRecordsOnData", {{kOn.first, kOn.second + "qrvlog_path=/data\n"}}, {},
                 {{"history", "mkdir /data/qrvlog/tavlolog/APLog_"}, {"history", " M("}}},
        Scenario{"LowDataStartsNoRun", {kOn}, mode("0", 0, 8),
                 {{"history", "/data is low, dont start children process(2)"}, {"ctl", "stop", "stop,1"},
                  {"gone", "/data/log_temp"}, {"lacks", kHistory, " M("}}},
        Scenario{"FastPowerOffLogsComeBackAsHbr", {kOn}, {},
                 {{"ctl", "HBR_SHUTDOWN", "HBR_SHUTDOWN,1"}, {"kmsg", "hbr line"},
                  {"has", "/data/log_hbr/kernel_log", "hbr line"}, {"boot", "0"}, {"kmsg", "second boot"},
                  {"has", "/data/log_temp/kernel_log", "second boot"}, {"ctl", "stop", "stop,1"},
                  {"ctl", "deep_start", "deep_start,1"}, {"has", "$RUN/kernel_log.hbr", N + kFileHeader + "hbr line\n"},
                  {"has", "$RUN/kernel_log.boot", "second boot"}, {"gone", "/data/log_hbr"}}},
        Scenario{"OtherBootsKeepTwoEarlierAndComeInOrder", {kOn}, mode("7"),
                 {{"boot", "none"}, {"boot", "7"}, {"boot", "9"}, {"kmsg", "other 4"},
                  {"has", "/data/log_other_mode/4/kernel_log", "other 4"}, {"boot", "7"}, {"kmsg", "other 5"},
                  {"has", "/data/log_other_mode/5/kernel_log", "other 5"}, {"boot", "7"}, {"kmsg", "other 6"},
                  {"has", "/data/log_other_mode/6/kernel_log", "other 6"}, {"gone", "/data/log_other_mode/3"},
                  {"boot", "0"}, {"ctl", "stop", "stop,1"}, {"ctl", "start", "start,1"},
                  {"has", "$RUN/kernel_log.otherboot", "other 4\n" + N + kFileHeader + "other 5\n" + N + kFileHeader + "other 6\n"},
                  {"has", "$RUN/kernel_log.boot", N + kFileHeader}, {"gone", "/data/log_other_mode"}, {"gone", "/data/log_temp"}}},
        // A restart would fail the same way: the daemon serves without a run instead.
        Scenario{"OtherBootFolderThatCannotBeMadeLeavesNoRun", {kOn, {"/data/log_other_mode", "no folder"}}, mode("7"),
                 {{"history", "mkdir /data/log_other_mode/1/ failed"}, {"ctl", "start", "start,1"}}},
        Scenario{"KelmBootCardAfterAPlainFolder", {}, mode("1", 0, 0, "dir after 3 link"),
                 {{"history", "/data/ext_sdcard_tool is not a link, will delete it"},
                  {"history", "SDcard mounted! kelm copy!"}, {"has", "$RUN/kernel_log.kelm_boot", N + kFileHeader},
                  {"gone", "/data/log_temp/kernel_log"}, {"ctl", "stop", "stop,1"}}},
        Scenario{"KelmBootWithoutCardStops", {}, mode("1"),
                 {{"history", "kelm wait sd timeout! stop!"}, {"history", "tavlolog stop done"},
                  {"has", "/data/log_temp/kernel_log", kFileHeader}, {"ctl", "stop", "stop,1"}}},
        // About five minutes: the boot copy waits that long for a client.
        Scenario{"NoClientForFiveMinutesCopiesTheBootLogs", {kOn}, {},
                 {{"kmsg", "boot line"}, {"history", "select() timeout", "", 320000}, {"history", "boot copy complete!"},
                  {"has", "$LAST/kernel_log.boot", "boot line"}}},
        // The held log does not fit: its pieces stay in /data, nothing of them lands on the card.
        Scenario{"FullCardKeepsTheHeldLogs", {kOn}, mode("0", 2),
                 {{"kmsg", kBig + "end of held"}, {"has", "/data/log_temp/kernel_log", "end of held"},
                  {"ctl", "copy", "copy,1"}, {"history", "copy error! err:No space left on device"},
                  {"has", "/data/log_temp/kernel_log.1", kFileHeader + kBig.substr(0, 1000)},
                  {"has", "/data/log_temp/kernel_log", "end of held"}, {"lacks", "$RUN/kernel_log.boot", "x"},
                  {"ctl", "stop", "stop,1"}}}),
    [](const ::testing::TestParamInfo<Scenario>& info) { return info.param.name; });

}  // namespace
