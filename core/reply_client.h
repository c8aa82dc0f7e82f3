// Replies and broadcasts to control clients.
#pragma once

class LogController;

// Writes text to the client fd, or to every connected client when fd is -1.
// Safe from any thread: writes are serialised by the controller's reply_lock.
void reply_client(LogController* controller, int fd, const char* text);
