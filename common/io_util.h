// Small I/O helpers: complete short writes, read whole files. Calls that a
// signal can interrupt are retried with TEMP_FAILURE_RETRY of <unistd.h>.
#pragma once

#include <errno.h>
#include <stddef.h>
#include <sys/types.h>
#include <unistd.h>

// Writes all len bytes unless an error other than EINTR occurs. Returns the
// number of bytes written (len on success) or -1 when nothing could be written.
ssize_t write_fully(int fd, const void* buf, size_t len);

// Copies src into dst of size n, always NUL-terminated; returns 1 when it fit.
int copy_str(char* dst, size_t n, const char* src);

// Reads fd to its end into a new buffer (NUL-terminated, to be freed), at most
// cap bytes: *cut is set when more followed. nullptr when a read failed.
char* read_all(int fd, size_t cap, size_t* len, bool* cut);
