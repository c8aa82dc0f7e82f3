// The control client library and tavlologctl against scripted stand-ins for
// the daemon: reply parsing with broadcasts around it, time-outs, refusal of
// an untrusted server, and the tool's exit codes.
#include <errno.h>
#include <poll.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cutils/sockets.h>
#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "common/control_client.h"
#include "common/unique_fd.h"
#include "platform/properties.h"

namespace {

long long monotonic_ms() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

// Serves "tavlologd" for one client: reads its command, then writes the given
// chunks one by one (a short pause between them, so they arrive in separate
// reads), then keeps the connection open until the client goes, or closes it.
class ScriptedServer {
  public:
    ScriptedServer(std::vector<std::string> chunks, bool close_after)
        : chunks_(std::move(chunks)), close_after_(close_after) {
        listen_.reset(socket_local_server(CONTROL_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT,
                                          SOCK_STREAM));
        EXPECT_TRUE(listen_.ok()) << strerror(errno);
        int fds[2];
        EXPECT_EQ(0, pipe(fds));
        stop_read_.reset(fds[0]);
        stop_write_.reset(fds[1]);
        thread_ = std::thread([this] { serve(); });
    }
    ~ScriptedServer() {
        stop_write_.reset();  // wakes the thread wherever it waits
        thread_.join();
    }
    std::string received() const { return received_; }

  private:
    // Waits until fd is readable; false when the test ends first.
    bool wait_readable(int fd) {
        struct pollfd pfds[2] = {{fd, POLLIN, 0}, {stop_read_.get(), POLLIN, 0}};
        while (poll(pfds, 2, -1) < 0) {
        }
        return pfds[0].revents != 0;
    }

    void serve() {
        if (!wait_readable(listen_.get())) return;
        UniqueFd client(accept(listen_.get(), nullptr, nullptr));
        if (!client.ok()) return;
        char buf[512];
        if (!wait_readable(client.get())) return;
        ssize_t n = read(client.get(), buf, sizeof(buf));
        if (n > 0) received_.assign(buf, static_cast<size_t>(n));
        for (const std::string& chunk : chunks_) {
            if (send(client.get(), chunk.data(), chunk.size(), MSG_NOSIGNAL) < 0) return;
            usleep(20000);
        }
        if (close_after_) return;
        // Hold the connection until the client closes it.
        while (wait_readable(client.get()) && read(client.get(), buf, sizeof(buf)) > 0) {
        }
    }

    UniqueFd listen_;
    UniqueFd stop_read_;
    UniqueFd stop_write_;
    std::vector<std::string> chunks_;
    bool close_after_;
    std::string received_;
    std::thread thread_;
};

// Runs a shell command line; returns its exit status and its output (stdout,
// and stderr too unless with_stderr is false).
int run(const std::string& command, std::string* output, bool with_stderr = true) {
    FILE* pipe = popen((command + (with_stderr ? " 2>&1" : " 2>/dev/null")).c_str(), "r");
    if (!pipe) return -1;
    char buf[256];
    output->clear();
    while (fgets(buf, sizeof(buf), pipe)) *output += buf;
    int status = pclose(pipe);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace

TEST(ControlClientProtocol, ExpectedReply) {
    struct Case {
        const char* cmd;
        const char* reply;
    } cases[] = {
        {"start", "start"},
        {"deep_start", "deep_start"},
        {"deep_stopnow", "deep_stop"},
        {"stopped", "stop"},
        {"copy", "copy"},
        {"HBR_SHUTDOWN", "HBR_SHUTDOWN"},
        {"star", "star"},                    // no word: a configuration message
        {"KernelLog=0  ", "KernelLog=0"},    // trailing spaces go
        {"  logsize=200", "  logsize=200"},  // leading spaces stay
        {" ", " "},                          // the first character always stays
        {"hbr_shutdown", "hbr_shutdown"},    // words are case-sensitive
    };
    for (const Case& c : cases) {
        char reply[CONTROL_REPLY_MAX + 1];
        control_expected_reply(c.cmd, reply, sizeof(reply));
        EXPECT_STREQ(c.reply, reply) << "command '" << c.cmd << "'";
    }
}

TEST(ControlClientProtocol, ReplyStatus) {
    EXPECT_EQ(1, control_reply_status("start,1"));
    EXPECT_EQ(0, control_reply_status("start,0"));
    EXPECT_EQ(1, control_reply_status("x=1,1"));
    EXPECT_EQ(-1, control_reply_status("storage_full"));
    EXPECT_EQ(-1, control_reply_status(","));
    EXPECT_EQ(-1, control_reply_status(""));
}

TEST(ControlClient, NobodyServing) {
    ControlConnection conn;
    long long begin = monotonic_ms();
    EXPECT_EQ(CC_UNREACHABLE, control_connect(&conn, 2000));
    EXPECT_LT(monotonic_ms() - begin, 1000) << "a refused connection must not be retried";
    char reply[CONTROL_REPLY_MAX + 1];
    EXPECT_EQ(CC_UNREACHABLE, control_command("start", reply, sizeof(reply), 1000));
}

// Replies and broadcasts share the byte stream without terminators: the
// reply must be found whatever arrives around it and however it is cut.
TEST(ControlClient, ReplyAmongBroadcasts) {
    struct Case {
        const char* name;
        const char* cmd;
        std::vector<std::string> chunks;
        const char* reply;
        std::vector<std::string> events;  // what control_next_event hands out afterwards
    } cases[] = {
        {"plain", "start", {"start,1"}, "start,1", {}},
        {"failed", "copy", {"copy,0"}, "copy,0", {}},
        {"broadcast before", "stop", {"storage_fullstop,1"}, "stop,1", {"storage_full"}},
        {"broadcasts around",
         "stop",
         {"tqlog_stoppedstop,1log_folder_lost"},
         "stop,1",
         {"tqlog_stopped", "log_folder_lost"}},
        {"reply in pieces", "deep_start", {"deep_", "start", ",1"}, "deep_start,1", {}},
        {"broadcast in pieces", "stop", {"storage_", "fullstop,1"}, "stop,1", {"storage_full"}},
        {"config echo", "KernelLog=0 ", {"KernelLog=0,1"}, "KernelLog=0,1", {}},
        {"config echo like a broadcast",
         "storage_full=1",
         {"storage_full", "storage_full=1,1"},
         "storage_full=1,1",
         {"storage_full"}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        ScriptedServer server(c.chunks, false);
        ControlConnection conn;
        ASSERT_EQ(CC_OK, control_connect(&conn, 2000));
        ASSERT_EQ(CC_OK, control_send(&conn, c.cmd, 2000));
        char reply[CONTROL_REPLY_MAX + 1];
        ASSERT_EQ(CC_OK, control_read_reply(&conn, c.cmd, reply, sizeof(reply), 3000));
        EXPECT_STREQ(c.reply, reply);
        for (const std::string& expected : c.events) {
            char event[CONTROL_RECV_MAX];
            ASSERT_EQ(CC_OK, control_next_event(&conn, event, sizeof(event), 2000));
            EXPECT_EQ(expected, event);
        }
        char event[CONTROL_RECV_MAX];
        EXPECT_EQ(CC_TIMEOUT, control_next_event(&conn, event, sizeof(event), 50));
    }
}

TEST(ControlClient, SendsCommandWithOneTerminatingNul) {
    ScriptedServer server({"logsize=200,1"}, false);
    ControlConnection conn;
    ASSERT_EQ(CC_OK, control_connect(&conn, 2000));
    ASSERT_EQ(CC_OK, control_send(&conn, "logsize=200", 2000));
    char reply[CONTROL_REPLY_MAX + 1];
    ASSERT_EQ(CC_OK, control_read_reply(&conn, "logsize=200", reply, sizeof(reply), 2000));
    EXPECT_EQ(std::string("logsize=200\0", 12), server.received());
}

TEST(ControlClient, RefusesBadCommands) {
    ScriptedServer server({}, false);
    ControlConnection conn;
    ASSERT_EQ(CC_OK, control_connect(&conn, 2000));
    EXPECT_EQ(CC_BAD_COMMAND, control_send(&conn, "", 1000));
    EXPECT_EQ(CC_BAD_COMMAND,
              control_send(&conn, std::string(CONTROL_CMD_MAX + 1, 'a').c_str(), 1000));
    EXPECT_EQ(CC_BAD_COMMAND, control_send(&conn, "logsize=1\nlogpath=/x", 1000));
    EXPECT_EQ(CC_BAD_COMMAND, control_send(&conn, "a\x7f", 1000));
    // The longest command that fits the daemon's read goes out.
    EXPECT_EQ(CC_OK, control_send(&conn, std::string(CONTROL_CMD_MAX, 'a').c_str(), 1000));
}

TEST(ControlClient, TimesOutWhenNobodyAnswers) {
    ScriptedServer server({}, false);
    ControlConnection conn;
    ASSERT_EQ(CC_OK, control_connect(&conn, 2000));
    ASSERT_EQ(CC_OK, control_send(&conn, "start", 1000));
    char reply[CONTROL_REPLY_MAX + 1];
    long long begin = monotonic_ms();
    EXPECT_EQ(CC_TIMEOUT, control_read_reply(&conn, "start", reply, sizeof(reply), 300));
    long long spent = monotonic_ms() - begin;
    EXPECT_GE(spent, 250);
    EXPECT_LT(spent, 3000);
}

TEST(ControlClient, IncompleteReplyTimesOut) {
    ScriptedServer server({"star"}, false);
    char reply[CONTROL_REPLY_MAX + 1];
    EXPECT_EQ(CC_TIMEOUT, control_command("start", reply, sizeof(reply), 300));
}

TEST(ControlClient, ClosedOrGarbled) {
    {
        ScriptedServer server({}, true);
        char reply[CONTROL_REPLY_MAX + 1];
        EXPECT_EQ(CC_CLOSED, control_command("start", reply, sizeof(reply), 2000));
    }
    {
        ScriptedServer server({"hello"}, false);
        char reply[CONTROL_REPLY_MAX + 1];
        EXPECT_EQ(CC_PROTOCOL, control_command("start", reply, sizeof(reply), 2000));
    }
    {
        // A notice cut short by the close is still handed out, then the close.
        ScriptedServer server({"start,1storage_"}, true);
        ControlConnection conn;
        ASSERT_EQ(CC_OK, control_connect(&conn, 2000));
        ASSERT_EQ(CC_OK, control_send(&conn, "start", 1000));
        char reply[CONTROL_REPLY_MAX + 1];
        ASSERT_EQ(CC_OK, control_read_reply(&conn, "start", reply, sizeof(reply), 2000));
        char event[CONTROL_RECV_MAX];
        ASSERT_EQ(CC_OK, control_next_event(&conn, event, sizeof(event), 2000));
        EXPECT_STREQ("storage_", event);
        EXPECT_EQ(CC_CLOSED, control_next_event(&conn, event, sizeof(event), 2000));
    }
}

// Anyone can bind an abstract name first; commands must only go to the
// daemon (root before it drops privileges, or its own user).
TEST(ControlClient, RefusesUntrustedServer) {
    struct Case {
        uid_t uid;
        int result;
    } cases[] = {{12345, CC_UNTRUSTED}, {1000, CC_UNTRUSTED}, {2000, CC_OK}};
    for (const Case& c : cases) {
        SCOPED_TRACE(c.uid);
        int ready[2];
        ASSERT_EQ(0, pipe(ready));
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            close(ready[0]);
            if (setuid(c.uid) != 0) _exit(1);
            int fd = socket_local_server(CONTROL_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT,
                                         SOCK_STREAM);
            if (fd < 0) _exit(2);
            if (write(ready[1], "r", 1) != 1) _exit(3);
            int client = accept(fd, nullptr, nullptr);
            char buf[64];
            // Answer whatever comes, so that a client that wrongly trusts us gets a reply.
            if (client >= 0 && read(client, buf, sizeof(buf)) > 0) {
                if (write(client, "start,1", 7) != 7) _exit(4);
            }
            _exit(0);
        }
        close(ready[1]);
        char byte;
        ASSERT_EQ(1, read(ready[0], &byte, 1));
        close(ready[0]);

        ControlConnection conn;
        EXPECT_EQ(c.result, control_connect(&conn, 2000));
        EXPECT_EQ(c.uid, conn.server_uid);
        EXPECT_EQ(c.result == CC_OK, conn.fd.ok());
        if (c.result == CC_OK) {
            ASSERT_EQ(CC_OK, control_send(&conn, "start", 1000));
            char reply[CONTROL_REPLY_MAX + 1];
            EXPECT_EQ(CC_OK, control_read_reply(&conn, "start", reply, sizeof(reply), 2000));
        }
        conn.fd.reset();
        int status;
        ASSERT_EQ(pid, waitpid(pid, &status, 0));
    }
}

// tavlologctl: 0 on ",1", 1 on ",0", 2 whenever it cannot get a reply.
TEST(Tavlologctl, ExitCodes) {
    std::string out;
    {
        ScriptedServer server({"KernelLog=0,1"}, false);
        EXPECT_EQ(0, run("tavlologctl KernelLog=0", &out)) << out;
        EXPECT_EQ("KernelLog=0,1\n", out);
    }
    {
        ScriptedServer server({"start,0"}, true);
        EXPECT_EQ(1, run("tavlologctl start", &out)) << out;
        EXPECT_EQ("start,0\n", out);
    }
    {
        // A broadcast that came with the reply goes to stderr, the reply alone to stdout.
        ScriptedServer server({"storage_fullstop,1"}, false);
        EXPECT_EQ(0, run("tavlologctl stop", &out, false)) << out;
        EXPECT_EQ("stop,1\n", out);
    }
    EXPECT_EQ(2, run("tavlologctl start", &out));
    EXPECT_NE(std::string::npos, out.find("cannot be reached")) << out;
    {
        ScriptedServer server({}, false);
        long long begin = monotonic_ms();
        EXPECT_EQ(2, run("tavlologctl -t 1 start", &out));
        EXPECT_LT(monotonic_ms() - begin, 5000);
        EXPECT_NE(std::string::npos, out.find("did not answer in time")) << out;
    }
    EXPECT_EQ(2, run("tavlologctl", &out));
    EXPECT_EQ(2, run("tavlologctl -t 0 start", &out));
    EXPECT_EQ(2, run("tavlologctl start stop", &out));
}

TEST(Tavlologctl, ListenPrintsBroadcastsUntilClosed) {
    ScriptedServer server({"ping,1", "storage_fulltqlog_stopped", "log_folder_lost"}, true);
    std::string out;
    EXPECT_EQ(0, run("tavlologctl --listen --send ping", &out));
    EXPECT_EQ("ping,1\nstorage_full\ntqlog_stopped\nlog_folder_lost\n", out);
}

TEST(Tavlologctl, StatusFromProperties) {
    std::string out;
    EXPECT_EQ(0, run("tavlologctl status", &out));
    EXPECT_EQ("running: no\nrun folder: none\nrotation size: unknown\n", out);
    ASSERT_EQ(0, property_set("debug.TQ.running", "1"));
    ASSERT_EQ(0, property_set("debug.TQ.realpath",
                              "/mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/"));
    ASSERT_EQ(0, property_set("debug.TQ.logsize", "2457"));
    EXPECT_EQ(0, run("tavlologctl status", &out));
    EXPECT_EQ(
        "running: yes\nrun folder: /mnt/sdcard/qrvlog/tavlolog/APLog_2026_0304_070649/\n"
        "rotation size: 2457 KB\n",
        out);
}
