// System properties with the signatures and limits of Android's libcutils.
// On the emulated phone they live in a folder shared by every process of the
// phone; a value is replaced whole (write aside, rename), so a reader never
// sees half of one.
#pragma once

#define PROPERTY_KEY_MAX 32    // key of at most 31 characters
#define PROPERTY_VALUE_MAX 92  // value of at most 91 characters

#ifdef __cplusplus
extern "C" {
#endif

// Copies the value of key (or default_value when unset) into value, which must
// hold PROPERTY_VALUE_MAX bytes. Returns the length of the copied value.
int property_get(const char* key, char* value, const char* default_value);

// Returns 0 on success, < 0 on failure (bad key, value too long, ro. already set).
int property_set(const char* key, const char* value);

// Calls propfn for every property, in name order. Returns 0, or -1 when the
// property area cannot be read.
int property_list(void (*propfn)(const char* key, const char* value, void* cookie), void* cookie);

#ifdef __cplusplus
}
#endif
