// Files of the kernel, reached through one place.
#pragma once

// The previous boot's kernel log that a phone's kernel keeps in /proc.
#define LAST_KMSG_PATH "/proc/last_kmsg"
#define LAST_KMSG2_PATH "/proc/last_kmsg2"

// Where device_path can be opened. The emulated phone's kernel cannot add
// files to /proc, so its image keeps the previous boot's kernel logs in
// /dev/emu; every other path is returned unchanged.
const char* kernel_file_path(const char* device_path);
