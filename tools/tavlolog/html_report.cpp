// The report is one HTML page: the page and its script first, then the
// entries in data scripts of a few thousand each, written as they arrive, so
// memory stays bounded whatever the run's size. An entry's numbers are
// base-64 VLQ values (deltas where they are close to the previous entry's),
// its message one piece of its chunk's text; report.js decodes the same way.
#include "tools/tavlolog/html_report.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

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
// Distinct tags remembered; past that the table starts again, and a tag seen
// before gets a second number (the page compares tags by text).
constexpr size_t TAG_MEMORY = 1 << 16;

// Flags of an entry's extension value, beside its kind in the low 3 bits.
constexpr unsigned EXT_NO_INSTANT = 1 << 3;
constexpr unsigned EXT_FILE = 1 << 4;  // the source moved to another file
constexpr unsigned EXT_BOOT = 1 << 5;  // another boot section starts
constexpr unsigned EXT_ZONE = 1 << 6;  // another zone offset

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

// A JavaScript array literal of the strings.
void put_string_array(std::string& out, const std::string& joined, size_t count) {
    out += '[';
    size_t at = 0;
    for (size_t k = 0; k < count; k++) {
        const size_t end = joined.find('\0', at);
        if (k) out += ',';
        out += '"';
        out.append(joined, at, end - at);
        out += '"';
        at = end + 1;
    }
    out += ']';
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

    // The chunk being filled. The name lists are escaped texts each ended by
    // a NUL, which no escaped text holds.
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

    std::string out;  // bytes on their way to the file

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

    void flush_chunk() {
        if (count == 0) return;
        out += "<script>C(";
        out += std::to_string(count);
        out += ",\"";
        out += cols;
        out += "\",\"";
        out += msgs;
        out += "\",";
        put_string_array(out, tag_names, new_tags);
        out += ',';
        put_string_array(out, file_names, new_files);
        out += ',';
        put_string_array(out, boot_names, new_boots);
        out += ")</script>\n";
        write_out();
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
        append_js_text(tag_names, tag);
        tag_names += '\0';
        new_tags++;
        return tag_count++;
    }

    void add(const Entry& e);
};

void HtmlReport::State::add(const Entry& e) {
    const unsigned src = e.source < SRC_COUNT ? e.source : SRC_KERNEL;
    const int prio = std::clamp<int>(e.priority, PRIO_NONE, PRIO_VERBOSE);
    const unsigned kind = e.kind <= KIND_MALFORMED ? e.kind : KIND_MALFORMED;
    unsigned ext = kind;
    if (!e.has_instant) ext |= EXT_NO_INSTANT;
    if (!file_set[src] || e.file != file_of[src]) ext |= EXT_FILE;
    if (!started || e.boot != boot || e.boot_name != boot_name) ext |= EXT_BOOT;
    if (e.utc_offset_s != zone) ext |= EXT_ZONE;
    started = true;

    put_vlq(cols, (ext ? 1u : 0u) | src << 1 | static_cast<unsigned>(prio + 1) << 4);
    if (ext) put_vlq(cols, ext);
    const int64_t us = to_us(e.instant_ns);
    int64_t& last = last_us[e.has_instant ? 0 : 1];
    put_signed(cols, us - last);
    last = us;
    const int64_t pid = e.pid < 0 ? -1 : e.pid;
    const int64_t tid = e.tid < 0 ? -1 : e.tid;
    put_vlq(cols, static_cast<uint64_t>(pid + 1));
    put_signed(cols, tid - pid);
    put_vlq(cols, tag_number(e.tag));
    if (ext & EXT_FILE) {
        file_of[src].assign(e.file);
        file_set[src] = true;
        offset_of[src] = 0;
        append_js_text(file_names, e.file);
        file_names += '\0';
        new_files++;
    }
    put_signed(cols, static_cast<int64_t>(e.offset - offset_of[src]));
    offset_of[src] = e.offset;
    if (ext & EXT_BOOT) {
        boot = e.boot;
        boot_name.assign(e.boot_name);
        put_signed(cols, boot);
        append_js_text(boot_names, e.boot_name);
        boot_names += '\0';
        new_boots++;
    }
    if (ext & EXT_ZONE) {
        zone = e.utc_offset_s;
        put_signed(cols, zone);
    }
    if (count) msgs += "\\n";
    append_js_text(msgs, e.message);
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
    const int fd = ::open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) return -1;
    state_ = new State;
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
