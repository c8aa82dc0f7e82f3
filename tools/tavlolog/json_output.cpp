// JSON Lines: one object per entry, the same fields in the same order on
// every line, null where an entry has no value. README lists the fields.
#include <cstring>

#include "tools/tavlolog/line_parse.h"
#include "tools/tavlolog/output.h"
#include "tools/tavlolog/text_scan.h"

namespace tavlolog {

namespace {

// A JSON string; bytes that are not UTF-8 become \u00NN (their value kept).
// At most six bytes for each of s, the quotes, and 16 of room beyond.
char* put_string(char* w, std::string_view s) {
    static const char kHex[] = "0123456789abcdef";
    *w++ = '"';
    const unsigned char* p = reinterpret_cast<const unsigned char*>(s.data());
    const unsigned char* end = p + s.size();
    while (p < end) {
        p = copy_plain(w, p, end, true);
        if (p == end) break;
        unsigned char c = *p;
        if (c >= 0x80) {
            int more = c >= 0xf0 && c < 0xf5 ? 3 : c >= 0xe0 && c < 0xf0 ? 2 : c >= 0xc2 && c < 0xe0 ? 1 : -1;
            bool whole = more > 0 && end - p > more;
            for (int i = 1; whole && i <= more; i++) whole = (p[i] & 0xc0) == 0x80;
            if (whole) {
                for (int i = 0; i <= more; i++) *w++ = static_cast<char>(*p++);
                continue;
            }
        }
        *w++ = '\\';
        if (c == '"' || c == '\\') {
            *w++ = static_cast<char>(c);
        } else if (c == '\n') {
            *w++ = 'n';
        } else if (c == '\t') {
            *w++ = 't';
        } else {
            w[0] = 'u';
            w[1] = '0';
            w[2] = '0';
            w[3] = kHex[c >> 4];
            w[4] = kHex[c & 15];
            w += 5;
        }
        p++;
    }
    *w++ = '"';
    return w;
}

template <size_t N>
char* put(char* w, const char (&text)[N]) {
    memcpy(w, text, N - 1);
    return w + N - 1;
}

// A field's text written out once: kept with room beyond it, so that a short
// one is copied in one fixed block (the output has the room too).
class Written {
  public:
    static constexpr size_t kBlock = 64;
    void set(const std::string& text) {
        text_ = text;
        size_ = text.size();
        text_.append(kBlock, '\0');
    }
    size_t size() const { return size_; }
    char* put(char* w) const {
        if (size_ <= kBlock)
            memcpy(w, text_.data(), kBlock);
        else
            memcpy(w, text_.data(), size_);
        return w + size_;
    }

  private:
    std::string text_;
    size_t size_ = 0;
};

// Names of files differ mostly in their length or their last byte (the generation).
bool same(std::string_view a, const std::string& b) {
    if (a.size() != b.size()) return false;
    if (a.empty()) return true;
    return a.back() == b.back() && memcmp(a.data(), b.data(), a.size()) == 0;
}

class JsonOutput : public Sink {
  public:
    explicit JsonOutput(FILE* out) : out_(out) {
        for (int p = PRIO_NONE; p <= PRIO_VERBOSE; p++) {
            priority_[p + 1].set(p == PRIO_NONE ? std::string(",\"priority\":null,\"priority_name\":null")
                                                : ",\"priority\":" + std::to_string(p) + ",\"priority_name\":\"" +
                                                      priority_name(p) + "\"");
        }
        for (int s = 0; s < SRC_COUNT; s++)
            source_[s].set(std::string(",\"source\":\"") + source_name(static_cast<Source>(s)) + "\"");
        for (int k = KIND_LINE; k <= KIND_MALFORMED; k++)
            kind_[k].set(std::string(",\"kind\":\"") + kind_name(static_cast<Kind>(k)) + "\",\"file\":");
        for (FileName& f : files_) f.text.set("\"\"");
    }

    // A section's entries name its texts from one place; another section
    // may have others at the same place.
    void section(const SectionInfo&) override { fresh_ = true; }

    void entry(const Entry& e) override {
        // The lanes take turns: a few files' names kept written out.
        const Written* file = nullptr;
        for (size_t i = 0; i < kFiles && file == nullptr; i++)
            if (same(e.file, files_[i].name)) file = &files_[i].text;
        if (file == nullptr) {
            FileName& f = files_[next_file_++ % kFiles];
            f.name.assign(e.file.data(), e.file.size());
            f.text.set(escaped(e.file));
            file = &f.text;
        }
        if (fresh_ || e.run.data() != run_ || e.run.size() != run_size_ || e.boot_name.data() != boot_name_ ||
            e.boot_name.size() != boot_name_size_ || e.boot != boot_) {
            fresh_ = false;
            run_ = e.run.data();
            run_size_ = e.run.size();
            boot_name_ = e.boot_name.data();
            boot_name_size_ = e.boot_name.size();
            boot_ = e.boot;
            tail_.set(",\"boot\":" + std::to_string(e.boot) + ",\"boot_name\":" +
                      escaped(e.boot_name.empty() ? std::string_view("run") : e.boot_name) +
                      ",\"run\":" + escaped(e.run) + "}\n");
        }
        // The longest form: the fixed fields, every byte of tag and message
        // escaped, and the room the copies may write beyond.
        char* w = out_.reserve(512 + file->size() + tail_.size() + 6 * (e.tag.size() + e.message.size()));
        w = put(w, "{\"time\":");
        if (e.has_instant) {
            *w++ = '"';
            w = time_.local(w, e.instant_ns, e.utc_offset_s, 'T', 9);
            int32_t off = e.utc_offset_s;
            if (off == 0) {
                *w++ = 'Z';
            } else {
                int a = off < 0 ? -off : off;
                *w++ = off < 0 ? '-' : '+';
                put_digits(w, static_cast<uint32_t>(a / 3600 % 100));
                w[2] = ':';
                put_digits(w + 3, static_cast<uint32_t>(a / 60 % 60));
                w += 5;
            }
            *w++ = '"';
        } else {
            w = put(w, "null");
        }
        w = e.inherited ? put(w, ",\"inherited\":true,\"uptime\":") : put(w, ",\"inherited\":false,\"uptime\":");
        if (e.uptime_ns >= 0) {
            w = put_number(w, e.uptime_ns / 1000000000);
            *w++ = '.';
            uint32_t f = static_cast<uint32_t>(e.uptime_ns % 1000000000);
            *w++ = static_cast<char>('0' + f / 100000000);
            f %= 100000000;
            put_digits(w, f / 1000000);
            put_digits(w + 2, f / 10000 % 100);
            put_digits(w + 4, f / 100 % 100);
            put_digits(w + 6, f % 100);
            w += 8;
        } else {
            w = put(w, "null");
        }
        w = source_[e.source < SRC_COUNT ? e.source : 0].put(w);
        w = priority_[e.priority >= PRIO_NONE && e.priority <= PRIO_VERBOSE ? e.priority + 1 : 0].put(w);
        w = put(w, ",\"pid\":");
        w = e.pid >= 0 ? put_number(w, e.pid) : put(w, "null");
        w = put(w, ",\"tid\":");
        w = e.tid >= 0 ? put_number(w, e.tid) : put(w, "null");
        w = put(w, ",\"tag\":");
        w = put_string(w, e.tag);
        w = put(w, ",\"message\":");
        w = put_string(w, e.message);
        w = kind_[e.kind <= KIND_MALFORMED ? e.kind : 0].put(w);
        w = file->put(w);
        w = put(w, ",\"offset\":");
        w = put_number(w, static_cast<int64_t>(e.offset));
        w = tail_.put(w);
        out_.commit(w);
    }

    void idle() override { out_.flush(); }

  private:
    static std::string escaped(std::string_view s) {
        std::string t(6 * s.size() + 32, '\0');
        t.resize(static_cast<size_t>(put_string(&t[0], s) - t.data()));
        return t;
    }

    OutBuffer out_;
    TimeFormat time_;
    Written priority_[PRIO_VERBOSE + 2], source_[SRC_COUNT], kind_[KIND_MALFORMED + 1];
    static constexpr size_t kFiles = 8;
    struct FileName {
        std::string name;
        Written text;
    } files_[kFiles];
    size_t next_file_ = 0;
    Written tail_;
    const char* run_ = nullptr;
    const char* boot_name_ = nullptr;
    size_t run_size_ = 0, boot_name_size_ = 0;
    int boot_ = 0;
    bool fresh_ = true;
};

}  // namespace

std::unique_ptr<Sink> make_json_output(FILE* out) { return std::unique_ptr<Sink>(new JsonOutput(out)); }

}  // namespace tavlolog
