// The control client library and tavlologctl against scripted stand-ins for the daemon.
#include "common/control_client.h"

#include <sys/socket.h>

#include <cutils/sockets.h>

#include <memory>

#include "test_util.h"

namespace {

const char kReceived[] = "/tmp/scripted_received";

// Serves "tavlologd" as user uid for one client, in a child process: reads its
// command (kept in kReceived), writes the given chunks 20 ms apart (so they
// arrive in separate reads), then closes the connection or holds it.
class ScriptedServer {
  public:
    ScriptedServer(const std::vector<std::string>& chunks, bool close_after = false, uid_t uid = 0) {
        int ready[2];
        EXPECT_EQ(0, pipe(ready));
        pid_ = fork();
        if (pid_ == 0) {
            int fd = setuid(uid) != 0 ? -1
                                      : socket_local_server(CONTROL_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
            if (fd < 0 || write(ready[1], "r", 1) != 1) _exit(2);
            int client = accept(fd, nullptr, nullptr);
            char buf[512];
            ssize_t n = read(client, buf, sizeof(buf));
            int out = open(kReceived, O_WRONLY | O_CREAT | O_TRUNC, 0666);
            if (out >= 0 && n > 0 && write(out, buf, n) != n) _exit(3);
            for (const std::string& chunk : chunks) {
                if (send(client, chunk.data(), chunk.size(), MSG_NOSIGNAL) < 0) _exit(4);
                usleep(20000);
            }
            while (!close_after && read(client, buf, sizeof(buf)) > 0) {
            }
            _exit(0);
        }
        close(ready[1]);
        char byte;
        EXPECT_EQ(1, read(ready[0], &byte, 1)) << "the server did not start";
        close(ready[0]);
    }
    ~ScriptedServer() { wait_exit(pid_, 0); }

  private:
    pid_t pid_;
};

// Replies and broadcasts share the byte stream without terminators: the reply is found whatever
// arrives around it and however it is cut. No complete reply: timeout, closed or protocol error.
TEST(ControlClient, ReplyAmongBroadcasts) {
    const struct {
        const char* cmd;
        std::vector<std::string> chunks;
        const char* reply;
        std::vector<std::string> events;  // what control_next_event hands out afterwards
        int result = CC_OK;
        bool close_after = false;
    } cases[] = {
        {"copy", {"copy,0"}, "copy,0", {}},
        {"stop", {"storage_fullstop,1"}, "stop,1", {"storage_full"}},
        {"stop", {"tqlog_stoppedstop,1log_folder_lost"}, "stop,1", {"tqlog_stopped", "log_folder_lost"}},
        {"deep_start", {"deep_", "start", ",1"}, "deep_start,1", {}},
        {"stop", {"storage_", "fullstop,1"}, "stop,1", {"storage_full"}},
        {"KernelLog=0 ", {"KernelLog=0,1"}, "KernelLog=0,1", {}},
        {"storage_full=1", {"storage_full", "storage_full=1,1"}, "storage_full=1,1", {"storage_full"}},
        {"start", {"star"}, "", {}, CC_TIMEOUT},
        {"start", {}, "", {}, CC_CLOSED, true},
        {"start", {"hello"}, "", {}, CC_PROTOCOL},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.reply);
        ScriptedServer server(c.chunks, c.close_after);
        ControlConnection conn;
        ASSERT_EQ(CC_OK, control_connect(&conn, 2000));
        ASSERT_EQ(CC_OK, control_send(&conn, c.cmd, 2000));
        char reply[CONTROL_REPLY_MAX + 1] = {};
        ASSERT_EQ(c.result, control_read_reply(&conn, c.cmd, reply, sizeof(reply), c.result == CC_OK ? 3000 : 500));
        EXPECT_STREQ(c.reply, reply);
        char event[CONTROL_RECV_MAX];
        for (const std::string& expected : c.events) {
            ASSERT_EQ(CC_OK, control_next_event(&conn, event, sizeof(event), 2000));
            EXPECT_EQ(expected, event);
        }
        EXPECT_TRUE(c.result != CC_OK || control_next_event(&conn, event, sizeof(event), 50) == CC_TIMEOUT);
    }
}

TEST(ControlClient, SendsOneTerminatingNulAndRefusesBadCommands) {
    {
        ScriptedServer server({"logsize=200,1"});
        char reply[CONTROL_REPLY_MAX + 1];
        ASSERT_EQ(CC_OK, control_command("logsize=200", reply, sizeof(reply), 2000));
        EXPECT_EQ(std::string("logsize=200\0", 12), read_file(kReceived));
    }
    ScriptedServer server({});
    ControlConnection conn;
    ASSERT_EQ(CC_OK, control_connect(&conn, 2000));
    for (const std::string& bad : {std::string(), std::string(CONTROL_CMD_MAX + 1, 'a'),
                                   std::string("logsize=1\nlogpath=/x"), std::string("a\x7f")})
        EXPECT_EQ(CC_BAD_COMMAND, control_send(&conn, bad.c_str(), 1000)) << bad;
    // The longest command that fits the daemon's read goes out.
    EXPECT_EQ(CC_OK, control_send(&conn, std::string(CONTROL_CMD_MAX, 'a').c_str(), 1000));
}

// Anyone can bind an abstract name first; commands must only go to the
// daemon (root before it drops privileges, or its own user).
TEST(ControlClient, RefusesUntrustedServer) {
    for (uid_t uid : {12345, 1000, 2000}) {
        ScriptedServer server({}, true, uid);
        ControlConnection conn;
        EXPECT_EQ(uid == 2000 ? CC_OK : CC_UNTRUSTED, control_connect(&conn, 2000)) << uid;
        EXPECT_EQ(uid, conn.server_uid);
        EXPECT_EQ(uid == 2000, conn.fd.ok()) << uid;
    }
}

// tavlologctl: 0 on ",1" (a broadcast that came with it to stderr), 1 on ",0",
// 2 whenever it cannot get a reply or is misused.
TEST(Tavlologctl, ExitCodes) {
    const struct {
        std::vector<std::string> chunks;  // none: nothing serves
        const char* command;
        int code;
        const char* out;  // stdout, or a part of stderr when code is 2
    } cases[] = {
        {{"start,0"}, "start", 1, "start,0\n"},
        {{"storage_fullstop,1"}, "stop", 0, "stop,1\n"},
        {{}, "start", 2, "cannot be reached"},
        {{""}, "-t 1 start", 2, "did not answer in time"},
        {{}, "start stop", 2, ""},
    };
    for (const auto& c : cases) {
        std::unique_ptr<ScriptedServer> server(c.chunks.empty() ? nullptr : new ScriptedServer(c.chunks));
        std::string out;
        EXPECT_EQ(c.code, run_shell(std::string("tavlologctl ") + c.command, &out, c.code == 2)) << c.command;
        EXPECT_NE(std::string::npos, out.find(c.out)) << c.command << ": " << out;
        EXPECT_TRUE(c.code == 2 || out == c.out) << c.command << ": " << out;
    }
}

}  // namespace
