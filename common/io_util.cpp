#include "common/io_util.h"

#include <stdlib.h>
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

char* read_all(int fd, size_t cap, size_t* len, bool* cut) {
    size_t size = 4096, used = 0;
    char* buf = static_cast<char*>(malloc(size + 1));
    *cut = false;
    while (buf != nullptr) {
        if (used == size) {
            if (size >= cap) {
                char probe;
                *cut = TEMP_FAILURE_RETRY(read(fd, &probe, 1)) > 0;
                break;
            }
            size = size * 2 > cap ? cap : size * 2;
            char* bigger = static_cast<char*>(realloc(buf, size + 1));
            if (bigger == nullptr) {
                *cut = true;
                break;
            }
            buf = bigger;
        }
        ssize_t n = TEMP_FAILURE_RETRY(read(fd, buf + used, size - used));
        if (n < 0) {
            free(buf);
            return nullptr;
        }
        if (n == 0) break;
        used += static_cast<size_t>(n);
    }
    if (buf == nullptr) return nullptr;
    buf[used] = '\0';
    *len = used;
    return buf;
}
