// Random configuration lines and files through trim, config_parse_line and
// config_read_file, checked against a small model of the syntax.
#include <string.h>

#include <fstream>
#include <vector>

#include "config/config_store.h"
#include "fuzz/fuzz_util.h"

namespace {

// The daemon's keys, then the system image's.
const char* const KEYS[] = {"autostart", "logpath", "logsize", "AndroidLog", "KernelLog", "BTLog", "totallogsize",
                            "com.quorvex.log.tavlo.enabled", "com.quorvex.log.tavlo.maxsize", "qrvlog_path"};
const char kSoup[] = "  ==\n\n\r\tabc01_.";

ConfigCache cache;
std::string values[CONFIG_ITEM_COUNT];  // the model's cache

std::string spaces(Fuzz& f) { return std::string(f.pick(4) ? f.pick(3) : f.pick(300), ' '); }

std::string line(Fuzz& f) {
    std::string key = f.pick(4) ? KEYS[f.pick(10)] : f.text(20, kSoup, 16);
    std::string value;
    switch (f.pick(5)) {
        case 0: value = f.pick(2) ? std::to_string(f.rng() % 100000) : f.pick(2) ? "true" : "TRUE"; break;
        case 1: value = std::string(CONFIG_FIELD_LEN - 2 + f.pick(4), 'v'); break;  // around the limit
        case 2: value = f.text(f.pick(2) ? 30 : 1500, kSoup, 16); break;
        default: value = f.text(f.pick(2) ? 40 : 2000); break;
    }
    std::string s = spaces(f) + key + spaces(f) + std::string(f.pick(8) ? 1 : f.pick(5), '=') + spaces(f) + value + spaces(f);
    if (f.pick(4)) s += '\n';
    if (f.pick(4) == 0) s.insert(f.pick(s.size() + 1), f.pick(2) ? f.text(8) : std::string(f.pick(1200), "= \nx"[f.pick(4)]));
    return s;
}

// A line of the daemon's file (source 0) or of the system defaults (1).
void model_parse(int source, const std::string& line) {
    std::string s = line.substr(0, std::min(line.find('\0'), size_t{254}));
    size_t eq = s.find('=');
    if (eq == std::string::npos || eq == 0 || eq + 1 == s.size()) return;
    std::string key = fuzz_skip_spaces(fuzz_trimmed(s.substr(0, eq)));
    std::string value = fuzz_skip_spaces(fuzz_trimmed(s.substr(eq + 1)));
    if (source == 1) {
        if (key == KEYS[7]) value = value == "true" ? "1" : "0";
        key = key == KEYS[7] ? KEYS[0] : key == KEYS[8] ? KEYS[2] : key == KEYS[9] ? KEYS[1] : "";
    }
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++)
        if (key == KEYS[i] && value.size() < CONFIG_FIELD_LEN) values[i] = value;
}

// A file is read in pieces of at most 1022 characters; a piece holding a NUL byte is skipped.
void model_read(int source, const std::string& content) {
    for (size_t pos = 0, len; pos < content.size(); pos += len) {
        size_t end = content.find('\n', pos);
        len = std::min(end == std::string::npos ? content.size() - pos : end - pos + 1, size_t{1022});
        if (content.substr(pos, len).find('\0') == std::string::npos) model_parse(source, content.substr(pos, len));
    }
}

void reset() {
    config_set_defaults(&cache);
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) values[i] = cache.items[i].value;
}

const char* check_cache() {
    for (int i = 0; i < CONFIG_ITEM_COUNT; i++) {
        if (strnlen(cache.items[i].value, CONFIG_FIELD_LEN) == CONFIG_FIELD_LEN) return "value not terminated";
        if (strcmp(cache.items[i].key, KEYS[i]) != 0) return "a key changed";
        if (values[i] != cache.items[i].value) return "value differs from the model";
    }
    return nullptr;
}

const char* one_round(Fuzz& f) {
    if (f.round == 0) config_init(&cache), reset();
    f.input = line(f);
    // Guard bytes behind the string catch a write past it.
    std::string c_string = f.input.substr(0, f.input.find('\0'));
    std::vector<char> buf(c_string.begin(), c_string.end());
    buf.insert(buf.end(), {'\0', '#', '#', '#', '#'});
    char* trimmed = trim(buf.data());
    if (trimmed < buf.data() || trimmed > buf.data() + c_string.size() ||
        trimmed != fuzz_skip_spaces(fuzz_trimmed(c_string)))
        return "trim differs from the model";
    if (std::string(buf.end() - 4, buf.end()) != "####") return "trim wrote past the string";

    if (f.pick(16) == 0) reset();
    cache.source = static_cast<int>(f.pick(2));
    model_parse(cache.source, f.input);
    config_parse_line(&cache, f.input.c_str());
    if (const char* failed = check_cache()) return failed;

    if (f.round % 64 != 0) return nullptr;
    // A whole file of such lines, as either file.
    f.input.clear();
    for (size_t n = f.pick(40); n > 0; n--) f.input += line(f);
    int source = static_cast<int>(f.pick(2));
    const char* path = source == 0 ? CONFIG_FILE : SYSTEM_DEFAULTS_FILE;
    if (!(std::ofstream(path, std::ios::binary) << f.input)) return "cannot write the file";
    reset();
    model_read(source, f.input);
    if (config_read_file(&cache, path) != 1 || cache.source != source) return "file not read as its kind";
    return check_cache();
}

}  // namespace

int main(int argc, char** argv) { return fuzz_main("config_parse_fuzz", argc, argv, 0x7a7101, 30000, one_round); }
