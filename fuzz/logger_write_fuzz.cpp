// Randomized harness for the logger devices' write path: random writes (empty,
// small, over the payload limit) and random injection writes (valid, unknown
// or absent buffers, truncated headers, binary noise) into small rings that
// wrap all the time, with readers that open at any moment and read at their
// own pace. Every result, every entry read and the rings' positions are
// checked against a plain model: a list of every entry ever written, of which
// a ring keeps the longest tail that fits.
//
//   logger_write_fuzz [SECONDS [SEED]]   (or TAVLO_FUZZ_SECONDS, TAVLO_FUZZ_SEED)
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "platform/logger_ring.h"

namespace {

constexpr unsigned long DEFAULT_SEED = 0x10661;
constexpr double DEFAULT_SECONDS = 5.0;
constexpr int READERS = 3;

std::mt19937_64 rng;
unsigned long iteration = 0;
unsigned long seed = DEFAULT_SEED;

size_t pick(size_t n) { return n == 0 ? 0 : static_cast<size_t>(rng() % n); }

[[noreturn]] void fail(const char* what, int buffer) {
    fprintf(stderr, "logger_write_fuzz: FAILED at iteration %lu (seed %lu), buffer %d: %s\n", iteration, seed, buffer, what);
    abort();
}

double now_seconds() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

// A buffer as the model sees it: every entry written, and which are kept.
struct Model {
    size_t size = 0;
    std::vector<std::string> entries;  // header and payload, as a reader gets them
    std::vector<uint64_t> starts;      // absolute position of each entry
    size_t first_kept = 0;
    uint64_t end = 0;
    size_t reader_next[READERS] = {};  // index of the entry each reader reads next

    void add(const std::string& entry) {
        entries.push_back(entry);
        starts.push_back(end);
        end += entry.size();
        while (end - starts[first_kept] > size) first_kept++;
    }
    uint64_t oldest() const { return first_kept < starts.size() ? starts[first_kept] : end; }
};

LoggerRing* rings[LOGGER_BUFFER_COUNT];
Model models[LOGGER_BUFFER_COUNT];
uint64_t reader_pos[LOGGER_BUFFER_COUNT][READERS];

std::string random_bytes(size_t n) {
    std::string s(n, '\0');
    for (char& c : s) c = static_cast<char>(rng());
    return s;
}

// Empty, small, around the payload limit, anything.
size_t random_len() {
    const size_t lens[] = {pick(4), pick(200), LOGGER_MAX_PAYLOAD - 2 + pick(5), pick(6000)};
    return lens[pick(4)];
}

std::string entry_of(const LoggerHeader& header, const std::string& payload) {
    LoggerHeader h = header;
    h.len = static_cast<uint16_t>(payload.size());
    h.pad = 0;
    return std::string(reinterpret_cast<const char*>(&h), sizeof(h)) + payload;
}

void device_write(int b) {
    std::string bytes = random_bytes(random_len());
    struct timespec now = {static_cast<time_t>(rng() & 0x7fffffff), static_cast<long>(pick(1000000000))};
    int32_t pid = static_cast<int32_t>(rng()), tid = static_cast<int32_t>(rng());
    size_t kept = logger_device_write(rings[b], pid, tid, now, bytes.data(), bytes.size());
    std::string payload = bytes.substr(0, LOGGER_MAX_PAYLOAD);
    if (kept != payload.size()) fail("device write kept a wrong length", b);
    LoggerHeader h = {0, 0, pid, tid, static_cast<int32_t>(now.tv_sec), static_cast<int32_t>(now.tv_nsec)};
    if (!payload.empty()) models[b].add(entry_of(h, payload));
}

void inject_write() {
    static const char* const names[] = {"main", "system", "radio", "events", "kernel", "", "mainx"};
    std::string name = names[pick(7)];
    const std::string choices[] = {random_bytes(pick(64)), name + random_bytes(pick(40)),
                                   name + '\0' + random_bytes(LOGGER_HEADER_LEN + random_len())};
    std::string bytes = choices[std::min<size_t>(pick(4), 2)];
    long taken = logger_inject_write(rings, bytes.data(), bytes.size());

    // The model's reading of the same bytes.
    size_t nul = bytes.find('\0');
    int b = nul != std::string::npos && nul < 16 ? logger_buffer_by_name(bytes.c_str()) : -1;
    if (b < 0 || rings[b] == nullptr || bytes.size() - nul - 1 < LOGGER_HEADER_LEN) {
        if (taken != -1) fail("injection of bad bytes accepted", b);
        return;
    }
    LoggerHeader h;
    memcpy(&h, bytes.data() + nul + 1, sizeof(h));
    std::string payload = bytes.substr(nul + 1 + LOGGER_HEADER_LEN, LOGGER_MAX_PAYLOAD);
    if (taken != static_cast<long>(nul + 1 + LOGGER_HEADER_LEN + payload.size())) fail("injection took a wrong length", b);
    if (!payload.empty()) models[b].add(entry_of(h, payload));
}

void read_some(int b, int r) {
    Model& m = models[b];
    LoggerRing& ring = *rings[b];
    for (size_t n = pick(8); n > 0; n--) {
        uint64_t pos = ring.clamp(reader_pos[b][r]);
        size_t& next = m.reader_next[r];
        if (next < m.first_kept) next = m.first_kept;
        if ((pos == ring.end()) != (next == m.entries.size())) fail("unread entries differ", b);
        if (next == m.entries.size()) return;
        if (pos != m.starts[next]) fail("reader position is not the model's entry", b);
        size_t len = ring.entry_len(pos);
        if (len != m.entries[next].size()) fail("entry length differs", b);
        uint8_t out[LOGGER_MAX_ENTRY];
        ring.copy_entry(pos, out);
        if (memcmp(out, m.entries[next].data(), len) != 0) fail("entry bytes differ", b);
        reader_pos[b][r] = pos + len;
        next++;
    }
}

}  // namespace

int main(int argc, char** argv) {
    double seconds = DEFAULT_SECONDS;
    const char* env_seconds = getenv("TAVLO_FUZZ_SECONDS");
    const char* env_seed = getenv("TAVLO_FUZZ_SEED");
    if (argc > 1) seconds = atof(argv[1]);
    else if (env_seconds) seconds = atof(env_seconds);
    if (argc > 2) seed = strtoul(argv[2], nullptr, 0);
    else if (env_seed) seed = strtoul(env_seed, nullptr, 0);
    printf("logger_write_fuzz: seed %lu, %.1f s\n", seed, seconds);
    fflush(stdout);
    rng.seed(seed);

    double deadline = now_seconds() + seconds;
    unsigned long entries = 0;
    for (unsigned long round = 0; now_seconds() < deadline; round++) {
        // Fresh rings now and then, of sizes that wrap after a few entries;
        // "system" is sometimes absent.
        LoggerRing fresh[LOGGER_BUFFER_COUNT];
        for (int b = 0; b < LOGGER_BUFFER_COUNT; b++) {
            rings[b] = nullptr;
            models[b] = Model();
            if (b == LOGGER_SYSTEM && pick(3) == 0) continue;
            size_t size = LOGGER_MIN_SIZE + pick(3 * LOGGER_MAX_ENTRY);
            if (!fresh[b].init(size)) fail("ring init failed", b);
            rings[b] = &fresh[b];
            models[b].size = size;
            for (int r = 0; r < READERS; r++) reader_pos[b][r] = 0;
        }
        for (int step = 0; step < 2000; step++, iteration++) {
            int b = static_cast<int>(pick(LOGGER_BUFFER_COUNT));
            if (rings[b] == nullptr) b = LOGGER_MAIN;
            switch (pick(5)) {
                case 0: device_write(b); break;
                case 1: inject_write(); break;
                case 2: {
                    // A reader opens anew: at the oldest kept entry.
                    int r = static_cast<int>(pick(READERS));
                    reader_pos[b][r] = rings[b]->oldest();
                    models[b].reader_next[r] = models[b].first_kept;
                    break;
                }
                default: read_some(b, static_cast<int>(pick(READERS)));
            }
            if (rings[b]->oldest() != models[b].oldest() || rings[b]->end() != models[b].end)
                fail("ring positions differ from the model", b);
        }
        for (const Model& m : models) entries += m.entries.size();
    }
    printf("logger_write_fuzz: %lu operations, %lu entries, no fault\n", iteration, entries);
    return 0;
}
