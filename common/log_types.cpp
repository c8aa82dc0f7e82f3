#include "common/log_types.h"

const char* log_type_name(int type) {
    static const char* const names[LOG_TYPE_COUNT] = {"main_log", "radio_log", "events_log",
                                                      "kernel_log", "bt_log"};
    if (type < 0 || type >= LOG_TYPE_COUNT) return "unknown";
    return names[type];
}

int log_type_from_letter(char letter) {
    for (int i = 0; i < LOG_TYPE_COUNT; i++) {
        if (LOG_TYPE_LETTERS[i] == letter) return i;
    }
    return -1;
}
