// The control socket of the real daemon, driven from inside the phone: the
// commands and what they publish, configuration and when it applies, the ten
// client slots and the peers that are refused.
#include "tests/integration/log_daemon.h"

namespace {

const std::string H = kFileHeader;
const std::string kAsUid = "setpriv --reuid=$u --regid=$u --clear-groups tavlologctl ";
// An app binding the collectors' socket name: "bound" when it got it.
const std::string kSquatLogSocket =
    "setpriv --reuid=10050 --regid=10050 --clear-groups perl -MSocket -e 'socket(S, PF_UNIX, SOCK_STREAM, 0) or die;"
    " print bind(S, pack_sockaddr_un(\"\\0log_socket\")) ? \"bound\\n\" : \"refused\\n\"'";

std::vector<Step> ten_clients() {
    std::vector<Step> steps;
    for (char c = '0'; c <= '9'; c++) steps.push_back({"listen", std::string("c") + c, ""});
    return steps;
}

SCENARIOS(Control, {
    {"StartAndStopPublishTheRunAndRepeatsChangeNothing", {}, {},
     {{"ctl", "start"}, {"prop", "debug.TQ.running", "1"}, {"is", "/dev/emu/oru_calls", "-m 3\n"},
      {"has", "$RUN/tqlog_history", "kernel_log, fd = "}, {"ctl", "start"},
      {"hist", "tqlog already running, why send start"}, {"hist", " M(", "1"}, {"ctl", "stop"},
      {"prop", "debug.TQ.running", "0"}, {"is", "/dev/emu/oru_calls", "-m 3\n-m 4\n"}, {"ctl", "stop"},
      {"hist", "tavlolog already stopped, ignore this stop", "1"}, {"hist", "tavlolog stop done", "1"}}},
    {"InternalBuildUsesItsOwnEngineModes", {{"/system/build.prop", "ro.build.type=user\nro.oru.build.info=internal\n"}}, {},
     {{"ctl", "start stop"}, {"is", "/dev/emu/oru_calls", "-m 1\n-m 2\n"}}},
    {"EngBuildLeavesTheEngineAlone", {{"/system/build.prop", "ro.build.type=eng\n"}}, {},
     {{"ctl", "start stop"}, {"is", "/dev/emu/oru_calls", ""}, {"hist", "init oru mode:", "0"}}},
    // A message without its terminating byte loses its last byte; a start
    // without its folder fails and leaves nothing behind.
    {"OddStartsChangeNothing", {}, {},
     {{"sh", "tavlologctl --raw start", "star,1\n"}, {"hist", "star is not a valid configure"},
      {"sh", "touch /mnt/sdcard/qrvlog"}, {"ctl", "start", "start,0\n"}, {"hist", "fails at last"},
      {"prop", "debug.TQ.running", "0"}, {"hist", " M(", "0"}, {"is", "/dev/emu/oru_calls", ""},
      {"sh", "rm /mnt/sdcard/qrvlog"}, {"ctl", "start"}}},
    {"ConfigurationIsStoredAndAppliesFromTheNextStart", {}, {},
     {{"ctl", "AndroidLog=0 BTLog=0 start"}, {"kmsg", "before the change\n"},
      {"has", "$RUN/kernel_log", "before the change\n"}, {"ctl", "KernelLog=0 sublog_BTLog=1"},
      {"has", kConfig, "\nKernelLog=0\n"}, {"has", kConfig, "\nBTLog=1\n"}, {"lacks", kConfig, "sublog"},
      {"kmsg", "during the run\n"}, {"has", "$RUN/kernel_log", "during the run\n"}, {"ctl", "stop start"},
      // Only the Bluetooth type is on now: its five files share the 300 MB.
      {"hist", "K(0),B("}, {"prop", "debug.TQ.logsize", "61440"}}},
    {"CopyStartsARunThenMovesItOnceWithItsCollector", {}, {},
     {{"ctl", "AndroidLog=0 BTLog=0 copy"}, {"hist", "start tavlolog when recv copy"},
      {"prop", "debug.TQ.running", "1"}, {"mark"}, {"kmsg", "in the first folder\n"},
      {"has", "$MARK/kernel_log", "in the first folder\n"},
      // Folder names go by the second: the move needs a later one.
      {"sh", "s=$(date +%s); while [ $(date +%s) = $s ]; do sleep 0.05; done"}, {"ctl", "copy"},
      {"hist", "copy to sdcard!"}, {"kmsg", "in the second folder\n"},
      {"is", "$RUN/kernel_log", H + "in the second folder\n"}, {"is", "$MARK/kernel_log", H + "in the first folder\n"},
      {"hist", " M(", "1"}, {"ctl", "copy"}, {"hist", "has copyed to sd,ignore this 'copy'"}}},
    {"TenClientsAreServedAndTheEleventhIsClosedAtOnce", {}, {},
     [] {
         std::vector<Step> s = ten_clients();
         s.insert(s.end(), {{"sh", "tavlologctl start; echo $?", "2\n"}, {"hist", "no free slot for client uid 0 pid "},
                            {"hist", "new client,fd:", "10"}, {"prop", "debug.TQ.running", "0"},
                            // A client that leaves frees its slot; the others stay.
                            {"end", "c3"}, {"hist", "exception when handle message, close client"},
                            {"ctl", "start"}, {"alive", "c0"}, {"alive", "c9"}});
         return s;
     }()},
    // The daemon holds "log_socket" from its start to its end, runs or not.
    {"AnAppCannotTakeTheCollectorsSocket", {}, {},
     {{"sh", kSquatLogSocket, "refused\n"}, {"ctl", "AndroidLog=0 BTLog=0 start stop"},
      {"sh", kSquatLogSocket, "refused\n"}, {"ctl", "start"}, {"kmsg", "recorded\n"},
      {"has", "$RUN/kernel_log", "recorded\n"}}},
    // Refusals are recorded within a limit: the first, then a summary.
    {"OnlyPrivilegedUsersAreServed", {}, {},
     {{"sh", "for u in 12345 10000 9999 1000 2000 0; do " + kAsUid + "logsize=300; echo $?; done",
       "2\n2\n2\nlogsize=300,1\n0\nlogsize=300,1\n0\nlogsize=300,1\n0\n"},
      {"sh", "u=12345; " + kAsUid + "start; echo $?", "2\n"}, {"hist", "refuse client uid ", "1"},
      {"hist", "refuse client uid 12345 pid "}, {"hist", "3 more refused control clients not recorded"},
      {"hist", "recv 'logsize=300'", "3"}, {"hist", "recv 'start'", "0"}, {"prop", "debug.TQ.running", "0"}}},
});

}  // namespace
