// Writes into small rings that wrap all the time, read at any pace by readers
// opened at any moment; checked against a list of every entry written, of
// which a ring keeps the longest tail that fits.
#include <string.h>
#include <time.h>

#include <algorithm>
#include <vector>

#include "fuzz/fuzz_util.h"
#include "platform/logger_ring.h"

namespace {

constexpr int READERS = 3;

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

// Empty, small, around the payload limit, anything.
size_t random_len(Fuzz& f) {
    const size_t lens[] = {f.pick(4), f.pick(200), LOGGER_MAX_PAYLOAD - 2 + f.pick(5), f.pick(6000)};
    return lens[f.pick(4)];
}

const char* device_write(Fuzz& f, int b) {
    std::string bytes = f.bytes(random_len(f));
    struct timespec now = {static_cast<time_t>(f.rng() & 0x7fffffff), static_cast<long>(f.pick(1000000000))};
    int32_t pid = static_cast<int32_t>(f.rng()), tid = static_cast<int32_t>(f.rng());
    size_t kept = logger_device_write(rings[b], pid, tid, now, bytes.data(), bytes.size());
    std::string payload = bytes.substr(0, LOGGER_MAX_PAYLOAD);
    if (kept != payload.size()) return "device write kept a wrong length";
    LoggerHeader h = {static_cast<uint16_t>(payload.size()), 0, pid, tid, static_cast<int32_t>(now.tv_sec),
                      static_cast<int32_t>(now.tv_nsec)};
    if (!payload.empty()) models[b].add(std::string(reinterpret_cast<const char*>(&h), sizeof(h)) + payload);
    return nullptr;
}

const char* read_some(Fuzz& f, int b, int r) {
    Model& m = models[b];
    LoggerRing& ring = *rings[b];
    for (size_t n = f.pick(8); n > 0; n--) {
        uint64_t pos = ring.clamp(reader_pos[b][r]);
        size_t& next = m.reader_next[r];
        if (next < m.first_kept) next = m.first_kept;
        if ((pos == ring.end()) != (next == m.entries.size())) return "unread entries differ";
        if (next == m.entries.size()) return nullptr;
        if (pos != m.starts[next]) return "reader position is not the model's entry";
        size_t len = ring.entry_len(pos);
        if (len != m.entries[next].size()) return "entry length differs";
        uint8_t out[LOGGER_MAX_ENTRY];
        ring.copy_entry(pos, out);
        if (memcmp(out, m.entries[next].data(), len) != 0) return "entry bytes differ";
        reader_pos[b][r] = pos + len;
        next++;
    }
    return nullptr;
}

const char* one_round(Fuzz& f) {
    // Rings of sizes that wrap after a few entries.
    LoggerRing fresh[LOGGER_BUFFER_COUNT];
    for (int b = 0; b < LOGGER_BUFFER_COUNT; b++) {
        models[b] = Model();
        size_t size = LOGGER_MIN_SIZE + f.pick(3 * LOGGER_MAX_ENTRY);
        if (!fresh[b].init(size)) return "ring init failed";
        rings[b] = &fresh[b];
        models[b].size = size;
        for (int r = 0; r < READERS; r++) reader_pos[b][r] = 0;
    }
    for (int step = 0; step < 2000; step++) {
        int b = static_cast<int>(f.pick(LOGGER_BUFFER_COUNT));
        const char* failed = nullptr;
        switch (f.pick(5)) {
            case 0: case 1: failed = device_write(f, b); break;
            case 2: {
                // A reader opens anew: at the oldest kept entry.
                int r = static_cast<int>(f.pick(READERS));
                reader_pos[b][r] = rings[b]->oldest();
                models[b].reader_next[r] = models[b].first_kept;
                break;
            }
            default: failed = read_some(f, b, static_cast<int>(f.pick(READERS)));
        }
        if (!failed && (rings[b]->oldest() != models[b].oldest() || rings[b]->end() != models[b].end))
            failed = "ring positions differ from the model";
        if (failed) return failed;
    }
    return nullptr;
}

}  // namespace

int main(int argc, char** argv) { return fuzz_main("logger_write_fuzz", argc, argv, 0x10661, 40, one_round); }
