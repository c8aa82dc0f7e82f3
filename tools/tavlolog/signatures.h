// The problems a phone engineer looks for first, as data: which lines show
// them. The summary lists every match with its instant and the line.
#pragma once

#include <cstdint>

#include "tools/tavlolog/entry.h"

namespace tavlolog {

struct Signature {
    const char* problem;  // as the summary names it
    unsigned sources;     // bit per Source the text is looked for in
    const char* tag;      // the line's tag must be this one (nullptr: any)
    const char* text;     // the message holds this
};

constexpr unsigned kAndroid = (1u << SRC_MAIN) | (1u << SRC_SYSTEM) | (1u << SRC_RADIO) | (1u << SRC_EVENTS);
constexpr unsigned kKernel = 1u << SRC_KERNEL;

constexpr Signature kSignatures[] = {
    {"app crash", kAndroid, nullptr, "FATAL EXCEPTION"},
    {"native crash", kAndroid, nullptr, "*** *** *** *** *** *** *** *** *** *** *** *** *** *** *** ***"},
    {"native crash", kAndroid, nullptr, "Fatal signal"},
    {"ANR", kAndroid, nullptr, "ANR in "},
    {"kernel oops or panic", kKernel, nullptr, "Internal error: Oops"},
    {"kernel oops or panic", kKernel, nullptr, "Kernel panic"},
    {"kernel oops or panic", kKernel, nullptr, "Unable to handle kernel"},
    {"kernel oops or panic", kKernel, nullptr, "BUG: "},
    {"watchdog", kKernel, nullptr, "watchdog"},
    {"watchdog", kKernel, nullptr, "Watchdog bark"},
    {"watchdog", kAndroid, "Watchdog", "WATCHDOG KILLING SYSTEM PROCESS"},
    {"low memory kill", kKernel, nullptr, "lowmemorykiller"},
    {"low memory kill", kKernel, nullptr, "Out of memory: Kill"},
    {"low memory kill", kAndroid, "lowmemorykiller", "Kill"},
    {"low memory kill", kAndroid, "lmkd", "Kill"},
    {"reboot", kKernel, nullptr, "Restarting system"},
    {"reboot", kAndroid, "ShutdownThread", "Rebooting"},
};

// The ORU overload marker a collector writes when it falls behind.
inline bool is_overload_marker(const Entry& e) {
    return e.kind == KIND_LINE && e.pid == 0 && e.tag == "ORU" && e.message == "trigger log";
}

}  // namespace tavlolog
