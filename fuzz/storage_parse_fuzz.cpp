// Syntax-heavy bytes through the dump list and folder record parsers, checked
// against small models; parsed records are also written and read back.
#include <limits.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "fuzz/fuzz_util.h"
#include "storage/debug_dump.h"
#include "storage/folder_records.h"

namespace {

// The lines of text (with their line feed when keep_feed), empty when longer
// than 254 bytes, each read up to a NUL.
std::vector<std::string> lines(const std::string& text, bool keep_feed) {
    std::vector<std::string> out;
    for (size_t pos = 0; pos < text.size();) {
        size_t end = std::min(text.find('\n', pos), text.size());
        size_t len = end - pos + (keep_feed && end < text.size() ? 1 : 0);
        out.push_back(len > 254 ? std::string() : text.substr(pos, len).substr(0, text.substr(pos, len).find('\0')));
        pos = end + 1;
    }
    return out;
}

bool plain_name(const std::string& n) { return !n.empty() && n.find('/') == std::string::npos && n != "." && n != ".."; }

// Not comments, split at spaces, output names that are one file name and fit, kinds as written;
// last line first.
std::vector<std::string> dump_model(const std::string& text, const std::string& run) {
    std::vector<std::string> out;
    for (const std::string& line : lines(text, false)) {
        std::vector<std::string> f;
        for (size_t at = 0; at < line.size() && line[0] != '#';) {
            size_t next = std::min(line.find(' ', at), line.size());
            if (next > at && f.size() < 3) f.push_back(line.substr(at, next - at));
            at = next + 1;
        }
        std::string name = f.size() > 1 ? f[1] : "properties";
        if (!f.empty() && plain_name(name) && run.size() + name.size() <= 254)
            out.insert(out.begin(), f[0] + ">" + run + name + (f.size() > 2 && f[2] == "sys_prop" ? "P" : "F"));
    }
    return out;
}

// A plain name before the first space, the size as a count of KiB after it.
std::vector<std::string> records_model(const std::string& text) {
    std::vector<std::string> out;
    for (const std::string& line : lines(text, true)) {
        size_t space = line.find(' ');
        if (space == std::string::npos || !plain_name(line.substr(0, space))) continue;
        long size = strtol(line.c_str() + space + 1, nullptr, 10);
        out.push_back(line.substr(0, space) + " " + std::to_string(size < 0 ? 0 : size > INT_MAX ? INT_MAX : size));
    }
    return out;
}

std::vector<std::string> records_of(FolderRecord* list) {
    std::vector<std::string> out;
    for (FolderRecord* r = list; r != nullptr; r = r->next) out.push_back(std::string(r->name) + " " + std::to_string(r->size_kb));
    free_folder_records(list);
    return out;
}

const char* one_round(Fuzz& f) {
    static const std::string pieces[] = {" ", "  ", "\n", "#", "/src", "out", "sys_prop", "SYS_PROP", "..", "/", ".",
                                         std::string(1, '\0'), "APLog_2026_0304_070649", "-7", "99999999999"};
    if (f.round == 0) mkdir("/data/misc", 0771);
    for (size_t n = f.pick(80); n > 0; n--) {
        size_t k = f.pick(8);
        f.input += k == 0 ? std::string(f.pick(300), "sx /1"[f.pick(5)]) : k == 1 ? f.bytes(1) : pieces[f.pick(15)];
    }
    const std::string& text = f.input;
    std::string run = "/mnt/sdcard/" + std::string(f.pick(250), 'r') + "/";
    std::vector<std::string> entries;
    DumpEntry* list = parse_dump_list_text(text.data(), text.size(), "/mnt/sdcard", run.c_str());
    for (DumpEntry* e = list; e != nullptr; e = e->next)
        entries.push_back(std::string(e->source) + ">" + e->output + (e->dumper == dump_properties ? "P" : "F"));
    free_dump_list(list);
    if (entries != dump_model(text, run)) return "dump list differs from the model";

    FolderRecord* records = parse_folder_records(text.data(), text.size());
    bool written = f.round % 16 == 0 && write_folder_records(records, "NEW", 1) == 1;
    std::vector<std::string> got = records_of(records), expected = records_model(text);
    if (got != expected) return "folder records differ from the model";
    if (!written) return nullptr;
    // Each record comes back, but one whose rewritten line outgrew what the
    // reader takes (an empty size written as "0"): it is dropped as any such line.
    expected.clear();
    for (const std::string& r : got)
        if (r.size() + 1 <= 254) expected.push_back(r);
    expected.push_back("NEW 0");
    return records_of(read_folder_records(1)) == expected ? nullptr : "folder records not read back as written";
}

}  // namespace

int main(int argc, char** argv) { return fuzz_main("storage_parse_fuzz", argc, argv, 0xd0f11e, 5000, one_round); }
