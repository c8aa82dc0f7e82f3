// Rate-limited records: the first, then one summary per window with the count.
#include "storage/record_limit.h"

#include <limits.h>

#include <thread>

#include "test_util.h"

namespace {

TEST(RecordLimit, FirstRecordThenOneSummaryPerWindow) {
    SKIP_OUTSIDE_PHONE();
    RecordLimit limit = RECORD_LIMIT(TAG_MAIN, "test records");
    limit.window_ms = 100;
    EXPECT_TRUE(record_limit_pass(&limit));
    for (int i = 0; i < 3; i++) EXPECT_FALSE(record_limit_pass(&limit));
    EXPECT_GT(record_limit_flush(&limit), 0);  // window not over: nothing written yet
    EXPECT_TRUE(history_messages().empty());
    ASSERT_TRUE(wait_for([&] { return record_limit_flush(&limit) == -1; }, 2000));
    EXPECT_EQ(history_messages(), std::vector<std::string>{"3 more test records not recorded"});
    usleep(limit.window_ms * 1000);  // the summary opened a window; after it a record passes alone
    EXPECT_TRUE(record_limit_pass(&limit));
    EXPECT_EQ(history_messages().size(), 1u);

    limit.next_ms = LLONG_MAX;  // threads within one window lose no count
    std::atomic<int> passed{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; t++)
        threads.emplace_back([&] {
            for (int i = 0; i < 10000; i++) passed += record_limit_pass(&limit) ? 1 : 0;
        });
    for (std::thread& t : threads) t.join();
    EXPECT_EQ(passed.load(), 0);
    EXPECT_EQ(limit.held.load(), 40000);
}

}  // namespace
