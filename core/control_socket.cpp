// The control socket "tavlologd" and the control thread, the daemon's one
// event loop: client connections, client commands, collector deaths
// (efd_chld) and a failing transist (efd_thread).
#include "core/control_socket.h"

#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <cutils/sockets.h>

#include "common/clock.h"
#include "common/control_protocol.h"
#include "common/io_util.h"
#include "core/boot_copy.h"
#include "core/child_supervision.h"
#include "core/client_table.h"
#include "core/fatal.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "core/peer_auth.h"
#include "record/record.h"
#include "storage/storage_check.h"

time_t boot_copy_timeout_s = BOOT_COPY_TIMEOUT_S;
// How often "tavlologd" is tried again while another process holds it.
static constexpr long long CONTROL_RETRY_MS = 3000;

static void* control_thread(void* arg) {
    prctl(PR_SET_NAME, "tavlo.control", 0, 0, 0);
    control_loop(static_cast<LogController*>(arg));
    return nullptr;
}

// Creates and listens on "tavlologd". Returns the descriptor, or -1 with
// *failed_step 1 (create) or 2 (listen).
static int open_control_socket(int* failed_step) {
    int fd =
        socket_local_server(CONTROL_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    if (fd < 0) {
        *failed_step = 1;
        return -1;
    }
    // The daemon runs shell commands ("oru -m 3"); they must not inherit the socket.
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    if (listen(fd, CONTROL_BACKLOG) < 0) {
        *failed_step = 2;
        close(fd);
        return -1;
    }
    return fd;
}

// Records why "tavlologd" could not be opened; once, not at every retry.
static void record_socket_failure(int failed_step) {
    if (failed_step == 1) {
        HLOG(TAG_MAIN, WLOG_ERROR, "create socket 'tavlologd' failed");
    } else {
        HLOG(TAG_MAIN, WLOG_ERROR, "listen socket 'tavlologd' error\n");
    }
    report_system_warning(failed_step);
}

void start_control_socket(LogController* controller) {
    int failed_step = 0;
    controller->listen_fd = open_control_socket(&failed_step);
    if (controller->listen_fd >= 0) {
        WLOG(TAG_MAIN, WLOG_DEBUG, "create socket 'tavlologd' success");
    } else {
        // Most likely another process holds the name since this daemon's
        // predecessor died: exiting would only make init restart us in a
        // loop. The control thread retries and serves as soon as it can, and
        // meanwhile a boot-time run keeps its supervision.
        record_socket_failure(failed_step);
    }

    pthread_t thread;
    int rc = pthread_create(&thread, nullptr, control_thread, controller);
    if (rc != 0) {
        // "deamon" as stored histories and tools have it.
        HLOG(TAG_MAIN, WLOG_ERROR, "create deamon thread failed(%s)", strerror(rc));
        report_system_warning(3);
        daemon_exit(-1);
    }
    // Never joined: the thread lives as long as the process.
    pthread_detach(thread);
}

// Another try at "tavlologd" while it cannot be had.
static void retry_control_socket(LogController* controller, int* retries) {
    int failed_step = 0;
    int fd = open_control_socket(&failed_step);
    if (fd < 0) {
        (*retries)++;
        return;
    }
    controller->listen_fd = fd;
    HLOG(TAG_MAIN, WLOG_INFO, "socket 'tavlologd' ready after %d retries", *retries + 1);
}

// Accepts one connection into a free slot, or closes it at once when the peer
// is not trusted or all slots are taken. Returns 0 when accept itself failed.
static int accept_client(LogController* controller) {
    unsigned char addr[sizeof(ClientSlot::addr)] = {};
    socklen_t addr_len = sizeof(addr);
    // Non-blocking: a client that connects and then misbehaves must not be
    // able to stall the only event loop. CLOEXEC: see start_control_socket.
    int fd = TEMP_FAILURE_RETRY(accept4(controller->listen_fd, reinterpret_cast<sockaddr*>(addr),
                                 &addr_len, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (fd < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "accept failed %s(%d)", strerror(errno), errno);
        return 0;
    }

    uid_t uid = 0;
    pid_t pid = 0;
    // The records of refused connections are rate-limited: an app can
    // connect in a loop, and each record would grow the history.
    if (!peer_credentials(fd, &uid, &pid)) {
        int err = errno;
        HLOG_LIMITED(refused_control_peers, TAG_MAIN, WLOG_ERROR,
                     "cannot get credentials of client fd:%d(%s), close it", fd, strerror(err));
        close(fd);
        return 1;
    }
    if (!control_peer_allowed(uid)) {
        HLOG_LIMITED(refused_control_peers, TAG_MAIN, WLOG_WARN, "refuse client uid %d pid %d",
                     static_cast<int>(uid), static_cast<int>(pid));
        close(fd);
        return 1;
    }
    // select() cannot watch a descriptor at or above FD_SETSIZE.
    if (fd >= FD_SETSIZE) {
        HLOG_LIMITED(refused_control_peers, TAG_MAIN, WLOG_ERROR,
                     "client fd:%d out of select range, close it", fd);
        close(fd);
        return 1;
    }

    pthread_mutex_lock(&controller->client_lock);
    int slot = add_client(controller, fd, addr);
    pthread_mutex_unlock(&controller->client_lock);
    if (slot < 0) {
        HLOG_LIMITED(refused_control_peers, TAG_MAIN, WLOG_WARN,
                     "no free slot for client uid %d pid %d, close fd:%d", static_cast<int>(uid),
                     static_cast<int>(pid), fd);
        close(fd);
        return 1;
    }
    HLOG(TAG_MAIN, WLOG_INFO, "new client,fd:%d", fd);
    return 1;
}

static void serve_clients(LogController* controller, fd_set* readable) {
    pthread_mutex_lock(&controller->client_lock);
    for (int i = 0; i < MAX_CLIENTS; i++) {
        // Re-read each slot: a command (HBR_SHUTDOWN) may close other clients.
        int fd = controller->clients[i].fd;
        if (fd < 0 || !FD_ISSET(fd, readable)) continue;
        if (handle_client_message(controller, fd) == 0) {
            HLOG(TAG_MAIN, WLOG_ERROR, "exception when handle message, close client %d", fd);
            release_client(controller, i);
        }
    }
    pthread_mutex_unlock(&controller->client_lock);
}

// Reads an eventfd counter; 0 when there was nothing to read.
static unsigned long long read_counter(int fd) {
    uint64_t value = 0;
    if (TEMP_FAILURE_RETRY(read(fd, &value, sizeof(value))) != sizeof(value)) return 0;
    return value;
}

static void keep_earliest(long long* wait_ms, long long ms) {
    if (ms < 0) ms = 0;
    if (*wait_ms < 0 || ms < *wait_ms) *wait_ms = ms;
}

static void watch(fd_set* set, int fd, int* max_fd) {
    FD_SET(fd, set);
    if (fd > *max_fd) *max_fd = fd;
}

void control_loop(LogController* controller) {
    // The time-out counts from the start of the loop: any event disarms it,
    // so until then all the time was spent waiting.
    const long long boot_copy_deadline = monotonic_ms() + static_cast<long long>(boot_copy_timeout_s) * 1000;
    long long next_bind_try = monotonic_ms() + CONTROL_RETRY_MS;
    int bind_retries = 0;

    for (;;) {
        if (controller->listen_fd < 0 && monotonic_ms() >= next_bind_try) {
            retry_control_socket(controller, &bind_retries);
            next_bind_try = monotonic_ms() + CONTROL_RETRY_MS;
        }
        fd_set readable;
        FD_ZERO(&readable);
        int max_fd = -1;
        if (controller->listen_fd >= 0) watch(&readable, controller->listen_fd, &max_fd);
        if (controller->efd_chld > 0) watch(&readable, controller->efd_chld, &max_fd);
        if (controller->efd_thread > 0) watch(&readable, controller->efd_thread, &max_fd);
        // Only this thread changes the slots, so they can be read without the lock.
        for (const ClientSlot& slot : controller->clients) {
            if (slot.fd >= 0) watch(&readable, slot.fd, &max_fd);
        }

        long long wait_ms = -1;
        if (controller->boot_copy_timer) keep_earliest(&wait_ms, boot_copy_deadline - monotonic_ms());
        if (controller->listen_fd < 0) keep_earliest(&wait_ms, next_bind_try - monotonic_ms());
        int flush_ms = peer_records_flush();
        if (flush_ms >= 0) keep_earliest(&wait_ms, flush_ms);
        struct timeval timeout = {static_cast<time_t>(wait_ms / 1000),
                                  static_cast<suseconds_t>(wait_ms % 1000 * 1000)};

        int ready = select(max_fd + 1, &readable, nullptr, nullptr, wait_ms >= 0 ? &timeout : nullptr);
        if (ready < 0) {
            // A SIGCHLD delivered to this thread is no failure; the event
            // counter it wrote is seen in the next pass.
            if (errno == EINTR) continue;
            HLOG(TAG_MAIN, WLOG_ERROR, "select failed: %s(%d)", strerror(errno), errno);
            sleep(1);
            continue;
        }
        if (ready == 0) {
            // Other waits (a retry, a record summary) end here too.
            if (!controller->boot_copy_timer || monotonic_ms() < boot_copy_deadline) continue;
            HLOG(TAG_MAIN, WLOG_ERROR, "select() timeout");
            controller->boot_copy_timer = 0;
            if (boot_fail_copy(controller) < 0) {
                HLOG(TAG_MAIN, WLOG_ERROR, "copy fail!");
            } else {
                HLOG(TAG_MAIN, WLOG_ERROR, "boot copy complete!");
            }
            continue;
        }
        WLOG(TAG_MAIN, WLOG_DEBUG, "select() over,some fd can be read");
        // Any activity means a client or a run is alive: the boot copy time-out is off for good.
        bool boot_copy_armed = controller->boot_copy_timer != 0;
        controller->boot_copy_timer = 0;

        if (controller->listen_fd >= 0 && FD_ISSET(controller->listen_fd, &readable)) {
            if (!accept_client(controller)) {
                sleep(1);
                continue;
            }
            // Clients that were readable too are served in the next pass.
        } else {
            serve_clients(controller, &readable);
        }

        // Each counter is read once, before the record: HLOG evaluates its
        // arguments for the history and again for the platform log.
        if (controller->efd_chld > 0 && FD_ISSET(controller->efd_chld, &readable)) {
            unsigned long long deaths = read_counter(controller->efd_chld);
            HLOG(TAG_MAIN, WLOG_INFO, "recv efd_chld %llu", deaths);
            pid_t before[LOG_TYPE_COUNT];
            memcpy(before, controller->collector_pid, sizeof(before));
            check_children(controller);
            // The daemon's own shell commands ("oru -m 3" as the boot run starts)
            // end too: only a collector's end tells that someone is there.
            if (boot_copy_armed && ready == 1 && memcmp(before, controller->collector_pid, sizeof(before)) == 0)
                controller->boot_copy_timer = 1;
        }
        if (controller->efd_thread > 0 && FD_ISSET(controller->efd_thread, &readable)) {
            // EVENT_STORAGE_LOW, EVENT_FOLDER_LOST (or their sum): either way the run ends.
            // 0: a stop in this pass has already discarded what was there.
            unsigned long long events = read_counter(controller->efd_thread);
            if (events != 0) {
                HLOG(TAG_MAIN, WLOG_INFO, "recv efd_thread %llu", events);
                stop_logging(controller);
            }
        }
    }
}
