// Random, mutated and whole entries queued on two text devices and an events
// device, then formatted: an entry is taken exactly when whole, the queues keep
// time order (arrival order among equal times) and their count.
#include <fcntl.h>
#include <stdint.h>

#include "collectors/log_cat.h"
#include "fuzz/fuzz_util.h"

namespace {

// The library's complaints go to /dev/null, sanitizer reports to standard error.
extern "C" void __sanitizer_set_report_fd(void* fd) __attribute__((weak));

void put32(std::string& s, size_t at, uint32_t v) {
    for (int i = 0; i < 4; i++) s[at + i] = static_cast<char>(v >> (8 * i));
}

// Whole entries carry the arrival number as pid and a time within a minute,
// so that their order can be checked; wild ones are anything at all.
std::string make_entry(Fuzz& f, uint32_t arrival, bool* wild) {
    std::string s(f.pick(8) == 0 ? f.pick(LOGGER_READ_MAX + 1) : LEGACY_HEADER_SIZE + f.pick(600), '\0');
    for (char& c : s) c = static_cast<char>(f.rng());
    *wild = f.pick(6) == 0 || s.size() < LEGACY_HEADER_SIZE;
    if (s.size() < LEGACY_HEADER_SIZE) return s;
    size_t len = s.size() - LEGACY_HEADER_SIZE;
    if (f.pick(5) == 0) len -= f.pick(len + 1);  // a stated length below what was read,
    if (f.pick(7) == 0) len += 1 + f.pick(200);  // or beyond it
    s[0] = static_cast<char>(len);
    s[1] = static_cast<char>(len >> 8);
    if (*wild) return s;
    put32(s, 4, arrival);
    put32(s, 12, 1000 + static_cast<uint32_t>(f.pick(60)));
    put32(s, 16, static_cast<uint32_t>(f.pick(3)) * 250000000u);
    size_t read_len = s.size() - LEGACY_HEADER_SIZE;
    if (len >= 2 && len <= read_len && f.pick(2)) s[LEGACY_HEADER_SIZE + 1 + f.pick(len - 1)] = '\0';  // a tag end
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

LogCat* cat;
LogDevice* devices[3];
bool wild_queued = false;

const char* one_round(Fuzz& f) {
    if (f.round == 0) {
        if (__sanitizer_set_report_fd) __sanitizer_set_report_fd(reinterpret_cast<void*>(static_cast<intptr_t>(dup(2))));
        if (!freopen("/dev/null", "w", stderr)) return "no /dev/null";
        cat = new LogCat("main_log");
        cat->transist_fd = open("/dev/null", O_WRONLY | O_CLOEXEC);
        if (cat->transist_fd < 0 || !cat->set_output_format()) return "no output format";
        devices[0] = cat->add_device("/dev/log/main", false, LOG_ID_MAIN, -1);
        devices[1] = cat->add_device("/dev/log/system", false, LOG_ID_SYSTEM, -1);
        devices[2] = cat->add_device("/dev/log/events", true, LOG_ID_EVENTS, -1);
    }
    bool wild = false;
    f.input = make_entry(f, static_cast<uint32_t>(f.round), &wild);
    const std::string& raw = f.input;
    size_t stated = raw.size() < 2 ? 0 : static_cast<unsigned char>(raw[0]) | static_cast<unsigned char>(raw[1]) << 8;
    bool whole = raw.size() >= LEGACY_HEADER_SIZE && stated <= raw.size() - LEGACY_HEADER_SIZE;
    if (cat->take_entry(devices[f.pick(3)], raw.data(), raw.size()) != (whole ? 1 : 0)) return "taken or not";
    wild_queued = wild_queued || (whole && wild);

    int count = 0;
    for (LogDevice* d : devices)
        if (!in_order(d, &count) && !wild_queued) return "a queue out of order";
    if (count != cat->queued_count || cat->overloaded != (count > OVERLOAD_THRESHOLD)) return "held count";
    if (f.pick(8) == 0) cat->print_ready();
    if (f.pick(64) == 0) {
        cat->print_all();
        if (cat->queued_count != 0) return "left after printing all";
        wild_queued = false;
    }
    return nullptr;
}

}  // namespace

int main(int argc, char** argv) { return fuzz_main("logger_entry_fuzz", argc, argv, 0x10c4a7, 100000, one_round); }
