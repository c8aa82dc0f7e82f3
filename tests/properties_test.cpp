// System properties of the emulated phone, in its real /dev/emu/properties and /data/property.
#include "platform/properties.h"

#include <atomic>
#include <thread>

#include "platform/property_area.h"
#include "test_util.h"

namespace {

std::string get(const std::string& key, const char* def = nullptr) {
    char value[PROPERTY_VALUE_MAX];
    property_get(key.c_str(), value, def);
    return value;
}

class PropertiesTest : public ::testing::Test {
  protected:
    void SetUp() override {
        for (const char* dir : {PROPERTY_AREA_DIR, PROPERTY_PERSIST_DIR})
            for (const std::string& name : files_in(dir)) unlink((std::string(dir) + "/" + name).c_str());
    }
};

TEST_F(PropertiesTest, KeysFollowThePropertyServiceRules) {
    const std::string k31(31, 'k'), k32(32, 'k');
    const struct {
        const char* key;
        bool legal;
    } cases[] = {
        {"a", true},         {k31.c_str(), true},  {"debug.TQ.running", true}, {"a:b@c-d_e.f9", true},
        {k32.c_str(), false}, {"", false},         {".hidden", false},         {"trailing.", false},
        {"two..dots", false}, {"a/b", false},      {"../escape", false},       {"with space", false},
        {"tab\there", false}, {"caf\xc3\xa9", false}, {"new\nline", false},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.key);
        EXPECT_EQ(c.legal ? 1 : 0, property_key_valid(c.key));
        int rc = property_set(c.key, "v");
        EXPECT_TRUE(c.legal ? rc == 0 : rc < 0) << rc;
        EXPECT_EQ(c.legal ? "v" : "dflt", get(c.key, "dflt"));
    }
    // Nothing but the legal keys reached the folder; nothing outside it.
    EXPECT_EQ(4u, files_in(PROPERTY_AREA_DIR).size());
    EXPECT_FALSE(exists("/dev/emu/escape"));
    EXPECT_EQ(0, property_key_valid(nullptr));
    EXPECT_LT(property_set(nullptr, "v"), 0);
    EXPECT_LT(property_set("a", nullptr), 0);
}

TEST_F(PropertiesTest, ValuesAndDefaultsAreCutNeverOverrun) {
    const std::string v91(91, 'x');
    EXPECT_EQ(0, property_set("debug.v", v91.c_str()));
    EXPECT_EQ(v91, get("debug.v"));
    EXPECT_LT(property_set("debug.v", std::string(92, 'y').c_str()), 0);
    EXPECT_EQ(v91, get("debug.v")) << "a refused set changes nothing";

    char value[PROPERTY_VALUE_MAX + 8];
    write_file(PROPERTY_AREA_DIR "/debug.big", std::string(300, 'z'), 0664);  // written by hand
    memset(value, '#', sizeof(value));
    EXPECT_EQ(91, property_get("debug.big", value, nullptr));
    EXPECT_EQ(std::string(91, 'z'), value);
    EXPECT_EQ('#', value[PROPERTY_VALUE_MAX]);
    memset(value, '#', sizeof(value));
    EXPECT_EQ(91, property_get("debug.missing", value, std::string(200, 'd').c_str()));
    EXPECT_EQ(std::string(91, 'd'), value);
    EXPECT_EQ('#', value[PROPERTY_VALUE_MAX]);

    EXPECT_EQ(0, property_get("debug.missing", value, nullptr));
    EXPECT_STREQ("", value);
    EXPECT_EQ(4, property_get("debug.missing", value, "dflt"));
    EXPECT_STREQ("dflt", value);
    EXPECT_EQ(0, property_set("debug.empty", ""));  // as libcutils: empty yields the default
    EXPECT_EQ("dflt", get("debug.empty", "dflt"));
    write_file(PROPERTY_AREA_DIR "/debug.nul", std::string("ab\0cd", 5), 0664);  // a NUL byte ends it
    EXPECT_EQ(2, property_get("debug.nul", value, nullptr));
    EXPECT_STREQ("ab", value);
}

TEST_F(PropertiesTest, PersistentPropertiesAreStoredWhole) {
    mode_t old = umask(077);  // the modes must not depend on the caller's umask
    EXPECT_EQ(0, property_set("persist.emu.kept", "value 1"));
    EXPECT_EQ(0, property_set("persist.emu.kept", "value 2"));
    umask(old);
    EXPECT_EQ("value 2", get("persist.emu.kept"));
    EXPECT_EQ("value 2", read_file(PROPERTY_PERSIST_DIR "/persist.emu.kept"));
    EXPECT_EQ(0600u, mode_of(PROPERTY_PERSIST_DIR "/persist.emu.kept"));
    EXPECT_EQ(0664u, mode_of(PROPERTY_AREA_DIR "/persist.emu.kept"));
    EXPECT_EQ(0, property_set("debug.emu.not_kept", "x"));  // other prefixes are not stored
    EXPECT_EQ(std::vector<std::string>{"persist.emu.kept"}, files_in(PROPERTY_PERSIST_DIR)) << "no temporary file";

    // A value that cannot be stored is not set either.
    ASSERT_EQ(0, rename(PROPERTY_PERSIST_DIR, "/data/property.away"));
    EXPECT_LT(property_set("persist.emu.kept", "new"), 0);
    EXPECT_EQ("value 2", get("persist.emu.kept"));
    ASSERT_EQ(0, rename("/data/property.away", PROPERTY_PERSIST_DIR));
}

// Writers in threads and processes replace one key with values of one letter
// repeated 91 times; readers must only ever see one whole such value.
TEST_F(PropertiesTest, ConcurrentSetsNeverShowTornValues) {
    const char* key = "debug.emu.torn";
    ASSERT_EQ(0, property_set(key, std::string(91, 'A').c_str()));
    auto whole = [](const std::string& v) {
        return v.size() == 91 && v[0] >= 'A' && v[0] <= 'F' && v == std::string(91, v[0]);
    };
    auto write_and_read = [&](char letter) {
        bool ok = true;
        for (int i = 0; i < 150; i++) {
            ok = property_set(key, std::string(91, letter).c_str()) == 0 && ok;
            ok = whole(get(key, "")) && ok;
        }
        return ok;
    };
    std::vector<pid_t> children;
    for (char letter : {'E', 'F'}) {
        pid_t pid = fork();
        if (pid == 0) _exit(write_and_read(letter) ? 0 : 1);
        ASSERT_GT(pid, 0);
        children.push_back(pid);
    }
    std::atomic<int> failed{0};
    std::vector<std::thread> threads;
    for (char letter : {'A', 'B', 'C', 'D'})
        threads.emplace_back([&, letter] { failed += write_and_read(letter) ? 0 : 1; });
    for (auto& t : threads) t.join();
    for (pid_t pid : children) EXPECT_TRUE(exits_with(pid, 0, 30000)) << "child " << pid;
    EXPECT_EQ(0, failed.load());
    EXPECT_TRUE(whole(get(key)));
    EXPECT_EQ(1u, files_in(PROPERTY_AREA_DIR).size()) << "every temporary file was renamed away";
}

}  // namespace
