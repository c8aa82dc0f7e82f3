// The randomized harnesses' driver: a fixed seed printed first, bounded rounds, and on a failure
// the round, seed and input to replay it: NAME_fuzz [ROUNDS [SEED]].
#pragma once

#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <random>
#include <string>

#include "record/record.h"
#include "storage/history_log.h"

// The code under test records into the history, as the daemon's start-up sets it up.
[[maybe_unused]] static const bool history_sink_installed = (record_set_history_sink(history_vlog), true);

struct Fuzz {
    std::mt19937_64 rng;
    unsigned long round = 0;
    std::string input;  // what the round works on, shown when it fails

    size_t pick(size_t n) { return n == 0 ? 0 : static_cast<size_t>(rng() % n); }
    // n characters of alphabet (of any byte when it is null); text: up to max of them.
    std::string bytes(size_t n, const char* alphabet = nullptr, size_t alphabet_len = 0) {
        std::string s(n, '\0');
        for (char& c : s) c = alphabet ? alphabet[pick(alphabet_len)] : static_cast<char>(rng());
        return s;
    }
    std::string text(size_t max, const char* alphabet = nullptr, size_t alphabet_len = 0) {
        return bytes(pick(max + 1), alphabet, alphabet_len);
    }
};

// Without trailing spaces and line feeds (but the first character), as the daemon trims.
inline std::string fuzz_trimmed(std::string s) {
    while (s.size() > 1 && (s.back() == ' ' || s.back() == '\n')) s.pop_back();
    return s;
}

inline std::string fuzz_skip_spaces(const std::string& s) {
    size_t lead = s.find_first_not_of(' ');
    return lead == std::string::npos ? "" : s.substr(lead);
}

// Runs round(f) ROUNDS times; a round returns nullptr when it passed, else what failed.
inline int fuzz_main(const char* name, int argc, char** argv, unsigned long seed, unsigned long rounds,
                     const char* (*round)(Fuzz& f)) {
    if (access("/dev/emu/properties", F_OK) != 0) {
        fprintf(stderr, "%s: run it inside the emulated phone (tools/tavlo-emu sandbox)\n", name);
        return 2;
    }
    if (argc > 1) rounds = strtoul(argv[1], nullptr, 0);
    if (argc > 2) seed = strtoul(argv[2], nullptr, 0);
    printf("%s: seed %lu, %lu rounds\n", name, seed, rounds);
    fflush(stdout);
    Fuzz f;
    f.rng.seed(seed);
    for (; f.round < rounds; f.round++) {
        f.input.clear();
        if (const char* failed = round(f)) {
            // On standard output (a harness may have silenced standard error), the input escaped.
            std::string shown;
            for (unsigned char c : f.input.substr(0, 4096)) {
                char hex[8];
                snprintf(hex, sizeof(hex), c >= 0x20 && c < 0x7f && c != '\\' ? "%c" : "\\x%02x", c);
                shown += hex;
            }
            printf("%s: FAILED in round %lu (seed %lu): %s\ninput (%zu bytes): \"%s\"\n", name, f.round, seed,
                   failed, f.input.size(), shown.c_str());
            fflush(stdout);
            abort();
        }
    }
    printf("%s: %lu rounds, no failure\n", name, rounds);
    return 0;
}
