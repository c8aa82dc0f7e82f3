// Driving the daemon of an emulated phone from an integration test: its
// commands through tavlologctl inside the phone, its history, its run folders
// and the kernel-log stream. Every wait polls; nothing sleeps a fixed time.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"

constexpr char kHistory[] = "/data/misc/tqlog/tqlog_history";  // the daemon's central history
constexpr char kConfig[] = "/data/misc/tqlog/tqlog_config";    // its configuration file
constexpr char kCardRoot[] = "/mnt/sdcard/qrvlog/tavlolog/";   // run folders on the internal card
constexpr char kFileHeader[] = "-----timezone: GMT\n";          // first line of every log file

bool contains(const std::string& text, const std::string& needle);
int count(const std::string& text, const std::string& needle);

// tavlologctl with args inside the phone, as root. Returns its exit status
// (0 on a ",1" reply, 1 on ",0", 2 when it got no reply); stdout in *out.
int ctl(EmuPhone& phone, const std::vector<std::string>& args, std::string* out = nullptr);

// Sends each key=value message in turn; true when every one was answered ",1".
bool configure(EmuPhone& phone, const std::vector<std::string>& settings);

std::string history(const EmuPhone& phone);

// How often the phone's init has started the daemon: more than once means it
// ended (crashed) and was restarted behind the test's back.
int daemon_starts(const EmuPhone& phone);
// The phone's platform log: one "time pid tid priority tag: message" line per record.
std::string platform_log(const EmuPhone& phone);

// For each line of text that holds needle, what follows it on that line.
std::vector<std::string> after_each(const std::string& text, const std::string& needle);

// The values the daemon recorded after record ("recv efd_chld ") in its
// history, in order; *same is set when the platform log shows the same values
// (it may lag the history by the record being written just now).
std::vector<std::string> recorded_values(const EmuPhone& phone, const std::string& record,
                                         bool* same);

// Waits until the central history holds needle at least times times.
bool wait_history(const EmuPhone& phone, const std::string& needle, int times = 1,
                  int timeout_ms = 10000);

// The central history after the last occurrence of needle ("" when none).
std::string history_since_last(const EmuPhone& phone, const std::string& needle);

// The collector pids of the last "M(%d),R(%d),E(%d),K(%d),B(%d)" record, in
// that order; false when there is none.
bool collector_pids(const EmuPhone& phone, int pids[5]);

// Names of the run folders ("APLog_...") under <card>/qrvlog/tavlolog/, sorted.
std::vector<std::string> run_folders(const EmuPhone& phone,
                                     const std::string& card = "/mnt/sdcard");

// True when name is "APLog_" followed by a time as %Y_%m%d_%H%M%S and a slash.
bool is_run_folder_name(const std::string& name);

// The property debug.TQ.realpath: the running (or last) run's folder.
std::string run_folder(const EmuPhone& phone);

// A file's content after its header line; "" with *ok false when the file
// does not begin with the header.
std::string body_of(const std::string& file, bool* ok = nullptr);

// `tavlologctl --listen` (with `--send send` when given), once the daemon has
// taken it into a client slot; nullptr when it did not get there.
std::unique_ptr<EmuProcess> connect_listener(EmuPhone& phone, const std::string& send = "");

// Lines "<tag> line NNNNNNN ...\n" numbered from first, each of length bytes
// (at least 24): a stream in which a lost, doubled or torn line shows.
std::string numbered_lines(const std::string& tag, int first, int n, int length = 64);

// Byte-exact comparison that reports where the two first differ, with a short
// excerpt of each, instead of printing megabytes.
::testing::AssertionResult same_bytes(const std::string& actual, const std::string& expected);

// True when part is the first part.size() bytes of whole.
bool is_prefix(const std::string& part, const std::string& whole);
// True when part is the last part.size() bytes of whole.
bool is_suffix(const std::string& part, const std::string& whole);
