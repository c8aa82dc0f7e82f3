// Folders and files opened without following links planted below a trusted root.
#include "storage/safe_file.h"

#include "common/limits.h"
#include "test_util.h"

namespace {

class SafeFileTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_EQ(system("rm -rf /data/* /tmp/target && mkdir -p /data/misc/tqlog /data/card /tmp/target && "
                         "ln -s /data/card /data/link_to_card && echo secret > /tmp/target/file"),
                  0);
        umask(077);  // modes must not depend on it
    }
    void TearDown() override { umask(0); }
};

TEST_F(SafeFileTest, FolderChainBelowTheRoot) {
    const struct {
        const char* setup;  // shell run first
        const char* root;
        const char* path;
        int err;                // 0: opens
        const char* untouched;  // must not exist afterwards
    } cases[] = {
        {"", "/data/link_to_card", "/data/link_to_card/qrvlog/tavlolog/APLog_1/", 0, ""},  // the root may be a link
        {"ln -s /tmp/target /data/card/qrvlog", "/data/card", "/data/card/qrvlog/tavlolog", ELOOP, "/tmp/target/tavlolog"},
        {"mkdir /data/card/a && ln -s /tmp/target /data/card/a/b", "/data/card", "/data/card/a/b/c/", ELOOP, "/tmp/target/c"},
        {"touch /data/card/qrvlog", "/data/card", "/data/card/qrvlog/x", ENOTDIR, ""},
        {"", "/data/card", "/data/card/../misc", EINVAL, ""},
        {"", "/data/card", "/data/cardigan/x", EINVAL, "/data/cardigan"},
        {"", "/data/card", "relative/x", EINVAL, ""},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.path);
        ASSERT_EQ(system((std::string("rm -rf /data/card/* /tmp/target/[!f]*; ") + c.setup).c_str()), 0);
        char failed_at[PATH_LEN];
        errno = 0;
        int fd = safe_open_dir(c.root, c.path, true, 0770, failed_at);
        if (c.err == 0) {
            ASSERT_GE(fd, 0) << strerror(errno) << " at " << failed_at;
            EXPECT_EQ(mode_of(c.path), 0770u);
            close(fd);
        } else {
            EXPECT_EQ(fd, -1);
            EXPECT_EQ(errno, c.err);
        }
        if (c.untouched[0]) {
            EXPECT_FALSE(exists(c.untouched));
        }
    }
    EXPECT_TRUE(history_has("/data/card/qrvlog is a symbolic link, refused"));
}

TEST_F(SafeFileTest, FilesNeverThroughLinksOrIntoFifos) {
    int dir = safe_open_dir("/data", "/data/card", false, 0);
    ASSERT_GE(dir, 0);
    ASSERT_EQ(symlink("/tmp/target/file", "/data/card/kernel_log"), 0);
    ASSERT_EQ(mkfifo("/data/card/main_log", 0666), 0);
    for (SafeOpen how : {SAFE_READ, SAFE_APPEND, SAFE_TRUNC, SAFE_EXCL}) {
        EXPECT_EQ(safe_open_file(dir, "kernel_log", how, 0600), -1) << how;
        EXPECT_EQ(safe_open_file(dir, "main_log", how, 0600), -1) << how;  // would block without O_NONBLOCK
    }
    EXPECT_EQ(read_file("/tmp/target/file"), "secret\n");
    EXPECT_EQ(mode_of("/tmp/target/file"), 0644u);
    EXPECT_TRUE(history_has("/data/card/kernel_log is a symbolic link, refused"));

    int fd = safe_open_file(dir, "bt_log", SAFE_APPEND, 0664);  // created: mode set through the descriptor
    ASSERT_GE(fd, 0);
    EXPECT_EQ(mode_of("/data/card/bt_log"), 0664u);
    close(fd);
    fd = safe_open_path_file("/data/link_to_card", "/data/link_to_card/bt_log", SAFE_READ, 0);
    EXPECT_GE(fd, 0);
    close(fd);

    // Replacing: a link at the name is replaced itself, the temporary name is made afresh.
    ASSERT_EQ(symlink("/tmp/target/file", "/data/card/config.tmp"), 0);
    EXPECT_EQ(safe_replace_file(dir, "kernel_log", "new\n", 4, 0600), 0);
    EXPECT_EQ(read_file("/data/card/kernel_log"), "new\n");
    EXPECT_EQ(mode_of("/data/card/kernel_log"), 0600u);
    EXPECT_EQ(safe_replace_file(dir, "config", "c\n", 2, 0600), 0);
    EXPECT_EQ(read_file("/tmp/target/file"), "secret\n");
    EXPECT_EQ(files_in("/data/card"), (std::vector<std::string>{"bt_log", "config", "kernel_log", "main_log"}));
    close(dir);
}

int collect(void* arg, const char* name, int type) {
    static_cast<std::vector<std::string>*>(arg)->push_back(std::string(name) + ":" + std::to_string(type));
    return 0;
}

TEST_F(SafeFileTest, ListAndRemoveTreeStayBelowTheFolder) {
    ASSERT_EQ(system("mkdir -p /data/card/run/sub && touch /data/card/run/f /data/card/run/sub/g && "
                     "ln -s /tmp/target /data/card/run/out"),
              0);
    int dir = safe_open_dir("/data", "/data/card/run", false, 0);
    ASSERT_GE(dir, 0);
    std::vector<std::string> seen;
    EXPECT_EQ(safe_list_dir(dir, collect, &seen), 3);
    std::sort(seen.begin(), seen.end());
    EXPECT_EQ(seen, (std::vector<std::string>{"f:" + std::to_string(DT_REG), "out:" + std::to_string(DT_LNK),
                                              "sub:" + std::to_string(DT_DIR)}));
    int file = open("/data/card/run/f", O_RDONLY);
    EXPECT_EQ(safe_list_dir(file, collect, &seen), -1);  // a failed listing is no empty folder
    close(file);
    close(dir);

    int card = safe_open_dir("/data", "/data/card", false, 0);
    EXPECT_EQ(safe_remove_tree(card, "run"), 0);
    EXPECT_FALSE(exists("/data/card/run"));
    EXPECT_EQ(read_file("/tmp/target/file"), "secret\n");
    close(card);
}

}  // namespace
