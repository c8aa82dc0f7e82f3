#include <gtest/gtest.h>
#include <stdio.h>
#include <sys/prctl.h>

#include <fstream>
#include <sstream>
#include <ostream>
#include <string>

#include "core/boot_mode.h"
#include "core/privileges.h"

namespace {

std::string read_all(const char* path) {
    std::ifstream in(path);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

struct BootModeCase {
    const char* content;
    int mode;
};

// Names the case in test output instead of dumping its bytes.
void PrintTo(const BootModeCase& c, std::ostream* os) { *os << '"' << c.content << '"'; }

class BootModeFile : public ::testing::TestWithParam<BootModeCase> {};

TEST_P(BootModeFile, OnlyTheFirstCharacterCounts) {
    const char* path = "/tmp/boot_mode";
    FILE* f = fopen(path, "w");
    ASSERT_NE(f, nullptr);
    fputs(GetParam().content, f);
    fclose(f);
    EXPECT_EQ(read_boot_mode(path), GetParam().mode);
}

INSTANTIATE_TEST_SUITE_P(Contents, BootModeFile,
                         ::testing::Values(BootModeCase{"0", 0}, BootModeCase{"1\n", 1},
                                           BootModeCase{"10", 1}, BootModeCase{"7", 7},
                                           BootModeCase{"x", 0}, BootModeCase{"", 0},
                                           BootModeCase{"-3", 0},
                                           BootModeCase{"\xff\xfe binary", 0}),
                         [](const ::testing::TestParamInfo<BootModeCase>& info) {
                             return "case" + std::to_string(info.index);
                         });

TEST(BootMode, OddContentIsRecorded) {
    FILE* f = fopen("/tmp/boot_mode_odd", "w");
    ASSERT_NE(f, nullptr);
    fputs("10", f);
    fclose(f);
    EXPECT_EQ(read_boot_mode("/tmp/boot_mode_odd"), 1);
    std::string history = read_all("/data/misc/tqlog/tqlog_history");
    EXPECT_NE(history.find("boot mode file /tmp/boot_mode_odd holds 2 odd byte(s), boot mode 1"),
              std::string::npos);
}

TEST(BootMode, MissingFileIsMinusOneAndRecorded) {
    EXPECT_EQ(read_boot_mode("/tmp/no/such/boot_mode"), -1);
    std::string history = read_all("/data/misc/tqlog/tqlog_history");
    EXPECT_NE(history.find("Failed to open boot mode file /tmp/no/such/boot_mode"), std::string::npos);
}

TEST(Privileges, InheritableStaysWithinTheBoundingSet) {
    for (int word = 0; word < 2; word++) {
        uint32_t bits = inheritable_within_bounds(word, 0xFFFFFFFF);
        for (int bit = 0; bit < 32; bit++) {
            bool allowed = prctl(PR_CAPBSET_READ, word * 32 + bit, 0, 0, 0) == 1;
            EXPECT_EQ((bits >> bit) & 1u, allowed ? 1u : 0u) << "capability " << word * 32 + bit;
        }
    }
    EXPECT_EQ(inheritable_within_bounds(1, 0x4), 0x4u) << "syslog is in any root bounding set";
}

}  // namespace
