// A logging run with all five collectors on the emulated phone: what the
// phone's writers put into the logger devices, the kernel log and the
// Bluetooth log service lands once in its file, as threadtime lines in time
// order for the Android logs, and the stop takes everything written before it.
#include <stdio.h>
#include <string.h>

#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tests/integration/emu_phone.h"
#include "tests/integration/log_daemon.h"

namespace {

std::vector<std::string> lines_of(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
}

// "MM-DD HH:MM:SS.mmm  pid  tid P tag: message", as the platform library renders it.
bool is_threadtime(const std::string& line) {
    int f[8], used = 0;
    char priority;
    return sscanf(line.c_str(), "%2d-%2d %2d:%2d:%2d.%3d %d %d %c %n", &f[0], &f[1], &f[2], &f[3], &f[4], &f[5],
                  &f[6], &f[7], &priority, &used) == 9 &&
           used > 0 && strchr("VDIWEF", priority) != nullptr && line.find(": ", used) != std::string::npos;
}

std::string numbered(const std::string& word, int n) {
    std::string text;
    for (int i = 0; i < n; i++) text += word + " " + std::to_string(i) + "\n";
    return text;
}

TEST(AllCollectors, EveryEntryLandsOnceInItsFileAndTheStopTakesThemAll) {
    EmuPhone phone;
    ASSERT_TRUE(phone.boot());
    std::string out;
    ASSERT_EQ(0, ctl(phone, {"start"}, &out));
    std::string folder = run_folder(phone);
    int pids[5];
    ASSERT_TRUE(collector_pids(phone, pids));
    for (int pid : pids) EXPECT_GT(pid, 0);

    // Kernel and Bluetooth bytes pass through relays of the phone: wait for them.
    std::string bt;
    for (int i = 0; i < 600; i++) bt.push_back(static_cast<char>(i % 256));
    ASSERT_TRUE(phone.write_btlog(bt));
    ASSERT_TRUE(phone.write_kmsg("<6>kernel line\n"));
    EXPECT_TRUE(EmuPhone::wait_for([&] {
        return phone.read_file(folder + "bt_log").size() > bt.size() &&
               contains(phone.read_file(folder + "kernel_log"), "kernel line");
    }));

    // The Android entries are written right before the stop.
    const struct {
        std::vector<std::string> args;
        std::string input;
    } writes[] = {
        {{"log", "-t", "demo", "hello"}, ""},
        {{"log", "-b", "system", "-t", "sys"}, numbered("system", 300)},
        {{"log", "-t", "num"}, numbered("main", 300)},
        {{"log", "-b", "radio", "-t", "rad"}, numbered("radio", 100)},
        {{"log", "-b", "events", "-t", "1000001", "i:42"}, ""},
        {{"log", "-b", "events", "-t", "1000003", "i:3", "s:lbl"}, ""},
    };
    for (const auto& w : writes) ASSERT_EQ(0, phone.exec(w.args, nullptr, w.input)) << w.args[1];
    ASSERT_EQ(0, ctl(phone, {"stop"}, &out));

    bool header = false;
    std::string main_log = body_of(phone.read_file(folder + "main_log"), &header);
    EXPECT_TRUE(header);
    std::vector<std::string> lines = lines_of(main_log);
    ASSERT_FALSE(lines.empty());
    EXPECT_EQ("--------- beginning of /dev/log/main", lines[0]);
    EXPECT_EQ(1, count(main_log, "--------- beginning of /dev/log/system\n"));
    std::string previous;
    for (const std::string& line : lines) {
        if (line.rfind("--------- beginning of ", 0) == 0) continue;
        EXPECT_TRUE(is_threadtime(line)) << line;
        EXPECT_LE(previous, line.substr(0, 18)) << "out of time order: " << line;
        previous = line.substr(0, 18);
    }
    EXPECT_EQ(1, count(main_log, " I demo    : hello\n"));
    for (int i = 0; i < 300; i++) {
        EXPECT_EQ(1, count(main_log, ": main " + std::to_string(i) + "\n")) << i;
        EXPECT_EQ(1, count(main_log, ": system " + std::to_string(i) + "\n")) << i;
    }
    std::string radio_log = body_of(phone.read_file(folder + "radio_log"));
    for (int i = 0; i < 100; i++) EXPECT_EQ(1, count(radio_log, ": radio " + std::to_string(i) + "\n")) << i;
    std::string events_log = body_of(phone.read_file(folder + "events_log"));
    EXPECT_EQ(1, count(events_log, " I tavlo_demo_int: 42\n")) << events_log;
    EXPECT_EQ(1, count(events_log, " I tavlo_demo_list: [3,lbl]\n")) << events_log;
    EXPECT_TRUE(same_bytes(body_of(phone.read_file(folder + "bt_log")), bt));
    EXPECT_EQ("<6>kernel line\n", body_of(phone.read_file(folder + "kernel_log")));

    EXPECT_FALSE(contains(history(phone), "dies unexpectly")) << history(phone);
    EXPECT_EQ(1, daemon_starts(phone)) << "the daemon ended during the test";
}

}  // namespace
