#include "core/client_table.h"

#include <string.h>
#include <unistd.h>

#include "core/log_controller.h"

int add_client(LogController* controller, int fd, const unsigned char* addr) {
    for (int i = 0; i < MAX_CLIENTS; i++) {
        ClientSlot& slot = controller->clients[i];
        if (slot.fd >= 0) continue;
        pthread_mutex_lock(&controller->reply_lock);
        slot.fd = fd;
        memcpy(slot.addr, addr, sizeof(slot.addr));
        pthread_mutex_unlock(&controller->reply_lock);
        return i;
    }
    return -1;
}

void release_client(LogController* controller, int index) {
    ClientSlot& slot = controller->clients[index];
    pthread_mutex_lock(&controller->reply_lock);
    if (slot.fd >= 0) close(slot.fd);
    slot.fd = -1;
    memset(slot.addr, 0, sizeof(slot.addr));
    pthread_mutex_unlock(&controller->reply_lock);
}

void close_all_clients(LogController* controller) {
    for (int i = 0; i < MAX_CLIENTS; i++) {
        if (controller->clients[i].fd > 0) release_client(controller, i);
    }
}
