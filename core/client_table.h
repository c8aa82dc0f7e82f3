// The ten control-client slots of the controller. Callers hold client_lock;
// these functions also take reply_lock around every change of a slot, so that
// a broadcast from the transist's writer never writes to a descriptor that is
// being closed, or that has already been reused for a log file.
#pragma once

class LogController;

// Puts fd and its peer address (16 bytes) into the first free slot. Returns the
// slot index, or -1 when all slots are taken (fd is then left to the caller).
int add_client(LogController* controller, int fd, const unsigned char* addr);

// Closes the client of slot index and frees the slot.
void release_client(LogController* controller, int index);

// Closes every connected client and frees all slots.
void close_all_clients(LogController* controller);
