// The card's storage: folders and files opened without following planted links,
// the run-folder records, copies of held logs, debug dumps and free-space checks.
#include <sys/resource.h>

#include <map>

#include "core/log_controller.h"
#include "storage/debug_dump.h"
#include "storage/folder_records.h"
#include "storage/log_copy.h"
#include "storage/safe_file.h"
#include "storage/storage_check.h"
#include "test_util.h"

namespace {

using Lines = std::vector<std::string>;
const std::string kRun = "/mnt/sdcard/run/";

class SafeFileTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_EQ(system("rm -rf /data/* /tmp/target && mkdir -p /data/card /tmp/target && "
                         "ln -s /data/card /data/link_to_card && echo secret > /tmp/target/file"), 0);
        umask(077);  // modes must not depend on it
    }
};

TEST_F(SafeFileTest, FolderChainBelowTheRoot) {
    const struct {
        const char *setup, *root, *path;
        int err;  // 0: opens
    } cases[] = {
        {"", "/data/link_to_card", "/data/link_to_card/qrvlog/tavlolog/APLog_1/", 0},  // the root may be a link
        {"ln -s /tmp/target /data/card/qrvlog", "/data/card", "/data/card/qrvlog/tavlolog", ELOOP},
        {"mkdir /data/card/a && ln -s /tmp/target /data/card/a/b", "/data/card", "/data/card/a/b/c/", ELOOP},
        {"touch /data/card/qrvlog", "/data/card", "/data/card/qrvlog/x", ENOTDIR},
        {"", "/data/card", "/data/card/../misc", EINVAL},
        {"", "/data/card", "/data/cardigan/x", EINVAL},
        {"", "/data/card", "relative/x", EINVAL},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.path);
        ASSERT_EQ(system(("rm -rf /data/card/*; " + std::string(c.setup)).c_str()), 0);
        errno = 0;
        int fd = safe_open_dir(c.root, c.path, true, 0770);
        EXPECT_EQ(fd < 0 ? errno : 0, c.err);
        EXPECT_EQ(fd < 0 ? 0770u : mode_of(c.path), 0770u);
        close(fd);
    }
    EXPECT_EQ(files_in("/tmp/target"), Lines{"file"});
    EXPECT_TRUE(history_has("/data/card/qrvlog is a symbolic link, refused"));
}

TEST_F(SafeFileTest, FilesNeverThroughLinksOrIntoFifos) {
    int dir = safe_open_dir("/data", "/data/card", false, 0);
    ASSERT_EQ(symlink("/tmp/target/file", "/data/card/kernel_log"), 0);
    ASSERT_EQ(mkfifo("/data/card/main_log", 0666), 0);
    for (SafeOpen how : {SAFE_READ, SAFE_APPEND, SAFE_TRUNC, SAFE_EXCL}) {
        EXPECT_EQ(safe_open_file(dir, "kernel_log", how, 0600), -1) << how;
        EXPECT_EQ(safe_open_file(dir, "main_log", how, 0600), -1) << how;  // would block without O_NONBLOCK
    }
    EXPECT_EQ(read_file("/tmp/target/file"), "secret\n");
    int fd = safe_open_file(dir, "bt_log", SAFE_APPEND, 0664);  // created: mode set through the descriptor
    EXPECT_EQ(mode_of("/data/card/bt_log"), 0664u);
    close(fd);
    close(dir);
}

int collect(void* arg, const char* name, int type) {
    static_cast<Lines*>(arg)->push_back(name + std::string(type == DT_LNK ? "@" : ""));
    return 0;
}

// A link in the tree is listed as one and removed, never followed out.
TEST_F(SafeFileTest, ListAndRemoveTreeStayBelowTheFolder) {
    ASSERT_EQ(system("mkdir -p /data/card/sub && touch /data/card/sub/g && ln -s /tmp/target /data/card/out"), 0);
    int card = safe_open_dir("/data", "/data/card", false, 0), data = safe_open_dir("/data", "/data", false, 0);
    Lines seen;
    EXPECT_EQ(safe_list_dir(card, collect, &seen), 2);
    std::sort(seen.begin(), seen.end());
    EXPECT_EQ(seen, (Lines{"out@", "sub"}));
    int file = open("/tmp/target/file", O_RDONLY);
    EXPECT_EQ(safe_list_dir(file, collect, &seen), -1) << "a failed listing is no empty folder";
    close(file);
    EXPECT_EQ(safe_remove_tree(data, "card"), 0);
    EXPECT_FALSE(exists("/data/card"));
    EXPECT_EQ(read_file("/tmp/target/file"), "secret\n");
    close(card);
    close(data);
}

const std::string kParent = "/mnt/sdcard/qrvlog/tavlolog/";
const std::string kFolderRecords = "/data/misc/tqlog/inter_sd_folder";

// Sizes learnt once, gone folders and the oldest over the budget forgotten, the folders never touched.
TEST(UpdateFolderRecords, RecordsTheNewFolderLastWithinTheBudget) {
    const struct {
        std::string before;                                  // the records file; "-" none
        std::vector<std::pair<std::string, off_t>> on_card;  // folders and the bytes in each
        int total, log;
        std::string after;
        Lines records;
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
        ASSERT_EQ(0, system(("rm -rf /mnt/sdcard/qrvlog " + kFolderRecords + "; mkdir -p /data/misc/tqlog " + kParent + "D").c_str()));
        unlink(kHistory);
        if (c.before != "-") write_file(kFolderRecords, c.before);
        for (const auto& folder : c.on_card) {
            mkdir((kParent + folder.first).c_str(), 0700);
            write_file(kParent + folder.first + "/log", "");
            ASSERT_EQ(0, truncate((kParent + folder.first + "/log").c_str(), folder.second));
        }
        EXPECT_EQ(1, update_folder_records("/mnt/sdcard", (kParent + "D/").c_str(), 1, c.total, c.log));
        EXPECT_EQ(c.after, read_file(kFolderRecords));
        for (const std::string& record : c.records) EXPECT_TRUE(has_record(record)) << record;
        for (const auto& folder : c.on_card) EXPECT_TRUE(exists(kParent + folder.first));
    }
    // A parent that cannot be opened: the record says which.
    ASSERT_EQ(0, system("rm -rf /mnt/sdcard/qrvlog"));
    EXPECT_EQ(0, update_folder_records("/mnt/sdcard", (kParent + "D/").c_str(), 1, 600, 300));
    EXPECT_TRUE(has_record("open " + kParent + " fail No such file or directory"));
}

using Files = std::map<std::string, std::string>;
const std::string kHeld = "/data/log_temp/";
const std::string N = "TavloLog in Normal\n";

Files files_of(const std::string& dir) {
    Files out;
    for (const std::string& name : files_in(dir)) out[name] = read_file(dir + name);
    return out;
}

TEST(CopyLogFolder, AppendsOldestPieceFirstAndKeepsWhatCannotGo) {
    signal(SIGXFSZ, SIG_IGN);
    const struct {
        Files held;
        int kernel, android, bt, low;
        rlim_t file_limit;  // largest file this process may write, a full card in small
        Files copied;       // what the run folder holds afterwards (its kernel_log.boot held "old")
        Lines kept;
        CopyResult result;
    } cases[] = {
        {{{"kernel_log", "k0"}, {"kernel_log.1", "k1"}, {"kernel_log.3", "k3"}}, 1, 0, 0, 0, RLIM_INFINITY,
         {{"kernel_log.boot", "old" + N + "k3" + N + "k1" + N + "k0"}}, {}, COPY_DONE},
        {{}, 1, 0, 0, 1, RLIM_INFINITY,
         {{"kernel_log.boot", "old" + std::string("TavloLog in Low Nand Storage, some or all boot(hbr) logs are NOT saved!!!\n")}}, {}, COPY_DONE},
        // Pieces beyond the fourth keep their names, a switched-off type's never the run's; dot files stay.
        {{{"bt_log", "b"}, {"main_log.5", "m5"}, {".x", "x"}}, 0, 1, 0, 0, RLIM_INFINITY,
         {{"kernel_log.boot", "old"}, {"main_log.boot", N}, {"events_log.boot", N}, {"radio_log.boot", N},
          {"bt_log.boot", N + "b"}, {"main_log.5", N + "m5"}}, {".x"}, COPY_DONE},
        // A piece that cannot be read stays; the newer ones still go to the suffixed file, none to the run's own.
        {{{"kernel_log.3", "k3"}, {"kernel_log.2/", ""}, {"kernel_log", "k0"}}, 1, 0, 0, 0, RLIM_INFINITY,
         {{"kernel_log.boot", "old" + N + "k3" + N + "k0"}}, {"kernel_log.2"}, COPY_DONE},
        // A folder among the held files cannot be read: it stays, the card gets nothing of it.
        {{{"bt_log/", ""}, {"kernel_log", "k0"}}, 1, 0, 0, 0, RLIM_INFINITY,
         {{"kernel_log.boot", "old" + N + "k0"}}, {"bt_log"}, COPY_DONE},
        // The card fills: the piece stays, what its copy added goes again.
        {{{"kernel_log.2", "k2"}, {"kernel_log", std::string(9000, 'k')}}, 1, 0, 0, 0, 4096,
         {{"kernel_log.boot", "old" + N + "k2"}}, {"kernel_log"}, COPY_ABORT},
    };
    LogController controller;
    strcpy(controller.logpath, "/mnt/sdcard");
    for (const auto& c : cases) {
        SCOPED_TRACE(c.copied.begin()->second.substr(0, 40));
        ASSERT_EQ(0, system(("rm -rf " + kHeld + " " + kRun + "; mkdir -p " + kHeld + " " + kRun).c_str()));
        for (const auto& f : c.held) f.first.back() == '/' ? (void)mkdir((kHeld + f.first).c_str(), 0700) : write_file(kHeld + f.first, f.second);
        write_file(kRun + "kernel_log.boot", "old");
        controller.kernel_log = c.kernel;
        controller.android_log = c.android;
        controller.bt_log = c.bt;
        data_storage_low = c.low;
        struct rlimit limit = {c.file_limit, RLIM_INFINITY};
        setrlimit(RLIMIT_FSIZE, &limit);
        CopyResult result = copy_log_folder(&controller, kHeld.c_str(), kRun.c_str(), ".boot");
        limit.rlim_cur = RLIM_INFINITY;
        setrlimit(RLIMIT_FSIZE, &limit);
        EXPECT_EQ(c.result, result);
        EXPECT_EQ(c.copied, files_of(kRun));
        EXPECT_EQ(c.kept, files_in(kHeld));
        for (const std::string& name : c.kept) EXPECT_EQ(c.held.count(name) ? c.held.at(name) : "", read_file(kHeld + name));
    }
    // The suffixed file cannot be opened: the held log stays, and goes to no file of the run instead.
    ASSERT_EQ(0, system(("rm -rf " + kHeld + "* " + kRun + "*; mkdir " + kRun + "kernel_log.boot").c_str()));
    write_file(kHeld + "kernel_log", "k0");
    copy_log_folder(&controller, kHeld.c_str(), kRun.c_str(), ".boot");
    EXPECT_EQ(Lines{"kernel_log.boot"}, files_in(kRun));
    EXPECT_EQ(Lines{"kernel_log"}, files_in(kHeld));
}

const std::string kFooter = "================ END of FILE ===============\n\n";

// Section headers of a dump output, in order.
Lines headers_of(const std::string& path) {
    Lines out;
    for (const std::string& line : lines_of(path))
        if (line.compare(0, 3, "<< ") == 0) out.push_back(line);
    return out;
}

TEST(RunDebugDump, FramesEachSourceAndTheProperties) {
    ASSERT_EQ(0, system(("mkdir -p /data/misc/tqlog /system/data/misc /tmp/dir " + kRun).c_str()));
    write_file("/data/misc/tqlog/inter_sd_folder", "A 0\n");
    write_file("/data/misc/tqlog/tqlog_config", "autostart=1\n");
    write_file("/system/data/misc/DeviceRecipe.mk", "X := 1\n");
    ASSERT_EQ(0, property_set("tavlo.test", "v1"));
    run_debug_dump("/mnt/sdcard", kRun.c_str());
    EXPECT_EQ((Lines{"<< /data/misc/tqlog/inter_sd_folder >>:", "<< /data/misc/tqlog/tqlog_config >>:",
                     "<< /data/misc/tqlog/tqlog_history >>:", "<< system properties >>"}),
              headers_of(kRun + "properties"));
    std::string props = read_file(kRun + "properties");
    EXPECT_NE(std::string::npos, props.find("<< /data/misc/tqlog/inter_sd_folder >>:\nA 0\n" + kFooter));
    EXPECT_NE(std::string::npos, props.find("[tavlo.test]: [v1]\n")) << props;
    EXPECT_EQ(kFooter, props.substr(props.size() - kFooter.size()));
    EXPECT_EQ("<< /system/data/misc/DeviceRecipe.mk >>:\nX := 1\n" + kFooter, read_file(kRun + "DeviceRecipe.mk"));
    EXPECT_EQ((Lines{"DeviceRecipe.mk", "properties"}), files_in(kRun));

    // The device's own list: a FIFO or a folder as source is skipped, never waited on.
    ASSERT_EQ(0, mkfifo("/tmp/fifo", 0600));
    write_file(DUMP_LIST_FILE, "/tmp/fifo fifo\n/tmp/dir dir\n/system/data/misc/DeviceRecipe.mk own\nx props sys_prop\n");
    run_debug_dump("/mnt/sdcard", kRun.c_str());
    EXPECT_EQ((Lines{"<< system properties >>"}), headers_of(kRun + "props"));
    EXPECT_EQ((Lines{"DeviceRecipe.mk", "own", "properties", "props"}), files_in(kRun));
    EXPECT_TRUE(has_record("/tmp/fifo is not a regular file, not dumped"));
}

// Above 4 GiB: a 32-bit wrap would make these low.
TEST(FreeSpaceThreshold, BelowTenMebibytesIsLow) {
    for (uint64_t bytes : {10485760ULL, (4ULL << 30) + 4096, 0xffffffffffffffffULL}) EXPECT_EQ(is_free_space_low(bytes), 0) << bytes;
    for (uint64_t bytes : {10485759ULL, 0ULL}) EXPECT_EQ(is_free_space_low(bytes), 1) << bytes;
}

// A missing path fails at once; a file system without blocks (procfs, as an
// unmounted card) is retried, then given up. Either is low.
TEST(StorageCheck, UnavailablePathIsLow) {
    SKIP_OUTSIDE_PHONE();
    const std::string retry = "SD card is unavailable!! Retrying!", gave_up = "SD card is unavailable! We have retried!";
    const std::string missing = "Failed to get the file status of /mnt/nosuchcard, errno=2";
    const struct {
        const char* path;
        Lines get_records, low_records;
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

TEST(StorageCheck, WarningRecordsDependOnTypeAndEncryption) {
    SKIP_OUTSIDE_PHONE();
    const struct {
        int type;
        const char* encrypt_progress;  // "": unset
        Lines records;
    } cases[] = {
        {-1, "42", {}},
        {5, "", {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 5", "out put to log file failed"}},
        {11, "", {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 11", "sdcard is full"}},
        {4, "", {"prop:vold.encrypt_progress,temp:", "oru warning comes,type is 4", "oru type 4 comes"}},
        {5, "42", {"prop:vold.encrypt_progress,temp:42", "phone is encryping, will not show red screen:42"}},
    };
    for (const auto& c : cases) {
        ASSERT_EQ(system("rm -f /dev/emu/properties/* /data/misc/tqlog/tqlog_history"), 0);
        if (c.encrypt_progress[0]) { ASSERT_EQ(property_set("vold.encrypt_progress", c.encrypt_progress), 0); }
        report_system_warning(c.type);
        EXPECT_EQ(history_messages(), c.records) << c.type;
    }
}

}  // namespace
