// The run's output files on the phone's real /data.
#include "transist/log_files.h"

#include "test_util.h"
#include "transist/transist_state.h"

namespace {

const std::string kHeader = "-----timezone: GMT\n";

class LogFilesTest : public ::testing::Test {
  protected:
    void SetUp() override {
        mkdir("/data/run", 0770);
        for (LogFile& entry : log_files) {
            entry.fd = -1;
            entry.sock = -1;
            entry.size = 0;
            entry.name[0] = '\0';
        }
        rotate_limit_kb = 1024;
    }
    void TearDown() override {
        for (LogFile& entry : log_files) close_log_file(&entry);
        sync_retired_files();
    }
    // Opens the type's file in folder as a run would.
    void open_entry(int type, const std::string& folder) {
        LogFile* entry = &log_files[type];
        ASSERT_EQ(compose_log_name(entry->name, folder.c_str(), type), 1);
        entry->fd = open_log_file(entry->name);
        ASSERT_GT(entry->fd, 0);
    }
    // Opens the files of a run in folder with only the given switches on.
    void open_run(const char* folder, int android, int kernel, int bt) {
        open_output_files({folder, "", {android != 0, android != 0, android != 0, kernel != 0, bt != 0}, 1024});
    }
};

TEST(LogHeader, FitsOneLineOfAtMost99Bytes) {
    const std::string cases[][2] = {
        {std::string(83, 'z'), "-----timezone: " + std::string(83, 'z') + "\n"},  // the longest that fits
        {std::string(91, 'y'), "-----timezone: " + std::string(83, 'y') + "\n"},
        {"Europe/Paris\n-----fake", "-----timezone: Europe/Paris?-----fake\n"},  // one line, whatever the zone
    };
    for (const auto& c : cases) {
        char out[HEADER_MAX + 1];
        int len = format_header(out, sizeof(out), c[0].c_str());
        EXPECT_EQ(std::string(out, static_cast<size_t>(std::max(len, 0))), c[1]);
    }
}

TEST_F(LogFilesTest, OpenWritesTimezoneHeaderAppendsAndIsPrivate) {
    const char path[] = "/data/run/main_log";
    int fd = open_log_file(path);
    ASSERT_GT(fd, 0);
    EXPECT_EQ(read_file(path), kHeader);
    EXPECT_EQ(mode_of(path), 0600u);
    EXPECT_NE(fcntl(fd, F_GETFL) & O_APPEND, 0);
    EXPECT_NE(fcntl(fd, F_GETFD) & FD_CLOEXEC, 0);
    close(fd);
    // Reopening an existing file appends a new header; nothing is overwritten.
    ASSERT_EQ(property_set("persist.sys.timezone", "Asia/Tokyo"), 0);
    fd = open_log_file(path);
    ASSERT_GT(fd, 0);
    EXPECT_EQ(read_file(path), kHeader + "-----timezone: Asia/Tokyo\n");
    close(fd);

    // Descriptor 0 means "no file" elsewhere in the transist.
    int saved = dup(0);
    close(0);
    EXPECT_GT(fd = open_log_file("/data/run/kernel_log"), 0);
    dup2(saved, 0);
    close(saved);
    if (fd > 0) close(fd);
}

TEST(RotationDue, OnlyPastTheLimit) {
    const struct {
        int64_t size;
        int limit_kb;
        bool due;
    } cases[] = {{1049599, 1024, false}, {1049600, 1024, true}, {1023, 0, false}, {1024, 0, true},
                 {2147000000, 2147483647, true}};  // never let the byte count overflow
    for (const auto& c : cases) EXPECT_EQ(rotation_due(c.size, c.limit_kb), c.due) << c.size << " " << c.limit_kb;
}

TEST_F(LogFilesTest, RotatingFiveGenerationsDropsTheOldest) {
    mkdir("/data/gen", 0770);
    for (int gen = 1; gen <= 4; gen++)
        write_file("/data/gen/radio_log." + std::to_string(gen), "gen" + std::to_string(gen));
    open_entry(LOG_RADIO, "/data/gen/");
    ASSERT_EQ(write_log_data(LOG_RADIO, "gen0", 4), 4);
    EXPECT_EQ(log_files[LOG_RADIO].size, 4);  // the header is not counted
    ASSERT_EQ(rotate_log_files(&log_files[LOG_RADIO]), 0);
    EXPECT_EQ(log_files[LOG_RADIO].size, 0);
    EXPECT_EQ(files_in("/data/gen"),
              (std::vector<std::string>{"radio_log", "radio_log.1", "radio_log.2", "radio_log.3", "radio_log.4"}));
    EXPECT_EQ(read_file("/data/gen/radio_log"), kHeader);
    EXPECT_EQ(read_file("/data/gen/radio_log.1"), kHeader + "gen0");
    for (int gen = 2; gen <= 4; gen++)
        EXPECT_EQ(read_file("/data/gen/radio_log." + std::to_string(gen)), "gen" + std::to_string(gen - 1));
    ASSERT_EQ(write_log_data(LOG_RADIO, "new", 3), 3);  // through the new descriptor
    EXPECT_EQ(read_file("/data/gen/radio_log"), kHeader + "new");
}

// A file that cannot be made or written leaves its type without a file, with one record.
TEST_F(LogFilesTest, FailuresLeaveTheTypeWithoutFile) {
    mkdir("/data/gone", 0770);
    open_entry(LOG_EVENTS, "/data/gone/");
    ASSERT_EQ(system("rm -rf /data/gone"), 0);
    EXPECT_EQ(rotate_log_files(&log_files[LOG_EVENTS]), -1);
    EXPECT_EQ(log_files[LOG_EVENTS].fd, -1);
    open_run("/data/missing/", 1, 0, 1);
    for (const LogFile& entry : log_files) EXPECT_EQ(entry.fd, -1);
    char name[PATH_LEN];  // a folder without room for a file name
    EXPECT_EQ(compose_log_name(name, ("/data/" + std::string(245, 'd') + "/").c_str(), LOG_MAIN), 0);
    EXPECT_STREQ(name, "");

    write_file("/data/run/bt_log", "");
    LogFile* entry = &log_files[LOG_BT];
    ASSERT_EQ(compose_log_name(entry->name, "/data/run/", LOG_BT), 1);
    entry->fd = open(entry->name, O_RDONLY | O_CLOEXEC);  // every write fails
    EXPECT_EQ(write_log_data(LOG_BT, "abc", 3), 0);
    EXPECT_EQ(write_log_data(LOG_BT, "def", 3), 0);
    EXPECT_EQ(entry->size, 0);
    EXPECT_EQ(count_of(read_file(kHistory), "write log data to /data/run/bt_log fail"), 1u);
}

// A link planted where a log file goes, or in place of the folder of a
// running log, is refused; nothing is written through it.
TEST_F(LogFilesTest, PlantedLinksAreNeverWrittenThrough) {
    write_file("/data/target", "autostart=0\n");
    ASSERT_EQ(symlink("/data/target", "/data/run/kernel_log"), 0);
    open_run("/data/run/", 0, 1, 0);
    EXPECT_EQ(log_files[LOG_KERNEL].fd, -1);

    ASSERT_EQ(unlink("/data/run/kernel_log"), 0);
    open_entry(LOG_MAIN, "/data/run/");
    ASSERT_EQ(system("mv /data/run /data/old && mkdir /data/other && ln -s /data/other /data/run"), 0);
    EXPECT_EQ(rotate_log_files(&log_files[LOG_MAIN]), -1);
    EXPECT_TRUE(files_in("/data/other").empty());
    EXPECT_EQ(read_file("/data/target"), "autostart=0\n");
}

TEST_F(LogFilesTest, ChangeFolderReopensExactlyTheOpenFiles) {
    mkdir("/data/next", 0770);
    open_entry(LOG_MAIN, "/data/run/");
    open_entry(LOG_KERNEL, "/data/run/");
    ASSERT_EQ(write_log_data(LOG_MAIN, "before", 6), 6);
    change_log_folder("/data/next/", "", 2048);
    EXPECT_EQ(files_in("/data/next"), (std::vector<std::string>{"kernel_log", "main_log"}));
    EXPECT_EQ(read_file("/data/next/kernel_log"), kHeader);
    EXPECT_EQ(read_file("/data/run/main_log"), kHeader + "before");
    EXPECT_STREQ(log_files[LOG_MAIN].name, "/data/next/main_log");
    EXPECT_EQ(log_files[LOG_MAIN].size, 0);
    EXPECT_EQ(log_files[LOG_RADIO].fd, -1);
    EXPECT_EQ(rotate_limit_kb, 2048);
    ASSERT_EQ(write_log_data(LOG_MAIN, "after", 5), 5);
    EXPECT_EQ(read_file("/data/next/main_log"), kHeader + "after");

    // A folder too long for the names keeps the current file; a missing one leaves none.
    change_log_folder(("/data/" + std::string(250, 'n') + "/").c_str(), "", 1024);
    ASSERT_EQ(write_log_data(LOG_MAIN, "kept", 4), 4);
    EXPECT_EQ(read_file("/data/next/main_log"), kHeader + "afterkept");
    change_log_folder("/data/absent/", "", 1024);
    EXPECT_EQ(log_files[LOG_MAIN].fd, -1);
}

}  // namespace
