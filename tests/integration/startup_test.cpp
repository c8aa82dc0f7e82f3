// Start-up of the real daemon: its identity, the configuration it creates or
// loads, a second copy started by hand, and a restart after a crash.
#include "tests/integration/log_daemon.h"

namespace {

const char kDefaults[] = "/system/etc/qrvlog-config.prop";

SCENARIOS(Startup, {
    {"FreshPhoneGetsBannerDefaultsAndTheDaemonsIdentity", {}, {},
     {{"hist", " ****** TQLOG START *******\n"}, {"hist", " boot mode: 0\n"},
      {"hist", "boot:0,path:/mnt/sdcard,size:300,Tsize:600,A:1,K:1,B:1"},
      {"is", kConfig, "autostart=0\nlogpath=internal_sd\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=1\ntotallogsize=600\n"},
      {"sh", std::string("stat -c %a ") + kConfig + " " + kHistory, "600\n664\n"},
      // Its own user and groups (listed sorted) and, of all capabilities, CAP_SYSLOG.
      {"sh", "grep -E '^(Uid|Gid|Groups|CapPrm|CapEff):' /proc/$(cat /dev/emu/daemon.pid)/status | sed 's/ *$//'",
       "Uid:\t2000\t2000\t2000\t2000\nGid:\t1000\t1000\t1000\t1000\nGroups:\t1000 1001 1007 1015 1023 1028 2001 9998\n"
       "CapPrm:\t0000000400000000\nCapEff:\t0000000400000000\n"}}},
    {"FirstBootTranslatesTheSystemDefaults",
     {{kDefaults, "# maker defaults\ncom.quorvex.log.tavlo.enabled=true\ncom.quorvex.log.tavlo.maxsize=500\n"
                  "qrvlog_path = external_sd\nsome.other.key=1\n"}}, {},
     {{"is", kConfig, "autostart=1\nlogpath=external_sd\nlogsize=500\nAndroidLog=1\nKernelLog=1\nBTLog=1\ntotallogsize=600\n"},
      {"hist", "boot:1,path:/mnt/sdcard2,size:500"}}},
    {"RebootLoadsTheStoredConfigurationInsteadOfTheDefaults", {}, {},
     {{"sh", std::string("printf 'logsize=120\\nKernelLog=0\\nlogpath=/data\\n' > ") + kConfig +
                 "; echo com.quorvex.log.tavlo.maxsize=999 > " + kDefaults},
      {"boot", "0"}, {"hist", "TQLOG START", "2"}, {"hist", "boot:0,path:/data,size:120,Tsize:600,A:1,K:0,B:1"}}},
    // Started as the shell user, a second daemon records that it is not root,
    // then finds "tavlologd" taken and waits for it.
    {"AsAnotherUserRecordsItAndGoesOn", {}, {},
     {{"spawn", "second", "setpriv --reuid 2000 --regid 1000 --clear-groups /system/bin/tavlo_log_d"},
      {"hist", "create socket 'tavlologd' failed"}, {"hist", "[== First Log ==] tavlo_log_d is not in root user"},
      {"hist", "TQLOG START", "2"},
      {"has", "/dev/emu/wlog", "TavloLogD/DEBUG: [== First Log ==] tavlo_log_d is not in root user"}}},
    // The daemon that init starts after a crash in a run neither sees a live
    // run nor writes into the dead run's folder.
    {"RestartForgetsTheDeadRun", {}, {},
     {{"ctl", "logpath=/data start"}, {"mark"}, {"crash"}, {"hist", "boot:0,path:/data", "2"},
      {"prop", "debug.TQ.realpath", ""}, {"prop", "debug.TQ.running", "0"},
      {"lacks", "$MARK/tqlog_history", "boot:0,path:/data"}}},
});

}  // namespace
