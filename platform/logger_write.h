// Writers of the phone's logger devices (/dev/log/<buffer>): text entries as
// Android's log library writes them, binary events entries, and entries with
// a header of the caller's choice through the devices' injection file.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include "platform/logger_ring.h"

#define LOGGER_DEVICE_DIR "/dev/log/"
#define LOGGER_INJECT_PATH LOGGER_DEVICE_DIR ".inject"

// Binary event value types, as the platform's event decoder reads them.
enum { EVENT_TYPE_INT = 0, EVENT_TYPE_LONG = 1, EVENT_TYPE_STRING = 2, EVENT_TYPE_LIST = 3, EVENT_TYPE_FLOAT = 4 };

// The payload of a text entry: priority byte, tag and NUL, message and NUL,
// cut to LOGGER_MAX_PAYLOAD (the message's NUL kept). Returns its length.
size_t logger_text_payload(int priority, const char* tag, const char* message, uint8_t* out, size_t cap);

// The payload of an events entry: the tag number, then the values of words,
// each one of "i:INT" (32-bit), "l:INT" (64-bit), "f:FLOAT", "s:TEXT", or "["
// and "]" around the values of a list; several values at the top are sent as
// one list. Returns its length, or -1 for a bad word, an unbalanced bracket, a
// list of more than 255 values or a payload over cap.
long logger_event_payload(int32_t tag, const char* const* words, int count, uint8_t* out, size_t cap);

// Appends payload to the buffer as one entry (one write); with header it goes
// through the injection file (root only) and carries that header's pid, tid
// and time. Returns 1, or 0 with errno set.
int logger_write(const char* buffer, const void* payload, size_t n, const LoggerHeader* header = nullptr);
