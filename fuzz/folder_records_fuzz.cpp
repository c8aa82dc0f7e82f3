// Randomized harness for the folder-records parser: random and record-like
// bytes through parse_folder_records, checked against a small model, and the
// parsed list written and read back unchanged.
//
//   folder_records_fuzz [SECONDS [SEED]]   (or TAVLO_FUZZ_SECONDS, TAVLO_FUZZ_SEED)
#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <random>
#include <string>
#include <vector>

#include "fuzz/fuzz_util.h"
#include "storage/folder_records.h"

namespace {

std::mt19937_64 rng;
size_t pick(size_t n) { return n == 0 ? 0 : static_cast<size_t>(rng() % n); }

std::string random_records() {
    static const std::string pieces[] = {" ", "\n", "APLog_2026_0304_070649", "0", "-7", "99999999999", "..",
                                         "/", ".", std::string(1, '\0'), "12 ", "\r"};
    std::string s;
    for (size_t n = pick(60); n > 0; n--) {
        switch (pick(8)) {
            case 0: s += std::string(pick(300), "a 1"[pick(3)]); break;
            case 1: s += static_cast<char>(rng() & 0xff); break;
            default: s += pieces[pick(sizeof(pieces) / sizeof(pieces[0]))]; break;
        }
    }
    return s;
}

std::vector<std::string> listed(FolderRecord* list) {
    std::vector<std::string> out;
    for (FolderRecord* r = list; r != nullptr; r = r->next) out.push_back(std::string(r->name) + " " + std::to_string(r->size_kb));
    free_folder_records(list);
    return out;
}

// Lines of at most 254 bytes with their line feed, read up to a NUL: a plain
// name before the first space, the size as a count of KiB after it.
std::vector<std::string> model(const std::string& text) {
    std::vector<std::string> out;
    for (size_t pos = 0; pos < text.size();) {
        size_t end = text.find('\n', pos);
        end = end == std::string::npos ? text.size() : end + 1;
        std::string line = end - pos > 254 ? std::string() : text.substr(pos, end - pos);
        pos = end;
        line = line.substr(0, line.find('\0'));
        size_t space = line.find(' ');
        if (space == std::string::npos) continue;
        std::string name = line.substr(0, space);
        if (name.empty() || name.find('/') != std::string::npos || name == "." || name == "..") continue;
        long size = strtol(line.c_str() + space + 1, nullptr, 10);
        out.push_back(name + " " + std::to_string(size < 0 ? 0 : size > INT_MAX ? INT_MAX : size));
    }
    return out;
}

}  // namespace

int main(int argc, char** argv) {
    double seconds = 10;
    unsigned long seed = 0xf01de2;
    fuzz_start("folder_records_fuzz", argc, argv, &seconds, &seed);
    rng.seed(seed);
    mkdir("/data/misc", 0771);
    double deadline = fuzz_now() + seconds;
    unsigned long i = 0;
    for (; fuzz_now() < deadline; i++) {
        std::string text = random_records();
        FolderRecord* list = parse_folder_records(text.data(), text.size());
        bool written = i % 16 == 0 && write_folder_records(list, "NEW", 1) == 1;
        std::vector<std::string> got = listed(list), expected = model(text);
        if (got == expected && written) {
            expected.push_back("NEW 0");
            got = listed(read_folder_records(1));
        }
        if (got != expected) {
            fprintf(stderr, "folder_records_fuzz: FAILED at iteration %lu (seed %lu): %zu records, model %zu\nfile: \"%s\"\n",
                    i, seed, got.size(), expected.size(), fuzz_printable(text).c_str());
            abort();
        }
    }
    printf("folder_records_fuzz: %lu record files, no failure\n", i);
    return 0;
}
