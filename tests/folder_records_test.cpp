// The record of run folders: sizes learnt once, gone folders and the oldest
// over the budget forgotten, the folders themselves never touched.
#include "storage/folder_records.h"

#include "test_util.h"

namespace {

const std::string kParent = "/mnt/sdcard/qrvlog/tavlolog/";
const std::string kRecords = "/data/misc/tqlog/inter_sd_folder";

TEST(UpdateFolderRecords, RecordsTheNewFolderLastWithinTheBudget) {
    const struct {
        std::string before;                             // the records file; "-" none
        std::vector<std::pair<std::string, off_t>> on_card;  // folders and the bytes in each
        int total, log;
        std::string after;
        std::vector<std::string> records;
    } cases[] = {
        {"-", {}, 600, 300, "D 0\n", {"open /data/misc/tqlog/inter_sd_folder faild No such file or directory"}},
        {"A 0\nB 100\n", {{"A", 300 << 10}, {"B", 0}}, 600, 300, "A 300\nB 100\nD 0\n", {}},
        {"A 700\nB 600\nC 0\n", {{"A", 0}, {"B", 0}, {"C", 0}}, 2, 1, "B 600\nC 0\nD 0\n",
         {"log folder total size overflow  ", "delete A "}},
        {"A 700\nB 600\n", {{"A", 0}, {"B", 0}}, 1, 1, "A 700\nB 600\nD 0\n", {"log_sz bigger than total_sz(1:1)"}},
        {"X 5\nbare\nA 7\n", {{"A", 0}}, 600, 300, "A 7\nD 0\n",
         {"wrong format bare", "X not in sd anymore", "delete X (no exist)"}},
        // More than 2 GiB in one folder; a start in the same second names the folder again.
        {"A 0\nD 0\n", {{"A", 3LL << 30}}, 9000, 300, "A 3145728\nD 0\n", {}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.before);
        ASSERT_EQ(0, system(("rm -rf /mnt/sdcard/qrvlog " + kRecords + "; mkdir -p /data/misc/tqlog " + kParent + "D").c_str()));
        unlink(kHistory);
        if (c.before != "-") write_file(kRecords, c.before);
        for (const auto& folder : c.on_card) {
            mkdir((kParent + folder.first).c_str(), 0700);
            write_file(kParent + folder.first + "/log", "");
            ASSERT_EQ(0, truncate((kParent + folder.first + "/log").c_str(), folder.second));
        }
        EXPECT_EQ(1, update_folder_records("/mnt/sdcard", (kParent + "D/").c_str(), 1, c.total, c.log));
        EXPECT_EQ(c.after, read_file(kRecords));
        for (const std::string& record : c.records) EXPECT_TRUE(has_record(record)) << record;
        for (const auto& folder : c.on_card) EXPECT_TRUE(exists(kParent + folder.first));
    }
}

}  // namespace
