#include "tests/integration/log_daemon.h"

#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <sstream>

bool contains(const std::string& text, const std::string& needle) { return text.find(needle) != std::string::npos; }

int count(const std::string& text, const std::string& needle) {
    int n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) n++;
    return n;
}

std::string history(const EmuPhone& phone) { return phone.read_file(kHistory); }

bool ctl(EmuPhone& phone, const std::string& commands, std::string* out) {
    // One shell for all of them: each exec into the phone costs a fraction of
    // a second. A boot that holds its logs serves clients only once through.
    std::string script = "until grep -q @tavlologd /proc/net/unix; do sleep 0.05; done";
    std::string expected, word, got;
    for (std::istringstream in(commands); in >> word;) script += "; tavlologctl " + word, expected += word + ",1\n";
    phone.exec({"sh", "-c", script}, &got);
    if (out != nullptr) *out = got;
    return got == expected;
}

std::string run_folder(const EmuPhone& phone) { return phone.getprop("debug.TQ.realpath"); }

std::string kill_kernel_collector(const std::string& signal) {
    // The collectors' pids are recorded as "M(%d),R(%d),E(%d),K(%d),B(%d)".
    return "kill -" + signal + " $(grep -o 'K([0-9]*)' " + kHistory + " | tail -n 1 | tr -dc 0-9)";
}

std::string numbered_lines(const std::string& tag, int first, int n, int length) {
    std::string text;
    char line[256];
    length = std::min(std::max(length, 24), static_cast<int>(sizeof(line)) - 1);
    for (int i = first; i < first + n; i++) {
        int used = std::min(snprintf(line, sizeof(line), "%s line %07d ", tag.c_str(), i), length - 1);
        for (int j = used; j < length - 1; j++) line[j] = static_cast<char>('a' + (i + j) % 26);
        line[length - 1] = '\n';
        text.append(line, static_cast<size_t>(length));
    }
    return text;
}

::testing::AssertionResult same_bytes(const std::string& actual, const std::string& expected) {
    size_t at = std::mismatch(actual.begin(), actual.begin() + std::min(actual.size(), expected.size()),
                              expected.begin()).first - actual.begin();
    if (actual == expected) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << actual.size() << " bytes where " << expected.size()
                                         << " were expected; first difference at offset " << at << ": got \""
                                         << actual.substr(at, 40) << "\", expected \"" << expected.substr(at, 40)
                                         << "\"";
}

namespace {

const int kWaitMs = 30000;  // only a failing step waits this long

std::string expand(EmuPhone& phone, const std::string& path, const std::string& mark) {
    if (path.empty() || path[0] != '$') return path;
    std::string folder = path[1] == 'M' ? mark : run_folder(phone);
    if (path[1] == 'L')
        phone.exec({"sh", "-c", "ls -d /mnt/sdcard/qrvlog/tavlolog/*/ | tail -n 1 | tr -d '\\n'"}, &folder);
    // The kelm boot's card is behind a link that the host cannot follow.
    if (folder.compare(0, 22, "/data/ext_sdcard_tool/") == 0) folder = "/mnt/sdcard2/" + folder.substr(22);
    return folder + path.substr(path.find('/') + 1);
}

// Files of the daemon's own folder are seeded as the daemon would have made them.
bool seed(EmuPhone& phone, const std::string& path, const std::string& content) {
    bool own = path.compare(0, 17, "/data/misc/tqlog/") == 0;
    if (!phone.write_image_file(path, content, own ? 0600 : 0644)) return false;
    std::string file = phone.host_path(path), dir = file.substr(0, file.rfind('/'));
    return !own || (chown(dir.c_str(), 2000, 1000) == 0 && chmod(dir.c_str(), 0700) == 0 &&
                    chown(file.c_str(), 2000, 1000) == 0);
}

}  // namespace

void run_scenario(const Scenario& scenario) {
    EmuPhone phone;
    for (const auto& f : scenario.files) ASSERT_TRUE(seed(phone, f.first, f.second)) << f.first;
    std::vector<std::string> options = scenario.boot;
    ASSERT_TRUE(phone.boot(options));
    int starts = 1;
    std::map<std::string, std::unique_ptr<EmuProcess>> clients;
    std::string mark;
    for (const Step& step : scenario.steps) {
        SCOPED_TRACE(step.op + " " + step.a.substr(0, 60) + " " + step.b.substr(0, 60));
        const std::string& op = step.op;
        std::string path = expand(phone, step.a, mark), out;
        auto file_has = [&] { return contains(phone.read_file(path), step.b); };
        auto hist_has = [&](int times) { return count(history(phone), step.a) >= times; };
        int times = step.b.empty() ? 1 : atoi(step.b.c_str());
        if (op == "boot") {
            auto mode = std::find(options.begin(), options.end(), "--boot-mode");
            if (mode == options.end()) mode = options.insert(options.end(), {"--boot-mode", ""});
            mode[1] = step.a;
            ASSERT_TRUE(phone.stop() && phone.boot(options));
            starts++;
        } else if (op == "crash") {
            int banners = count(history(phone), "TQLOG START");
            ASSERT_EQ(0, phone.exec({"kill", "-9", std::to_string(phone.daemon_pid())}));
            ASSERT_TRUE(EmuPhone::wait_for([&] { return count(history(phone), "TQLOG START") > banners; }));
            starts++;
        } else if (op == "ctl") {
            bool all_done = ctl(phone, step.a, &out);
            EXPECT_TRUE(step.b.empty() ? all_done : out == step.b) << out;
        } else if (op == "sh") {
            phone.exec({"sh", "-c", step.a}, &out);
            EXPECT_EQ(step.b, out);
        } else if (op == "kmsg" || op == "btlog") {
            ASSERT_TRUE(phone.feed(op.c_str(), step.a, 30000));
        } else if (op == "hist") {
            EXPECT_TRUE(times == 0 || EmuPhone::wait_for([&] { return hist_has(times); }, kWaitMs)) << history(phone);
            if (!step.b.empty()) {
                EXPECT_EQ(times, count(history(phone), step.a)) << history(phone);
            }
        } else if (op == "wait") {
            EXPECT_TRUE(EmuPhone::wait_for([&] { return hist_has(1); }, times * 1000)) << history(phone);
        } else if (op == "has" || op == "is") {
            EXPECT_TRUE(EmuPhone::wait_for([&] { return op == "has" ? file_has() : phone.read_file(path) == step.b; }, kWaitMs))
                << path << ": " << same_bytes(phone.read_file(path), step.b).message();
        } else if (op == "lacks") {
            EXPECT_FALSE(file_has()) << path;
        } else if (op == "gone") {
            EXPECT_TRUE(EmuPhone::wait_for([&] { return !phone.file_exists(path); }, kWaitMs)) << path;
        } else if (op == "prop") {
            EXPECT_TRUE(EmuPhone::wait_for([&] { return phone.getprop(step.a) == step.b; })) << phone.getprop(step.a);
        } else if (op == "mark") {
            mark = run_folder(phone);
        } else if (op == "listen" || op == "spawn") {
            // A listener is ready once its reply came, or the daemon recorded it.
            int clients_seen = count(history(phone), "new client,fd:");
            std::vector<std::string> args = {"tavlologctl", "--listen"};
            if (!step.b.empty()) args.insert(args.end(), {"--send", step.b});
            if (op == "spawn") args.clear();
            for (std::istringstream in(step.b); op == "spawn" && in >> out;) args.push_back(out);
            auto& client = clients[step.a] = phone.spawn(args);
            ASSERT_TRUE(client && (op == "spawn" || (step.b.empty() ? EmuPhone::wait_for([&] {
                                       return count(history(phone), "new client,fd:") > clients_seen;
                                   }) : client->read_until("\n"))));
        } else if (op == "hear") {
            EXPECT_TRUE(clients[step.a]->read_until(step.b)) << clients[step.a]->output();
        } else if (op == "closed") {
            EXPECT_EQ(0, clients[step.a]->wait());
        } else if (op == "end") {
            clients[step.a]->kill();
        } else if (op == "alive") {
            EXPECT_EQ(-1, clients[step.a]->wait(0));
        } else {
            FAIL() << "unknown step " << op;
        }
        if (::testing::Test::HasFailure()) return;  // later steps build on this one
    }
    EXPECT_EQ(starts, count(phone.read_file("/dev/emu/init.log"), "start tavlo_log_d pid "))
        << "the daemon ended during the test";
}
