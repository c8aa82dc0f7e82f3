// Copies of a holding folder onto the card (the boot-copy wait is run end to end by the boot scenarios).
#include "storage/log_copy.h"

#include <sys/resource.h>

#include <map>

#include "core/log_controller.h"
#include "test_util.h"

namespace {

using Files = std::map<std::string, std::string>;
const std::string kHeld = "/data/log_temp/";
const std::string kRun = "/mnt/sdcard/run/";
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
        std::vector<std::string> kept;
        CopyResult result;
    } cases[] = {
        {{{"kernel_log", "k0"}, {"kernel_log.1", "k1"}, {"kernel_log.3", "k3"}}, 1, 0, 0, 0, RLIM_INFINITY,
         {{"kernel_log.boot", "old" + N + "k3" + N + "k1" + N + "k0"}}, {}, COPY_DONE},
        {{}, 1, 0, 0, 1, RLIM_INFINITY,
         {{"kernel_log.boot", "old" + std::string("TavloLog in Low Nand Storage, some or all boot(hbr) logs are NOT saved!!!\n")}}, {}, COPY_DONE},
        // Switched-off types and pieces beyond the fourth keep their names; dot files stay.
        {{{"bt_log", "b"}, {"main_log.5", "m5"}, {".x", "x"}}, 0, 1, 0, 0, RLIM_INFINITY,
         {{"kernel_log.boot", "old"}, {"main_log.boot", N}, {"events_log.boot", N}, {"radio_log.boot", N},
          {"bt_log", N + "b"}, {"main_log.5", N + "m5"}}, {".x"}, COPY_DONE},
        // A folder among the held files cannot be read: it stays, the card gets nothing of it.
        {{{"bt_log/", ""}, {"kernel_log", "k0"}}, 1, 0, 0, 0, RLIM_INFINITY,
         {{"kernel_log.boot", "old" + N + "k0"}}, {"bt_log"}, COPY_DONE},
        // The card fills: the piece stays, what its copy added goes again.
        {{{"kernel_log.2", "k2"}, {"kernel_log", std::string(9000, 'k')}}, 1, 0, 0, 0, 4096,
         {{"kernel_log.boot", "old" + N + "k2"}}, {"kernel_log"}, COPY_ABORT},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.copied.begin()->second.substr(0, 40));
        ASSERT_EQ(0, system(("rm -rf " + kHeld + " " + kRun + "; mkdir -p " + kHeld + " " + kRun).c_str()));
        for (const auto& f : c.held) f.first.back() == '/' ? (void)mkdir((kHeld + f.first).c_str(), 0700) : write_file(kHeld + f.first, f.second);
        write_file(kRun + "kernel_log.boot", "old");
        LogController controller;
        strcpy(controller.logpath, "/mnt/sdcard");
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
}

}  // namespace
