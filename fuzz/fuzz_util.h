// What the harnesses share: their bounds from the command line or the
// environment, a printed seed, and escaped input in failure reports.
#pragma once

#include <stdio.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <string>

inline double fuzz_now() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

// NAME [SECONDS [SEED]], or TAVLO_FUZZ_SECONDS and TAVLO_FUZZ_SEED. Prints the
// seed so that a failure can be replayed; exits when not inside the emulated
// phone, since the harnesses write its /data.
inline void fuzz_start(const char* name, int argc, char** argv, double* seconds, unsigned long* seed) {
    if (access("/dev/emu/properties", F_OK) != 0) {
        fprintf(stderr, "%s: run it inside the emulated phone (tools/tavlo-emu sandbox)\n", name);
        exit(2);
    }
    const char* env_seconds = getenv("TAVLO_FUZZ_SECONDS");
    const char* env_seed = getenv("TAVLO_FUZZ_SEED");
    if (argc > 1 || env_seconds) *seconds = atof(argc > 1 ? argv[1] : env_seconds);
    if (argc > 2 || env_seed) *seed = strtoul(argc > 2 ? argv[2] : env_seed, nullptr, 0);
    printf("%s: seed %lu, %.1f s\n", name, *seed, *seconds);
    fflush(stdout);
}

inline std::string fuzz_printable(const std::string& s) {
    std::string out;
    for (unsigned char c : s) {
        char hex[8];
        snprintf(hex, sizeof(hex), c >= 0x20 && c < 0x7f && c != '\\' ? "%c" : "\\x%02x", c);
        out += hex;
    }
    return out;
}
