// The control socket served in-process by a fresh controller, talked to
// through the client library as a client on the phone would: configuration
// messages, framing of odd messages, commands that need no run, the client
// table, the peer check and the event counters.
#include "core/control_socket.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <vector>

#include "common/control_client.h"
#include "config/config_store.h"
#include "core/client_table.h"
#include "core/log_controller.h"
#include "platform/properties.h"

namespace {

const char kHistory[] = "/data/misc/tqlog/tqlog_history";
constexpr int kTimeoutMs = 5000;

// The seven settings with the Bluetooth log off, so that turning it on shows.
const char kBaseConfig[] =
    "autostart=0\n"
    "logpath=internal_sd\n"
    "logsize=300\n"
    "AndroidLog=1\n"
    "KernelLog=1\n"
    "BTLog=0\n"
    "totallogsize=600\n";

std::string read_file(const char* path) {
    std::string out;
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) return out;
    char buf[4096];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) out.append(buf, static_cast<size_t>(n));
    close(fd);
    return out;
}

void write_config(const std::string& content) {
    mkdir("/data/misc", 0771);
    mkdir(CONFIG_DIR, 0700);
    int fd = open(CONFIG_FILE, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(static_cast<ssize_t>(content.size()), write(fd, content.data(), content.size()));
    close(fd);
}

// The stored value of key, or "(none)".
std::string config_value(const std::string& key) {
    std::string all = read_file(CONFIG_FILE);
    size_t at = all.find(key + "=");
    while (at != std::string::npos && at != 0 && all[at - 1] != '\n')
        at = all.find(key + "=", at + 1);
    if (at == std::string::npos) return "(none)";
    size_t begin = at + key.size() + 1;
    return all.substr(begin, all.find('\n', begin) - begin);
}

bool history_has(const std::string& text) {
    return read_file(kHistory).find(text) != std::string::npos;
}

// Records written by the control thread after the reply (or on its own) need a moment.
bool wait_for_history(const std::string& text) {
    for (int waited = 0; waited < kTimeoutMs; waited += 10) {
        if (history_has(text)) return true;
        usleep(10000);
    }
    return false;
}

std::unique_ptr<ControlConnection> connect_client() {
    auto conn = std::make_unique<ControlConnection>();
    EXPECT_EQ(CC_OK, control_connect(conn.get(), kTimeoutMs));
    return conn;
}

// Sends raw bytes and returns the reply to them (or the error as text);
// `as` is the text the reply is expected to echo.
std::string exchange_raw(ControlConnection* conn, const std::string& bytes, const std::string& as) {
    int rc = control_send_raw(conn, bytes.data(), bytes.size(), kTimeoutMs);
    if (rc != CC_OK) return control_result_text(rc);
    char reply[CONTROL_REPLY_MAX + 1];
    rc = control_read_reply(conn, as.c_str(), reply, sizeof(reply), kTimeoutMs);
    return rc == CC_OK ? reply : control_result_text(rc);
}

std::string exchange(ControlConnection* conn, const char* cmd) {
    int rc = control_send(conn, cmd, kTimeoutMs);
    if (rc != CC_OK) return control_result_text(rc);
    char reply[CONTROL_REPLY_MAX + 1];
    rc = control_read_reply(conn, cmd, reply, sizeof(reply), kTimeoutMs);
    return rc == CC_OK ? reply : control_result_text(rc);
}

// True when the daemon has closed conn (nothing but the end of the stream follows).
bool closed_by_daemon(ControlConnection* conn) {
    char event[CONTROL_RECV_MAX];
    return control_next_event(conn, event, sizeof(event), kTimeoutMs) == CC_CLOSED;
}

int run(const std::string& command, std::string* output) {
    FILE* pipe = popen((command + " 2>&1").c_str(), "r");
    if (!pipe) return -1;
    char buf[512];
    output->clear();
    while (fgets(buf, sizeof(buf), pipe)) *output += buf;
    int status = pclose(pipe);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

class ControlSocketTest : public ::testing::Test {
  protected:
    void SetUp() override {
        write_config(kBaseConfig);
        // Lives as long as the process, as the daemon's controller does.
        controller = new LogController();
        // Not a normal boot: stop and deep_stop leave the exception engine alone.
        controller->boot_mode = 1;
    }
    void start() { start_control_socket(controller); }

    LogController* controller = nullptr;
};

}  // namespace

TEST_F(ControlSocketTest, ConfigurationMessages) {
    struct Case {
        const char* name;
        std::string bytes;   // exactly what the client writes
        std::string reply;   // the text before ",1"
        const char* key;     // setting to look at afterwards
        const char* value;   // its stored value afterwards
        const char* record;  // a history record that must appear, or nullptr
    } cases[] = {
        {"newline terminator", "KernelLog=0\n", "KernelLog=0", "KernelLog", "0",
         "recv 'KernelLog=0' from client"},
        {"NUL terminator", std::string("KernelLog=0\0", 12), "KernelLog=0", "KernelLog", "0",
         nullptr},
        {"sublog group prefix", std::string("sublog_BTLog=1\0", 15), "sublog_BTLog=1", "BTLog", "1",
         nullptr},
        {"sublog without underscore", std::string("sublogBTLog=1\0", 14), "sublogBTLog=1", "BTLog",
         "0", "sublogBTLog=1 is not a valid configure"},
        {"no equal sign", std::string("hello\0", 6), "hello", "BTLog", "0",
         "hello is not a valid configure"},
        {"start without terminator", "start", "star", "autostart", "0",
         "star is not a valid configure"},
        {"trailing spaces", std::string("logsize=200   \0", 15), "logsize=200", "logsize", "200",
         nullptr},
        {"leading spaces stay in the reply", std::string("  logsize=250\0", 14), "  logsize=250",
         "logsize", "250", nullptr},
        {"bytes after the NUL are ignored", std::string("AndroidLog=0\0start\0", 19),
         "AndroidLog=0", "AndroidLog", "0", nullptr},
        {"a second line is not stored", std::string("logsize=1\nlogpath=/x\0", 21),
         "logsize=1\nlogpath=/x", "logpath", "internal_sd",
         "logsize=1\\x0alogpath=/x is not a valid configure"},
        {"binary bytes", std::string("\x01\x02\xfe=\x03\0", 6), "\x01\x02\xfe=\x03", "BTLog", "0",
         "\\x01\\x02\xfe=\\x03 is not a valid configure"},
        {"value too long to store", "logpath=" + std::string(100, 'a') + '\0',
         "logpath=" + std::string(100, 'a'), "logpath", "internal_sd",
         "is not a valid configure (too long)"},
        {"unknown key", std::string("colour=blue\0", 12), "colour=blue", "logsize", "300",
         "update item colour=blue to cache failed"},
    };
    start();
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        write_config(kBaseConfig);
        auto conn = connect_client();
        EXPECT_EQ(c.reply + REPLY_DONE, exchange_raw(conn.get(), c.bytes, c.reply));
        EXPECT_EQ(c.value, config_value(c.key));
        if (c.record) {
            EXPECT_TRUE(history_has(c.record)) << read_file(kHistory);
        }
        EXPECT_FALSE(is_running());
    }
}

TEST_F(ControlSocketTest, InvalidMessagesLeaveTheFileAlone) {
    start();
    auto conn = connect_client();
    for (const char* cmd : {"sublogKernelLog=0", "KernelLog", "logpath=/a\x01", "=1"}) {
        EXPECT_EQ(std::string(cmd) + REPLY_DONE,
                  exchange_raw(conn.get(), std::string(cmd) + '\0', cmd));
    }
    EXPECT_EQ(kBaseConfig, read_file(CONFIG_FILE));
}

// One read takes at most 254 bytes: a longer message is cut there, its last
// byte dropped, and the rest comes as a message of its own.
TEST_F(ControlSocketTest, OverlongMessageIsReadInBoundedPieces) {
    start();
    auto conn = connect_client();
    std::string bytes(300, 'a');
    ASSERT_EQ(CC_OK, control_send_raw(conn.get(), bytes.data(), bytes.size(), kTimeoutMs));
    char reply[CONTROL_REPLY_MAX + 1];
    std::string first(CONTROL_MSG_MAX - 1, 'a');
    ASSERT_EQ(CC_OK,
              control_read_reply(conn.get(), first.c_str(), reply, sizeof(reply), kTimeoutMs));
    EXPECT_EQ(first + REPLY_DONE, reply);
    std::string second(300 - CONTROL_MSG_MAX - 1, 'a');
    ASSERT_EQ(CC_OK,
              control_read_reply(conn.get(), second.c_str(), reply, sizeof(reply), kTimeoutMs));
    EXPECT_EQ(second + REPLY_DONE, reply);
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));
}

TEST_F(ControlSocketTest, StopWhileStopped) {
    start();
    auto conn = connect_client();
    controller->log_path_state = 0;
    EXPECT_EQ("stop,1", exchange(conn.get(), "stop"));
    EXPECT_TRUE(history_has("tavlolog already stopped, ignore this stop"));
    EXPECT_EQ(-1, controller->log_path_state);
    // Anything after the word is ignored.
    EXPECT_EQ("stop,1", exchange(conn.get(), "stopnow"));
    EXPECT_EQ("0", config_value("autostart"));
}

TEST_F(ControlSocketTest, DeepStopTurnsBootLoggingOff) {
    write_config(std::string("autostart=1\n") + (kBaseConfig + strlen("autostart=0\n")));
    start();
    auto conn = connect_client();
    EXPECT_EQ("deep_stop,1", exchange(conn.get(), "deep_stop"));
    EXPECT_TRUE(history_has("tavlolog already stopped, ignore this stop"));
    // The setting changes after the reply; the next round trip waits for it.
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));
    EXPECT_EQ("0", config_value("autostart"));
}

// debug.TQ.running is the one record of the running state: with it set, the
// start commands answer without starting anything.
TEST_F(ControlSocketTest, CommandsWhileRunning) {
    start();
    ASSERT_EQ(0, property_set(PROP_RUNNING, "1"));
    controller->log_path_state = 1;
    auto conn = connect_client();
    EXPECT_EQ("start,1", exchange(conn.get(), "start"));
    EXPECT_TRUE(history_has("tqlog already running, why send start"));
    EXPECT_EQ("deep_start,1", exchange(conn.get(), "deep_start"));
    EXPECT_TRUE(history_has("tqlog already running, why send deep_start"));
    EXPECT_EQ("copy,1", exchange(conn.get(), "copy"));
    EXPECT_TRUE(history_has("has copyed to sd,ignore this 'copy'"));
    EXPECT_EQ("0", config_value("autostart"));
    ASSERT_EQ(0, property_set(PROP_RUNNING, "0"));
}

// A start whose folder cannot be made answers ",0" and drops the client.
TEST_F(ControlSocketTest, StartFailsWithoutFolder) {
    write_config(
        std::string(kBaseConfig).replace(12, strlen("logpath=internal_sd"), "logpath=/proc/tqlog"));
    ASSERT_EQ("/proc/tqlog", config_value("logpath"));
    start();
    for (const char* word : {"start", "deep_start", "copy"}) {
        SCOPED_TRACE(word);
        auto conn = connect_client();
        EXPECT_EQ(std::string(word) + REPLY_FAILED, exchange(conn.get(), word));
        EXPECT_TRUE(closed_by_daemon(conn.get()));
        EXPECT_FALSE(is_running());
    }
    EXPECT_TRUE(history_has("exception when handle message, close client"));
    // deep_start did not get as far as turning boot logging on.
    EXPECT_EQ("0", config_value("autostart"));
}

TEST_F(ControlSocketTest, HbrShutdownWithoutBootLoggingStops) {
    start();
    auto conn = connect_client();
    EXPECT_EQ("HBR_SHUTDOWN,1", exchange(conn.get(), "HBR_SHUTDOWN"));
    EXPECT_TRUE(history_has("as boot option is 0, stop tavlolog for hbrshutdown"));
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));  // still connected
}

TEST_F(ControlSocketTest, HbrShutdownWithBootLoggingClosesEveryClient) {
    write_config(std::string("autostart=1\n") + (kBaseConfig + strlen("autostart=0\n")));
    start();
    auto other = connect_client();
    EXPECT_EQ("x,1", exchange(other.get(), "x"));
    auto conn = connect_client();
    EXPECT_EQ("HBR_SHUTDOWN,1", exchange(conn.get(), "HBR_SHUTDOWN"));
    EXPECT_TRUE(closed_by_daemon(conn.get()));
    EXPECT_TRUE(closed_by_daemon(other.get()));
    struct stat st;
    EXPECT_EQ(0, stat("/data/log_hbr", &st));
    EXPECT_EQ(0, controller->log_path_state);
    // A new client is served again.
    auto later = connect_client();
    EXPECT_EQ("x,1", exchange(later.get(), "x"));
}

TEST_F(ControlSocketTest, EleventhClientIsClosed) {
    start();
    std::vector<std::unique_ptr<ControlConnection>> clients;
    for (int i = 0; i < MAX_CLIENTS; i++) {
        clients.push_back(connect_client());
        ASSERT_EQ("x,1", exchange(clients.back().get(), "x"));
    }
    auto eleventh = connect_client();
    control_send(eleventh.get(), "x", kTimeoutMs);  // may already find the connection closed
    EXPECT_TRUE(closed_by_daemon(eleventh.get()));
    EXPECT_TRUE(wait_for_history("no free slot for client"));

    // A client that goes frees its slot; the next round trip makes sure the
    // daemon has seen it go.
    clients[3].reset();
    EXPECT_EQ("x,1", exchange(clients[4].get(), "x"));
    EXPECT_TRUE(history_has("exception when handle message, close client"));
    auto replacement = connect_client();
    EXPECT_EQ("y,1", exchange(replacement.get(), "y"));
}

// Only root, system, shell and the daemon's own user may send commands.
TEST_F(ControlSocketTest, PeerCheck) {
    struct Case {
        uid_t uid;
        bool served;
    } cases[] = {{12345, false}, {10050, false}, {1002, false}, {1000, true}, {2000, true}};
    start();
    for (const Case& c : cases) {
        SCOPED_TRACE(c.uid);
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            // Only the client library's plain socket calls run here: the
            // parent's other threads may have held locks at the fork.
            if (setuid(c.uid) != 0) _exit(3);
            ControlConnection conn;
            if (control_connect(&conn, kTimeoutMs) != CC_OK) _exit(4);
            control_send(&conn, "KernelLog=0", kTimeoutMs);
            char reply[CONTROL_REPLY_MAX + 1];
            int rc = control_read_reply(&conn, "KernelLog=0", reply, sizeof(reply), kTimeoutMs);
            if (rc == CC_OK) _exit(strcmp(reply, "KernelLog=0,1") == 0 ? 0 : 5);
            _exit(rc == CC_CLOSED ? 1 : 6);
        }
        int status = 0;
        ASSERT_EQ(pid, waitpid(pid, &status, 0));
        ASSERT_TRUE(WIFEXITED(status));
        char record[64];
        snprintf(record, sizeof(record), "refuse client uid %d pid %d", static_cast<int>(c.uid),
                 static_cast<int>(pid));
        if (c.served) {
            EXPECT_EQ(0, WEXITSTATUS(status));
            EXPECT_EQ("0", config_value("KernelLog"));
        } else {
            EXPECT_EQ(1, WEXITSTATUS(status)) << "the connection must be closed without a reply";
            EXPECT_TRUE(history_has(record)) << read_file(kHistory);
            EXPECT_EQ("1", config_value("KernelLog"));
        }
        write_config(kBaseConfig);
    }
}

TEST_F(ControlSocketTest, BroadcastReachesEveryClient) {
    start();
    auto first = connect_client();
    auto second = connect_client();
    EXPECT_EQ("x,1", exchange(first.get(), "x"));
    EXPECT_EQ("x,1", exchange(second.get(), "x"));
    reply_client(controller, -1, BROADCAST_STORAGE_FULL);
    for (ControlConnection* conn : {first.get(), second.get()}) {
        char event[CONTROL_RECV_MAX];
        ASSERT_EQ(CC_OK, control_next_event(conn, event, sizeof(event), kTimeoutMs));
        EXPECT_STREQ(BROADCAST_STORAGE_FULL, event);
    }
    // A broadcast between two commands does not disturb the next reply.
    reply_client(controller, -1, BROADCAST_STOPPED);
    EXPECT_EQ("y,1", exchange(first.get(), "y"));
    char event[CONTROL_RECV_MAX];
    ASSERT_EQ(CC_OK, control_next_event(first.get(), event, sizeof(event), kTimeoutMs));
    EXPECT_STREQ(BROADCAST_STOPPED, event);
}

TEST_F(ControlSocketTest, EventCounters) {
    start();
    uint64_t value = 1001;
    ASSERT_EQ(8, write(efd_thread, &value, sizeof(value)));
    EXPECT_TRUE(wait_for_history("recv efd_thread 1001"));
    EXPECT_TRUE(wait_for_history("tavlolog already stopped, ignore this stop"));
    value = 1;
    ASSERT_EQ(8, write(efd_chld, &value, sizeof(value)));
    EXPECT_TRUE(wait_for_history("recv efd_chld 1"));
    EXPECT_TRUE(wait_for_history("all processes die, no need to check"));
    // The loop goes on serving clients.
    auto conn = connect_client();
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));
}

// Shell commands the daemon runs ("oru -m 3") must not inherit client
// connections, or a client would never see its connection close.
TEST_F(ControlSocketTest, DescriptorsAreCloseOnExecAndThreadIsNamed) {
    start();
    auto conn = connect_client();
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));
    EXPECT_TRUE(fcntl(controller->listen_fd, F_GETFD) & FD_CLOEXEC);
    pthread_mutex_lock(&controller->client_lock);
    int client_fd = controller->clients[0].fd;
    pthread_mutex_unlock(&controller->client_lock);
    ASSERT_GT(client_fd, 0);
    EXPECT_TRUE(fcntl(client_fd, F_GETFD) & FD_CLOEXEC);

    bool named = false;
    DIR* tasks = opendir("/proc/self/task");
    ASSERT_NE(nullptr, tasks);
    while (struct dirent* entry = readdir(tasks)) {
        std::string comm =
            read_file(("/proc/self/task/" + std::string(entry->d_name) + "/comm").c_str());
        if (comm == "tavlo.control\n") named = true;
    }
    closedir(tasks);
    EXPECT_TRUE(named);
}

TEST_F(ControlSocketTest, TavlologctlAgainstTheDaemon) {
    start();
    std::string out;
    EXPECT_EQ(0, run("tavlologctl KernelLog=0", &out)) << out;
    EXPECT_EQ("KernelLog=0,1\n", out);
    EXPECT_EQ("0", config_value("KernelLog"));

    write_config(
        std::string(kBaseConfig).replace(12, strlen("logpath=internal_sd"), "logpath=/proc/tqlog"));
    EXPECT_EQ(1, run("tavlologctl start", &out)) << out;
    EXPECT_EQ("start,0\n", out);

    // Listening: the reply to --send, then each broadcast, until the daemon closes.
    FILE* listener = popen("tavlologctl --listen --send x", "r");
    ASSERT_NE(nullptr, listener);
    char line[128];
    ASSERT_NE(nullptr, fgets(line, sizeof(line), listener));
    EXPECT_STREQ("x,1\n", line);
    reply_client(controller, -1, BROADCAST_FOLDER_LOST);
    ASSERT_NE(nullptr, fgets(line, sizeof(line), listener));
    EXPECT_STREQ("log_folder_lost\n", line);
    pthread_mutex_lock(&controller->client_lock);
    close_all_clients(controller);
    pthread_mutex_unlock(&controller->client_lock);
    // The control thread's pending select still holds the closed connection;
    // any activity ends that select and lets the connection go.
    auto conn = connect_client();
    EXPECT_EQ("y,1", exchange(conn.get(), "y"));
    int status = pclose(listener);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
}

// A whole run driven by commands, with every collector off so that nothing
// but the transist runs: start, a second start, copy, stop.
TEST_F(ControlSocketTest, StartCopyStopWithoutCollectors) {
    write_config(
        "autostart=0\nlogpath=/mnt/sdcard\nlogsize=300\nAndroidLog=0\nKernelLog=0\n"
        "BTLog=0\ntotallogsize=600\n");
    start();
    auto conn = connect_client();
    EXPECT_EQ("start,1", exchange(conn.get(), "start"));
    EXPECT_TRUE(is_running());
    char folder[PROPERTY_VALUE_MAX];
    property_get(PROP_REALPATH, folder, "");
    EXPECT_EQ(0, strncmp(folder, "/mnt/sdcard/qrvlog/tavlolog/APLog_", 34)) << folder;
    struct stat st;
    EXPECT_EQ(0, stat(folder, &st)) << folder;
    EXPECT_STREQ(folder, controller->run_folder);

    EXPECT_EQ("start,1", exchange(conn.get(), "start"));
    EXPECT_TRUE(history_has("tqlog already running, why send start"));

    // Started by "start", the run is not marked as placed on the card, so
    // "copy" moves it to a new folder under the log path.
    EXPECT_EQ("copy,1", exchange(conn.get(), "copy"));
    EXPECT_TRUE(history_has("copy to sdcard!"));
    EXPECT_EQ(1, controller->log_path_state);
    EXPECT_EQ("copy,1", exchange(conn.get(), "copy"));
    EXPECT_TRUE(history_has("has copyed to sd,ignore this 'copy'"));

    EXPECT_EQ("stop,1", exchange(conn.get(), "stop"));
    EXPECT_FALSE(is_running());
    EXPECT_TRUE(history_has("tavlolog stop done"));
    EXPECT_EQ(-1, controller->log_path_state);
}
