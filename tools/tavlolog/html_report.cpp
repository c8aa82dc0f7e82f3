// The report is one HTML page: the page and its script first, then the
// entries, written as they arrive so that memory stays bounded whatever the
// run's size. The entries go in chunks of a few thousand through one raw
// deflate stream; its output is cut into data scripts Z("base-64"), which the
// page inflates with the browser's DecompressionStream while it still parses
// the rest. The browser thus parses less than half the bytes, and the data
// scripts hold nothing but base-64 digits, whatever the apps wrote.
//
// A chunk, once inflated, is one line "N TAGS FILES BOOTS BYTES", then BYTES
// of UTF-8: the entries' numbers as base-64 VLQ values (deltas where they are
// close to the previous entry's), a line feed, the tags, file names and boot
// names first used in the chunk one per line, then the N messages separated by
// line feeds (no text holds one: it is made visible first). report.js decodes
// the same way.
#include "tools/tavlolog/html_report.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <zlib.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string>
#include <unordered_map>

#include "tools/tavlolog/report_assets.h"
#include "tools/tavlolog/report_text.h"

namespace tavlolog {
namespace {

// A chunk is written once it holds this many entries or message bytes.
constexpr unsigned CHUNK_ENTRIES = 4096;
constexpr size_t CHUNK_BYTES = 512 * 1024;
// Deflate's output is written as one data script each time this much is ready.
constexpr size_t PIECE_BYTES = 96 * 1024;
// Level 1 packs the entries to about a third at a third of the default
// level's time; the default saves only a sixth more.
constexpr int DEFLATE_LEVEL = 1;
// Distinct tags remembered; past that the table starts again, and a tag seen
// before gets a second number (the page compares tags by text).
constexpr size_t TAG_MEMORY = 1 << 16;

// Flags of an entry's extension value, beside its kind in the low 3 bits.
constexpr unsigned EXT_NO_INSTANT = 1 << 3;
constexpr unsigned EXT_FILE = 1 << 4;  // the source moved to another file
constexpr unsigned EXT_BOOT = 1 << 5;  // another boot section starts
constexpr unsigned EXT_ZONE = 1 << 6;  // another zone offset
constexpr unsigned EXT_UNTIMED = 1 << 7;  // no time at all: no time value follows

constexpr char DIGITS[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

// Low 5 bits per digit first, bit 5 set on every digit but the last.
void put_vlq(std::string& out, uint64_t v) {
    while (v >= 32) {
        out += DIGITS[32 | (v & 31)];
        v >>= 5;
    }
    out += DIGITS[v];
}

void put_signed(std::string& out, int64_t v) {
    put_vlq(out, (static_cast<uint64_t>(v) << 1) ^ static_cast<uint64_t>(v >> 63));
}

// Microseconds, rounded down also before the epoch or boot.
int64_t to_us(int64_t ns) { return ns / 1000 - (ns % 1000 < 0 ? 1 : 0); }

void put_base64(std::string& out, const unsigned char* p, size_t n) {
    for (; n >= 3; p += 3, n -= 3) {
        const uint32_t v = static_cast<uint32_t>(p[0]) << 16 | p[1] << 8 | p[2];
        out += DIGITS[v >> 18];
        out += DIGITS[(v >> 12) & 63];
        out += DIGITS[(v >> 6) & 63];
        out += DIGITS[v & 63];
    }
    if (n > 0) {
        const uint32_t v = static_cast<uint32_t>(p[0]) << 16 | (n > 1 ? p[1] << 8 : 0);
        out += DIGITS[v >> 18];
        out += DIGITS[(v >> 12) & 63];
        out += n > 1 ? DIGITS[(v >> 6) & 63] : '=';
        out += '=';
    }
}

}  // namespace

struct HtmlReport::State {
    int fd = -1;
    std::string path;
    bool regular = false;  // only a regular file is removed when writing fails
    bool failed = false;
    int error = 0;
    const char* tail = nullptr;  // the page after the data
    uint64_t entries = 0;

    // The chunk being filled. The name lists are visible texts each ended by
    // a line feed, which no visible text holds.
    std::string cols, msgs, tag_names, file_names, boot_names;
    unsigned count = 0, new_tags = 0, new_files = 0, new_boots = 0;

    // What the previous entries left, as the page's decoder keeps it.
    int64_t last_us[2] = {0, 0};
    std::string file_of[SRC_COUNT];
    bool file_set[SRC_COUNT] = {};
    uint64_t offset_of[SRC_COUNT] = {};
    bool started = false;
    int boot = 0;
    std::string boot_name;
    int32_t zone = 0;
    std::unordered_map<std::string, uint32_t> tags;
    uint32_t tag_count = 0;

    z_stream zs{};
    bool deflating = false;
    std::string chunk;                       // a chunk's bytes on their way into deflate
    unsigned char piece[PIECE_BYTES];        // deflate's output not yet written
    std::string out;                         // bytes on their way to the file

    ~State() {
        if (deflating) deflateEnd(&zs);
    }

    void write_out() {
        for (size_t done = 0; done < out.size() && !failed;) {
            const ssize_t n = ::write(fd, out.data() + done, out.size() - done);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) {
                failed = true;
                error = n < 0 ? errno : EIO;
                break;
            }
            done += static_cast<size_t>(n);
        }
        out.clear();
    }

    // Writes what deflate made of the piece so far as one data script.
    void write_piece() {
        const size_t n = PIECE_BYTES - zs.avail_out;
        if (n == 0) return;
        out += "<script>Z(\"";
        put_base64(out, piece, n);
        out += "\")</script>\n";
        write_out();
        zs.next_out = piece;
        zs.avail_out = PIECE_BYTES;
    }

    // Feeds BYTES (or, with Z_FINISH, the end of the stream) to deflate.
    void deflate_bytes(const std::string& bytes, int flush) {
        zs.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));
        zs.avail_in = static_cast<uInt>(bytes.size());
        for (;;) {
            const int rc = deflate(&zs, flush);
            if (rc == Z_STREAM_ERROR) {
                failed = true;
                error = EIO;
                return;
            }
            if (zs.avail_out == 0) {
                write_piece();
                continue;
            }
            if (flush != Z_FINISH || rc == Z_STREAM_END) break;
        }
        if (flush == Z_FINISH) write_piece();
    }

    void flush_chunk() {
        if (count == 0) return;
        chunk = std::to_string(count) + ' ' + std::to_string(new_tags) + ' ' + std::to_string(new_files) + ' ' +
                std::to_string(new_boots) + ' ' +
                std::to_string(cols.size() + 1 + tag_names.size() + file_names.size() + boot_names.size() +
                               msgs.size()) +
                '\n';
        chunk += cols;
        chunk += '\n';
        chunk += tag_names;
        chunk += file_names;
        chunk += boot_names;
        chunk += msgs;
        deflate_bytes(chunk, Z_NO_FLUSH);
        cols.clear();
        msgs.clear();
        tag_names.clear();
        file_names.clear();
        boot_names.clear();
        count = new_tags = new_files = new_boots = 0;
    }

    uint32_t tag_number(std::string_view tag) {
        auto found = tags.find(std::string(tag));
        if (found != tags.end()) return found->second;
        if (tags.size() >= TAG_MEMORY) tags.clear();
        tags.emplace(std::string(tag), tag_count);
        append_visible_text(tag_names, tag);
        tag_names += '\n';
        new_tags++;
        return tag_count++;
    }

    void add(const Entry& e);
};

void HtmlReport::State::add(const Entry& e) {
    const unsigned src = e.source < SRC_COUNT ? e.source : SRC_KERNEL;
    const int prio = std::clamp<int>(e.priority, PRIO_NONE, PRIO_VERBOSE);
    const unsigned kind = e.kind <= KIND_MALFORMED ? e.kind : KIND_MALFORMED;
    // Without an instant, a kernel line keeps its time since boot (its own, or
    // inherited from the line before it), as the terminal shows it; anything
    // else (Bluetooth bytes, a marker before the file's first timed line) has
    // no time to place it by.
    const bool since_boot =
        !e.has_instant && e.source == SRC_KERNEL && (e.uptime_ns >= 0 || (e.inherited && e.instant_ns > 0));
    unsigned ext = kind;
    if (!e.has_instant) ext |= since_boot ? EXT_NO_INSTANT : EXT_UNTIMED;
    if (!file_set[src] || e.file != file_of[src]) ext |= EXT_FILE;
    if (!started || e.boot != boot || e.boot_name != boot_name) ext |= EXT_BOOT;
    if (e.utc_offset_s != zone) ext |= EXT_ZONE;
    started = true;

    put_vlq(cols, (ext ? 1u : 0u) | src << 1 | static_cast<unsigned>(prio + 1) << 4);
    if (ext) put_vlq(cols, ext);
    if (!(ext & EXT_UNTIMED)) {
        const int64_t us = to_us(e.instant_ns);
        int64_t& last = last_us[e.has_instant ? 0 : 1];
        put_signed(cols, us - last);
        last = us;
    }
    const int64_t pid = e.pid < 0 ? -1 : e.pid;
    const int64_t tid = e.tid < 0 ? -1 : e.tid;
    put_vlq(cols, static_cast<uint64_t>(pid + 1));
    put_signed(cols, tid - pid);
    put_vlq(cols, tag_number(e.tag));
    if (ext & EXT_FILE) {
        file_of[src].assign(e.file);
        file_set[src] = true;
        offset_of[src] = 0;
        append_visible_text(file_names, e.file);
        file_names += '\n';
        new_files++;
    }
    put_signed(cols, static_cast<int64_t>(e.offset - offset_of[src]));
    offset_of[src] = e.offset;
    if (ext & EXT_BOOT) {
        boot = e.boot;
        boot_name.assign(e.boot_name);
        put_signed(cols, boot);
        append_visible_text(boot_names, e.boot_name);
        boot_names += '\n';
        new_boots++;
    }
    if (ext & EXT_ZONE) {
        zone = e.utc_offset_s;
        put_signed(cols, zone);
    }
    if (count) msgs += '\n';
    append_visible_text(msgs, e.message);
    entries++;
    if (++count >= CHUNK_ENTRIES || msgs.size() >= CHUNK_BYTES) flush_chunk();
}

HtmlReport::~HtmlReport() {
    // A report left open is finished: what was added is worth keeping.
    if (state_) close();
}

int HtmlReport::open(const char* path, const char* title) {
    if (state_) {
        errno = EBUSY;
        return -1;
    }
    const char* title_at = strstr(REPORT_HTML, "<!--TITLE-->");
    const char* script_at = strstr(REPORT_HTML, "<!--SCRIPT-->");
    const char* data_at = strstr(REPORT_HTML, "<!--DATA-->");
    if (!title_at || !script_at || !data_at) {
        errno = EINVAL;  // the built-in page lost a marker
        return -1;
    }
    State* s = new State;
    // Raw deflate (no zlib header): what the page's "deflate-raw" expects.
    if (deflateInit2(&s->zs, DEFLATE_LEVEL, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY) != Z_OK) {
        delete s;
        errno = ENOMEM;
        return -1;
    }
    s->deflating = true;
    s->zs.next_out = s->piece;
    s->zs.avail_out = PIECE_BYTES;
    const int fd = ::open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) {
        const int err = errno;
        delete s;
        errno = err;
        return -1;
    }
    state_ = s;
    state_->fd = fd;
    state_->path = path;
    struct stat st;
    state_->regular = fstat(fd, &st) == 0 && S_ISREG(st.st_mode);
    std::string& out = state_->out;
    out.append(REPORT_HTML, title_at);
    append_html_text(out, title ? title : "");
    out.append(title_at + strlen("<!--TITLE-->"), script_at);
    out += "<script>";
    out += REPORT_JS;
    out += "</script>";
    out.append(script_at + strlen("<!--SCRIPT-->"), data_at);
    state_->tail = data_at + strlen("<!--DATA-->");
    state_->write_out();
    return 0;
}

void HtmlReport::add(const Entry& entry) {
    if (state_ && !state_->failed) state_->add(entry);
}

int HtmlReport::close() {
    if (!state_) return 0;
    State* s = state_;
    state_ = nullptr;
    s->flush_chunk();
    if (!s->failed) s->deflate_bytes(std::string(), Z_FINISH);
    s->out += "<script>done(" + std::to_string(s->entries) + ")</script>\n";
    s->out += s->tail;
    s->write_out();
    bool ok = !s->failed;
    int err = s->error;
    if (::close(s->fd) != 0 && ok) {
        ok = false;
        err = errno;
    }
    if (!ok && s->regular) unlink(s->path.c_str());
    delete s;
    if (!ok) {
        errno = err;
        return -1;
    }
    return 0;
}

}  // namespace tavlolog
