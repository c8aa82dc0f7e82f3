#include "tools/tavlolog/lane.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <algorithm>
#include <cstring>

#include "tools/tavlolog/text_scan.h"
#include "tools/tavlolog/warnings.h"

namespace tavlolog {

namespace {

constexpr size_t kBtLine = 4096;  // Bluetooth bytes without a line feed: cut here
constexpr size_t kHexChunk = 32;  // bytes per counted hex chunk
constexpr int kGenerations = 4;

// Opens a piece for reading; -1 (warned) when it cannot be, or is not a file.
int open_piece_fd(const Piece& piece, ino_t* inode) {
    int fd = open(piece.path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    struct stat st;
    if (fd >= 0 && (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode))) {
        close(fd);
        fd = -1;
        errno = EINVAL;
    }
    if (fd < 0) {
        warn("%s cannot be read: %s", piece.path.c_str(), errno == EINVAL ? "not a regular file" : strerror(errno));
        return -1;
    }
    if (inode != nullptr) *inode = st.st_ino;
    return fd;
}

// Text a terminal shows as it is: printable ASCII, tabs and whole UTF-8 characters.
bool printable(std::string_view s) {
    const unsigned char* p = reinterpret_cast<const unsigned char*>(s.data());
    const unsigned char* end = p + s.size();
    while (p < end) {
        p = plain_until(p, end, false);
        if (p == end) break;
        unsigned char c = *p;
        if (c == '\t' || (c == '\r' && p + 1 == end)) {
            p++;
            continue;
        }
        int more = c >= 0xf0 && c < 0xf5 ? 3 : c >= 0xe0 ? 2 : c >= 0xc2 && c < 0xe0 ? 1 : -1;
        if (c >= 0xf5 || more < 0 || end - p <= more) return false;
        for (int i = 1; i <= more; i++)
            if ((p[i] & 0xc0) != 0x80) return false;
        p += more + 1;
    }
    return true;
}

int64_t floor_div(int64_t a, int64_t b) { return a >= 0 ? a / b : -((-a + b - 1) / b); }

}  // namespace

Lane::Lane(const LaneFiles& files, const LaneContext* context)
    : source_(files.source), context_(context), base_path_(files.base_path), buf_(new char[kWindow]) {
    zone_.reset(new Zone("GMT"));
    untimed_ = source_ == SRC_BT || (source_ == SRC_KERNEL && !context->has_boot_wallclock);
    // Only main_log merges two buffers; the other files are each one stream in order.
    reorders_ = source_ == SRC_MAIN;
    final_ = true;
    // Every piece is opened now: a rotation while the folder is read then
    // cannot make one piece be read twice or another be missed.
    for (const Piece& piece : files.pieces) {
        ino_t inode = 0;
        int fd = open_piece_fd(piece, &inode);
        if (fd < 0) continue;
        pieces_.push_back(piece);
        fds_.push_back(fd);
        inode_ = inode;
    }
    piece_ = 0;
}

Lane::~Lane() {
    for (int fd : fds_)
        if (fd >= 0) close(fd);
}

void Lane::follow() { final_ = base_path_.empty(); }

Lane::Read Lane::next_line(std::string_view* line, uint64_t* offset, const std::string** file) {
    char* buf = buf_.get();
    for (;;) {
        if (piece_ >= pieces_.size()) return NONE;
        size_t avail = end_ - pos_;
        size_t limit = source_ == SRC_BT && avail > kBtLine ? kBtLine : avail;
        char* nl = static_cast<char*>(memchr(buf + pos_, '\n', limit));
        *file = &pieces_[piece_].name;
        if (nl != nullptr || (source_ == SRC_BT && avail >= kBtLine)) {
            size_t len = nl != nullptr ? static_cast<size_t>(nl - (buf + pos_)) : kBtLine;
            *line = std::string_view(buf + pos_, len);
            *offset = buf_offset_ + pos_;
            pos_ += len + (nl != nullptr);
            return GOT;
        }
        if (pos_ == 0 && end_ == kWindow) {
            warn("%s: a line longer than %zu KiB at offset %llu is shown in pieces", pieces_[piece_].path.c_str(),
                 kWindow / 1024, static_cast<unsigned long long>(buf_offset_));
            *line = std::string_view(buf, end_);
            *offset = buf_offset_;
            pos_ = end_;
            return GOT;
        }
        if (pos_ > 0) {
            memmove(buf, buf + pos_, end_ - pos_);
            buf_offset_ += pos_;
            end_ -= pos_;
            pos_ = 0;
        }
        ssize_t n = read(fds_[piece_], buf + end_, kWindow - end_);
        if (n < 0 && errno == EINTR) continue;
        if (n > 0) {
            end_ += static_cast<size_t>(n);
            continue;
        }
        if (n < 0)
            warn("%s cannot be read at offset %llu: %s", pieces_[piece_].path.c_str(),
                 static_cast<unsigned long long>(buf_offset_ + end_), strerror(errno));
        bool last = piece_ + 1 >= pieces_.size();
        if (last && !final_) return NONE;  // following: the rest is still to come
        if (end_ > pos_) {
            if (!last) {
                // Cut by the rotation: the rest follows the next piece's header.
                carry_.assign(buf + pos_, end_ - pos_);
                carry_file_ = pieces_[piece_].name;
                carry_offset_ = buf_offset_ + pos_;
            } else {
                warn("%s ends inside a line (offset %llu)", pieces_[piece_].path.c_str(),
                     static_cast<unsigned long long>(buf_offset_ + pos_));
                *line = std::string_view(buf + pos_, end_ - pos_);
                *offset = buf_offset_ + pos_;
                pos_ = end_;
                return GOT;
            }
        }
        if (last) {
            if (carry_.empty()) return NONE;
            // A line cut before a piece that never came.
            joined_.swap(carry_);
            carry_.clear();
            *line = joined_;
            *offset = carry_offset_;
            *file = &carry_file_;
            return GOT;
        }
        close(fds_[piece_]);
        fds_[piece_] = -1;
        piece_++;
        pos_ = end_ = 0;
        buf_offset_ = 0;
    }
}

namespace {
// std::*_heap keep the greatest on top: the latest is the earliest instant.
struct Later {
    bool operator()(const Lane::Slot& a, const Lane::Slot& b) const {
        return a.key != b.key ? a.key > b.key : a.order > b.order;
    }
};
}  // namespace

bool Lane::next() {
    if (!reorders_) return read_one();
    static_assert((kReorderEntries & (kReorderEntries - 1)) == 0, "the ring's size is a power of two");
    constexpr size_t mask = kReorderEntries - 1;
    if (out_slot_ != UINT32_MAX) {
        // A rare long line gives its room back rather than keep it in a slot.
        if (held_[out_slot_].text.capacity() > 2048) std::string().swap(held_[out_slot_].text);
        free_.push_back(out_slot_);
        out_slot_ = UINT32_MAX;
        out_ = &none_;
    }
    while (count_ + heap_.size() < kReorderEntries && held_bytes_ < kReorderBytes && read_one()) hold();
    if (count_ > 0 && (heap_.empty() || !Later()(ring_[head_], heap_.front()))) {
        out_slot_ = static_cast<uint32_t>(ring_[head_].order & 0xffff);
        head_ = (head_ + 1) & mask;
        count_--;
    } else if (!heap_.empty()) {
        std::pop_heap(heap_.begin(), heap_.end(), Later());
        out_slot_ = static_cast<uint32_t>(heap_.back().order & 0xffff);
        heap_.pop_back();
    } else {
        return false;
    }
    Held& h = held_[out_slot_];
    size_t tag = h.entry.tag.size(), message = h.entry.message.size();
    held_bytes_ -= tag + message + kHeldCost;
    // The views point into the copy, which stays until the next call.
    const char* text = h.text.data();
    h.entry.tag = std::string_view(text, tag);
    h.entry.message = std::string_view(text + tag, message);
    h.entry.file = std::string_view(text + tag + message, h.entry.file.size());
    out_ = &h;
    // The lines next out were read thousands of lines ago: fetch them meanwhile.
    if (count_ > 8) __builtin_prefetch(&held_[ring_[(head_ + 8) & mask].order & 0xffff]);
    if (count_ > 0) {
        const Held& next = held_[ring_[head_].order & 0xffff];
        __builtin_prefetch(next.text.data());
        __builtin_prefetch(next.text.data() + 64);
    }
    return true;
}

void Lane::hold() {
    static_assert(kReorderEntries < 0xffff, "a slot's number fits its record");
    constexpr size_t mask = kReorderEntries - 1;
    if (held_.empty()) {
        held_.reserve(kReorderEntries + 1);
        ring_.reset(new Slot[kReorderEntries]);
    }
    uint32_t slot;
    if (free_.empty()) {
        slot = static_cast<uint32_t>(held_.size());
        held_.emplace_back();
    } else {
        slot = free_.back();
        free_.pop_back();
    }
    Held& h = held_[slot];
    h.entry = entry_;
    h.key = key_;
    h.text.assign(entry_.tag.data(), entry_.tag.size());
    h.text.append(entry_.message.data(), entry_.message.size());
    h.text.append(entry_.file.data(), entry_.file.size());
    held_bytes_ += entry_.tag.size() + entry_.message.size() + kHeldCost;
    Slot record{key_, arrivals_++ << 16 | slot};
    if (count_ == 0 || ring_[(head_ + count_ - 1) & mask].key <= key_) {
        ring_[(head_ + count_) & mask] = record;
        count_++;
    } else {
        heap_.push_back(record);
        std::push_heap(heap_.begin(), heap_.end(), Later());
    }
}

bool Lane::read_one() {
    if (hex_done_ < hex_line_.size()) {
        size_t n = std::min(kHexChunk, hex_line_.size() - hex_done_);
        static const char kHex[] = "0123456789abcdef";
        hex_text_.clear();
        hex_text_ += "[" + std::to_string(n) + " bytes]";
        for (size_t i = 0; i < n; i++) {
            unsigned char c = static_cast<unsigned char>(hex_line_[hex_done_ + i]);
            hex_text_ += ' ';
            hex_text_ += kHex[c >> 4];
            hex_text_ += kHex[c & 15];
        }
        entry_.kind = KIND_HEX;
        entry_.message = hex_text_;
        entry_.offset = hex_offset_ + hex_done_;
        hex_done_ += n;
        return true;
    }
    std::string_view line;
    uint64_t offset;
    const std::string* file;
    for (;;) {
        if (next_line(&line, &offset, &file) == NONE) return false;
        std::string_view zone;
        if (parse_header(line, &zone)) {
            set_zone(zone);
            continue;
        }
        if (!carry_.empty()) {
            joined_ = carry_;
            joined_.append(line.data(), line.size());
            line = joined_;
            offset = carry_offset_;
            file = &carry_file_;
            carry_.clear();
        }
        make_entry(line, offset, *file);
        return true;
    }
}

void Lane::make_entry(std::string_view line, uint64_t offset, const std::string& file) {
    entry_.source = source_;
    entry_.kind = KIND_LINE;
    entry_.priority = PRIO_NONE;
    entry_.pid = entry_.tid = -1;
    entry_.tag = std::string_view();
    entry_.message = line;
    entry_.file = file;
    entry_.offset = offset;
    entry_.boot = context_->boot;
    entry_.boot_name = context_->boot_name;
    entry_.run = context_->run_name;
    entry_.inherited = false;
    entry_.uptime_ns = -1;
    size_t note = base_path_.empty() ? note_start(line) : std::string_view::npos;
    if (note != std::string_view::npos) {
        if (note > 0) {
            // The piece before ended inside a line: its rest follows this note's piece header.
            std::string cut(line.data(), note);
            carry_.swap(cut);
            carry_file_ = file;
            carry_offset_ = offset;
        }
        entry_.kind = KIND_NOTE;
        entry_.message = line.substr(note);
        entry_.offset = offset + note;
        inherit();
        return;
    }
    ParsedLine p;
    if (source_ == SRC_BT) {
        bt_entry(line, offset);
    } else if (source_ == SRC_KERNEL ? parse_kernel(line, &p) : parse_threadtime(line, &p)) {
        if (source_ == SRC_KERNEL)
            kernel_entry(p);
        else
            android_entry(p);
    } else {
        entry_.kind = KIND_MALFORMED;
        inherit();
    }
}

void Lane::inherit() {
    entry_.inherited = true;
    entry_.has_instant = has_last_ && !untimed_;
    entry_.instant_ns = has_last_ ? last_instant_ : 0;
    entry_.utc_offset_s = last_offset_;
    key_ = has_last_ ? last_instant_ : INT64_MIN;
}

void Lane::android_entry(const ParsedLine& p) {
    if (p.kind == KIND_MARKER) {
        entry_.kind = KIND_MARKER;
        if (p.message.find("/dev/log/system") != std::string_view::npos) entry_.source = SRC_SYSTEM;
        inherit();
        return;
    }
    int year = p.year != 0 ? p.year : year_of(p.month, p.day);
    int date = (year * 13 + p.month) * 32 + p.day;
    if (date != cached_date_) {
        cached_date_ = date;
        cached_days_ = days_from_civil(year, p.month, p.day);
    }
    int64_t local = cached_days_ * 86400 + p.hour * 3600 + p.minute * 60 + p.second;
    int32_t off = zone_->offset_of_local(local);
    if (local - off >= MAX_TIME_S || local - off <= -MAX_TIME_S) {
        // A year no instant can hold (a damaged folder name): shown as it is.
        entry_.kind = KIND_MALFORMED;
        inherit();
        return;
    }
    entry_.instant_ns = (local - off) * 1000000000 + p.nanos;
    entry_.has_instant = true;
    entry_.utc_offset_s = off;
    entry_.priority = p.priority;
    entry_.pid = p.pid;
    entry_.tid = p.tid;
    entry_.tag = p.tag;
    entry_.message = p.message;
    key_ = entry_.instant_ns;
    has_last_ = true;
    last_instant_ = entry_.instant_ns;
    last_offset_ = off;
}

void Lane::kernel_entry(const ParsedLine& p) {
    entry_.priority = p.priority;
    entry_.message = p.message;
    entry_.uptime_ns = p.uptime_ns;
    if (p.uptime_ns < 0) {
        inherit();
        return;
    }
    if (untimed_) {
        entry_.has_instant = false;
        entry_.instant_ns = p.uptime_ns;
        entry_.utc_offset_s = 0;
    } else if (__builtin_add_overflow(context_->boot_wallclock_ns, p.uptime_ns, &entry_.instant_ns)) {
        inherit();
        return;
    } else {
        entry_.has_instant = true;
        entry_.utc_offset_s = zone_->offset_of_instant(floor_div(entry_.instant_ns, 1000000000));
    }
    key_ = entry_.instant_ns;
    has_last_ = true;
    last_instant_ = entry_.instant_ns;
    last_offset_ = entry_.utc_offset_s;
}

void Lane::bt_entry(std::string_view line, uint64_t offset) {
    entry_.has_instant = false;
    entry_.instant_ns = 0;
    entry_.utc_offset_s = 0;
    key_ = INT64_MIN;
    if (printable(line)) {
        if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
        entry_.message = line;
        return;
    }
    hex_line_ = line;
    hex_offset_ = offset;
    hex_done_ = 0;
    read_one();
}

void Lane::set_zone(std::string_view name) {
    std::string zone(name.empty() ? std::string_view("GMT") : name);
    if (zone == zone_->name()) return;
    zone_.reset(new Zone(zone));
    if (!zone_->known())
        warn("the zone \"%s\" (%s) is not in the system's zone data: its times are taken as UTC", zone.c_str(),
             context_->run_path.c_str());
}

int Lane::year_of(int month, int day) {
    int md = month * 32 + day;
    if (md == cached_md_) return cached_year_;
    int fy, fm, fd;
    civil_from_days(context_->folder_days, &fy, &fm, &fd);
    // The year that puts the date nearest the folder's: a December line in a
    // January folder is of the year before, a January line in a December folder
    // of the year after.
    int best = fy;
    int64_t best_gap = INT64_MAX;
    for (int y = fy - 1; y <= fy + 1; y++) {
        int64_t gap = days_from_civil(y, month, day) - context_->folder_days;
        if (gap < 0) gap = -gap;
        if (gap < best_gap) {
            best_gap = gap;
            best = y;
        }
    }
    cached_md_ = md;
    cached_year_ = best;
    return best;
}

bool Lane::poll() {
    if (base_path_.empty() || final_) return false;
    struct stat st;
    bool there = stat(base_path_.c_str(), &st) == 0;
    if (pieces_.empty()) {
        if (!there) return false;
        return append_piece(Piece{base_path_, base_path_.substr(base_path_.rfind('/') + 1)});
    }
    if (there && st.st_ino == inode_) return false;
    // The file being read was renamed to X.k: the generations newer than it,
    // then the new X, follow it.
    int ours = 0;
    for (int g = 1; g <= kGenerations && ours == 0; g++) {
        struct stat gs;
        if (stat((base_path_ + "." + std::to_string(g)).c_str(), &gs) == 0 && gs.st_ino == inode_) ours = g;
    }
    if (ours == 0) {
        warn("%s rotated more than %d times between two looks: lines may be missing", base_path_.c_str(),
             kGenerations);
        ours = kGenerations + 1;
    }
    bool added = false;
    for (int g = ours - 1; g >= 1; g--) {
        std::string path = base_path_ + "." + std::to_string(g);
        if (access(path.c_str(), F_OK) == 0) added |= append_piece(Piece{path, path.substr(path.rfind('/') + 1)});
    }
    if (there) added |= append_piece(Piece{base_path_, base_path_.substr(base_path_.rfind('/') + 1)});
    return added;
}

bool Lane::append_piece(const Piece& piece) {
    ino_t inode = 0;
    int fd = open_piece_fd(piece, &inode);
    if (fd < 0) return false;
    pieces_.push_back(piece);
    fds_.push_back(fd);
    inode_ = inode;
    return true;
}

}  // namespace tavlolog
