#include "core/reply_client.h"

#include <string.h>
#include <unistd.h>

#include <sys/socket.h>

#include "core/log_controller.h"
#include "record/record.h"

// A client that stops reading must not hold up the control thread or the
// transist's writer: the texts are tiny and are sent without waiting.
static void send_text(int fd, const char* text, size_t len) {
    send(fd, text, len, MSG_DONTWAIT | MSG_NOSIGNAL);
}

void reply_client(LogController* controller, int fd, const char* text) {
    WLOG(TAG_MAIN, WLOG_DEBUG, "write %s to client %d ", text, fd);
    size_t len = strlen(text);
    pthread_mutex_lock(&controller->reply_lock);
    if (fd == -1) {
        for (const ClientSlot& slot : controller->clients) {
            if (slot.fd > 0) send_text(slot.fd, text, len);
        }
    } else {
        send_text(fd, text, len);
    }
    pthread_mutex_unlock(&controller->reply_lock);
    WLOG(TAG_MAIN, WLOG_DEBUG, "write to client over");
}
