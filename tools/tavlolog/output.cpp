#include "tools/tavlolog/output.h"

#include <cstring>

#include "tools/tavlolog/line_parse.h"
#include "tools/tavlolog/text_scan.h"

namespace tavlolog {

void OutBuffer::flush() {
    if (len_ == 0) return;
    if (fwrite(buf_.get(), 1, len_, out_) != len_) failed_ = true;
    len_ = 0;
    if (fflush(out_) != 0) failed_ = true;
}

void OutBuffer::make_room(size_t n) {
    flush();
    if (room_ >= n) return;
    // A line longer than the buffer: a buffer as long, for this once and after.
    room_ = n;
    buf_.reset(new char[room_]);
}

void OutBuffer::append(const std::string& s) {
    char* w = reserve(s.size());
    memcpy(w, s.data(), s.size());
    commit(w + s.size());
}

void TimeFormat::local(std::string& out, int64_t instant_ns, int32_t offset_s, char separator, int fraction_digits) {
    char text[32];
    char* end = local(text, instant_ns, offset_s, separator, fraction_digits);
    out.append(text, static_cast<size_t>(end - text));
}

char* TimeFormat::local(char* out, int64_t instant_ns, int32_t offset_s, char separator, int fraction_digits) {
    int64_t local_ns = instant_ns + int64_t{offset_s} * 1000000000;
    int64_t secs = local_ns >= 0 ? local_ns / 1000000000 : -((-local_ns + 999999999) / 1000000000);
    uint32_t frac = static_cast<uint32_t>(local_ns - secs * 1000000000);
    if (secs != cached_s_ || separator != cached_sep_) {
        int64_t days = secs >= 0 ? secs / 86400 : -((-secs + 86399) / 86400);
        int64_t rest = secs - days * 86400;
        int y, m, d;
        civil_from_days(days, &y, &m, &d);
        y = y < 0 ? 0 : y > 9999 ? 9999 : y;
        put_digits(text_, static_cast<uint32_t>(y / 100));
        put_digits(text_ + 2, static_cast<uint32_t>(y % 100));
        text_[4] = '-';
        put_digits(text_ + 5, static_cast<uint32_t>(m));
        text_[7] = '-';
        put_digits(text_ + 8, static_cast<uint32_t>(d));
        text_[10] = separator;
        put_digits(text_ + 11, static_cast<uint32_t>(rest / 3600));
        text_[13] = ':';
        put_digits(text_ + 14, static_cast<uint32_t>(rest / 60 % 60));
        text_[16] = ':';
        put_digits(text_ + 17, static_cast<uint32_t>(rest % 60));
        text_[19] = '.';
        cached_s_ = secs;
        cached_sep_ = separator;
    }
    memcpy(out, text_, 20);
    char digits[10];
    digits[0] = static_cast<char>('0' + frac / 100000000);
    frac %= 100000000;
    put_digits(digits + 1, frac / 1000000);
    put_digits(digits + 3, frac / 10000 % 100);
    put_digits(digits + 5, frac / 100 % 100);
    put_digits(digits + 7, frac % 100);
    memcpy(out + 20, digits, 9);
    return out + 20 + fraction_digits;
}

const char* source_name(Source s) {
    static const char* const names[SRC_COUNT] = {"kernel", "main", "system", "radio", "events", "bt"};
    return s < SRC_COUNT ? names[s] : "";
}

const char* kind_name(Kind k) {
    static const char* const names[] = {"line", "marker", "note", "hex", "malformed"};
    return k <= KIND_MALFORMED ? names[k] : "";
}

}  // namespace tavlolog
