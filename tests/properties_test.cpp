// System properties of the emulated phone (runs in a throwaway phone, so the
// real /dev/emu/properties and /data/property are used).
#include "platform/properties.h"

#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "platform/property_area.h"

namespace {

std::string get(const std::string& key, const char* def = nullptr) {
    char value[PROPERTY_VALUE_MAX];
    property_get(key.c_str(), value, def);
    return value;
}

std::string read_file(const std::string& path) {
    std::string text;
    int fd = open(path.c_str(), O_RDONLY);
    if (fd < 0) return "<missing>";
    char buf[256];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) text.append(buf, n);
    close(fd);
    return text;
}

void write_file(const std::string& path, const std::string& text) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0664);
    ASSERT_GE(fd, 0) << path;
    ASSERT_EQ(static_cast<ssize_t>(text.size()), write(fd, text.data(), text.size()));
    close(fd);
}

std::vector<std::string> folder_entries(const char* dir) {
    std::vector<std::string> names;
    DIR* d = opendir(dir);
    if (d == nullptr) return names;
    while (struct dirent* e = readdir(d))
        if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) names.push_back(e->d_name);
    closedir(d);
    return names;
}

// Each test starts with an empty property area.
class PropertiesTest : public ::testing::Test {
  protected:
    void SetUp() override {
        for (const auto& name : folder_entries(PROPERTY_AREA_DIR))
            unlink((std::string(PROPERTY_AREA_DIR "/") + name).c_str());
        for (const auto& name : folder_entries(PROPERTY_PERSIST_DIR))
            unlink((std::string(PROPERTY_PERSIST_DIR "/") + name).c_str());
    }
};

struct KeyCase {
    const char* key;
    bool legal;
};

TEST_F(PropertiesTest, KeysFollowThePropertyServiceRules) {
    const std::string k31(31, 'k');
    const std::string k32(32, 'k');
    const KeyCase cases[] = {
        {"a", true},           {k31.c_str(), true},   {"debug.TQ.running", true},
        {"a:b@c-d_e.f9", true}, {k32.c_str(), false}, {"", false},
        {".hidden", false},    {"trailing.", false},  {"two..dots", false},
        {"a/b", false},        {"../escape", false},  {"with space", false},
        {"tab\there", false},  {"caf\xc3\xa9", false}, {"new\nline", false},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.key);
        EXPECT_EQ(c.legal ? 1 : 0, property_key_valid(c.key));
        int rc = property_set(c.key, "v");
        if (c.legal) {
            EXPECT_EQ(0, rc);
            EXPECT_EQ("v", get(c.key));
        } else {
            EXPECT_LT(rc, 0);
            EXPECT_EQ("dflt", get(c.key, "dflt"));
        }
    }
    // Nothing but the legal keys reached the folder; nothing outside it.
    EXPECT_EQ(4u, folder_entries(PROPERTY_AREA_DIR).size());
    EXPECT_EQ("<missing>", read_file("/dev/emu/escape"));
    EXPECT_EQ(0, property_key_valid(nullptr));
    EXPECT_LT(property_set(nullptr, "v"), 0);
    EXPECT_LT(property_set("a", nullptr), 0);
}

TEST_F(PropertiesTest, ValueLimits) {
    const std::string v91(91, 'x');
    const std::string v92(92, 'y');
    EXPECT_EQ(0, property_set("debug.v", v91.c_str()));
    EXPECT_EQ(v91, get("debug.v"));
    EXPECT_LT(property_set("debug.v", v92.c_str()), 0);
    EXPECT_EQ(v91, get("debug.v"));  // a refused set changes nothing
    // Bytes beyond 91 of a hand-written file are cut.
    write_file(PROPERTY_AREA_DIR "/debug.big", std::string(300, 'z'));
    char value[PROPERTY_VALUE_MAX + 8];
    memset(value, '#', sizeof(value));
    EXPECT_EQ(91, property_get("debug.big", value, nullptr));
    EXPECT_EQ(std::string(91, 'z'), value);
    EXPECT_EQ('#', value[PROPERTY_VALUE_MAX]);
}

TEST_F(PropertiesTest, GetFallsBackToTheDefault) {
    char value[PROPERTY_VALUE_MAX + 8];
    memset(value, '#', sizeof(value));
    EXPECT_EQ(0, property_get("debug.missing", value, nullptr));
    EXPECT_STREQ("", value);
    EXPECT_EQ(4, property_get("debug.missing", value, "dflt"));
    EXPECT_STREQ("dflt", value);
    // A default longer than a value is cut, never overruns.
    const std::string long_default(200, 'd');
    memset(value, '#', sizeof(value));
    EXPECT_EQ(91, property_get("debug.missing", value, long_default.c_str()));
    EXPECT_EQ(std::string(91, 'd'), value);
    EXPECT_EQ('#', value[PROPERTY_VALUE_MAX]);
    // As libcutils: an empty value yields the default.
    EXPECT_EQ(0, property_set("debug.empty", ""));
    EXPECT_EQ("dflt", get("debug.empty", "dflt"));
    EXPECT_EQ("", get("debug.empty"));
    // A value holding a NUL byte ends there.
    write_file(PROPERTY_AREA_DIR "/debug.nul", std::string("ab\0cd", 5));
    EXPECT_EQ(2, property_get("debug.nul", value, nullptr));
    EXPECT_STREQ("ab", value);
}

TEST_F(PropertiesTest, ReadOnlyPropertiesAreSetOnce) {
    EXPECT_EQ(0, property_set("ro.emu.once", "first"));
    EXPECT_LT(property_set("ro.emu.once", "second"), 0);
    EXPECT_EQ(EEXIST, errno);
    EXPECT_EQ("first", get("ro.emu.once"));
    EXPECT_EQ(0, property_set("debug.ro.not", "1"));
    EXPECT_EQ(0, property_set("debug.ro.not", "2"));  // only the "ro." prefix counts
}

TEST_F(PropertiesTest, ReadOnlyRaceHasOneWinner) {
    const int kWriters = 8;
    std::vector<pid_t> pids;
    int go[2];
    ASSERT_EQ(0, pipe(go));
    for (int i = 0; i < kWriters; i++) {
        pid_t pid = fork();
        if (pid == 0) {
            char c;
            close(go[1]);
            if (read(go[0], &c, 1) != 0) _exit(3);
            std::string mine = "writer" + std::to_string(i);
            _exit(property_set("ro.emu.race", mine.c_str()) == 0 ? 0 : 1);
        }
        pids.push_back(pid);
    }
    close(go[0]);
    close(go[1]);  // all start together
    int winners = 0;
    int winner = -1;
    for (int i = 0; i < kWriters; i++) {
        int status = 0;
        ASSERT_EQ(pids[i], waitpid(pids[i], &status, 0));
        ASSERT_TRUE(WIFEXITED(status));
        if (WEXITSTATUS(status) == 0) {
            winners++;
            winner = i;
        }
    }
    EXPECT_EQ(1, winners);
    EXPECT_EQ("writer" + std::to_string(winner), get("ro.emu.race"));
}

TEST_F(PropertiesTest, PersistentPropertiesAreStored) {
    mode_t old = umask(077);  // the modes must not depend on the caller's umask
    EXPECT_EQ(0, property_set("persist.emu.kept", "value 1"));
    EXPECT_EQ(0, property_set("persist.emu.kept", "value 2"));
    umask(old);
    EXPECT_EQ("value 2", get("persist.emu.kept"));
    EXPECT_EQ("value 2", read_file(PROPERTY_PERSIST_DIR "/persist.emu.kept"));
    struct stat st;
    ASSERT_EQ(0, stat(PROPERTY_PERSIST_DIR "/persist.emu.kept", &st));
    EXPECT_EQ(0600u, st.st_mode & 07777);
    ASSERT_EQ(0, stat(PROPERTY_AREA_DIR "/persist.emu.kept", &st));
    EXPECT_EQ(0664u, st.st_mode & 07777);
    // Other prefixes and runtime-only sets are not stored.
    EXPECT_EQ(0, property_set("debug.emu.not_kept", "x"));
    EXPECT_EQ(0, property_set_runtime("persist.emu.runtime", "y"));
    EXPECT_EQ("y", get("persist.emu.runtime"));
    std::vector<std::string> stored = folder_entries(PROPERTY_PERSIST_DIR);
    ASSERT_EQ(1u, stored.size());  // no temporary file left either
    EXPECT_EQ("persist.emu.kept", stored[0]);
}

TEST_F(PropertiesTest, PersistentSetFailsWholeWhenItCannotBeStored) {
    ASSERT_EQ(0, property_set("persist.emu.p", "old"));
    ASSERT_EQ(0, rename(PROPERTY_PERSIST_DIR, "/data/property.away"));
    EXPECT_LT(property_set("persist.emu.p", "new"), 0);
    EXPECT_EQ("old", get("persist.emu.p"));
    ASSERT_EQ(0, rename("/data/property.away", PROPERTY_PERSIST_DIR));
}

struct Listed {
    std::vector<std::string> lines;
};

void collect(const char* key, const char* value, void* cookie) {
    static_cast<Listed*>(cookie)->lines.push_back(std::string(key) + "=" + value);
}

TEST_F(PropertiesTest, ListIsInNameOrderAndSkipsForeignFiles) {
    ASSERT_EQ(0, property_set("b.second", "2"));
    ASSERT_EQ(0, property_set("a.first", "1"));
    ASSERT_EQ(0, property_set("B.upper", "U"));
    ASSERT_EQ(0, property_set("a.empty", ""));
    write_file(PROPERTY_AREA_DIR "/.tmp.a.first.1.1.1", "half");
    write_file(PROPERTY_AREA_DIR "/not a key", "junk");
    Listed listed;
    EXPECT_EQ(0, property_list(collect, &listed));
    const std::vector<std::string> expected = {"B.upper=U", "a.empty=", "a.first=1", "b.second=2"};
    EXPECT_EQ(expected, listed.lines);

    EXPECT_EQ(-1, property_list(nullptr, nullptr));
    ASSERT_EQ(0, rename(PROPERTY_AREA_DIR, "/dev/emu/properties.away"));
    EXPECT_EQ(-1, property_list(collect, &listed));
    EXPECT_EQ("dflt", get("a.first", "dflt"));
    EXPECT_LT(property_set("a.first", "x"), 0);
    ASSERT_EQ(0, rename("/dev/emu/properties.away", PROPERTY_AREA_DIR));
}

// Writers in threads and in processes replace one key with values that are
// each one letter repeated 91 times; readers must only ever see one whole
// such value, never a short, empty or mixed one.
TEST_F(PropertiesTest, ConcurrentSetsNeverShowTornValues) {
    const char* key = "debug.emu.torn";
    const int kSetsPerWriter = 150;
    ASSERT_EQ(0, property_set(key, std::string(91, 'A').c_str()));
    auto check = [](const char* v) {
        size_t len = strlen(v);
        if (len != 91 || v[0] < 'A' || v[0] > 'F') return false;
        for (size_t i = 1; i < len; i++)
            if (v[i] != v[0]) return false;
        return true;
    };
    auto writer = [&](char letter) {
        std::string value(91, letter);
        for (int i = 0; i < kSetsPerWriter; i++)
            if (property_set(key, value.c_str()) != 0) return false;
        return true;
    };

    std::vector<pid_t> children;
    for (char letter : {'E', 'F'}) {
        pid_t pid = fork();
        if (pid == 0) {
            bool ok = writer(letter);
            // The child also reads while the others write.
            char value[PROPERTY_VALUE_MAX];
            for (int i = 0; i < 200; i++) {
                property_get(key, value, "");
                if (!check(value)) ok = false;
            }
            _exit(ok ? 0 : 1);
        }
        ASSERT_GT(pid, 0);
        children.push_back(pid);
    }
    std::atomic<bool> stop{false};
    std::atomic<int> bad{0};
    std::atomic<int> reads{0};
    std::vector<std::thread> threads;
    for (int r = 0; r < 2; r++) {
        threads.emplace_back([&] {
            char value[PROPERTY_VALUE_MAX];
            while (!stop.load()) {
                property_get(key, value, "");
                if (!check(value)) bad++;
                reads++;
                std::this_thread::yield();
            }
        });
    }
    std::atomic<int> failed_sets{0};
    std::vector<std::thread> writers;
    for (char letter : {'A', 'B', 'C', 'D'})
        writers.emplace_back([&, letter] {
            if (!writer(letter)) failed_sets++;
        });
    for (auto& t : writers) t.join();
    for (pid_t pid : children) {
        int status = 0;
        ASSERT_EQ(pid, waitpid(pid, &status, 0));
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "child " << pid;
    }
    stop = true;
    for (auto& t : threads) t.join();
    EXPECT_EQ(0, failed_sets.load());
    EXPECT_EQ(0, bad.load());
    EXPECT_GT(reads.load(), 0);
    EXPECT_TRUE(check(get(key).c_str()));
    EXPECT_FALSE(get(key).empty());
    // Every temporary file was renamed away.
    EXPECT_EQ(1u, folder_entries(PROPERTY_AREA_DIR).size());
}

// The daemon runs as uid 2000 in group 1000 and replaces values root set.
TEST_F(PropertiesTest, DaemonIdentityReplacesRootValues) {
    ASSERT_EQ(0, chown(PROPERTY_AREA_DIR, 0, 1000));
    ASSERT_EQ(0, property_set("debug.emu.shared", "root"));
    pid_t pid = fork();
    if (pid == 0) {
        gid_t groups[] = {1000};
        if (setgroups(1, groups) != 0 || setgid(1000) != 0 || setuid(2000) != 0) _exit(2);
        if (property_set("debug.emu.shared", "daemon") != 0) _exit(3);
        // Stored persist. values are root's business.
        if (property_set("persist.emu.by_daemon", "x") == 0) _exit(4);
        _exit(0);
    }
    int status = 0;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
    EXPECT_EQ("daemon", get("debug.emu.shared"));
    EXPECT_EQ("dflt", get("persist.emu.by_daemon", "dflt"));
}

}  // namespace
