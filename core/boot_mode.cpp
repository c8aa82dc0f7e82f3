#include "core/boot_mode.h"

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include "common/io_util.h"
#include "common/wlog.h"
#include "storage/history_log.h"

int read_boot_mode(const char* path) {
    int fd = RETRY_EINTR(open(path, O_RDONLY | O_CLOEXEC));
    if (fd < 0) {
        HLOG(TAG_DEBUG, WLOG_ERROR, "Failed to open boot mode file %s", path);
        return -1;
    }
    // Only the first character counts: "10" is boot mode 1.
    char buf[2] = {0, 0};
    if (RETRY_EINTR(read(fd, buf, 1)) < 0) buf[0] = 0;
    close(fd);
    return atoi(buf);
}
