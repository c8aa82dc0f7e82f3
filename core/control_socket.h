// The control socket "tavlologd", its thread and the text command protocol.
#pragma once

#include <time.h>

class LogController;

#define CONTROL_SOCKET_NAME "tavlologd"

// After a normal boot into /data/log_temp/, the boot logs go to the card when
// no client has shown up within this time.
constexpr time_t BOOT_COPY_TIMEOUT_S = 300;
// The wait in use: BOOT_COPY_TIMEOUT_S; only a unit test shortens it.
extern time_t boot_copy_timeout_s;

void start_control_socket(LogController* controller);
void control_loop(LogController* controller);
int handle_client_message(LogController* controller, int fd);
// Writes text to the client fd, or to every connected client when fd is -1.
void reply_client(LogController* controller, int fd, const char* text);
// Applies one key=value message. Returns 0 when it was refused as unsafe to
// store (a line feed, too long, a logpath that cannot be used) or the file
// could not be written, else 1.
int apply_config_message(LogController* controller, char* text);
