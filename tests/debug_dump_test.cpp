// The dump into a run folder, from the default list and from the device's own.
#include "storage/debug_dump.h"

#include "test_util.h"

namespace {

const std::string kRun = "/mnt/sdcard/run/";
const std::string kFooter = "================ END of FILE ===============\n\n";

// Section headers of a dump output, in order.
std::vector<std::string> headers_of(const std::string& path) {
    std::vector<std::string> out;
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
    EXPECT_EQ((std::vector<std::string>{"<< /data/misc/tqlog/inter_sd_folder >>:", "<< /data/misc/tqlog/tqlog_config >>:",
                                        "<< /data/misc/tqlog/tqlog_history >>:", "<< system properties >>"}),
              headers_of(kRun + "properties"));
    std::string props = read_file(kRun + "properties");
    EXPECT_NE(std::string::npos, props.find("<< /data/misc/tqlog/inter_sd_folder >>:\nA 0\n" + kFooter));
    EXPECT_NE(std::string::npos, props.find("[tavlo.test]: [v1]\n")) << props;
    EXPECT_EQ(kFooter, props.substr(props.size() - kFooter.size()));
    EXPECT_EQ("<< /system/data/misc/DeviceRecipe.mk >>:\nX := 1\n" + kFooter, read_file(kRun + "DeviceRecipe.mk"));
    EXPECT_EQ((std::vector<std::string>{"DeviceRecipe.mk", "properties"}), files_in(kRun));

    // The device's own list: a FIFO or a folder as source is skipped, never waited on.
    ASSERT_EQ(0, mkfifo("/tmp/fifo", 0600));
    write_file(DUMP_LIST_FILE, "/tmp/fifo fifo\n/tmp/dir dir\n/system/data/misc/DeviceRecipe.mk own\nx props sys_prop\n");
    run_debug_dump("/mnt/sdcard", kRun.c_str());
    EXPECT_EQ((std::vector<std::string>{"<< system properties >>"}), headers_of(kRun + "props"));
    EXPECT_EQ((std::vector<std::string>{"DeviceRecipe.mk", "own", "properties", "props"}), files_in(kRun));
    EXPECT_TRUE(has_record("/tmp/fifo is not a regular file, not dumped"));
}

}  // namespace
