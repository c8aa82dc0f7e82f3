// Randomized harness for the dump-list parser: lists of random and
// syntax-heavy lines (long lines, NUL bytes, runs of spaces, names that climb)
// through parse_dump_list_text, each result checked against a small model.
//
//   dump_list_fuzz [SECONDS [SEED]]   (or TAVLO_FUZZ_SECONDS, TAVLO_FUZZ_SEED)

#include <random>
#include <string>
#include <vector>

#include "fuzz/fuzz_util.h"
#include "storage/debug_dump.h"

namespace {

std::mt19937_64 rng;
size_t pick(size_t n) { return n == 0 ? 0 : static_cast<size_t>(rng() % n); }

std::string random_list() {
    static const std::string pieces[] = {" ", "  ", "\n", "#", "/src", "out", "sys_prop", "default",
                                         "..", "/", ".", "\t", std::string(1, '\0'), "x"};
    std::string s;
    for (size_t n = pick(80); n > 0; n--) {
        switch (pick(8)) {
            case 0: s += std::string(pick(300), "sx /"[pick(4)]); break;
            case 1: s += static_cast<char>(rng() & 0xff); break;
            default: s += pieces[pick(sizeof(pieces) / sizeof(pieces[0]))]; break;
        }
    }
    return s;
}

// Lines of at most 254 bytes, read up to a NUL, not comments, split at spaces;
// output names that are one file name and fit; the last line first.
std::vector<std::string> model(const std::string& text, const std::string& run) {
    std::vector<std::string> out;
    for (size_t pos = 0; pos < text.size();) {
        size_t end = std::min(text.find('\n', pos), text.size());
        std::string line = text.substr(pos, end - pos);
        pos = end + 1;
        line = line.size() > 254 ? std::string() : line.substr(0, line.find('\0'));
        if (line.empty() || line[0] == '#') continue;
        std::vector<std::string> fields;
        for (size_t at = 0; at < line.size();) {
            size_t next = std::min(line.find(' ', at), line.size());
            if (next > at && fields.size() < 3) fields.push_back(line.substr(at, next - at));
            at = next + 1;
        }
        if (fields.empty()) continue;
        std::string name = fields.size() > 1 ? fields[1] : "properties";
        if (name.find('/') != std::string::npos || name == "." || name == ".." || run.size() + name.size() > 254)
            continue;
        out.insert(out.begin(), fields[0] + ">" + run + name + (fields.size() > 2 && fields[2] == "sys_prop" ? "P" : "F"));
    }
    return out;
}

}  // namespace

int main(int argc, char** argv) {
    double seconds = 10;
    unsigned long seed = 0xd0f11e;
    fuzz_start("dump_list_fuzz", argc, argv, &seconds, &seed);
    rng.seed(seed);
    double deadline = fuzz_now() + seconds;
    unsigned long i = 0;
    for (; fuzz_now() < deadline; i++) {
        std::string text = random_list();
        std::string run = "/mnt/sdcard/" + std::string(pick(250), 'r') + "/";
        std::vector<std::string> got;
        for (DumpEntry* e = parse_dump_list_text(text.data(), text.size(), "/mnt/sdcard", run.c_str()); e != nullptr;) {
            got.push_back(std::string(e->source) + ">" + e->output + (e->dumper == dump_properties ? "P" : "F"));
            DumpEntry* next = e->next;
            e->next = nullptr;
            free_dump_list(e);
            e = next;
        }
        if (got != model(text, run)) {
            fprintf(stderr, "dump_list_fuzz: FAILED at iteration %lu (seed %lu): %zu entries, model %zu\nlist: \"%s\"\n",
                    i, seed, got.size(), model(text, run).size(), fuzz_printable(text).c_str());
            abort();
        }
    }
    printf("dump_list_fuzz: %lu lists, no failure\n", i);
    return 0;
}
