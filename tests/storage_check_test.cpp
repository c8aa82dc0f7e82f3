// Free-space checks and system warnings: the threshold, the 64-bit measure,
// the failure and retry records, and the records of each warning type.
#include "storage/storage_check.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "platform/properties.h"

namespace {

const char kCentral[] = "/data/misc/tqlog/tqlog_history";

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

// Messages of the central history file, timestamps cut off.
std::vector<std::string> records() {
    std::vector<std::string> out;
    std::string all = read_file(kCentral);
    size_t start = 0;
    while (start < all.size()) {
        size_t end = all.find('\n', start);
        if (end == std::string::npos) end = all.size();
        out.push_back(all.substr(start + 20, end - start - 20));
        start = end + 1;
    }
    return out;
}

class StorageCheckTest : public ::testing::Test {
  protected:
    void SetUp() override {
        if (access("/dev/emu/properties", F_OK) != 0) GTEST_SKIP() << "runs only inside the emulated phone";
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/* && mkdir -p /data/misc/tqlog && : > /dev/emu/wlog"), 0);
    }
};

struct ThresholdCase {
    uint64_t free_bytes;
    int low;
};

void PrintTo(const ThresholdCase& c, std::ostream* os) { *os << c.free_bytes << " bytes"; }

class ThresholdTest : public ::testing::TestWithParam<ThresholdCase> {};

TEST_P(ThresholdTest, BelowTenMebibytesIsLow) {
    EXPECT_EQ(is_free_space_low(GetParam().free_bytes), GetParam().low) << GetParam().free_bytes;
}

INSTANTIATE_TEST_SUITE_P(Bytes, ThresholdTest,
                         ::testing::Values(ThresholdCase{0, 1}, ThresholdCase{1, 1},
                                           ThresholdCase{10485759, 1}, ThresholdCase{10485760, 0},
                                           ThresholdCase{10485761, 0},
                                           // Above 4 GiB: a 32-bit wrap would make these low.
                                           ThresholdCase{(4ULL << 30) + 4096, 0},
                                           ThresholdCase{64ULL << 30, 0},
                                           ThresholdCase{UINT64_MAX, 0}));

TEST_F(StorageCheckTest, FreeSpaceIsAvailableBlocksTimesBlockSize) {
    struct statfs st;
    ASSERT_EQ(statfs("/tmp", &st), 0);
    uint64_t expected = static_cast<uint64_t>(st.f_bavail) * static_cast<uint64_t>(st.f_bsize);
    uint64_t got = get_free_space("/tmp", 0);
    // /tmp is private to the test; nothing else writes there meanwhile.
    EXPECT_EQ(got, expected);
    EXPECT_GT(got, 0u);
    EXPECT_TRUE(records().empty());
}

TEST_F(StorageCheckTest, MissingPathFailsOnceAndIsLow) {
    EXPECT_EQ(get_free_space("/mnt/nosuchcard", 3), 0u);
    EXPECT_EQ(records(), std::vector<std::string>{"Failed to get the file status of /mnt/nosuchcard, errno=2"});

    ASSERT_EQ(system("rm -f /data/misc/tqlog/tqlog_history"), 0);
    EXPECT_EQ(is_storage_low("/mnt/nosuchcard"), 1);
    EXPECT_EQ(records(), (std::vector<std::string>{"Failed to get the file status of /mnt/nosuchcard, errno=2",
                                                  "/mnt/nosuchcard is almost full or unavailable!!"}));
}

TEST_F(StorageCheckTest, FileSystemWithoutBlocksIsRetriedThenGivenUp) {
    // procfs reports zero blocks, as an unmounted card does.
    EXPECT_EQ(get_free_space("/proc", 2), 0u);
    EXPECT_EQ(records(), (std::vector<std::string>{"SD card is unavailable!! Retrying!",
                                                  "SD card is unavailable!! Retrying!",
                                                  "SD card is unavailable!! Retrying!",
                                                  "SD card is unavailable! We have retried!"}));
}

TEST_F(StorageCheckTest, UnavailableFileSystemIsLowAfterOneAttempt) {
    EXPECT_EQ(is_storage_low("/proc"), 1);
    EXPECT_EQ(records(), (std::vector<std::string>{"SD card is unavailable!! Retrying!",
                                                  "SD card is unavailable! We have retried!",
                                                  "/proc is almost full or unavailable!!"}));
}

struct WarningCase {
    const char* name;
    int type;
    const char* encrypt_progress;  // "" leaves the property unset
    std::vector<std::string> records;
};

void PrintTo(const WarningCase& c, std::ostream* os) { *os << c.name; }

class WarningTest : public StorageCheckTest, public ::testing::WithParamInterface<WarningCase> {};

TEST_P(WarningTest, RecordsDependOnTypeAndEncryption) {
    const WarningCase& c = GetParam();
    if (c.encrypt_progress[0]) {
        ASSERT_EQ(property_set("vold.encrypt_progress", c.encrypt_progress), 0);
    }
    report_system_warning(c.type);
    EXPECT_EQ(records(), c.records);
    // The platform log gets the same texts under the main tag.
    std::string platform = read_file("/dev/emu/wlog");
    for (const std::string& r : c.records) EXPECT_NE(platform.find("TavloLogD: " + r + "\n"), std::string::npos) << r;
}

INSTANTIATE_TEST_SUITE_P(
    Types, WarningTest,
    ::testing::Values(
        WarningCase{"Negative", -1, "", {}},
        WarningCase{"NegativeWhileEncrypting", -1, "42", {}},
        WarningCase{"OutputFailed",
                    5,
                    "",
                    {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 5", "out put to log file failed"}},
        WarningCase{"CardFull",
                    11,
                    "",
                    {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 11", "sdcard is full"}},
        WarningCase{"CopyFailed",
                    4,
                    "",
                    {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 4", "oru type 4 comes"}},
        WarningCase{"Zero", 0, "", {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 0", "oru type 0 comes"}},
        WarningCase{"Encrypting",
                    5,
                    "42",
                    {"prop:vold.encrypt_progress,temp:42", "phone is encryping, will not show red screen:42"}}),
    [](const ::testing::TestParamInfo<WarningCase>& info) { return info.param.name; });

}  // namespace
