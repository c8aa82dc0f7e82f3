// The configuration store on the phone's real paths.
#include "config/config_store.h"

#include <sys/resource.h>

#include "test_util.h"

namespace {

const char kDefaultFile[] =
    "autostart=0\nlogpath=internal_sd\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=1\ntotallogsize=600\n";

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
    // Loads content as the daemon's own file into a fresh cache.
    void load(const std::string& content) {
        write_file(CONFIG_FILE, content);
        config_init(&cache_);
        ASSERT_EQ(config_read_file(&cache_, CONFIG_FILE), 1);
    }
    std::string value_of(const char* key) {
        const char* v = config_get(&cache_, key);
        return v ? v : "<null>";
    }

    ConfigCache cache_;
};

TEST_F(ConfigStoreTest, FirstBootWithoutDefaultsFileWritesTheSevenDefaultLines) {
    ASSERT_EQ(system("rm -rf /data/misc"), 0);
    config_init(&cache_);
    EXPECT_TRUE(exists(CONFIG_DIR));
    EXPECT_EQ(config_read_system_defaults(&cache_), 0);
    EXPECT_TRUE(has_record("open /system/etc/qrvlog-config.prop error (No such file or directory)"));
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
    EXPECT_EQ(mode_of(CONFIG_FILE), 0600u);
    EXPECT_FALSE(exists(CONFIG_FILE ".tmp")) << "temporary file left behind";
}

TEST_F(ConfigStoreTest, EngBuildStartsAutomatically) {
    ASSERT_EQ(property_set("ro.build.type", "eng"), 0);
    config_init(&cache_);
    EXPECT_EQ(value_of("autostart"), "1");
    ASSERT_EQ(unlink("/dev/emu/properties/ro.build.type"), 0);
    ASSERT_EQ(property_set("ro.build.type", "userdebug"), 0);
    config_init(&cache_);
    EXPECT_EQ(value_of("autostart"), "0");
}

// Only "true" exactly turns boot logging on; foreign keys are ignored silently.
TEST_F(ConfigStoreTest, SystemDefaultsKeysAreTranslated) {
    for (const char* enabled : {"true", "  true  ", "TRUE", "1"}) {
        SCOPED_TRACE(enabled);
        unlink(kHistory);
        config_init(&cache_);
        write_file(SYSTEM_DEFAULTS_FILE, std::string("# maker defaults\ncom.quorvex.log.tavlo.enabled=") + enabled +
                                             "\ncom.quorvex.log.tavlo.maxsize=500\nqrvlog_path=external_sd\n"
                                             "logsize=1\nro.other.key=zzz\n");
        ASSERT_EQ(config_read_system_defaults(&cache_), 1);
        EXPECT_EQ(cache_.source, 1);
        EXPECT_EQ(config_write(&cache_), 7);
        bool on = strstr(enabled, "true") != nullptr;
        EXPECT_EQ(read_file(CONFIG_FILE), std::string("autostart=") + (on ? "1" : "0") +
                                              "\nlogpath=external_sd\nlogsize=500\nAndroidLog=1\n"
                                              "KernelLog=1\nBTLog=1\ntotallogsize=600\n");
        EXPECT_FALSE(history_has("update item"));
    }
}

TEST_F(ConfigStoreTest, ReaderAcceptsWhatTheWriterNeverProduces) {
    const struct {
        const char* content;
        const char* logsize;  // its value afterwards
    } cases[] = {
        {"   logsize   =   200   \n", "200"},
        {"logsize 200\n", "300"},                 // no '='
        {"logsize=", "300"},                      // empty value at the end of the file
        {"logsize=\n", "\n"},                     // a lone line feed is not cut
        {"logsize= \n", ""},                      // emptiness is tested before trimming
        {"=200\n", "300"},                        // empty key
        {"logsize=100\nlogsize=200\n", "200"},    // the last one wins
        {"logsize=a=b\n", "a=b"},                 // the first '=' splits
        {"logsize=20\r\n", "20\r"},               // carriage returns stay
        {"LogSize=200\n", "300"},                 // keys are case-sensitive
        {"\n\n# logsize=5\nlogsize=9\n", "9"},
        {"logsize=42", "42"},                     // no final line feed
        {"bogus=7\n", "300"},                     // unknown keys are recorded
    };
    for (const auto& c : cases) {
        load(c.content);
        EXPECT_EQ(value_of("logsize"), c.logsize) << c.content;
        EXPECT_EQ(value_of("totallogsize"), "600") << c.content;
        EXPECT_EQ(value_of("KernelLog"), "1") << c.content;
    }
    EXPECT_TRUE(has_record("update item bogus=7 to cache failed"));
}

TEST_F(ConfigStoreTest, ChangeRewritesTheFileOnlyForARealChange) {
    write_file(CONFIG_FILE, kDefaultFile);
    ino_t before = inode_of(CONFIG_FILE);
    config_init(&cache_);
    config_change(&cache_, "logsize", "300");
    config_change(&cache_, "nosuchkey", "1");
    EXPECT_EQ(inode_of(CONFIG_FILE), before);
    config_init(&cache_);
    config_change(&cache_, "logsize", "200");
    EXPECT_NE(inode_of(CONFIG_FILE), before);
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("logsize=200"));
}

TEST_F(ConfigStoreTest, GetReturnsTextResolvedPathOrNull) {
    write_file(CONFIG_FILE, kDefaultFile);
    config_load(&cache_);
    EXPECT_EQ(value_of("KernelLog"), "1");
    EXPECT_EQ(value_of("logpath"), "/mnt/sdcard");
    EXPECT_EQ(config_get(&cache_, "kernellog"), nullptr);
    EXPECT_EQ(config_get(&cache_, ""), nullptr);
    EXPECT_EQ(config_get(&cache_, nullptr), nullptr);
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

// 91 characters fit and survive a round trip; 92 are refused with a record.
TEST_F(ConfigStoreTest, ValueLengthLimit) {
    std::string longest(CONFIG_FIELD_LEN - 1, 'v');
    ASSERT_EQ(config_update_item(&cache_, "totallogsize", longest.c_str()), 1);
    ASSERT_EQ(config_update_item(&cache_, "logpath", ("/" + longest.substr(1)).c_str()), 1);
    EXPECT_EQ(config_update_item(&cache_, "logsize", std::string(CONFIG_FIELD_LEN, '9').c_str()), 0);
    EXPECT_TRUE(has_record("value of logsize too long, ignored"));
    EXPECT_EQ(config_write(&cache_), 7);
    config_init(&cache_);
    config_load(&cache_);
    EXPECT_EQ(value_of("totallogsize"), longest);
    EXPECT_EQ(value_of("logpath"), "/" + longest.substr(1));
    EXPECT_EQ(value_of("logsize"), "300");

    load("logpath=/" + std::string(200, 'p') + "\n");
    EXPECT_EQ(std::string(cache_.items[1].value), "internal_sd");
}

// 254 characters are looked at; the rest of a 1022-character piece is dropped
// and the next piece of the same line is read as a line.
TEST_F(ConfigStoreTest, OverlongLinesAreCutAndRecordedOnce) {
    load(std::string(3000, 'g') + "\nlogsize=" + std::string(2000, 'x') + "\nKernelLog=0" + std::string(400, ' ') +
         "\nBTLog=0\n");
    EXPECT_EQ(value_of("logsize"), "300");
    EXPECT_EQ(value_of("KernelLog"), "0");
    EXPECT_EQ(value_of("BTLog"), "0");
    EXPECT_EQ(count_of(read_file(kHistory), "too long, cut at 254"), 1u);
    EXPECT_TRUE(has_record("value of logsize too long, ignored"));
}

TEST_F(ConfigStoreTest, BinaryBytesNeitherCrashNorForgeRecords) {
    load(std::string("logsize=4\0002\n", 12) + "\x01\xff=\x02\x1b[2J\nAndroidLog=0\n");
    EXPECT_EQ(value_of("logsize"), "300") << "a NUL byte must not shorten the line silently";
    EXPECT_EQ(value_of("AndroidLog"), "0");
    EXPECT_TRUE(has_record("1 lines of /data/misc/tqlog/tqlog_config hold a NUL byte, ignored"));
    // Control bytes are shown as '?', so the record stays one harmless line.
    EXPECT_TRUE(has_record("update item ?\xff=?\?[2J to cache failed"));

}

// The file is written aside and renamed: a failed write never leaves half a file.
TEST_F(ConfigStoreTest, FailedWriteKeepsTheOldFileWhole) {
    write_file(CONFIG_FILE, kDefaultFile);
    config_update_item(&cache_, "logsize", "123");
    signal(SIGXFSZ, SIG_IGN);  // the size limit fails the third line with EFBIG
    struct rlimit old_limit;
    getrlimit(RLIMIT_FSIZE, &old_limit);
    struct rlimit small = {40, old_limit.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
    int rc = config_write(&cache_);
    setrlimit(RLIMIT_FSIZE, &old_limit);
    EXPECT_EQ(rc, -1);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
    EXPECT_FALSE(exists(CONFIG_FILE ".tmp"));

    symlink("/data/elsewhere", CONFIG_FILE ".tmp");  // a stale temporary link is replaced, not followed
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), default_file_with("logsize=123"));
    EXPECT_FALSE(exists("/data/elsewhere"));
}

}  // namespace
