// Where the emulated phone keeps its system properties, and the pieces of the
// property store that the phone's init needs beyond the libcutils calls.
#pragma once

// One file per property, named by its key, holding the bare value. Shared by
// every process of the phone; recreated empty at each boot.
#define PROPERTY_AREA_DIR "/dev/emu/properties"

// persist.* properties are also kept here, one file per key, to survive reboots.
#define PROPERTY_PERSIST_DIR "/data/property"

// 1 when key is a legal property name (as Android's property service accepts:
// 1..31 characters of letters, digits, '_', '-', '@', ':' and '.', not starting
// or ending with '.', no ".."), else 0.
int property_key_valid(const char* key);

// Sets a property in the runtime area only: persist.* values are not written
// again to PROPERTY_PERSIST_DIR (init uses it while loading them from there).
// ro.* can still be set only once. Returns 0, or -1 with errno set.
int property_set_runtime(const char* key, const char* value);
