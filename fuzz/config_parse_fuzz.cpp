// Randomized harness for the configuration parser: random and mutated lines
// (binary bytes, huge lengths, many '=', spaces, line feeds) thrown at trim,
// config_parse_line and config_read_file, each result checked against a small
// model of the line syntax and against the cache's invariants.
//
//   config_parse_fuzz [SECONDS [SEED]]   (or TAVLO_FUZZ_SECONDS, TAVLO_FUZZ_SEED)
//
// Runs inside the emulated phone only: it writes /data and /system/etc.
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <random>
#include <string>
#include <vector>

#include "config/config_store.h"
#include "fuzz/fuzz_util.h"

namespace {

constexpr unsigned long DEFAULT_SEED = 0x7a7101;
constexpr double DEFAULT_SECONDS = 10.0;

const char* const KEYS[CONFIG_ITEM_COUNT] = {"autostart", "logpath",  "logsize", "AndroidLog",
                                             "KernelLog", "BTLog", "totallogsize"};
const char* const SYSTEM_KEYS[] = {"com.quorvex.log.tavlo.enabled", "com.quorvex.log.tavlo.maxsize",
                                   "qrvlog_path"};

std::mt19937_64 rng;
unsigned long iteration = 0;
unsigned long seed = DEFAULT_SEED;

size_t pick(size_t n) { return n == 0 ? 0 : static_cast<size_t>(rng() % n); }

[[noreturn]] void fail(const char* what, const std::string& input) {
    fprintf(stderr, "config_parse_fuzz: FAILED at iteration %lu (seed %lu): %s\ninput (%zu bytes): \"%s\"\n",
            iteration, seed, what, input.size(), fuzz_printable(input.substr(0, 4096)).c_str());
    abort();
}

// --- input generation ------------------------------------------------------

std::string random_bytes(size_t max_len) {
    std::string s(pick(max_len + 1), '\0');
    for (char& c : s) c = static_cast<char>(rng() & 0xff);
    return s;
}

// Text made mostly of the characters the parser cares about.
std::string syntax_soup(size_t max_len) {
    static const char alphabet[] = "  ==\n\n\r\tabc01_.";
    std::string s(pick(max_len + 1), ' ');
    for (char& c : s) c = alphabet[pick(sizeof(alphabet) - 1)];
    return s;
}

std::string spaces() { return std::string(pick(4) == 0 ? pick(300) : pick(3), ' '); }

std::string some_key() {
    switch (pick(5)) {
        case 0:
        case 1: return KEYS[pick(CONFIG_ITEM_COUNT)];
        case 2: return SYSTEM_KEYS[pick(3)];
        case 3: return syntax_soup(20);
        default: return random_bytes(pick(2) ? 16 : 400);
    }
}

std::string some_value() {
    switch (pick(6)) {
        case 0: return std::to_string(rng() % 100000);
        case 1: return pick(2) ? "true" : "TRUE";
        case 2: return std::string(CONFIG_FIELD_LEN - 2 + pick(4), 'v');  // around the 91-character limit
        case 3: return syntax_soup(pick(2) ? 30 : 1500);
        case 4: return random_bytes(pick(2) ? 40 : 2000);
        default: return "";
    }
}

std::string structured_line() {
    std::string line = spaces() + some_key() + spaces();
    int equals = pick(8) == 0 ? static_cast<int>(pick(5)) : 1;
    for (int i = 0; i < equals; i++) line += '=';
    line += spaces() + some_value() + spaces();
    if (pick(4) != 0) line += '\n';
    return line;
}

std::string mutate(std::string s) {
    int edits = 1 + static_cast<int>(pick(4));
    for (int i = 0; i < edits; i++) {
        size_t at = pick(s.size() + 1);
        switch (pick(6)) {
            case 0: if (!s.empty()) s[pick(s.size())] = static_cast<char>(rng() & 0xff); break;
            case 1: s.insert(at, 1, "= \n"[pick(3)]); break;
            case 2: s.insert(at, std::string(pick(1200), "= \nx"[pick(4)])); break;
            case 3: s.erase(at, pick(40)); break;
            case 4: s += s.substr(0, pick(s.size() + 1)); break;
            default: s.insert(at, random_bytes(8)); break;
        }
    }
    return s;
}

std::string random_line(const std::string& previous) {
    switch (pick(4)) {
        case 0: return random_bytes(pick(4) ? 300 : 3000);
        case 1: return mutate(previous);
        default: return structured_line();
    }
}

// --- the model -------------------------------------------------------------

std::string model_trim(const std::string& s) {
    size_t len = s.size();
    while (len > 1 && (s[len - 1] == ' ' || s[len - 1] == '\n')) len--;
    size_t start = 0;
    while (start < len && s[start] == ' ') start++;
    return s.substr(start, len - start);
}

struct Model {
    std::string values[CONFIG_ITEM_COUNT];
};

void model_update(Model* m, const std::string& key, const std::string& value) {
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) {
        if (key == KEYS[i]) {
            if (value.size() < static_cast<size_t>(CONFIG_FIELD_LEN)) m->values[i] = value;
            return;
        }
    }
}

void model_parse(Model* m, int source, const char* line) {
    std::string s(line, strnlen(line, 254));
    size_t eq = s.find('=');
    if (eq == std::string::npos || eq == 0 || eq + 1 == s.size()) return;
    std::string key = model_trim(s.substr(0, eq));
    std::string value = model_trim(s.substr(eq + 1));
    if (source == 0) {
        model_update(m, key, value);
    } else if (source == 1) {
        if (key == SYSTEM_KEYS[0]) model_update(m, "autostart", value == "true" ? "1" : "0");
        if (key == SYSTEM_KEYS[1]) model_update(m, "logsize", value);
        if (key == SYSTEM_KEYS[2]) model_update(m, "logpath", value);
    }
}

// A file as config_read_file sees it: pieces of at most 1022 characters,
// pieces holding a NUL byte skipped.
void model_read(Model* m, int source, const std::string& content) {
    size_t pos = 0;
    while (pos < content.size()) {
        size_t end = content.find('\n', pos);
        size_t len = end == std::string::npos ? content.size() - pos : end - pos + 1;
        if (len > 1022) len = 1022;
        std::string piece = content.substr(pos, len);
        pos += len;
        if (piece.find('\0') != std::string::npos) continue;
        model_parse(m, source, piece.c_str());
    }
}

Model model_of(const ConfigCache& cache) {
    Model m;
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) m.values[i] = cache.items[i].value;
    return m;
}

// --- invariants --------------------------------------------------------------

void check_cache(const ConfigCache& cache, const Model& expected, const std::string& input) {
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) {
        const ConfigItem& item = cache.items[i];
        if (strnlen(item.key, CONFIG_FIELD_LEN) >= static_cast<size_t>(CONFIG_FIELD_LEN)) fail("key not terminated", input);
        if (strnlen(item.value, CONFIG_FIELD_LEN) >= static_cast<size_t>(CONFIG_FIELD_LEN)) fail("value not terminated", input);
        if (strcmp(item.key, KEYS[i]) != 0) fail("a key changed", input);
        if (expected.values[i] != item.value) {
            fprintf(stderr, "item %s: got \"%s\", model \"%s\"\n", KEYS[i], fuzz_printable(item.value).c_str(),
                    fuzz_printable(expected.values[i]).c_str());
            fail("value differs from the model", input);
        }
    }
}

void check_trim(const std::string& input) {
    std::vector<char> buf(input.begin(), input.end());
    buf.push_back('\0');
    std::string as_c(buf.data());
    // Guard bytes after the terminator catch a write past the string.
    buf.insert(buf.end(), 8, '#');
    char* r = trim(buf.data());
    if (r < buf.data() || r > buf.data() + as_c.size()) fail("trim result outside the string", input);
    if (r[strnlen(r, as_c.size() + 1)] != '\0') fail("trim result not terminated", input);
    // Everything after the C string (the rest of a line holding a NUL, the
    // guard) must stay as it was.
    for (size_t i = as_c.size() + 1; i < buf.size(); i++) {
        char expected = i < input.size() ? input[i] : (i == input.size() ? '\0' : '#');
        if (buf[i] != expected) fail("trim wrote past the string", input);
    }
    if (std::string(r) != model_trim(as_c)) fail("trim differs from the model", input);
}

void write_file(const char* path, const std::string& content) {
    int fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) {
        perror(path);
        exit(2);
    }
    if (write(fd, content.data(), content.size()) != static_cast<ssize_t>(content.size())) {
        perror(path);
        exit(2);
    }
    close(fd);
}

}  // namespace

int main(int argc, char** argv) {
    double seconds = DEFAULT_SECONDS;
    fuzz_start("config_parse_fuzz", argc, argv, &seconds, &seed);
    rng.seed(seed);

    ConfigCache cache;
    config_init(&cache);
    std::string previous = "logsize=300\n";
    double deadline = fuzz_now() + seconds;
    unsigned long files = 0;
    for (iteration = 0; fuzz_now() < deadline; iteration++) {
        std::string line = random_line(previous);
        // Mutations of mutations grow; start over from a fresh line now and then.
        previous = line.size() > 8192 ? structured_line() : line;

        check_trim(line);

        // One line into a cache, for either source.
        if (pick(16) == 0) config_set_defaults(&cache);
        cache.source = static_cast<int>(pick(2));
        Model expected = model_of(cache);
        model_parse(&expected, cache.source, line.c_str());
        config_parse_line(&cache, line.c_str());
        check_cache(cache, expected, line);

        // Now and then a whole file of such lines, as either file.
        if (iteration % 64 == 0) {
            std::string content;
            size_t lines = pick(40);
            std::string prev = previous;
            for (size_t i = 0; i < lines; i++) {
                prev = random_line(prev.size() > 8192 ? structured_line() : prev);
                content += prev;
            }
            if (content.size() > (2 << 20)) content.resize(2 << 20);
            bool own = pick(2) == 0;
            const char* path = own ? CONFIG_FILE : SYSTEM_DEFAULTS_FILE;
            write_file(path, content);
            config_set_defaults(&cache);
            Model file_model = model_of(cache);
            model_read(&file_model, own ? 0 : 1, content);
            if (config_read_file(&cache, path) != 1) fail("file could not be read", content);
            if (cache.source != (own ? 0 : 1)) fail("source not set from the path", content);
            check_cache(cache, file_model, content);
            files++;
        }
    }
    printf("config_parse_fuzz: %lu lines, %lu files, no failure\n", iteration, files);
    return 0;
}
