// Free-space checks and system warnings.
#include "storage/storage_check.h"

#include "test_util.h"

namespace {

using Records = std::vector<std::string>;

class StorageCheckTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/* && mkdir -p /data/misc/tqlog"), 0);
    }
};

// Above 4 GiB: a 32-bit wrap would make these low.
TEST(FreeSpaceThreshold, BelowTenMebibytesIsLow) {
    for (uint64_t bytes : {10485760ULL, (4ULL << 30) + 4096, 0xffffffffffffffffULL}) EXPECT_EQ(is_free_space_low(bytes), 0) << bytes;
    for (uint64_t bytes : {10485759ULL, 0ULL}) EXPECT_EQ(is_free_space_low(bytes), 1) << bytes;
}

// A missing path fails at once; a file system without blocks (procfs, as an
// unmounted card) is retried, then given up. Either is low.
TEST_F(StorageCheckTest, UnavailablePathIsLow) {
    const std::string retry = "SD card is unavailable!! Retrying!", gave_up = "SD card is unavailable! We have retried!";
    const std::string missing = "Failed to get the file status of /mnt/nosuchcard, errno=2";
    const struct {
        const char* path;
        Records get_records, low_records;
    } cases[] = {
        {"/mnt/nosuchcard", {missing}, {missing, "/mnt/nosuchcard is almost full or unavailable!!"}},
        {"/proc", {retry, retry, retry, gave_up}, {retry, gave_up, "/proc is almost full or unavailable!!"}},
    };
    for (const auto& c : cases) {
        unlink(kHistory);
        EXPECT_EQ(get_free_space(c.path, 2), 0u);  // up to two retries
        EXPECT_EQ(history_messages(), c.get_records);
        unlink(kHistory);
        EXPECT_EQ(is_storage_low(c.path), 1);
        EXPECT_EQ(history_messages(), c.low_records);
    }
}

TEST_F(StorageCheckTest, WarningRecordsDependOnTypeAndEncryption) {
    const struct {
        int type;
        const char* encrypt_progress;  // "": unset
        Records records;
    } cases[] = {
        {-1, "42", {}},
        {5, "", {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 5", "out put to log file failed"}},
        {11, "", {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 11", "sdcard is full"}},
        {4, "", {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 4", "oru type 4 comes"}},
        {5, "42", {"prop:vold.encrypt_progress,temp:42", "phone is encryping, will not show red screen:42"}},
    };
    for (const auto& c : cases) {
        SetUp();
        if (c.encrypt_progress[0]) { ASSERT_EQ(property_set("vold.encrypt_progress", c.encrypt_progress), 0); }
        report_system_warning(c.type);
        EXPECT_EQ(history_messages(), c.records) << c.type;
    }
}

}  // namespace
