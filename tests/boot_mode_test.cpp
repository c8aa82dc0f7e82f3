#include <sys/prctl.h>

#include "core/boot_mode.h"
#include "core/privileges.h"
#include "test_util.h"

namespace {

// Only the first character counts; odd content is recorded with what was read.
TEST(BootMode, FirstCharacterOfTheFile) {
    const struct {
        const char* content;
        int mode;
        const char* record;  // "": nothing recorded
    } cases[] = {
        {"0", 0, ""},
        {"1\n", 1, ""},
        {"7", 7, ""},
        {"10", 1, "boot mode file /tmp/boot_mode holds 2 odd byte(s), boot mode 1"},
        {"x", 0, "boot mode file /tmp/boot_mode holds 1 odd byte(s), boot mode 0"},
        {"", 0, "boot mode file /tmp/boot_mode holds 0 odd byte(s), boot mode 0"},
        {"-3", 0, "boot mode file /tmp/boot_mode holds 2 odd byte(s), boot mode 0"},
        {"\xff\xfe binary", 0, "boot mode file /tmp/boot_mode holds 8 odd byte(s), boot mode 0"},
    };
    for (const auto& c : cases) {
        unlink(kHistory);
        write_file("/tmp/boot_mode", c.content);
        EXPECT_EQ(read_boot_mode("/tmp/boot_mode"), c.mode) << c.content;
        if (c.record[0] != '\0') {
            EXPECT_TRUE(has_record(c.record)) << read_file(kHistory);
        } else {
            EXPECT_EQ(read_file(kHistory), "");
        }
    }
}

TEST(BootMode, MissingFileIsMinusOneAndRecorded) {
    EXPECT_EQ(read_boot_mode("/tmp/no/such/boot_mode"), -1);
    EXPECT_TRUE(history_has("Failed to open boot mode file /tmp/no/such/boot_mode"));
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
