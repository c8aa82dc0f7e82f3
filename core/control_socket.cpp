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
#include <unistd.h>

#include <cutils/sockets.h>

#include "common/control_protocol.h"
#include "common/io_util.h"
#include "common/wlog.h"
#include "core/boot_copy.h"
#include "core/child_supervision.h"
#include "core/client_table.h"
#include "core/log_controller.h"
#include "core/logging_run.h"
#include "core/peer_auth.h"
#include "storage/history_log.h"
#include "storage/storage_check.h"

time_t boot_copy_timeout_s = BOOT_COPY_TIMEOUT_S;

static void* control_thread(void* arg) {
    prctl(PR_SET_NAME, "tavlo.control", 0, 0, 0);
    control_loop(static_cast<LogController*>(arg));
    return nullptr;
}

void start_control_socket(LogController* controller) {
    int fd =
        socket_local_server(CONTROL_SOCKET_NAME, ANDROID_SOCKET_NAMESPACE_ABSTRACT, SOCK_STREAM);
    if (fd < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "create socket 'tavlologd' failed");
        report_system_warning(1);
        exit(-1);
    }
    // The daemon runs shell commands ("oru -m 3"); they must not inherit the socket.
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    controller->listen_fd = fd;
    WLOG(TAG_MAIN, WLOG_DEBUG, "create socket 'tavlologd' success");

    if (listen(fd, CONTROL_BACKLOG) < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "listen socket 'tavlologd' error\n");
        report_system_warning(2);
        exit(-1);
    }

    pthread_t thread;
    int rc = pthread_create(&thread, nullptr, control_thread, controller);
    if (rc != 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "create deamon thread failed(%s)", strerror(rc));
        report_system_warning(3);
        exit(-1);
    }
    // Never joined: the thread lives as long as the process.
    pthread_detach(thread);
}

// Accepts one connection into a free slot, or closes it at once when the peer
// is not trusted or all slots are taken. Returns 0 when accept itself failed.
static int accept_client(LogController* controller) {
    unsigned char addr[sizeof(ClientSlot::addr)] = {};
    socklen_t addr_len = sizeof(addr);
    // Non-blocking: a client that connects and then misbehaves must not be
    // able to stall the only event loop. CLOEXEC: see start_control_socket.
    int fd = RETRY_EINTR(accept4(controller->listen_fd, reinterpret_cast<sockaddr*>(addr),
                                 &addr_len, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (fd < 0) {
        HLOG(TAG_MAIN, WLOG_ERROR, "accept failed %s(%d)", strerror(errno), errno);
        return 0;
    }

    uid_t uid = 0;
    pid_t pid = 0;
    if (!peer_credentials(fd, &uid, &pid)) {
        HLOG(TAG_MAIN, WLOG_ERROR, "cannot get credentials of client fd:%d(%s), close it", fd,
             strerror(errno));
        close(fd);
        return 1;
    }
    if (!control_peer_allowed(uid)) {
        HLOG(TAG_MAIN, WLOG_WARN, "refuse client uid %d pid %d", static_cast<int>(uid),
             static_cast<int>(pid));
        close(fd);
        return 1;
    }
    // select() cannot watch a descriptor at or above FD_SETSIZE.
    if (fd >= FD_SETSIZE) {
        HLOG(TAG_MAIN, WLOG_ERROR, "client fd:%d out of select range, close it", fd);
        close(fd);
        return 1;
    }

    pthread_mutex_lock(&controller->client_lock);
    int slot = add_client(controller, fd, addr);
    pthread_mutex_unlock(&controller->client_lock);
    if (slot < 0) {
        HLOG(TAG_MAIN, WLOG_WARN, "no free slot for client uid %d pid %d, close fd:%d",
             static_cast<int>(uid), static_cast<int>(pid), fd);
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
    if (RETRY_EINTR(read(fd, &value, sizeof(value))) != sizeof(value)) return 0;
    return value;
}

void control_loop(LogController* controller) {
    // select() subtracts the time it waited, so the 300 seconds are spent over
    // every wait while the timer is armed, not restarted by each event.
    struct timeval timeout = {boot_copy_timeout_s, 0};

    for (;;) {
        fd_set readable;
        FD_ZERO(&readable);
        int max_fd = controller->listen_fd;
        FD_SET(controller->listen_fd, &readable);
        if (efd_chld > 0) {
            FD_SET(efd_chld, &readable);
            if (efd_chld > max_fd) max_fd = efd_chld;
        }
        if (efd_thread > 0) {
            FD_SET(efd_thread, &readable);
            if (efd_thread > max_fd) max_fd = efd_thread;
        }
        // Only this thread changes the slots, so they can be read without the lock.
        for (const ClientSlot& slot : controller->clients) {
            if (slot.fd < 0) continue;
            FD_SET(slot.fd, &readable);
            if (slot.fd > max_fd) max_fd = slot.fd;
        }

        int ready = select(max_fd + 1, &readable, nullptr, nullptr,
                           controller->boot_copy_timer ? &timeout : nullptr);
        if (ready < 0) {
            // A SIGCHLD delivered to this thread is no failure; the event
            // counter it wrote is seen in the next pass.
            if (errno == EINTR) continue;
            HLOG(TAG_MAIN, WLOG_ERROR, "select failed: %s(%d)", strerror(errno), errno);
            sleep(1);
            continue;
        }
        if (ready == 0) {
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

        if (FD_ISSET(controller->listen_fd, &readable)) {
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
        if (efd_chld > 0 && FD_ISSET(efd_chld, &readable)) {
            unsigned long long deaths = read_counter(efd_chld);
            HLOG(TAG_MAIN, WLOG_INFO, "recv efd_chld %llu", deaths);
            pid_t before[] = {controller->mlog_pid, controller->rlog_pid, controller->elog_pid,
                              controller->klog_pid, controller->blog_pid};
            check_children(controller);
            pid_t after[] = {controller->mlog_pid, controller->rlog_pid, controller->elog_pid,
                             controller->klog_pid, controller->blog_pid};
            // The daemon's own shell commands ("oru -m 3" as the boot run starts)
            // end too: only a collector's end tells that someone is there.
            if (boot_copy_armed && ready == 1 && memcmp(before, after, sizeof(before)) == 0)
                controller->boot_copy_timer = 1;
        }
        if (efd_thread > 0 && FD_ISSET(efd_thread, &readable)) {
            // 1001 storage low, 1002 log folder lost (or their sum): either way the run ends.
            unsigned long long events = read_counter(efd_thread);
            HLOG(TAG_MAIN, WLOG_INFO, "recv efd_thread %llu", events);
            stop_logging(controller);
        }
    }
}
