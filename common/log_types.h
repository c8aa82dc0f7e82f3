// The five log types, in the fixed order every per-type table uses.
#pragma once

constexpr int LOG_TYPE_COUNT = 5;

// Abstract-namespace local socket from the collectors to the transist.
#define LOG_SOCKET_NAME "log_socket"

enum LogTypeIndex { LOG_MAIN = 0, LOG_RADIO = 1, LOG_EVENTS = 2, LOG_KERNEL = 3, LOG_BT = 4 };

// Stream letter a collector sends first on "log_socket".
constexpr char LOG_TYPE_LETTERS[LOG_TYPE_COUNT] = {'M', 'R', 'E', 'K', 'B'};

// File name of the type in the run folder; "unknown" for any other index.
const char* log_type_name(int type);

// Index of a stream letter, or -1 when it is none of the five.
int log_type_from_letter(char letter);
