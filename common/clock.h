// The monotonic clock, for waits and windows that must not move when the wall
// clock is set.
#pragma once

#include <stdint.h>

int64_t monotonic_us();

inline int64_t monotonic_ms() { return monotonic_us() / 1000; }
