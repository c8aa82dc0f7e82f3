#include "platform/kernel_files.h"

#include <string.h>

const char* kernel_file_path(const char* device_path) {
    if (strcmp(device_path, LAST_KMSG_PATH) == 0) return "/dev/emu/last_kmsg";
    if (strcmp(device_path, LAST_KMSG2_PATH) == 0) return "/dev/emu/last_kmsg2";
    return device_path;
}
