#pragma once

#define BOOT_MODE_FILE "/sys/class/BOOT/BOOT/boot/boot_mode"

// The first character of the boot-mode file through atoi (0-9, anything else 0),
// or -1 when the file cannot be opened.
int read_boot_mode(const char* path = BOOT_MODE_FILE);
