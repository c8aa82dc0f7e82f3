// Resolution of the logpath setting and its override by a persistent property.
#include "config/log_path.h"

#include "config/config_store.h"
#include "test_util.h"

namespace {

std::string config_with_logpath(const std::string& logpath) {
    return "autostart=0\nlogpath=" + logpath + "\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=1\ntotallogsize=600\n";
}

class LogPathTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        umask(0);
        // persist. properties keep a copy in /data/property, as on the phone.
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/* && mkdir -p /data/property /data/misc/tqlog"), 0);
    }
};

TEST_F(LogPathTest, ValueBecomesADirectory) {
    const struct {
        const char *value, *internal_prop, *external_prop, *expected, *record;  // "": unset, none
    } cases[] = {
        {"internal_sd", "/storage/emulated/0", "", "/storage/emulated/0", ""},
        {"internal_sd", "", "/storage/ext", "/mnt/sdcard", "cant get log path through property internal_sd_path"},
        {"external_sd", "/storage/int", "", "/mnt/sdcard2", "cant get log path through property external_sd_path"},
        {"external_sd", "", "/storage/sdcard1", "/storage/sdcard1", ""},
        {"/data", "", "", "/data", ""},
        // Names are case-sensitive; a relative path or one with ".." is no directory to use.
        {"Internal_SD", "/storage/int", "", "/storage/int", "log path Internal_SD is not an absolute path, internal_sd used"},
        {"/mnt/sdcard/../../data", "/storage/int", "", "/storage/int",
         "log path /mnt/sdcard/../../data is not an absolute path, internal_sd used"},
        {"internal_sd", "tmp", "", "/mnt/sdcard", "cant get log path through property internal_sd_path"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.expected);
        ASSERT_EQ(system("rm -f /dev/emu/properties/* /data/misc/tqlog/tqlog_history"), 0);
        if (c.internal_prop[0]) { ASSERT_EQ(property_set("internal_sd_path", c.internal_prop), 0); }
        if (c.external_prop[0]) { ASSERT_EQ(property_set("external_sd_path", c.external_prop), 0); }
        char out[CONFIG_FIELD_LEN];
        EXPECT_EQ(resolve_log_path(c.value, out), out);
        EXPECT_STREQ(out, c.expected);
        EXPECT_EQ(history_messages(), c.record[0] ? std::vector<std::string>{c.record} : std::vector<std::string>{});
    }
}

// The override property, when set and different, rewrites the file's logpath.
TEST_F(LogPathTest, OverrideRewritesTheFileOnlyWhenItDiffers) {
    ASSERT_EQ(property_set("external_sd_path", "/storage/sdcard1"), 0);
    const struct {
        const char *override, *before, *path, *after;  // before nullptr: no file
    } cases[] = {
        {"/data", nullptr, "/data", "/data"},  // also when the file is made anew
        {"external_sd", "internal_sd", "/storage/sdcard1", "external_sd"},
        {"", "/data", "/data", "/data"},
        {"/data", "/data", "/data", "/data"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.override);
        unlink(CONFIG_FILE);
        if (c.before) write_file(CONFIG_FILE, config_with_logpath(c.before));
        ino_t before = inode_of(CONFIG_FILE);
        ASSERT_EQ(property_set("persist.qrvlog.log2sd.path", c.override), 0);
        ConfigCache cache;
        config_init(&cache);
        config_load(&cache);
        EXPECT_STREQ(config_get(&cache, "logpath"), c.path);
        EXPECT_EQ(read_file(CONFIG_FILE), config_with_logpath(c.after));
        bool same = c.before && strcmp(c.before, c.after) == 0;
        EXPECT_TRUE(!same || inode_of(CONFIG_FILE) == before) << "rewritten without a change";
    }
}

}  // namespace
