// JSON Lines: one object per entry, the same fields in the same order on
// every line, null where an entry has no value. README lists the fields.
#include <cstring>

#include "tools/tavlolog/line_parse.h"
#include "tools/tavlolog/output.h"
#include "tools/tavlolog/text_scan.h"

namespace tavlolog {

namespace {

// A JSON string; bytes that are not UTF-8 become \u00NN (their value kept).
void append_string(std::string& out, std::string_view s) {
    static const char kHex[] = "0123456789abcdef";
    out += '"';
    const unsigned char* p = reinterpret_cast<const unsigned char*>(s.data());
    const unsigned char* end = p + s.size();
    const unsigned char* plain = p;
    while (p < end) {
        p = plain_until(p, end, true);
        if (p == end) break;
        unsigned char c = *p;
        if (c >= 0x80) {
            int more = c >= 0xf0 && c < 0xf5 ? 3 : c >= 0xe0 && c < 0xf0 ? 2 : c >= 0xc2 && c < 0xe0 ? 1 : -1;
            bool whole = more > 0 && end - p > more;
            for (int i = 1; whole && i <= more; i++) whole = (p[i] & 0xc0) == 0x80;
            if (whole) {
                p += more + 1;
                continue;
            }
        }
        out.append(reinterpret_cast<const char*>(plain), static_cast<size_t>(p - plain));
        if (c == '"' || c == '\\') {
            out += '\\';
            out += static_cast<char>(c);
        } else if (c == '\n') {
            out += "\\n";
        } else if (c == '\t') {
            out += "\\t";
        } else {
            char esc[6] = {'\\', 'u', '0', '0', kHex[c >> 4], kHex[c & 15]};
            out.append(esc, 6);
        }
        plain = ++p;
    }
    out.append(reinterpret_cast<const char*>(plain), static_cast<size_t>(end - plain));
    out += '"';
}

class JsonOutput : public Sink {
  public:
    explicit JsonOutput(FILE* out) : out_(out) {}

    void entry(const Entry& e) override {
        std::string& t = out_.text();
        t += "{\"time\":";
        if (e.has_instant) {
            t += '"';
            time_.local(t, e.instant_ns, e.utc_offset_s, 'T', 9);
            int32_t off = e.utc_offset_s;
            if (off == 0) {
                t += 'Z';
            } else {
                char zone[8];
                int a = off < 0 ? -off : off;
                snprintf(zone, sizeof(zone), "%c%02d:%02d", off < 0 ? '-' : '+', a / 3600 % 100, a / 60 % 60);
                t += zone;
            }
            t += '"';
        } else {
            t += "null";
        }
        t += ",\"inherited\":";
        t += e.inherited ? "true" : "false";
        t += ",\"uptime\":";
        if (e.uptime_ns >= 0) {
            append_number(t, e.uptime_ns / 1000000000);
            t += '.';
            char frac[9];
            int64_t f = e.uptime_ns % 1000000000;
            for (int i = 8; i >= 0; i--, f /= 10) frac[i] = static_cast<char>('0' + f % 10);
            t.append(frac, 9);
        } else {
            t += "null";
        }
        t += ",\"source\":\"";
        t += source_name(e.source);
        t += "\",\"priority\":";
        if (e.priority == PRIO_NONE) {
            t += "null,\"priority_name\":null";
        } else {
            append_number(t, e.priority);
            t += ",\"priority_name\":\"";
            t += priority_name(e.priority);
            t += '"';
        }
        t += ",\"pid\":";
        if (e.pid >= 0) append_number(t, e.pid); else t += "null";
        t += ",\"tid\":";
        if (e.tid >= 0) append_number(t, e.tid); else t += "null";
        t += ",\"tag\":";
        append_string(t, e.tag);
        t += ",\"message\":";
        append_string(t, e.message);
        t += ",\"kind\":\"";
        t += kind_name(e.kind);
        t += "\",\"file\":";
        append_string(t, e.file);
        t += ",\"offset\":";
        append_number(t, static_cast<int64_t>(e.offset));
        t += ",\"boot\":";
        append_number(t, e.boot);
        t += ",\"boot_name\":";
        append_string(t, e.boot_name.empty() ? std::string_view("run") : e.boot_name);
        t += ",\"run\":";
        append_string(t, e.run);
        t += "}\n";
        out_.maybe_flush();
    }

    void idle() override { out_.flush(); }

  private:
    OutBuffer out_;
    TimeFormat time_;
};

}  // namespace

std::unique_ptr<Sink> make_json_output(FILE* out) { return std::unique_ptr<Sink>(new JsonOutput(out)); }

}  // namespace tavlolog
