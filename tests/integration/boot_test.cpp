// Recording from boot: the boot-mode paths, the logs held in /data and their
// way onto the card, and a fast power-off.
#include "tests/integration/log_daemon.h"

namespace {

const std::string N = "TavloLog in Normal\n";
const std::string H = kFileHeader;
const std::pair<std::string, std::string> kOn = {"/system/etc/qrvlog-config.prop", "com.quorvex.log.tavlo.enabled=true\n"};
const std::string kBig(3 << 20, 'x');

SCENARIOS(Boot, {
    {"CopyMovesTheRunAndTheHeldLogs", {kOn}, {},
     {{"kmsg", "held line\n"}, {"has", "/data/log_temp/kernel_log", "held line"}, {"ctl", "copy"},
      {"has", "$RUN/kernel_log.boot", N + H + "held line\n"},
      {"has", "$RUN/properties", "<< /data/misc/tqlog/tqlog_config >>:\nautostart=1\n"},
      {"has", "$RUN/properties", "<< system properties >>\n"}, {"gone", "/data/log_temp"},
      {"has", "/data/misc/tqlog/inter_sd_folder", "APLog_"}}},
    {"DataPathRecordsOnData", {{kOn.first, kOn.second + "qrvlog_path=/data\n"}}, {},
     {{"hist", "mkdir /data/qrvlog/tavlolog/APLog_"}, {"hist", " M("}}},
    // init restarts a crashed daemon within the boot: what it held stays; a
    // boot that ends before any copy has its held logs brought by the next one.
    {"RestartOrRebootBeforeACopyKeepsTheHeldLogs", {kOn}, {},
     {{"kmsg", "before the crash\n"}, {"has", "/data/log_temp/kernel_log", "before the crash"}, {"crash"},
      {"kmsg", "after\n"}, {"has", "/data/log_temp/kernel_log", "before the crash\n" + H + "after\n"},
      {"boot", "0"}, {"hist", "held logs of the previous boot kept in /data/log_temp_prev/"},
      {"kmsg", "next boot\n"}, {"has", "/data/log_temp/kernel_log", "next boot"}, {"ctl", "copy"},
      {"is", "$RUN/kernel_log.prev_boot", N + H + "before the crash\n" + H + "after\n"},
      {"has", "$RUN/kernel_log.boot", N + H + "next boot\n"}, {"gone", "/data/log_temp_prev"}}},
    {"LowDataStartsNoRun", {kOn}, {"--data-size", "8"},
     {{"hist", "/data is low, dont start children process(2)"}, {"ctl", "stop"}, {"gone", "/data/log_temp"},
      {"hist", " M(", "0"}}},
    // The run goes on into /data, every client is closed, and the next boot
    // brings those logs to the card.
    {"FastPowerOffLogsComeBackAsHbr", {}, {},
     {{"ctl", "AndroidLog=0 BTLog=0"}, {"listen", "starter", "deep_start"}, {"has", kConfig, "autostart=1\n"},
      {"listen", "bystander"}, {"mark"}, {"kmsg", "before the power-off\n"},
      {"has", "$MARK/kernel_log", "before the power-off\n"}, {"ctl", "HBR_SHUTDOWN"}, {"closed", "starter"},
      {"closed", "bystander"}, {"prop", "debug.TQ.realpath", "/data/log_hbr/"}, {"kmsg", "hbr line\n"},
      {"is", "/data/log_hbr/kernel_log", H + "hbr line\n"}, {"is", "$MARK/kernel_log", H + "before the power-off\n"},
      {"boot", "0"}, {"kmsg", "second boot\n"}, {"has", "/data/log_temp/kernel_log", "second boot"},
      {"ctl", "stop"}, {"ctl", "deep_start"}, {"has", "$RUN/kernel_log.hbr", N + H + "hbr line\n"},
      {"has", "$RUN/kernel_log.boot", "second boot"}, {"gone", "/data/log_hbr"},
      // A power-off that was not followed through: logging ends at boot too.
      {"ctl", "deep_stop"}, {"prop", "debug.TQ.running", "0"}, {"has", kConfig, "autostart=0\n"}}},
    // A stray file gives way to the folders; every number up to the newest
    // two is removed (4 was made by hand), restarts within a boot go on in its folder.
    {"OtherBootsKeepTwoEarlierAndComeInOrder", {kOn, {"/data/log_other_mode", "stray"}}, {"--boot-mode", "7"},
     {{"hist", "/data/log_other_mode is not a folder, will delete it"}, {"sh", "mkdir /data/log_other_mode/4"},
      {"boot", "none"}, {"kmsg", "other 5\n"}, {"has", "/data/log_other_mode/5/kernel_log", "other 5"},
      {"boot", "9"}, {"kmsg", "other 6\n"}, {"has", "/data/log_other_mode/6/kernel_log", "other 6"},
      {"boot", "7"}, {"kmsg", "other 7\n"}, {"has", "/data/log_other_mode/7/kernel_log", "other 7"},
      {"crash"}, {"crash"}, {"kmsg", "restarted\n"}, {"has", "/data/log_other_mode/7/kernel_log", "restarted"},
      {"sh", "grep -o 'rm -r .*' /data/misc/tqlog/tqlog_history",
       "rm -r /data/log_other_mode/1\nrm -r /data/log_other_mode/2\nrm -r /data/log_other_mode/4\n"},
      {"boot", "0"}, {"ctl", "stop start"},
      {"has", "$RUN/kernel_log.otherboot", "other 5\n" + N + H + "other 6\n" + N + H + "other 7\n" + H + H + "restarted\n"},
      {"has", "$RUN/kernel_log.boot", N + H}, {"gone", "/data/log_other_mode"}, {"gone", "/data/log_temp"}}},
    // A restart would fail the same way: the daemon serves without a run instead.
    {"OtherBootFolderThatCannotBeMadeLeavesNoRun", {kOn, {"/data/log_other_mode/.keep", ""}}, {"--boot-mode", "7"},
     {{"hist", "mkdir /data/log_other_mode/1/ failed"}, {"ctl", "start"}}},
    {"KelmBootCardAfterAPlainFolder", {}, {"--boot-mode", "1", "--ext-sdcard", "dir after 3 link"},
     {{"hist", "/data/ext_sdcard_tool is not a link, will delete it"}, {"hist", "SDcard mounted! kelm copy!"},
      {"has", "$RUN/kernel_log.kelm_boot", N + H}, {"gone", "/data/log_temp/kernel_log"}, {"ctl", "stop"}}},
    {"KelmBootWithoutCardStops", {}, {"--boot-mode", "1"},
     {{"wait", "kelm wait sd timeout! stop!", "60"}, {"hist", "tavlolog stop done"},
      {"has", "/data/log_temp/kernel_log", H}, {"gone", "/data/log_temp/bt_log"}, {"ctl", "stop"}}},
    // About five minutes: the boot copy waits that long for a client.
    {"NoClientForFiveMinutesCopiesTheBootLogs", {kOn}, {},
     {{"kmsg", "boot line\n"}, {"wait", "select() timeout", "330"}, {"hist", "boot copy complete!"},
      {"has", "$LAST/kernel_log.boot", "boot line"}}},
    // The held log does not fit: its pieces stay in /data, none of them lands on the card.
    {"FullCardKeepsTheHeldLogs", {kOn}, {"--sdcard-size", "2"},
     {{"kmsg", kBig + "end of held\n"}, {"has", "/data/log_temp/kernel_log", "end of held"}, {"ctl", "copy"},
      {"hist", "copy error! err:No space left on device"},
      {"has", "/data/log_temp/kernel_log.1", H + kBig.substr(0, 1000)},
      {"has", "/data/log_temp/kernel_log", "end of held"}, {"lacks", "$RUN/kernel_log.boot", "x"},
      {"ctl", "stop"}}},
});

}  // namespace
