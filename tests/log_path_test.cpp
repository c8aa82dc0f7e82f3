// Resolution of the logpath setting and its override by a persistent property.
#include "config/log_path.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "config/config_store.h"
#include "platform/properties.h"

namespace {

const char kHistory[] = "/data/misc/tqlog/tqlog_history";
const char kOverride[] = "persist.qrvlog.log2sd.path";

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
    int fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << path;
    ASSERT_EQ(write(fd, content.data(), content.size()), static_cast<ssize_t>(content.size()));
    close(fd);
}

ino_t inode_of(const char* path) {
    struct stat st;
    return stat(path, &st) == 0 ? st.st_ino : 0;
}

std::string config_with_logpath(const std::string& logpath) {
    return "autostart=0\nlogpath=" + logpath +
           "\nlogsize=300\nAndroidLog=1\nKernelLog=1\nBTLog=1\ntotallogsize=600\n";
}

class LogPathTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (access("/dev/emu/properties", F_OK) != 0) GTEST_SKIP() << "runs only inside the emulated phone";
        umask(0);
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/*"), 0);
        // persist. properties keep a copy here, as on the phone.
        ASSERT_EQ(system("mkdir -p /data/property /data/misc/tqlog"), 0);
    }
};

struct ResolveCase {
    const char* name;
    const char* value;
    const char* internal_prop;
    const char* external_prop;
    const char* expected;
    const char* record;  // expected history record, or "" for none
};

void PrintTo(const ResolveCase& c, std::ostream* os) { *os << c.name; }

class ResolveTest : public LogPathTest, public ::testing::WithParamInterface<ResolveCase> {};

TEST_P(ResolveTest, ValueBecomesADirectory) {
    const ResolveCase& c = GetParam();
    if (c.internal_prop[0]) {
        ASSERT_EQ(property_set("internal_sd_path", c.internal_prop), 0);
    }
    if (c.external_prop[0]) {
        ASSERT_EQ(property_set("external_sd_path", c.external_prop), 0);
    }
    char out[CONFIG_FIELD_LEN];
    EXPECT_EQ(resolve_log_path(c.value, out), out);
    EXPECT_STREQ(out, c.expected);
    std::string history = read_file(kHistory);
    if (c.record[0]) {
        EXPECT_NE(history.find(std::string(c.record) + "\n"), std::string::npos) << history;
    } else {
        EXPECT_EQ(history, "");
    }
}

INSTANTIATE_TEST_SUITE_P(
    Values, ResolveTest,
    ::testing::Values(
        ResolveCase{"InternalFromProperty", "internal_sd", "/storage/emulated/0", "", "/storage/emulated/0", ""},
        ResolveCase{"InternalFallback", "internal_sd", "", "/storage/ext", "/mnt/sdcard",
                    "cant get log path through property internal_sd_path"},
        ResolveCase{"ExternalFallback", "external_sd", "/storage/int", "", "/mnt/sdcard2",
                    "cant get log path through property external_sd_path"},
        ResolveCase{"ExternalFromProperty", "external_sd", "", "/storage/sdcard1", "/storage/sdcard1", ""},
        ResolveCase{"DataNeedsNoProperty", "/data", "", "", "/data", ""},
        ResolveCase{"NamesAreCaseSensitive", "Internal_SD", "/storage/int", "", "Internal_SD", ""},
        ResolveCase{"EmptyStaysEmpty", "", "", "", "", ""}),
    [](const ::testing::TestParamInfo<ResolveCase>& info) { return info.param.name; });

TEST_F(LogPathTest, OverlongValueIsCutInsideTheBuffer) {
    std::string value(300, 'd');
    char out[CONFIG_FIELD_LEN + 8];
    memset(out, 'X', sizeof(out));
    resolve_log_path(value.c_str(), out);
    EXPECT_EQ(strlen(out), static_cast<size_t>(CONFIG_FIELD_LEN - 1));
    for (size_t i = CONFIG_FIELD_LEN; i < sizeof(out); i++) EXPECT_EQ(out[i], 'X') << "overrun at " << i;
}

TEST_F(LogPathTest, OverrideRewritesTheFileAndResolvesLater) {
    write_file(CONFIG_FILE, config_with_logpath("internal_sd"));
    ASSERT_EQ(property_set(kOverride, "external_sd"), 0);
    ASSERT_EQ(property_set("external_sd_path", "/storage/sdcard1"), 0);
    ConfigCache cache;
    config_init(&cache);
    config_load(&cache);
    EXPECT_EQ(read_file(CONFIG_FILE), config_with_logpath("external_sd"));
    EXPECT_STREQ(config_get(&cache, "logpath"), "/storage/sdcard1");

    // The value stays in the file after the property is cleared.
    ASSERT_EQ(property_set(kOverride, ""), 0);
    config_init(&cache);
    config_load(&cache);
    EXPECT_EQ(read_file(CONFIG_FILE), config_with_logpath("external_sd"));
}

struct NoRewriteCase {
    const char* name;
    const char* property;  // "" leaves it unset
};

void PrintTo(const NoRewriteCase& c, std::ostream* os) { *os << c.name; }

class OverrideNoRewriteTest : public LogPathTest, public ::testing::WithParamInterface<NoRewriteCase> {};

TEST_P(OverrideNoRewriteTest, FileIsLeftAlone) {
    write_file(CONFIG_FILE, config_with_logpath("/data"));
    ino_t before = inode_of(CONFIG_FILE);
    if (GetParam().property[0]) {
        ASSERT_EQ(property_set(kOverride, GetParam().property), 0);
    }
    ConfigCache cache;
    config_init(&cache);
    config_load(&cache);
    EXPECT_EQ(inode_of(CONFIG_FILE), before);
    EXPECT_EQ(read_file(CONFIG_FILE), config_with_logpath("/data"));
    EXPECT_STREQ(config_get(&cache, "logpath"), "/data");
}

INSTANTIATE_TEST_SUITE_P(Property, OverrideNoRewriteTest,
                         ::testing::Values(NoRewriteCase{"Unset", ""}, NoRewriteCase{"Equal", "/data"}),
                         [](const ::testing::TestParamInfo<NoRewriteCase>& info) { return info.param.name; });

TEST_F(LogPathTest, OverrideAppliesAlsoWhenTheFileIsRecreated) {
    ASSERT_EQ(property_set(kOverride, "/data"), 0);
    ConfigCache cache;
    config_init(&cache);
    config_load(&cache);
    EXPECT_EQ(read_file(CONFIG_FILE), config_with_logpath("/data"));
}

}  // namespace
