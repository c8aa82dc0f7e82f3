// The Bluetooth log collector.
#include "collectors/bt_cat.h"

#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <cutils/sockets.h>

#include "collectors/control_block.h"
#include "common/wlog.h"
#include "storage/history_log.h"
#include "storage/record_limit.h"

unsigned int BtCat::pause_us = 1000000;

// One read of at most this many bytes per chunk; the transist reassembles them.
constexpr int BT_CHUNK = 255;
// The stack's service may come up late: about 99 s of attempts, one a second.
constexpr int BT_CONNECT_ATTEMPTS = 100;
// After data, wait this long for more before going back to an unbounded wait.
constexpr long BT_QUIET_NS = 5 * 1000 * 1000;
// What a stop still forwards of what the service has already sent.
constexpr int BT_STOP_CHUNKS = 256;
// The Bluetooth stack's user on the phone.
constexpr uid_t AID_BLUETOOTH = 1002;

static RecordLimit squatter_records = RECORD_LIMIT(TAG_BT, "btlog squatter refusals");

// Any app can bind an abstract name before the stack does; its bytes must not
// land in bt_log as the stack's. Only root or the stack's user may serve it.
static bool served_by_stack(int fd, uid_t* server) {
    struct ucred cred;
    socklen_t len = sizeof(cred);
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
        *server = static_cast<uid_t>(-1);
        return false;
    }
    *server = cred.uid;
    return cred.uid == 0 || cred.uid == AID_BLUETOOTH;
}

static void pause_a_while() {
    struct timespec left = {static_cast<time_t>(BtCat::pause_us / 1000000),
                            static_cast<long>(BtCat::pause_us % 1000000) * 1000};
    while (nanosleep(&left, &left) == -1 && errno == EINTR) {
    }
}

void BtCat::run(const char*, int block_fd) {
    if (install_stop_signal(this) != 0) {
        HLOG(TAG_BT, WLOG_ERROR, "can't catch. errno = %d", errno);
    }
    shm_fd = block_fd;
    if (shm_fd == -1 || !attach_control_block(this)) {
        int err = shm_fd == -1 ? EBADF : errno;
        HLOG(TAG_BT, WLOG_ERROR, "shm open failed! errno = %d, %s", err, strerror(err));
        _exit(1);  // see exit_collector
    }
    connect_service();
    connect_transist(this);
    forward();
}

void BtCat::connect_service() {
    for (int attempt = 1;; attempt++) {
        int fd = socket_local_client(BT_LOG_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
        uid_t server;
        if (fd >= 0 && served_by_stack(fd, &server)) {
            mSockListenId = fd;
            WLOG(TAG_BT, WLOG_DEBUG, "mSockListenId ok\n");
            return;
        }
        if (fd >= 0) {
            // Counted as a failed attempt: the stack may still come once the name is free.
            close(fd);
            HLOG_LIMITED(squatter_records, TAG_BT, WLOG_ERROR,
                         "btlog is served by uid %d, not the Bluetooth stack", static_cast<int>(server));
        } else {
            HLOG(TAG_BT, WLOG_ERROR, "mSockListenId<0 , errno = %d", errno);
        }
        if (attempt >= BT_CONNECT_ATTEMPTS) {
            HLOG(TAG_BT, WLOG_ERROR, "BT connect timeout!");
            exit_collector(this, 1, REASON_BT_TIMEOUT);
        }
        pause_a_while();
    }
}

void BtCat::finish_at_stop(int reason) {
    char buf[BT_CHUNK];
    for (int i = 0; i < BT_STOP_CHUNKS; i++) {
        struct pollfd p = {mSockListenId, POLLIN, 0};
        if (poll(&p, 1, 0) != 1 || !(p.revents & POLLIN)) break;
        ssize_t n = read(mSockListenId, buf, sizeof(buf));
        if (n <= 0 || send_to_transist(buf, static_cast<size_t>(n), transist_fd) < 0) break;
    }
    exit_collector(this, 0, reason);
}

void BtCat::forward() {
    // The stop signal is taken only inside the wait, and then only noted, so
    // that what the service already sent still goes out.
    sigset_t wait_mask;
    hold_stop_signal(&wait_mask);
    defer_stop_signal = true;

    char buf[BT_CHUNK + 1];
    bool wait_forever = false;
    for (;;) {
        if (stop_signalled) finish_at_stop(REASON_SIGNAL);
        if (stop_asked(this)) finish_at_stop(REASON_NONE);
        memset(buf, 0, BT_CHUNK);

        fd_set readable;
        int ready;
        do {
            FD_ZERO(&readable);
            FD_SET(mSockListenId, &readable);
            // Each bounded wait gets the whole quiet time again.
            struct timespec quiet = {0, BT_QUIET_NS};
            ready = pselect(mSockListenId + 1, &readable, nullptr, nullptr,
                            wait_forever ? nullptr : &quiet, &wait_mask);
        } while (ready < 0 && errno == EINTR && !stop_signalled);
        if (ready < 0) {
            if (errno != EINTR) back_off_after_failed_wait(this, errno, &wait_mask);
            continue;
        }

        if (ready > 0 && FD_ISSET(mSockListenId, &readable)) {
            ssize_t n = read(mSockListenId, buf, BT_CHUNK);
            if (n < 0) {
                int err = errno;
                // Nothing was taken: read again once the wait says so.
                if (err == EINTR || err == EAGAIN) continue;
                HLOG(TAG_BT, WLOG_ERROR, "btcat read, errno = %d, %s", err, strerror(err));
                pause_a_while();
                exit_collector(this, 0, REASON_READ);
            }
            if (n == 0) {
                int err = errno;
                HLOG(TAG_BT, WLOG_ERROR, "read: Unexpected EOF, errno = %d, %s", err, strerror(err));
                pause_a_while();
                exit_collector(this, 0, REASON_READ);
            }
            if (send_to_transist(buf, static_cast<size_t>(n), transist_fd) == -1) {
                int err = errno;
                HLOG(TAG_BT, WLOG_ERROR, "write fails: %s, errno = %d", strerror(err), err);
                return;
            }
        }
        wait_forever = ready == 0;
    }
}
