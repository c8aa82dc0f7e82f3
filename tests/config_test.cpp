// The configuration store and the logpath setting on the phone's real paths.
#include "config/config_store.h"

#include <sys/resource.h>

#include "config/log_path.h"
#include "storage/folder_records.h"
#include "test_util.h"

namespace {

const char kDefaultFile[] =
    "autostart=0\nlogpath=internal_sd\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=1\ntotallogsize=600\n";

std::string default_file_with(const std::string& line) {
    std::string out = kDefaultFile;
    size_t at = out.find(line.substr(0, line.find('=') + 1));
    return out.replace(at, out.find('\n', at) - at, line);
}

class ConfigTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        umask(0);  // as the daemon: modes are exactly those given at creation
        ASSERT_EQ(system("rm -rf /data/misc /system/etc/* /dev/emu/properties/* && mkdir -p /data/misc/tqlog"), 0);
        config_init(&cache_);
    }
    ConfigCache cache_;
};

// Without the system image's defaults the first boot writes its own; an eng
// build starts recording by itself. (The translation is a boot scenario's.)
TEST_F(ConfigTest, FirstBootOfAnEngBuildStartsRecording) {
    ASSERT_EQ(property_set("ro.build.type", "eng"), 0);
    config_init(&cache_);
    EXPECT_EQ(config_read_system_defaults(&cache_), 0);
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("autostart=1"));
    EXPECT_EQ(mode_of(CONFIG_FILE), 0600u);
    EXPECT_FALSE(exists(CONFIG_FILE ".tmp")) << "temporary file left behind";
}

TEST_F(ConfigTest, LoadRecreatesAnUnreadableFileFromTheCache) {
    config_update_item(&cache_, "BTLog", "0");
    EXPECT_EQ(config_load(&cache_), 0);
    EXPECT_TRUE(has_record("open /data/misc/tqlog/tqlog_config error (No such file or directory)"));
    EXPECT_TRUE(has_record("some thing wrong when read /data/misc/tqlog/tqlog_config,recreate a new one"));
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("BTLog=0"));

    write_file("/data/target", "autostart=1\n");  // a link in its place is never read or written through
    ASSERT_EQ(unlink(CONFIG_FILE) + symlink("/data/target", CONFIG_FILE), 0);
    config_load(&cache_);
    EXPECT_EQ(read_file("/data/target"), "autostart=1\n");
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("BTLog=0"));
}

// The configuration and the folder records are written aside and renamed: a
// failed write never leaves half a file.
TEST_F(ConfigTest, FailedWriteKeepsTheOldFileWhole) {
    write_file(CONFIG_FILE, kDefaultFile);
    write_file("/data/misc/tqlog/inter_sd_folder", "A 1\n");
    config_update_item(&cache_, "logsize", "123");
    const std::string records = "APLog_2026_0304_070649 10\nAPLog_2026_0304_070650 20\n";
    FolderRecord* list = parse_folder_records(records.data(), records.size());
    signal(SIGXFSZ, SIG_IGN);  // the size limit fails the third line with EFBIG
    struct rlimit limit = {40, RLIM_INFINITY};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
    int rc = config_write(&cache_), records_rc = write_folder_records(list, "NEW", 1);
    limit.rlim_cur = RLIM_INFINITY;
    setrlimit(RLIMIT_FSIZE, &limit);
    free_folder_records(list);
    EXPECT_EQ(rc, -1);
    EXPECT_NE(records_rc, 1);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
    EXPECT_EQ(read_file("/data/misc/tqlog/inter_sd_folder"), "A 1\n");
    EXPECT_FALSE(exists(CONFIG_FILE ".tmp"));

    symlink("/data/elsewhere", CONFIG_FILE ".tmp");  // a stale temporary link is replaced, not followed
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("logsize=123"));
    EXPECT_FALSE(exists("/data/elsewhere"));
}

TEST_F(ConfigTest, ValueBecomesADirectory) {
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
        {"/data/misc/tqlog", "/storage/int", "", "/storage/int", "log path /data/misc/tqlog is the daemon's own folder, internal_sd used"},
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
TEST_F(ConfigTest, OverrideRewritesTheFileOnlyWhenItDiffers) {
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
        if (c.before) write_file(CONFIG_FILE, default_file_with("logpath=" + std::string(c.before)));
        ino_t before = inode_of(CONFIG_FILE);
        ASSERT_EQ(property_set("persist.qrvlog.log2sd.path", c.override), 0);
        config_init(&cache_);
        config_load(&cache_);
        EXPECT_STREQ(config_get(&cache_, "logpath"), c.path);
        EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("logpath=" + std::string(c.after)));
        bool same = c.before && strcmp(c.before, c.after) == 0;
        EXPECT_TRUE(!same || inode_of(CONFIG_FILE) == before) << "rewritten without a change";
    }
}

}  // namespace
