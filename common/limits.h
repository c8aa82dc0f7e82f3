// Sizes shared by every subsystem.
#pragma once

// Paths are NUL-terminated arrays of 256 bytes; folder paths end with '/'.
constexpr int PATH_LEN = 256;

// System property limits, as Android's libcutils.
constexpr int PROP_KEY_LEN = 32;    // at most 31 characters
constexpr int PROP_VALUE_LEN = 92;  // at most 91 characters
