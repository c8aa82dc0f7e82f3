// Driving the daemon of an emulated phone: its commands through tavlologctl,
// its history and run folders, and scenarios written as data run by one driver.
#pragma once

#include <memory>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"

constexpr char kHistory[] = "/data/misc/tqlog/tqlog_history";  // the daemon's central history
constexpr char kConfig[] = "/data/misc/tqlog/tqlog_config";    // its configuration file
constexpr char kFileHeader[] = "-----timezone: GMT\n";          // first line of every log file

bool contains(const std::string& text, const std::string& needle);
int count(const std::string& text, const std::string& needle);
std::string history(const EmuPhone& phone);
// Runs each space-separated command with tavlologctl once the daemon serves;
// true when every one was answered ",1".
bool ctl(EmuPhone& phone, const std::string& commands, std::string* out = nullptr);
// The property debug.TQ.realpath: the running (or last) run's folder.
std::string run_folder(const EmuPhone& phone);
// A shell command that signals the running kernel collector.
std::string kill_kernel_collector(const std::string& signal);
// Lines "<tag> line NNNNNNN ...\n" numbered from first, each length bytes
// (at least 24): a stream in which a lost, doubled or torn line shows.
std::string numbered_lines(const std::string& tag, int first, int n, int length = 64);
// Byte-exact comparison that says where the two first differ.
::testing::AssertionResult same_bytes(const std::string& actual, const std::string& expected);

// One step of a scenario. In paths, $RUN/ is the run folder, $MARK/ the one
// saved by the last "mark" step, $LAST/ the newest folder on the card.
//   boot MODE          power off, boot again in that boot mode
//   crash              kill the daemon, wait until init has started it again
//   ctl CMDS [REPLY]   tavlologctl, each command answered ",1" or REPLY exactly
//   sh CMD [OUT]       a shell command as root; its output must be OUT
//   kmsg|btlog BYTES   feed the kernel log or the Bluetooth log service
//   hist TEXT [N]      the history holds TEXT (waited for); with N, exactly N times
//   wait TEXT S        the history holds TEXT within S seconds
//   has PATH TEXT      the file holds TEXT (waited for); "is": it is exactly TEXT
//   lacks PATH TEXT    the file does not hold TEXT; "gone PATH": it is gone (waited for)
//   prop NAME VALUE    the property has VALUE (waited for)
//   mark               save the run folder as $MARK
//   listen NAME [CMD]  a `tavlologctl --listen` client, sending CMD when given
//   spawn NAME ARGS    a process inside the phone, its arguments space-separated
//   hear NAME TEXT     the client is told TEXT; "closed NAME": it was closed,
//                      "alive NAME": it is still connected, "end NAME": kill it
struct Step {
    Step(std::string o, std::string x = "", std::string y = "") : op(std::move(o)), a(std::move(x)), b(std::move(y)) {}
    std::string op, a, b;
};

struct Scenario {
    const char* name;
    std::vector<std::pair<std::string, std::string>> files;  // seeded before the boot: path, content
    std::vector<std::string> boot;                          // tavlo-emu boot options
    std::vector<Step> steps;
};

inline void PrintTo(const Scenario& s, std::ostream* os) { *os << s.name; }

// Boots a phone, runs the steps, and checks that the daemon never ended
// behind the test's back.
void run_scenario(const Scenario& scenario);

#define SCENARIOS(Suite, ...)                                                               \
    class Suite : public ::testing::TestWithParam<Scenario> {};                             \
    TEST_P(Suite, Runs) { run_scenario(GetParam()); }                                      \
    INSTANTIATE_TEST_SUITE_P(Of, Suite, ::testing::ValuesIn(std::vector<Scenario>(__VA_ARGS__)), \
                             [](const ::testing::TestParamInfo<Scenario>& i) { return std::string(i.param.name); })
