// tavlolog's line parsers and its reading of a folder, fed mutated lines and
// junk: nothing read outside its input, every parsed field in range, every
// entry's offset inside its file.
#include <sys/stat.h>

#include <fstream>

#include "fuzz/fuzz_util.h"
#include "tools/tavlolog/line_parse.h"
#include "tools/tavlolog/timeline.h"
#include "tools/tavlolog/warnings.h"

using namespace tavlolog;

namespace {

const char* const kSeeds[] = {
    "01-01 00:00:01.000  100  101 I tag     : message",
    "2026-12-31 23:59:59.123456  1  2 W a b c : x: y",
    "--------- beginning of /dev/log/system",
    "<6>[   12.345678] kernel text",
    "<14>[0.5] x",
    "<3>no time",
    "TavloLog in Normal",
    "partTavloLog in Low Nand Storage, some or all boot(hbr) logs are NOT saved!!!",
    "-----timezone: Europe/Berlin",
};
const char kAlphabet[] = "0123456789 -:.<>[]IWEFDVtag\n\x01\xff";

bool inside(std::string_view part, const std::string& whole) {
    return part.empty() || (part.data() >= whole.data() && part.data() + part.size() <= whole.data() + whole.size());
}

std::string mutated(Fuzz& f) {
    std::string s = f.pick(4) == 0 ? f.text(80) : kSeeds[f.pick(sizeof(kSeeds) / sizeof(kSeeds[0]))];
    for (size_t n = f.pick(4); n > 0 && !s.empty(); n--) {
        size_t at = f.pick(s.size());
        switch (f.pick(3)) {
            case 0: s[at] = kAlphabet[f.pick(sizeof(kAlphabet) - 1)]; break;
            case 1: s.erase(at, f.pick(8)); break;
            default: s.insert(at, f.text(6, kAlphabet, sizeof(kAlphabet) - 1)); break;
        }
    }
    return s;
}

const char* parse_round(Fuzz& f) {
    f.input = mutated(f);
    // A copy of exactly the input's size: a read past it shows under the sanitizers.
    std::string line(f.input);
    ParsedLine p;
    if (parse_threadtime(line, &p) && p.kind == KIND_LINE) {
        if (p.month < 1 || p.month > 12 || p.day < 1 || p.day > 31 || p.hour > 23 || p.minute > 59 || p.second > 60)
            return "a threadtime field out of range";
        if (p.nanos < 0 || p.nanos > 999999999 || p.pid < 0 || p.tid < 0) return "a threadtime number out of range";
        if (!inside(p.tag, line) || !inside(p.message, line)) return "a threadtime view outside the line";
    }
    if (parse_kernel(line, &p)) {
        if (p.priority < 0 || p.priority > 7) return "a kernel priority out of range";
        if (!inside(p.message, line)) return "a kernel view outside the line";
    }
    size_t note = note_start(line);
    if (note != std::string_view::npos && note >= line.size()) return "a note starting past the line";
    std::string_view zone;
    if (parse_header(line, &zone) && !inside(zone, line)) return "a zone outside the line";
    return nullptr;
}

struct Check : Sink {
    std::string dir;
    const char* failed = nullptr;
    void entry(const Entry& e) override {
        struct stat st;
        std::string path = dir + std::string(e.file);
        if (stat(path.c_str(), &st) != 0) failed = "an entry names a file that is not there";
        else if (e.offset > static_cast<uint64_t>(st.st_size)) failed = "an entry's offset lies past its file";
    }
};

const char* folder_round(Fuzz& f) {
    static const std::string dir = [] {
        char tmpl[] = "/tmp/tavlolog_fuzz.XXXXXX";
        std::string d = std::string(mkdtemp(tmpl)) + "/APLog_2026_0101_000000/";
        mkdir(d.c_str(), 0755);
        return d;
    }();
    static const char* const names[] = {"main_log", "main_log.1", "kernel_log", "bt_log", "radio_log.hbr"};
    for (const char* name : names) {
        std::string content;
        for (size_t n = f.pick(6); n > 0; n--) content += mutated(f) + (f.pick(5) ? "\n" : "");
        f.input += std::string(name) + ":" + content + "|";
        std::ofstream(dir + name, std::ios::binary | std::ios::trunc) << content;
    }
    Check check;
    check.dir = dir;
    Filter all;
    read_timeline({dir}, all, &check);
    return check.failed;
}

const char* round(Fuzz& f) { return f.round % 10 == 9 ? folder_round(f) : parse_round(f); }

}  // namespace

int main(int argc, char** argv) {
    set_warnings_quiet(true);
    return fuzz_main("tavlolog_lines_fuzz", argc, argv, 20260101, 20000, round);
}
