// Folders and files opened without following links planted below a trusted root.
#include "storage/safe_file.h"

#include "test_util.h"

namespace {

class SafeFileTest : public ::testing::Test {
  protected:
    void SetUp() override {
        SKIP_OUTSIDE_PHONE();
        ASSERT_EQ(system("rm -rf /data/* /tmp/target && mkdir -p /data/card /tmp/target && "
                         "ln -s /data/card /data/link_to_card && echo secret > /tmp/target/file"),
                  0);
        umask(077);  // modes must not depend on it
    }
    void TearDown() override { umask(0); }
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
    EXPECT_EQ(files_in("/tmp/target"), std::vector<std::string>{"file"});
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
    static_cast<std::vector<std::string>*>(arg)->push_back(name + std::string(type == DT_LNK ? "@" : ""));
    return 0;
}

// A link in the tree is listed as one and removed, never followed out.
TEST_F(SafeFileTest, ListAndRemoveTreeStayBelowTheFolder) {
    ASSERT_EQ(system("mkdir -p /data/card/sub && touch /data/card/sub/g && ln -s /tmp/target /data/card/out"), 0);
    int card = safe_open_dir("/data", "/data/card", false, 0), data = safe_open_dir("/data", "/data", false, 0);
    std::vector<std::string> seen;
    EXPECT_EQ(safe_list_dir(card, collect, &seen), 2);
    std::sort(seen.begin(), seen.end());
    EXPECT_EQ(seen, (std::vector<std::string>{"out@", "sub"}));
    int file = open("/tmp/target/file", O_RDONLY);
    EXPECT_EQ(safe_list_dir(file, collect, &seen), -1) << "a failed listing is no empty folder";
    close(file);
    EXPECT_EQ(safe_remove_tree(data, "card"), 0);
    EXPECT_FALSE(exists("/data/card"));
    EXPECT_EQ(read_file("/tmp/target/file"), "secret\n");
    close(card);
    close(data);
}

}  // namespace
