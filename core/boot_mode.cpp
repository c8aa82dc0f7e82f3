#include "core/boot_mode.h"

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include "common/io_util.h"
#include "record/record.h"

int read_boot_mode(const char* path) {
    int fd = TEMP_FAILURE_RETRY(open(path, O_RDONLY | O_CLOEXEC));
    if (fd < 0) {
        HLOG(TAG_DEBUG, WLOG_ERROR, "Failed to open boot mode file %s", path);
        return -1;
    }
    // Only the first character counts: "10" is boot mode 1. A little more is read
    // so that odd content can be recorded.
    char content[8] = {};
    ssize_t n = TEMP_FAILURE_RETRY(read(fd, content, sizeof(content)));
    close(fd);
    if (n < 0) n = 0;
    char buf[2] = {content[0], 0};
    int mode = atoi(buf);
    bool one_digit = n >= 1 && content[0] >= '0' && content[0] <= '9' &&
                     (n == 1 || content[1] == '\n');
    if (!one_digit) {
        HLOG(TAG_DEBUG, WLOG_WARN, "boot mode file %s holds %zd odd byte(s), boot mode %d", path, n,
             mode);
    }
    return mode;
}
