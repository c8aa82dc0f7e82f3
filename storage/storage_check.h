// Free-space checks and system warnings.
#pragma once

#include <stdint.h>

constexpr uint64_t LOW_STORAGE_BYTES = 10485760;  // 10 MiB

// Free bytes for unprivileged users of the file system holding path, or 0 when
// it cannot be measured or stays unavailable after retries + 1 attempts.
uint64_t get_free_space(const char* path, int retries);

// 1 when the file system holding path has less than 10 MiB free (or cannot be
// measured), else 0.
int is_storage_low(const char* path);

// The threshold of is_storage_low on a measured amount: 1 when free_bytes is
// below LOW_STORAGE_BYTES.
int is_free_space_low(uint64_t free_bytes);

// Records a warning of the given type; negative types are ignored.
void report_system_warning(int type);
