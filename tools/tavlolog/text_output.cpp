// The terminal's view: one line per entry, "instant source priority pid tid
// tag: message", control bytes shown escaped so that no log can drive the
// terminal, colour by priority when asked.
#include <cstring>

#include "tools/tavlolog/output.h"
#include "tools/tavlolog/text_scan.h"

namespace tavlolog {

namespace {

constexpr int kTimeWidth = 26;

// Appends s with control bytes and broken UTF-8 shown as \xNN.
void append_escaped(std::string& out, std::string_view s) {
    const unsigned char* p = reinterpret_cast<const unsigned char*>(s.data());
    const unsigned char* end = p + s.size();
    const unsigned char* plain = p;
    static const char kHex[] = "0123456789abcdef";
    while (p < end) {
        p = plain_until(p, end, false);
        if (p == end) break;
        unsigned char c = *p;
        int more = c >= 0xf0 && c < 0xf5 ? 3 : c >= 0xe0 && c < 0xf0 ? 2 : c >= 0xc2 && c < 0xe0 ? 1 : -1;
        bool whole = more > 0 && end - p > more;
        for (int i = 1; whole && i <= more; i++) whole = (p[i] & 0xc0) == 0x80;
        if (whole || c == '\t') {
            p += whole ? more + 1 : 1;
            continue;
        }
        out.append(reinterpret_cast<const char*>(plain), static_cast<size_t>(p - plain));
        char esc[4] = {'\\', 'x', kHex[c >> 4], kHex[c & 15]};
        out.append(esc, 4);
        plain = ++p;
    }
    out.append(reinterpret_cast<const char*>(plain), static_cast<size_t>(end - plain));
}

const char* colour_of(const Entry& e) {
    switch (e.kind) {
        case KIND_MARKER:
        case KIND_NOTE: return "\033[36m";
        case KIND_MALFORMED:
        case KIND_HEX: return "\033[35m";
        default: break;
    }
    if (e.priority == PRIO_NONE) return nullptr;
    if (e.priority <= 2) return "\033[1;31m";
    if (e.priority == 3) return "\033[31m";
    if (e.priority == 4) return "\033[33m";
    if (e.priority == 5) return "\033[1m";
    if (e.priority >= 7) return "\033[2m";
    return nullptr;
}

class TextOutput : public Sink {
  public:
    TextOutput(FILE* out, bool colour) : out_(out), colour_(colour) {}

    void section(const SectionInfo& s) override {
        std::string& t = out_.text();
        t += "-- ";
        if (s.boot == 0)
            t += "run " + s.run;
        else
            t += "held boot " + std::to_string(s.boot) + " \"" + s.name + "\" of " + s.run;
        t += " --\n";
    }

    void entry(const Entry& e) override {
        std::string& t = out_.text();
        const char* colour = colour_ ? colour_of(e) : nullptr;
        if (colour != nullptr) t += colour;
        if (e.has_instant) {
            time_.local(t, e.instant_ns, e.utc_offset_s, ' ', 6);
        } else if (e.source == SRC_KERNEL && (e.uptime_ns >= 0 || (e.inherited && e.instant_ns > 0))) {
            int64_t up = e.uptime_ns >= 0 ? e.uptime_ns : e.instant_ns;
            char text[48];
            int n = snprintf(text, sizeof(text), "boot +%lld.%06lld", static_cast<long long>(up / 1000000000),
                             static_cast<long long>(up % 1000000000 / 1000));
            t.append(text, static_cast<size_t>(n));
            if (n < kTimeWidth) t.append(static_cast<size_t>(kTimeWidth - n), ' ');
        } else {
            t.append(kTimeWidth, ' ');
        }
        t += ' ';
        t += SOURCE_LETTER[e.source];
        t += ' ';
        t += e.priority == PRIO_NONE ? '-' : e.source == SRC_KERNEL ? static_cast<char>('0' + e.priority)
                                                                      : priority_letter(e.priority);
        t += ' ';
        if (e.pid >= 0) {
            append_number(t, e.pid, 5);
            t += ' ';
            append_number(t, e.tid, 5);
            t += ' ';
        }
        switch (e.kind) {
            case KIND_LINE:
                if (e.source != SRC_KERNEL && e.source != SRC_BT) {
                    append_escaped(t, e.tag);
                    t += ": ";
                }
                break;
            case KIND_NOTE: t += "== "; break;
            case KIND_MALFORMED:
            case KIND_HEX:
                t += e.kind == KIND_HEX ? "[" : "[malformed ";
                t.append(e.file.data(), e.file.size());
                t += '@';
                append_number(t, static_cast<int64_t>(e.offset));
                t += "] ";
                break;
            default: break;
        }
        append_escaped(t, e.message);
        if (colour != nullptr) t += "\033[0m";
        t += '\n';
        out_.maybe_flush();
    }

    void idle() override { out_.flush(); }

  private:
    OutBuffer out_;
    bool colour_;
    TimeFormat time_;
};

}  // namespace

std::unique_ptr<Sink> make_text_output(FILE* out, bool colour) {
    return std::unique_ptr<Sink>(new TextOutput(out, colour));
}

}  // namespace tavlolog
