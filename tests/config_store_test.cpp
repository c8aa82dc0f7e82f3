// The configuration store on the phone's real paths.
#include "config/config_store.h"

#include <sys/resource.h>

#include "storage/folder_records.h"
#include "test_util.h"

namespace {

const char kDefaultFile[] =
    "autostart=0\nlogpath=internal_sd\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=1\ntotallogsize=600\n";

const char kRecords[] = "/data/misc/tqlog/inter_sd_folder";

std::string default_file_with(const std::string& line) {
    std::string out = kDefaultFile;
    size_t at = out.find(line.substr(0, line.find('=') + 1));
    return out.replace(at, out.find('\n', at) - at, line);
}

class ConfigStoreTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        umask(0);  // as the daemon: modes are exactly those given at creation
        ASSERT_EQ(system("rm -rf /data/* /system/etc/* /dev/emu/properties/*"), 0);
        mkdir("/data/misc", 0775);
        mkdir(CONFIG_DIR, 0700);
        config_init(&cache_);
    }
    ConfigCache cache_;
};

// Without the system image's defaults the first boot writes its own; an eng
// build starts recording by itself. (The translation is a boot scenario's.)
TEST_F(ConfigStoreTest, FirstBootOfAnEngBuildStartsRecording) {
    ASSERT_EQ(property_set("ro.build.type", "eng"), 0);
    config_init(&cache_);
    EXPECT_EQ(config_read_system_defaults(&cache_), 0);
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("autostart=1"));
    EXPECT_EQ(mode_of(CONFIG_FILE), 0600u);
    EXPECT_FALSE(exists(CONFIG_FILE ".tmp")) << "temporary file left behind";
}

TEST_F(ConfigStoreTest, LoadRecreatesAnUnreadableFileFromTheCache) {
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
TEST_F(ConfigStoreTest, FailedWriteKeepsTheOldFileWhole) {
    write_file(CONFIG_FILE, kDefaultFile);
    write_file(kRecords, "A 1\n");
    config_update_item(&cache_, "logsize", "123");
    const std::string records = "APLog_2026_0304_070649 10\nAPLog_2026_0304_070650 20\n";
    FolderRecord* list = parse_folder_records(records.data(), records.size());
    signal(SIGXFSZ, SIG_IGN);  // the size limit fails the third line with EFBIG
    struct rlimit old_limit;
    getrlimit(RLIMIT_FSIZE, &old_limit);
    struct rlimit small = {40, old_limit.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
    int rc = config_write(&cache_), records_rc = write_folder_records(list, "NEW", 1);
    setrlimit(RLIMIT_FSIZE, &old_limit);
    free_folder_records(list);
    EXPECT_EQ(rc, -1);
    EXPECT_NE(records_rc, 1);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
    EXPECT_EQ(read_file(kRecords), "A 1\n");
    EXPECT_FALSE(exists(CONFIG_FILE ".tmp"));

    symlink("/data/elsewhere", CONFIG_FILE ".tmp");  // a stale temporary link is replaced, not followed
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("logsize=123"));
    EXPECT_FALSE(exists("/data/elsewhere"));
}

}  // namespace
