// Randomized harness for what the Android collector does with the bytes of
// one read: random, mutated and well-formed entries (text and binary events)
// are queued on two text devices and an events device, then decoded and
// formatted through the platform library. Checked: an entry is taken exactly
// when it is whole, every queue stays in time order with arrival order among
// equal times, the count of held entries matches the queues, and the library
// never reads or writes out of bounds (under the sanitizers).
//
//   logger_entry_fuzz [SECONDS [SEED]]   (or TAVLO_FUZZ_SECONDS, TAVLO_FUZZ_SEED)
#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <random>
#include <string>

#include "collectors/log_cat.h"

namespace {

// The library reports every entry it cannot decode on standard error; that
// goes to /dev/null, and failures and sanitizer reports to the real one.
int report_fd = 2;
extern "C" void __sanitizer_set_report_fd(void* fd) __attribute__((weak));

void silence_library() {
    report_fd = dup(2);
    int null_fd = open("/dev/null", O_WRONLY | O_CLOEXEC);
    if (report_fd < 0 || null_fd < 0) return;
    if (__sanitizer_set_report_fd) __sanitizer_set_report_fd(reinterpret_cast<void*>(static_cast<intptr_t>(report_fd)));
    dup2(null_fd, 2);
    close(null_fd);
}

std::mt19937_64 rng;
unsigned long seed = 0x10c4a7;
size_t pick(size_t n) { return n == 0 ? 0 : static_cast<size_t>(rng() % n); }

[[noreturn]] void fail(const char* what, unsigned long iteration) {
    dprintf(report_fd, "logger_entry_fuzz: FAILED at iteration %lu (seed %lu): %s\n", iteration, seed, what);
    abort();
}

void put32(std::string& s, size_t at, uint32_t v) {
    for (int i = 0; i < 4; i++) s[at + i] = static_cast<char>(v >> (8 * i));
}

// Whole entries carry the arrival number as pid and a time within a minute,
// so that their order can be checked; wild ones are anything at all.
std::string make_entry(uint32_t arrival, bool* wild) {
    std::string s(pick(8) == 0 ? pick(LOGGER_READ_MAX + 1) : LEGACY_HEADER_SIZE + pick(600), '\0');
    for (char& c : s) c = static_cast<char>(rng());
    *wild = pick(6) == 0 || s.size() < LEGACY_HEADER_SIZE;
    if (s.size() < LEGACY_HEADER_SIZE) return s;
    size_t len = s.size() - LEGACY_HEADER_SIZE;
    if (pick(5) == 0) len -= pick(len + 1);  // a stated length below what was read,
    if (pick(7) == 0) len += 1 + pick(200);  // or beyond it
    s[0] = static_cast<char>(len);
    s[1] = static_cast<char>(len >> 8);
    if (*wild) return s;
    put32(s, 4, arrival);
    put32(s, 12, 1000 + static_cast<uint32_t>(pick(60)));
    put32(s, 16, static_cast<uint32_t>(pick(3)) * 250000000u);
    size_t read_len = s.size() - LEGACY_HEADER_SIZE;
    if (len >= 2 && len <= read_len && pick(2)) s[LEGACY_HEADER_SIZE + 1 + pick(len - 1)] = '\0';  // a tag end
    return s;
}

// Times never go back along a queue, and equal times keep arrival order.
bool in_order(const LogDevice* d, int* count) {
    for (const QueuedEntry* e = d->queue; e != nullptr; e = e->next) {
        ++*count;
        if (e->next == nullptr) return e == d->tail;
        int cmp = compare_entry_time(e->entry, e->next->entry);
        if (cmp > 0 || (cmp == 0 && e->entry.pid > e->next->entry.pid) || e->next->prev != e) return false;
    }
    return true;
}

double now_s() {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

}  // namespace

int main(int argc, char** argv) {
    double seconds = argc > 1 ? atof(argv[1]) : getenv("TAVLO_FUZZ_SECONDS") ? atof(getenv("TAVLO_FUZZ_SECONDS")) : 10;
    if (argc > 2) seed = strtoul(argv[2], nullptr, 0);
    else if (getenv("TAVLO_FUZZ_SEED")) seed = strtoul(getenv("TAVLO_FUZZ_SEED"), nullptr, 0);
    printf("logger_entry_fuzz: seed %lu, %.1f s\n", seed, seconds);
    fflush(stdout);
    rng.seed(seed);
    silence_library();

    LogCat cat("main_log");
    cat.transist_fd = open("/dev/null", O_WRONLY | O_CLOEXEC);
    if (cat.transist_fd < 0 || !cat.set_output_format()) return 2;
    LogDevice* devices[] = {cat.add_device("/dev/log/main", false, LOG_ID_MAIN, -1),
                            cat.add_device("/dev/log/system", false, LOG_ID_SYSTEM, -1),
                            cat.add_device("/dev/log/events", true, LOG_ID_EVENTS, -1)};
    bool wild_queued = false;
    unsigned long i = 0;
    for (double deadline = now_s() + seconds; now_s() < deadline; i++) {
        bool wild = false;
        std::string raw = make_entry(static_cast<uint32_t>(i), &wild);
        size_t stated = raw.size() < 2 ? 0 : static_cast<unsigned char>(raw[0]) | static_cast<unsigned char>(raw[1]) << 8;
        bool whole = raw.size() >= LEGACY_HEADER_SIZE && stated <= raw.size() - LEGACY_HEADER_SIZE;
        if (cat.take_entry(devices[pick(3)], raw.data(), raw.size()) != (whole ? 1 : 0)) fail("taken or not", i);
        wild_queued = wild_queued || (whole && wild);

        int count = 0;
        for (LogDevice* d : devices) {
            if (!in_order(d, &count) && !wild_queued) fail("a queue out of order", i);
        }
        if (count != cat.queued_count || cat.overloaded != (count > OVERLOAD_THRESHOLD)) fail("held count", i);
        if (pick(8) == 0) cat.print_ready();
        if (pick(64) == 0) {
            cat.print_all();
            if (cat.queued_count != 0) fail("left after printing all", i);
            wild_queued = false;
        }
    }
    printf("logger_entry_fuzz: %lu entries, no failure\n", i);
    return 0;
}
