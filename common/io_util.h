// Small I/O helpers: retry EINTR, complete short writes.
#pragma once

#include <errno.h>
#include <stddef.h>
#include <sys/types.h>

#define RETRY_EINTR(exp)                                  \
    ({                                                    \
        decltype(exp) retry_rc_;                          \
        do {                                              \
            retry_rc_ = (exp);                            \
        } while (retry_rc_ == -1 && errno == EINTR);      \
        retry_rc_;                                        \
    })

// Writes all len bytes unless an error other than EINTR occurs. Returns the
// number of bytes written (len on success) or -1 when nothing could be written.
ssize_t write_fully(int fd, const void* buf, size_t len);

// Copies src into dst of size n, always NUL-terminated; returns 1 when it fit.
int copy_str(char* dst, size_t n, const char* src);

// Reads fd to its end into a new buffer (NUL-terminated, to be freed), at most
// cap bytes: *cut is set when more followed. nullptr when a read failed.
char* read_all(int fd, size_t cap, size_t* len, bool* cut);
