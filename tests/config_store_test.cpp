// The configuration store on the emulated phone's real paths: the file format
// byte for byte, the defaults translation, the tolerant reader and the refusal
// of input that does not fit.
#include "config/config_store.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "platform/properties.h"

namespace {

const char kDefaultFile[] =
    "autostart=0\n"
    "logpath=internal_sd\n"
    "logsize=300\n"
    "AndroidLog=1\n"
    "KernelLog=1\n"
    "BTLog=1\n"
    "totallogsize=600\n";

const char kHistory[] = "/data/misc/tqlog/tqlog_history";

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

void write_file(const char* path, const std::string& content) {
    int fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    ASSERT_GE(fd, 0) << path;
    ASSERT_EQ(write(fd, content.data(), content.size()), static_cast<ssize_t>(content.size()));
    close(fd);
}

// Messages of the central history file, without their 20-character timestamps.
std::vector<std::string> history_messages() {
    std::vector<std::string> out;
    std::string all = read_file(kHistory);
    size_t start = 0;
    while (start < all.size()) {
        size_t end = all.find('\n', start);
        if (end == std::string::npos) end = all.size();
        std::string line = all.substr(start, end - start);
        out.push_back(line.size() >= 20 ? line.substr(20) : "<short line>" + line);
        start = end + 1;
    }
    return out;
}

bool has_record(const std::string& text) {
    std::vector<std::string> msgs = history_messages();
    return std::find(msgs.begin(), msgs.end(), text) != msgs.end();
}

ino_t inode_of(const char* path) {
    struct stat st;
    return stat(path, &st) == 0 ? st.st_ino : 0;
}

class ConfigStoreTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (access("/dev/emu/properties", F_OK) != 0) GTEST_SKIP() << "runs only inside the emulated phone";
        // As the daemon: modes are exactly those given at creation.
        umask(0);
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
    EXPECT_EQ(access(CONFIG_DIR, F_OK), 0);
    ASSERT_NE(access(CONFIG_FILE, F_OK), 0);
    EXPECT_EQ(config_read_system_defaults(&cache_), 0);
    EXPECT_TRUE(has_record("open /system/etc/qrvlog-config.prop error (No such file or directory)"));
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
    struct stat st;
    ASSERT_EQ(stat(CONFIG_FILE, &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0600u);
    EXPECT_NE(access(CONFIG_FILE ".tmp", F_OK), 0) << "temporary file left behind";
}

TEST_F(ConfigStoreTest, EngBuildStartsAutomatically) {
    ASSERT_EQ(property_set("ro.build.type", "eng"), 0);
    config_init(&cache_);
    EXPECT_EQ(value_of("autostart"), "1");
    ASSERT_EQ(system("rm -f /dev/emu/properties/ro.build.type"), 0);
    ASSERT_EQ(property_set("ro.build.type", "userdebug"), 0);
    config_init(&cache_);
    EXPECT_EQ(value_of("autostart"), "0");
}

struct DefaultsCase {
    const char* enabled;
    const char* expected_file;
};

void PrintTo(const DefaultsCase& c, std::ostream* os) { *os << "enabled=" << c.enabled; }

class SystemDefaultsTest : public ConfigStoreTest, public ::testing::WithParamInterface<DefaultsCase> {};

TEST_P(SystemDefaultsTest, KeysAreTranslated) {
    write_file(SYSTEM_DEFAULTS_FILE, std::string("# maker defaults\n"
                                                 "com.quorvex.log.tavlo.enabled=") +
                                         GetParam().enabled +
                                         "\n"
                                         "com.quorvex.log.tavlo.maxsize=500\n"
                                         "qrvlog_path=external_sd\n"
                                         "logsize=1\n"
                                         "ro.other.key=zzz\n");
    ASSERT_EQ(config_read_system_defaults(&cache_), 1);
    EXPECT_EQ(cache_.source, 1);
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), GetParam().expected_file);
    // Foreign keys of the defaults file are not the daemon's business.
    EXPECT_EQ(read_file(kHistory).find("update item"), std::string::npos);
}

INSTANTIATE_TEST_SUITE_P(
    Enabled, SystemDefaultsTest,
    ::testing::Values(
        DefaultsCase{"true", "autostart=1\nlogpath=external_sd\nlogsize=500\nAndroidLog=1\n"
                             "KernelLog=1\nBTLog=1\ntotallogsize=600\n"},
        DefaultsCase{"TRUE", "autostart=0\nlogpath=external_sd\nlogsize=500\nAndroidLog=1\n"
                             "KernelLog=1\nBTLog=1\ntotallogsize=600\n"},
        DefaultsCase{"  true  ", "autostart=1\nlogpath=external_sd\nlogsize=500\nAndroidLog=1\n"
                                 "KernelLog=1\nBTLog=1\ntotallogsize=600\n"},
        DefaultsCase{"1", "autostart=0\nlogpath=external_sd\nlogsize=500\nAndroidLog=1\n"
                          "KernelLog=1\nBTLog=1\ntotallogsize=600\n"}));

struct LineCase {
    const char* name;
    const char* content;
    const char* logsize;  // expected value of logsize afterwards
};

void PrintTo(const LineCase& c, std::ostream* os) { *os << c.name; }

class ConfigLineTest : public ConfigStoreTest, public ::testing::WithParamInterface<LineCase> {};

TEST_P(ConfigLineTest, ReaderAcceptsWhatTheWriterNeverProduces) {
    load(GetParam().content);
    EXPECT_EQ(value_of("logsize"), GetParam().logsize);
    // The other items keep their defaults whatever the line did.
    EXPECT_EQ(value_of("totallogsize"), "600");
    EXPECT_EQ(value_of("KernelLog"), "1");
}

INSTANTIATE_TEST_SUITE_P(
    Lines, ConfigLineTest,
    ::testing::Values(
        LineCase{"SpacesAroundKeyAndValue", "   logsize   =   200   \n", "200"},
        LineCase{"NoEquals", "logsize 200\n", "300"},
        LineCase{"EmptyValueAtEndOfFile", "logsize=", "300"},
        LineCase{"LoneLineFeedValue", "logsize=\n", "\n"},
        LineCase{"SingleSpaceValue", "logsize= \n", ""},
        LineCase{"EmptyKey", "=200\n", "300"},
        LineCase{"LastOneWins", "logsize=100\nlogsize=200\n", "200"},
        LineCase{"AnyOrder", "BTLog=1\nlogsize=7\nautostart=0\n", "7"},
        LineCase{"FirstEqualsSplits", "logsize=a=b\n", "a=b"},
        LineCase{"CarriageReturnStays", "logsize=20\r\n", "20\r"},
        LineCase{"KeysAreCaseSensitive", "LogSize=200\n", "300"},
        LineCase{"BlankAndCommentLines", "\n\n# logsize=5\nlogsize=9\n", "9"},
        LineCase{"NoFinalLineFeed", "logsize=42", "42"}),
    [](const ::testing::TestParamInfo<LineCase>& info) { return info.param.name; });

struct TrimCase {
    const char* in;
    const char* out;
};

void PrintTo(const TrimCase& c, std::ostream* os) { *os << ::testing::PrintToString(std::string(c.in)); }

class TrimTest : public ::testing::TestWithParam<TrimCase> {};

TEST_P(TrimTest, CutsTrailingSpacesAndLineFeedsOnly) {
    std::string s = GetParam().in;
    std::vector<char> buf(s.begin(), s.end());
    buf.push_back('\0');
    char* r = trim(buf.data());
    ASSERT_GE(r, buf.data());
    ASSERT_LE(r, buf.data() + s.size());
    EXPECT_STREQ(r, GetParam().out);
}

INSTANTIATE_TEST_SUITE_P(Strings, TrimTest,
                         ::testing::Values(TrimCase{"", ""}, TrimCase{"a", "a"}, TrimCase{"\n", "\n"},
                                           TrimCase{" ", ""}, TrimCase{"   ", ""},
                                           TrimCase{" \n", ""}, TrimCase{"\n\n\n", "\n"},
                                           TrimCase{"  a b  \n \n", "a b"},
                                           TrimCase{"\tx\t", "\tx\t"}, TrimCase{"x\r\n", "x\r"},
                                           TrimCase{"  lead", "lead"}));

TEST_F(ConfigStoreTest, UnknownKeyIsRecordedAndChangesNothing) {
    load("bogus=7\n");
    EXPECT_TRUE(has_record("update item bogus=7 to cache failed"));
    config_write(&cache_);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
}

TEST_F(ConfigStoreTest, UpdateReportsOnlyRealChanges) {
    EXPECT_EQ(config_update_item(&cache_, "logsize", "300"), 0);
    EXPECT_EQ(config_update_item(&cache_, "logsize", "301"), 1);
    EXPECT_EQ(config_update_item(&cache_, "nosuchkey", "1"), 0);
    EXPECT_EQ(config_update_item(&cache_, nullptr, "1"), 0);
    EXPECT_EQ(config_update_item(&cache_, "logsize", nullptr), 0);
    EXPECT_EQ(value_of("logsize"), "301");
}

TEST_F(ConfigStoreTest, ChangeToTheSameValueDoesNotRewriteTheFile) {
    write_file(CONFIG_FILE, kDefaultFile);
    ino_t before = inode_of(CONFIG_FILE);
    config_init(&cache_);
    config_change(&cache_, "logsize", "300");
    EXPECT_EQ(inode_of(CONFIG_FILE), before);
    config_change(&cache_, "nosuchkey", "1");
    EXPECT_EQ(inode_of(CONFIG_FILE), before);

    config_init(&cache_);
    config_change(&cache_, "logsize", "200");
    EXPECT_NE(inode_of(CONFIG_FILE), before);
    std::string expected = kDefaultFile;
    expected.replace(expected.find("logsize=300"), 11, "logsize=200");
    EXPECT_EQ(read_file(CONFIG_FILE), expected);
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
    std::string expected = kDefaultFile;
    expected.replace(expected.find("BTLog=1"), 7, "BTLog=0");
    EXPECT_EQ(read_file(CONFIG_FILE), expected);
}

TEST_F(ConfigStoreTest, LongestValuesSurviveAWriteAndARead) {
    std::string longest(CONFIG_FIELD_LEN - 1, 'v');
    ASSERT_EQ(config_update_item(&cache_, "totallogsize", longest.c_str()), 1);
    ASSERT_EQ(config_update_item(&cache_, "logpath", ("/" + longest.substr(1)).c_str()), 1);
    EXPECT_EQ(config_write(&cache_), 7);
    config_init(&cache_);
    config_load(&cache_);
    EXPECT_EQ(value_of("totallogsize"), longest);
    EXPECT_EQ(value_of("logpath"), "/" + longest.substr(1));
}

TEST_F(ConfigStoreTest, OverlongValueIsRefusedWithARecord) {
    std::string too_long(CONFIG_FIELD_LEN, '9');
    EXPECT_EQ(config_update_item(&cache_, "logsize", too_long.c_str()), 0);
    EXPECT_EQ(value_of("logsize"), "300");
    EXPECT_TRUE(has_record("value of logsize too long, ignored"));

    load("logpath=/" + std::string(200, 'p') + "\n");
    EXPECT_EQ(std::string(cache_.items[1].value), "internal_sd");
}

TEST_F(ConfigStoreTest, OverlongLinesAreCutAndRecordedOnce) {
    // 254 characters are looked at; the rest of a 1022-character piece is
    // dropped and the next piece of the same line is read as a line.
    std::string garbage(3000, 'g');
    load(garbage + "\n" + "logsize=" + std::string(2000, 'x') + "\n" + "KernelLog=0" +
         std::string(400, ' ') + "\n" + "BTLog=0\n");
    EXPECT_EQ(value_of("logsize"), "300");
    EXPECT_EQ(value_of("KernelLog"), "0");
    EXPECT_EQ(value_of("BTLog"), "0");
    int cut = 0;
    for (const std::string& m : history_messages()) cut += m.find("too long, cut at 254") != std::string::npos;
    EXPECT_EQ(cut, 1);
    EXPECT_TRUE(has_record("value of logsize too long, ignored"));
}

TEST_F(ConfigStoreTest, BinaryBytesNeitherCrashNorForgeRecords) {
    std::string content("logsize=4\0002\n", 12);
    const char control[] = "\x01\xff=\x02\x1b[2J\n";
    content += std::string(control, sizeof(control) - 1);
    content += "AndroidLog=0\n";
    load(content);
    EXPECT_EQ(value_of("logsize"), "300") << "a NUL byte must not shorten the line silently";
    EXPECT_EQ(value_of("AndroidLog"), "0");
    EXPECT_TRUE(has_record("1 lines of /data/misc/tqlog/tqlog_config hold a NUL byte, ignored"));
    // Control bytes are shown as '?', so the record stays one harmless line.
    EXPECT_TRUE(has_record("update item ?\xff=?\?[2J to cache failed"));
}

TEST_F(ConfigStoreTest, MegabyteOfRandomBytesAsDefaultsFile) {
    std::mt19937 rng(20240611);
    std::string noise(1 << 20, '\0');
    for (char& c : noise) c = static_cast<char>(rng() & 0xff);
    write_file(SYSTEM_DEFAULTS_FILE, noise);
    ASSERT_EQ(config_read_system_defaults(&cache_), 1);
    const char* keys[] = {"autostart", "logpath", "logsize", "AndroidLog", "KernelLog", "BTLog", "totallogsize"};
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) {
        EXPECT_STREQ(cache_.items[i].key, keys[i]);
        EXPECT_LT(strnlen(cache_.items[i].value, CONFIG_FIELD_LEN), static_cast<size_t>(CONFIG_FIELD_LEN));
    }
    EXPECT_EQ(config_write(&cache_), 7);

    // The same noise as the daemon's own file: every unknown key is recorded,
    // and each record stays one line with its timestamp.
    write_file(CONFIG_FILE, noise);
    config_init(&cache_);
    EXPECT_EQ(config_load(&cache_), 0);
    for (const std::string& m : history_messages()) ASSERT_NE(m.substr(0, 12), "<short line>");
}

TEST_F(ConfigStoreTest, WriteIntoAMissingFolderFailsAndIsRecordedInTheRunFile) {
    ASSERT_EQ(system("rm -rf /data/misc && mkdir -p /data/run && touch /data/misc"), 0);
    ASSERT_EQ(property_set("debug.TQ.realpath", "/data/run/"), 0);
    EXPECT_EQ(config_write(&cache_), -1);
    std::string run = read_file("/data/run/tqlog_history");
    EXPECT_NE(run.find("cant open the config file,errno=20,Not a directory"), std::string::npos) << run;
}

TEST_F(ConfigStoreTest, FailedWriteKeepsTheOldFileWhole) {
    write_file(CONFIG_FILE, kDefaultFile);
    config_update_item(&cache_, "logsize", "123");
    // The file size limit makes the third line fail half-way: EFBIG instead of SIGXFSZ.
    signal(SIGXFSZ, SIG_IGN);
    struct rlimit old_limit;
    getrlimit(RLIMIT_FSIZE, &old_limit);
    struct rlimit small = {40, old_limit.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
    int rc = config_write(&cache_);
    setrlimit(RLIMIT_FSIZE, &old_limit);
    EXPECT_EQ(rc, -1);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
    EXPECT_NE(access(CONFIG_FILE ".tmp", F_OK), 0);
}

TEST_F(ConfigStoreTest, StaleTemporaryFileOrLinkIsReplaced) {
    symlink("/data/elsewhere", CONFIG_FILE ".tmp");
    EXPECT_EQ(config_write(&cache_), 7);
    EXPECT_EQ(read_file(CONFIG_FILE), kDefaultFile);
    EXPECT_NE(access("/data/elsewhere", F_OK), 0);
}

}  // namespace
