// Rate-limited records: the first, then one summary per window with the count.
#include "storage/record_limit.h"

#include <thread>

#include "test_util.h"

namespace {

class RecordLimitTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_EQ(system("rm -rf /data/* /dev/emu/properties/* && mkdir -p /data/misc/tqlog"), 0);
        limit.window_ms = 100;
    }
    RecordLimit limit = RECORD_LIMIT(TAG_MAIN, "test records");
};

TEST_F(RecordLimitTest, FirstRecordThenOneSummaryPerWindow) {
    EXPECT_TRUE(record_limit_pass(&limit));
    for (int i = 0; i < 3; i++) EXPECT_FALSE(record_limit_pass(&limit));
    EXPECT_GT(record_limit_flush(&limit), 0);  // window not over: nothing written yet
    EXPECT_TRUE(history_messages().empty());
    ASSERT_TRUE(wait_for([&] { return record_limit_flush(&limit) == -1; }, 2000));
    EXPECT_EQ(history_messages(), std::vector<std::string>{"3 more test records not recorded"});
    // The summary opened a window; once it is over the next record passes alone.
    usleep(limit.window_ms * 1000);
    EXPECT_TRUE(record_limit_pass(&limit));
    EXPECT_EQ(history_messages().size(), 1u);
}

TEST_F(RecordLimitTest, ThreadsLoseNoCount) {
    limit.window_ms = 1000000;  // one window for the whole test
    std::atomic<int> passed{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; t++)
        threads.emplace_back([&] {
            for (int i = 0; i < 10000; i++) passed += record_limit_pass(&limit) ? 1 : 0;
        });
    for (std::thread& t : threads) t.join();
    EXPECT_EQ(passed.load(), 1);
    EXPECT_EQ(limit.held.load(), 39999);
}

}  // namespace
