// The run's output files on the phone's real /data: the header line byte for
// byte, the rotation test and the five generations, the table of open files
// per enabled type, and moving the open files to another folder.
#include "transist/log_files.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "core/log_controller.h"
#include "platform/properties.h"
#include "transist/transist_state.h"

namespace {

const char kHistory[] = "/data/misc/tqlog/tqlog_history";
const char kHeader[] = "-----timezone: GMT\n";

std::string read_file(const std::string& path) {
    std::string out;
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return "<missing>";
    char buf[4096];
    ssize_t n;
    while ((n = read(fd, buf, sizeof(buf))) > 0) out.append(buf, static_cast<size_t>(n));
    close(fd);
    return out;
}

void write_file(const std::string& path, const std::string& content) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << path;
    ASSERT_EQ(write(fd, content.data(), content.size()), static_cast<ssize_t>(content.size()));
    close(fd);
}

size_t count_of(const std::string& haystack, const std::string& needle) {
    size_t count = 0;
    for (size_t at = haystack.find(needle); at != std::string::npos;
         at = haystack.find(needle, at + 1)) {
        count++;
    }
    return count;
}

std::vector<std::string> files_in(const std::string& dir) {
    std::vector<std::string> out;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) return out;
    while (dirent* e = readdir(d)) {
        if (e->d_name[0] != '.') out.push_back(e->d_name);
    }
    closedir(d);
    std::sort(out.begin(), out.end());
    return out;
}

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
};

struct HeaderCase {
    const char* name;
    std::string zone;
    std::string line;
};

class HeaderTest : public ::testing::TestWithParam<HeaderCase> {};

TEST_P(HeaderTest, FitsOneLineOfAtMost99Bytes) {
    char out[HEADER_MAX + 1];
    int len = format_header(out, sizeof(out), GetParam().zone.c_str());
    EXPECT_EQ(std::string(out, static_cast<size_t>(len)), GetParam().line);
    EXPECT_LE(len, HEADER_MAX);
}

INSTANTIATE_TEST_SUITE_P(
    LogFiles, HeaderTest,
    ::testing::Values(
        HeaderCase{"Default", "GMT", "-----timezone: GMT\n"},
        HeaderCase{"Region", "Asia/Shanghai", "-----timezone: Asia/Shanghai\n"},
        HeaderCase{"LongestThatFits", std::string(83, 'z'),
                   "-----timezone: " + std::string(83, 'z') + "\n"},
        HeaderCase{"TooLongIsCut", std::string(91, 'y'),
                   "-----timezone: " + std::string(83, 'y') + "\n"},
        HeaderCase{"LineBreakCannotSplitTheLine", "Europe/Paris\n-----fake",
                   "-----timezone: Europe/Paris?-----fake\n"}),
    [](const ::testing::TestParamInfo<HeaderCase>& info) { return info.param.name; });

TEST_F(LogFilesTest, OpenWritesTimezoneHeaderAppendsAndIsPrivate) {
    const char path[] = "/data/run/main_log";
    int fd = open_log_file(path);
    ASSERT_GT(fd, 0);
    EXPECT_EQ(read_file(path), kHeader);
    struct stat st;
    ASSERT_EQ(fstat(fd, &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_NE(fcntl(fd, F_GETFL) & O_APPEND, 0);
    EXPECT_NE(fcntl(fd, F_GETFD) & FD_CLOEXEC, 0);
    close(fd);

    // Reopening an existing file appends a new header; nothing is overwritten.
    ASSERT_EQ(property_set("persist.sys.timezone", "Asia/Tokyo"), 0);
    fd = open_log_file(path);
    ASSERT_GT(fd, 0);
    EXPECT_EQ(read_file(path), std::string(kHeader) + "-----timezone: Asia/Tokyo\n");
    close(fd);
}

TEST_F(LogFilesTest, OpenNeverHandsOutDescriptorZero) {
    int saved = dup(0);
    close(0);
    int fd = open_log_file("/data/run/kernel_log");
    EXPECT_GT(fd, 0);
    EXPECT_EQ(read_file("/data/run/kernel_log"), kHeader);
    close(fd);
    dup2(saved, 0);
    close(saved);
}

TEST_F(LogFilesTest, OpenFailureReturnsNegative) {
    errno = 0;
    EXPECT_LT(open_log_file("/data/no/such/folder/main_log"), 0);
    EXPECT_EQ(errno, ENOENT);
}

struct RotationCase {
    int64_t size;
    int limit_kb;
    bool due;
};

class RotationDueTest : public ::testing::TestWithParam<RotationCase> {};

TEST_P(RotationDueTest, RotatesOnlyPastTheLimit) {
    EXPECT_EQ(rotation_due(GetParam().size, GetParam().limit_kb), GetParam().due)
        << GetParam().size << " bytes, limit " << GetParam().limit_kb << "K";
}

INSTANTIATE_TEST_SUITE_P(LogFiles, RotationDueTest,
                         ::testing::Values(RotationCase{1048000, 1024, false},
                                           RotationCase{1052000, 1024, true},  // 1027K
                                           RotationCase{1049599, 1024, false},  // 1024K
                                           RotationCase{1049600, 1024, true},   // 1025K
                                           RotationCase{0, 0, false},
                                           RotationCase{1023, 0, false},
                                           RotationCase{1024, 0, true},
                                           // never let the byte count overflow
                                           RotationCase{2147000000, 2147483647, true}),
                         [](const ::testing::TestParamInfo<RotationCase>& info) {
                             return std::to_string(info.param.size) + "Bytes" +
                                    std::to_string(info.param.limit_kb) + "K";
                         });

TEST_F(LogFilesTest, WritesCountBytesAndRotateAfterTheNodeThatPassesTheLimit) {
    open_entry(LOG_KERNEL, "/data/run/");
    LogFile* entry = &log_files[LOG_KERNEL];
    std::string first(1048000, 'a');
    std::string second(4000, 'b');
    ASSERT_EQ(write_log_data(LOG_KERNEL, first.data(), static_cast<int>(first.size())), 1048000);
    EXPECT_EQ(entry->size, 1048000);  // header not counted
    EXPECT_FALSE(rotation_due(entry->size, rotate_limit_kb));
    ASSERT_EQ(write_log_data(LOG_KERNEL, second.data(), static_cast<int>(second.size())), 4000);
    EXPECT_EQ(entry->size, 1052000);
    ASSERT_TRUE(rotation_due(entry->size, rotate_limit_kb));
    ASSERT_EQ(rotate_log_files(entry), 0);
    EXPECT_EQ(entry->size, 0);
    EXPECT_EQ(read_file("/data/run/kernel_log.1"), kHeader + first + second);
    EXPECT_EQ(read_file("/data/run/kernel_log"), kHeader);
}

TEST_F(LogFilesTest, RotatingOnlyXMakesXDot1AndAFreshX) {
    open_entry(LOG_MAIN, "/data/run/");
    ASSERT_EQ(write_log_data(LOG_MAIN, "old", 3), 3);

    testing::internal::CaptureStderr();
    ASSERT_EQ(rotate_log_files(&log_files[LOG_MAIN]), 0);
    // Missing older generations are normal: nothing is printed for them.
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
    EXPECT_EQ(files_in("/data/run"), (std::vector<std::string>{"main_log", "main_log.1"}));
    EXPECT_EQ(read_file("/data/run/main_log.1"), std::string(kHeader) + "old");
    EXPECT_EQ(read_file("/data/run/main_log"), kHeader);
    EXPECT_GT(log_files[LOG_MAIN].fd, 0);
    // The new descriptor writes to the new file.
    ASSERT_EQ(write_log_data(LOG_MAIN, "new", 3), 3);
    EXPECT_EQ(read_file("/data/run/main_log"), std::string(kHeader) + "new");
}

TEST_F(LogFilesTest, RotatingFiveGenerationsDropsTheOldest) {
    mkdir("/data/gen", 0770);
    write_file("/data/gen/radio_log.1", "gen1");
    write_file("/data/gen/radio_log.2", "gen2");
    write_file("/data/gen/radio_log.3", "gen3");
    write_file("/data/gen/radio_log.4", "gen4");
    open_entry(LOG_RADIO, "/data/gen/");
    ASSERT_EQ(write_log_data(LOG_RADIO, "gen0", 4), 4);
    ASSERT_EQ(rotate_log_files(&log_files[LOG_RADIO]), 0);
    EXPECT_EQ(files_in("/data/gen"),
              (std::vector<std::string>{"radio_log", "radio_log.1", "radio_log.2", "radio_log.3",
                                        "radio_log.4"}));
    EXPECT_EQ(read_file("/data/gen/radio_log"), kHeader);
    EXPECT_EQ(read_file("/data/gen/radio_log.1"), std::string(kHeader) + "gen0");
    EXPECT_EQ(read_file("/data/gen/radio_log.2"), "gen1");
    EXPECT_EQ(read_file("/data/gen/radio_log.3"), "gen2");
    EXPECT_EQ(read_file("/data/gen/radio_log.4"), "gen3");
}

TEST_F(LogFilesTest, FailedReopenAfterRotationIsRecordedAndLeavesNoFile) {
    mkdir("/data/gone", 0770);
    open_entry(LOG_EVENTS, "/data/gone/");
    ASSERT_EQ(system("rm -rf /data/gone"), 0);
    EXPECT_EQ(rotate_log_files(&log_files[LOG_EVENTS]), -1);
    EXPECT_EQ(log_files[LOG_EVENTS].fd, -1);
    EXPECT_NE(read_file(kHistory).find("couldn't open output file /data/gone/events_log,(2)"),
              std::string::npos);
}

TEST_F(LogFilesTest, FailedDataWritesAreRecordedOncePerFile) {
    write_file("/data/run/bt_log", "");
    LogFile* entry = &log_files[LOG_BT];
    ASSERT_EQ(compose_log_name(entry->name, "/data/run/", LOG_BT), 1);
    entry->fd = open(entry->name, O_RDONLY | O_CLOEXEC);  // every write fails
    ASSERT_GT(entry->fd, 0);
    EXPECT_EQ(write_log_data(LOG_BT, "abc", 3), 0);
    EXPECT_EQ(write_log_data(LOG_BT, "def", 3), 0);
    EXPECT_EQ(entry->size, 0);
    EXPECT_EQ(count_of(read_file(kHistory), "write log data to /data/run/bt_log fail"), 1u);
}

TEST_F(LogFilesTest, OutputFilesFollowTheControllerSwitches) {
    LogController controller;
    controller.android_log = 0;
    controller.kernel_log = 1;
    controller.bt_log = 0;
    open_output_files(&controller, "/data/run/");
    EXPECT_GT(log_files[LOG_KERNEL].fd, 0);
    EXPECT_STREQ(log_files[LOG_KERNEL].name, "/data/run/kernel_log");
    for (int type : {LOG_MAIN, LOG_RADIO, LOG_EVENTS, LOG_BT}) {
        EXPECT_EQ(log_files[type].fd, -1) << type;
        EXPECT_STREQ(log_files[type].name, "") << type;
    }
    EXPECT_EQ(files_in("/data/run"), std::vector<std::string>{"kernel_log"});
    std::string history = read_file(kHistory);
    EXPECT_NE(history.find("open /data/run/kernel_log, fd = " +
                           std::to_string(log_files[LOG_KERNEL].fd)),
              std::string::npos);
}

TEST_F(LogFilesTest, CreateFailuresUseEachTypesText) {
    LogController controller;
    controller.android_log = 1;
    controller.kernel_log = 0;
    controller.bt_log = 1;
    open_output_files(&controller, "/data/missing/");
    for (const LogFile& entry : log_files) EXPECT_EQ(entry.fd, -1);
    std::string history = read_file(kHistory);
    EXPECT_NE(history.find("Create /data/missing/main_log fail No such file or directory"),
              std::string::npos);
    EXPECT_NE(history.find("Create /data/missing/bt_log fail, No such file or directory"),
              std::string::npos);
    EXPECT_NE(history.find("open /data/missing/events_log, fd = -1"), std::string::npos);
}

TEST_F(LogFilesTest, RunFolderTooLongForANameIsRefused) {
    std::string folder = "/data/" + std::string(245, 'd') + "/";
    char name[PATH_LEN];
    EXPECT_EQ(compose_log_name(name, folder.c_str(), LOG_MAIN), 0);
    EXPECT_STREQ(name, "");
    LogController controller;
    controller.android_log = 0;
    controller.kernel_log = 1;
    controller.bt_log = 0;
    open_output_files(&controller, folder.c_str());
    EXPECT_EQ(log_files[LOG_KERNEL].fd, -1);
    EXPECT_NE(read_file(kHistory).find("log file path too long"), std::string::npos);
}

TEST_F(LogFilesTest, ChangeFolderReopensExactlyTheOpenFiles) {
    mkdir("/data/next", 0770);
    open_entry(LOG_MAIN, "/data/run/");
    open_entry(LOG_KERNEL, "/data/run/");
    ASSERT_EQ(write_log_data(LOG_MAIN, "before", 6), 6);
    change_log_folder("/data/next/", 2048);
    EXPECT_EQ(files_in("/data/next"), (std::vector<std::string>{"kernel_log", "main_log"}));
    EXPECT_EQ(read_file("/data/next/main_log"), kHeader);
    EXPECT_EQ(read_file("/data/next/kernel_log"), kHeader);
    EXPECT_EQ(read_file("/data/run/main_log"), std::string(kHeader) + "before");
    EXPECT_STREQ(log_files[LOG_MAIN].name, "/data/next/main_log");
    EXPECT_EQ(log_files[LOG_MAIN].size, 0);
    EXPECT_EQ(log_files[LOG_RADIO].fd, -1);
    EXPECT_EQ(rotate_limit_kb, 2048);
    EXPECT_NE(read_file(kHistory).find("rotates size change from 1024K to 2048K"),
              std::string::npos);
    ASSERT_EQ(write_log_data(LOG_MAIN, "after", 5), 5);
    EXPECT_EQ(read_file("/data/next/main_log"), std::string(kHeader) + "after");
}

TEST_F(LogFilesTest, ChangeFolderWithoutARunOnlySetsTheLimit) {
    mkdir("/data/next", 0770);
    rotate_limit_kb = 512;
    change_log_folder("/data/next/", 4096);
    EXPECT_TRUE(files_in("/data/next").empty());
    EXPECT_EQ(rotate_limit_kb, 4096);
    EXPECT_NE(read_file(kHistory).find("rotates size change from 512K to 4096K"),
              std::string::npos);
}

TEST_F(LogFilesTest, ChangeFolderIntoAMissingFolderLeavesTheTypeWithoutFile) {
    open_entry(LOG_MAIN, "/data/run/");
    change_log_folder("/data/absent/", 1024);
    EXPECT_EQ(log_files[LOG_MAIN].fd, -1);
    EXPECT_NE(read_file(kHistory).find("Change filename /data/absent/main_log fail, errno = 2: "
                                       "No such file or directory"),
              std::string::npos);
}

TEST_F(LogFilesTest, ChangeFolderTooLongKeepsTheCurrentFile) {
    open_entry(LOG_BT, "/data/run/");
    std::string folder = "/data/" + std::string(250, 'n') + "/";
    change_log_folder(folder.c_str(), 1024);
    EXPECT_GT(log_files[LOG_BT].fd, 0);
    EXPECT_STREQ(log_files[LOG_BT].name, "/data/run/bt_log");
    ASSERT_EQ(write_log_data(LOG_BT, "kept", 4), 4);
    EXPECT_EQ(read_file("/data/run/bt_log"), std::string(kHeader) + "kept");
}

}  // namespace
