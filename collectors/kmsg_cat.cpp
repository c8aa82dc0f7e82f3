// The kernel log collector.
#include "collectors/kmsg_cat.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/select.h>
#include <unistd.h>

#include "collectors/control_block.h"
#include "common/io_util.h"
#include "record/record.h"

const char* KmsgCat::kmsg_path = "/proc/kmsg";

// One read of at most this many bytes per chunk; the transist reassembles them.
constexpr int KMSG_CHUNK = 255;
// What several reads returned goes out in one send, up to this many bytes
// (within one read of the transist's).
constexpr size_t KMSG_BATCH = 16 * KMSG_CHUNK;
// After data, wait this long for more before going back to an unbounded wait.
constexpr int KMSG_QUIET_SECONDS = 3;

void KmsgCat::run(const char*, int block_fd) {
    if (install_stop_signal(this) != 0) {
        int err = errno;
        HLOG(TAG_KERNEL, WLOG_ERROR, "signal for switch failed. errno = %d, %s", err, strerror(err));
    }
    shm_fd = block_fd;
    if (shm_fd == -1 || !attach_control_block(this)) {
        // No block (or no lock for it): nothing can be marked.
        int err = shm_fd == -1 ? EBADF : errno;
        HLOG(TAG_KERNEL, WLOG_ERROR, "shm open failed! errno = %d, %s", err, strerror(err));
        _exit(1);  // see exit_collector
    }

    int kmsg_fd = TEMP_FAILURE_RETRY(open(kmsg_path, O_RDONLY | O_NONBLOCK | O_CLOEXEC));
    if (kmsg_fd < 0) {
        int err = errno;
        fprintf(stderr, "Unable to open /proc/kmsg: %s\n", strerror(err));
        HLOG(TAG_KERNEL, WLOG_ERROR, "Unable to open /proc/kmsg: %s", strerror(err));
        exit_collector(this, 1, REASON_OPEN);
    }

    connect_transist(this);
    forward(kmsg_fd);
}

// Reads what /proc/kmsg has ready, in reads of at most KMSG_CHUNK bytes, into
// buf (room for KMSG_BATCH): a busy kernel log then costs one send per batch
// instead of one per read. Returns the bytes read; on a first read that
// failed or found nothing, logs it and returns 0.
static size_t read_ready(int kmsg_fd, char* buf) {
    size_t got = 0;
    while (got + KMSG_CHUNK <= KMSG_BATCH) {
        memset(buf + got, 0, KMSG_CHUNK);
        ssize_t n = read(kmsg_fd, buf + got, KMSG_CHUNK);
        if (n > 0) got += static_cast<size_t>(n);
        // A short read took everything there was.
        if (n > 0 && n < KMSG_CHUNK) break;
        if (n > 0) continue;
        if (got > 0) break;
        if (n < 0) {
            WLOG(TAG_KERNEL, WLOG_DEBUG, "Maybe others read kmsg, ignore.(%s)", strerror(errno));
        } else {
            WLOG(TAG_KERNEL, WLOG_DEBUG, "read: Unexpected EOF! Maybe others read kmsg, ingore.\n");
        }
        break;
    }
    return got;
}

void KmsgCat::forward(int kmsg_fd) {
    sigset_t wait_mask;
    hold_stop_signal(&wait_mask);

    char buf[KMSG_BATCH + 1];
    bool wait_forever = true;
    for (;;) {
        check_stop(this);

        fd_set readable;
        int ready;
        do {
            FD_ZERO(&readable);
            FD_SET(kmsg_fd, &readable);
            // Each bounded wait gets the whole quiet period again.
            struct timespec quiet = {KMSG_QUIET_SECONDS, 0};
            ready = pselect(kmsg_fd + 1, &readable, nullptr, nullptr,
                            wait_forever ? nullptr : &quiet, &wait_mask);
        } while (ready < 0 && errno == EINTR);
        if (ready < 0) {
            back_off_after_failed_wait(this, errno, &wait_mask);
            continue;
        }

        if (ready > 0 && FD_ISSET(kmsg_fd, &readable)) {
            size_t n = read_ready(kmsg_fd, buf);
            if (n == 0) continue;
            if (send_to_transist(buf, n, transist_fd) == -1) {
                int err = errno;
                HLOG(TAG_KERNEL, WLOG_ERROR, "write fails: %s, errno = %d", strerror(err), err);
                return;
            }
        }
        wait_forever = ready == 0;
    }
}
