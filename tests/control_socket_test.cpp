// The control socket served in-process by a fresh controller, talked to as a client on the phone would.
#include "core/control_socket.h"

#include <memory>

#include <cutils/sockets.h>

#include "common/control_client.h"
#include "config/config_store.h"
#include "core/client_table.h"
#include "core/log_controller.h"
#include "test_util.h"

namespace {

constexpr int kTimeoutMs = 5000;

// The seven settings with the Bluetooth log off, so that turning it on shows.
const std::string kBaseConfig =
    "autostart=0\nlogpath=internal_sd\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=0\ntotallogsize=600\n";

void write_config(const std::string& content) {
    mkdir("/data/misc", 0771);
    mkdir(CONFIG_DIR, 0700);
    write_file(CONFIG_FILE, content);
}

// The stored value of key, or "(none)".
std::string config_value(const std::string& key) {
    std::string all = "\n" + read_file(CONFIG_FILE);
    size_t at = all.find("\n" + key + "=");
    if (at == std::string::npos) return "(none)";
    size_t begin = at + key.size() + 2;
    return all.substr(begin, all.find('\n', begin) - begin);
}

std::unique_ptr<ControlConnection> connect_client() {
    auto conn = std::make_unique<ControlConnection>();
    EXPECT_EQ(CC_OK, control_connect(conn.get(), kTimeoutMs));
    return conn;
}

// Sends raw bytes and returns the reply (or the error as text); `as` is the
// text the reply is expected to echo.
std::string exchange_raw(ControlConnection* conn, const std::string& bytes, const std::string& as) {
    int rc = control_send_raw(conn, bytes.data(), bytes.size(), kTimeoutMs);
    char reply[CONTROL_REPLY_MAX + 1];
    if (rc == CC_OK) rc = control_read_reply(conn, as.c_str(), reply, sizeof(reply), kTimeoutMs);
    return rc == CC_OK ? reply : control_result_text(rc);
}

std::string exchange(ControlConnection* conn, const std::string& cmd) {
    return exchange_raw(conn, cmd + '\0', cmd);
}

class ControlSocketTest : public ::testing::Test {
  protected:
    void SetUp() override {
        write_config(kBaseConfig);
        controller = new LogController();  // lives as long as the process, as the daemon's does
        controller->boot_mode = 1;         // not a normal boot: no exception-engine switch
        start_control_socket(controller);
    }
    LogController* controller = nullptr;
};

int squatter = -1;  // an app's socket holding "log_socket"

// A message unsafe to store, or one that cannot be carried out, is refused
// whole: ",0", the file as it was, no run (the message fuzzer checks the rules at large).
TEST_F(ControlSocketTest, RefusedMessagesChangeNothing) {
    const std::string too_long = "logpath=/mnt/" + std::string(47, 'p');  // a 52-character path
    const struct {
        std::string bytes, reply;  // exactly what the client writes; the text before ",0"
        const char* record;
        void (*setup)();
    } cases[] = {
        {std::string("AndroidLog=0\0start\0", 19), "AndroidLog=0", "(NUL byte)", nullptr},
        {std::string("logsize=1\nlogpath=/x\0", 21), "logsize=1\nlogpath=/x",
         "logsize=1\\x0alogpath=/x is not a valid configure (line feed)", nullptr},
        {std::string("logpath=/data/misc//tqlog/logs\0", 31), "logpath=/data/misc//tqlog/logs",
         "(the daemon's own folder)", nullptr},
        {too_long + '\0', too_long, "(too long for a run folder)", nullptr},
        {std::string("BTLog=1\0", 8), "BTLog=1", "cant open the config file,errno=17",
         [] { mkdir(CONFIG_FILE ".tmp", 0700); }},
        {std::string("start\0", 6), "start", "log_socket cannot be served, no run started",
         [] { squatter = socket_local_server("log_socket", ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM); }},
        // Without a file the default "1" is no change, and still not stored.
        {std::string("BTLog=1\0", 8), "BTLog=1", "some thing wrong when read",
         [] { unlink(CONFIG_FILE), mkdir(CONFIG_FILE, 0700); }},
    };
    for (const auto& c : cases) {
        if (c.setup) c.setup();
        std::string before = read_file(CONFIG_FILE);
        auto conn = connect_client();
        EXPECT_EQ(c.reply + REPLY_FAILED, exchange_raw(conn.get(), c.bytes, c.reply));
        EXPECT_EQ(before, read_file(CONFIG_FILE));
        EXPECT_TRUE(history_has(c.record)) << c.record << "\n" << read_file(kHistory);
        EXPECT_NE("1", property(PROP_RUNNING)) << "a run started";
    }
}

// One read takes at most 254 bytes: a longer message is cut there, its last
// byte dropped, and the rest comes as a message of its own.
TEST_F(ControlSocketTest, OverlongMessageIsReadInBoundedPieces) {
    auto conn = connect_client();
    std::string first(CONTROL_MSG_MAX - 1, 'a'), second(300 - CONTROL_MSG_MAX - 1, 'a');
    ASSERT_EQ(CC_OK, control_send_raw(conn.get(), std::string(300, 'a').data(), 300, kTimeoutMs));
    char reply[CONTROL_REPLY_MAX + 1];
    ASSERT_EQ(CC_OK, control_read_reply(conn.get(), first.c_str(), reply, sizeof(reply), kTimeoutMs));
    EXPECT_EQ(first + REPLY_DONE, reply);
    ASSERT_EQ(CC_OK, control_read_reply(conn.get(), second.c_str(), reply, sizeof(reply), kTimeoutMs));
    EXPECT_EQ(second + REPLY_DONE, reply);
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));
}

TEST_F(ControlSocketTest, StopsWhileStopped) {
    auto conn = connect_client();
    controller->log_path_state = 0;
    EXPECT_EQ("stop,1", exchange(conn.get(), "stop"));
    EXPECT_EQ(-1, controller->log_path_state);
    EXPECT_EQ("stop,1", exchange(conn.get(), "stopnow"));  // anything after the word is ignored
    EXPECT_EQ("0", config_value("autostart"));

    write_config("autostart=1" + kBaseConfig.substr(11));  // deep_stop also turns boot logging off
    EXPECT_EQ("deep_stop,1", exchange(conn.get(), "deep_stop"));
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));  // the setting changes after the reply; still connected
    EXPECT_EQ("0", config_value("autostart"));
}

// The daemon's own record of a live run decides too: the shell can set
// debug.TQ.running, and "0" must not let a start build a second run.
TEST_F(ControlSocketTest, LiveRunIsKnownWhateverTheProperty) {
    write_config("autostart=0\nlogpath=/data\nlogsize=300\nAndroidLog=0\nKernelLog=0\nBTLog=0\ntotallogsize=600\n");
    auto conn = connect_client();
    EXPECT_EQ("start,1", exchange(conn.get(), "start"));
    ASSERT_EQ(0, property_set(PROP_RUNNING, "0"));
    EXPECT_EQ("start,1", exchange(conn.get(), "start"));
    EXPECT_TRUE(history_has("tqlog already running, why send start"));
    EXPECT_EQ("stop,1", exchange(conn.get(), "stop"));
    EXPECT_TRUE(history_has("tavlolog stop done")) << "the stop was ignored";
    EXPECT_EQ(count_of(read_file(kHistory), "create read/write thread success"), 1u);
}

// "tavlologd" held by another process (after the daemon died): recorded once,
// then the daemon serves as soon as the name is free instead of exiting.
TEST(ControlSocketHeld, IsServedAsSoonAsItIsFree) {
    write_config(kBaseConfig);
    int holder = socket_local_server(CONTROL_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    ASSERT_GE(holder, 0);
    LogController* controller = new LogController();
    controller->boot_mode = 1;
    start_control_socket(controller);
    EXPECT_TRUE(has_record("create socket 'tavlologd' failed"));
    close(holder);
    ControlConnection conn;
    ASSERT_TRUE(wait_for([&] { return control_connect(&conn, 100) == CC_OK; }, 10000));
    EXPECT_EQ("x,1", exchange(&conn, "x"));
    EXPECT_EQ(count_of(read_file(kHistory), "create socket 'tavlologd' failed"), 1u);
}

// Shell commands the daemon runs ("oru -m 3") must not inherit client
// connections, or a client would never see its connection close.
TEST_F(ControlSocketTest, DescriptorsAreCloseOnExec) {
    auto conn = connect_client();
    EXPECT_EQ("x,1", exchange(conn.get(), "x"));
    EXPECT_TRUE(fcntl(controller->listen_fd, F_GETFD) & FD_CLOEXEC);
    pthread_mutex_lock(&controller->client_lock);
    int client_fd = controller->clients[0].fd;
    pthread_mutex_unlock(&controller->client_lock);
    ASSERT_GT(client_fd, 0);
    EXPECT_TRUE(fcntl(client_fd, F_GETFD) & FD_CLOEXEC);
}

}  // namespace
