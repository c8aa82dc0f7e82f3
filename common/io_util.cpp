#include "common/io_util.h"

#include <string.h>
#include <unistd.h>

ssize_t write_fully(int fd, const void* buf, size_t len) {
    const char* p = static_cast<const char*>(buf);
    size_t done = 0;
    while (done < len) {
        ssize_t n = write(fd, p + done, len - done);
        if (n < 0) {
            if (errno == EINTR) continue;
            return done > 0 ? static_cast<ssize_t>(done) : -1;
        }
        if (n == 0) break;
        done += static_cast<size_t>(n);
    }
    return static_cast<ssize_t>(done);
}

int copy_str(char* dst, size_t n, const char* src) {
    if (n == 0) return 0;
    size_t len = strnlen(src, n);
    if (len >= n) {
        memcpy(dst, src, n - 1);
        dst[n - 1] = '\0';
        return 0;
    }
    memcpy(dst, src, len + 1);
    return 1;
}
