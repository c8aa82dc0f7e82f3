// The terminal's view: one line per entry, "instant source priority pid tid
// tag: message", control bytes shown escaped so that no log can drive the
// terminal, colour by priority when asked.
#include <cstring>

#include "tools/tavlolog/output.h"
#include "tools/tavlolog/text_scan.h"

namespace tavlolog {

namespace {

constexpr int kTimeWidth = 26;

// Writes s with control bytes and broken UTF-8 shown as \xNN (at most four
// bytes for each of s, and 16 of room beyond).
char* put_escaped(char* w, std::string_view s) {
    const unsigned char* p = reinterpret_cast<const unsigned char*>(s.data());
    const unsigned char* end = p + s.size();
    static const char kHex[] = "0123456789abcdef";
    while (p < end) {
        p = copy_plain(w, p, end, false);
        if (p == end) break;
        unsigned char c = *p;
        int more = c >= 0xf0 && c < 0xf5 ? 3 : c >= 0xe0 && c < 0xf0 ? 2 : c >= 0xc2 && c < 0xe0 ? 1 : -1;
        bool whole = more > 0 && end - p > more;
        for (int i = 1; whole && i <= more; i++) whole = (p[i] & 0xc0) == 0x80;
        if (whole || c == '\t') {
            int n = whole ? more + 1 : 1;
            for (int i = 0; i < n; i++) *w++ = static_cast<char>(*p++);
            continue;
        }
        w[0] = '\\';
        w[1] = 'x';
        w[2] = kHex[c >> 4];
        w[3] = kHex[c & 15];
        w += 4;
        p++;
    }
    return w;
}

template <size_t N>
char* put(char* w, const char (&text)[N]) {
    memcpy(w, text, N - 1);
    return w + N - 1;
}

char* put(char* w, const char* text) {
    size_t n = strlen(text);
    memcpy(w, text, n);
    return w + n;
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
        std::string t = "-- ";
        if (s.boot == 0)
            t += "run " + s.run;
        else
            t += "held boot " + std::to_string(s.boot) + " \"" + s.name + "\" of " + s.run;
        t += " --\n";
        out_.append(t);
    }

    void entry(const Entry& e) override {
        // The longest form: colours, time, columns, the file, every byte escaped,
        // and the room a copy may write beyond.
        char* w = out_.reserve(256 + e.file.size() + 4 * (e.tag.size() + e.message.size()));
        const char* colour = colour_ ? colour_of(e) : nullptr;
        if (colour != nullptr) w = put(w, colour);
        if (e.has_instant) {
            w = time_.local(w, e.instant_ns, e.utc_offset_s, ' ', 6);
        } else if (e.source == SRC_KERNEL && (e.uptime_ns >= 0 || (e.inherited && e.instant_ns > 0))) {
            int64_t up = e.uptime_ns >= 0 ? e.uptime_ns : e.instant_ns;
            char text[48];
            int n = snprintf(text, sizeof(text), "boot +%lld.%06lld", static_cast<long long>(up / 1000000000),
                             static_cast<long long>(up % 1000000000 / 1000));
            memcpy(w, text, static_cast<size_t>(n));
            w += n;
            for (; n < kTimeWidth; n++) *w++ = ' ';
        } else {
            memset(w, ' ', kTimeWidth);
            w += kTimeWidth;
        }
        w[0] = ' ';
        w[1] = SOURCE_LETTER[e.source];
        w[2] = ' ';
        w[3] = e.priority == PRIO_NONE ? '-' : e.source == SRC_KERNEL ? static_cast<char>('0' + e.priority)
                                                                        : priority_letter(e.priority);
        w[4] = ' ';
        w += 5;
        if (e.pid >= 0) {
            w = put_number(w, e.pid, 5);
            *w++ = ' ';
            w = put_number(w, e.tid, 5);
            *w++ = ' ';
        }
        switch (e.kind) {
            case KIND_LINE:
                if (e.source != SRC_KERNEL && e.source != SRC_BT) {
                    w = put_escaped(w, e.tag);
                    w = put(w, ": ");
                }
                break;
            case KIND_NOTE: w = put(w, "== "); break;
            case KIND_MALFORMED:
            case KIND_HEX:
                w = e.kind == KIND_HEX ? put(w, "[") : put(w, "[malformed ");
                memcpy(w, e.file.data(), e.file.size());
                w += e.file.size();
                *w++ = '@';
                w = put_number(w, static_cast<int64_t>(e.offset));
                w = put(w, "] ");
                break;
            default: break;
        }
        w = put_escaped(w, e.message);
        if (colour != nullptr) w = put(w, "\033[0m");
        *w++ = '\n';
        out_.commit(w);
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
