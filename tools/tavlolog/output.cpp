#include "tools/tavlolog/output.h"

#include <cstring>

#include "tools/tavlolog/line_parse.h"

namespace tavlolog {

void OutBuffer::flush() {
    if (buf_.empty()) return;
    if (fwrite(buf_.data(), 1, buf_.size(), out_) != buf_.size()) failed_ = true;
    buf_.clear();
    if (fflush(out_) != 0) failed_ = true;
}

namespace {

void two(char* p, int v) {
    p[0] = static_cast<char>('0' + v / 10);
    p[1] = static_cast<char>('0' + v % 10);
}

}  // namespace

void TimeFormat::local(std::string& out, int64_t instant_ns, int32_t offset_s, char separator, int fraction_digits) {
    int64_t local_ns = instant_ns + int64_t{offset_s} * 1000000000;
    int64_t secs = local_ns >= 0 ? local_ns / 1000000000 : -((-local_ns + 999999999) / 1000000000);
    int64_t frac = local_ns - secs * 1000000000;
    if (secs != cached_s_ || separator != cached_sep_) {
        int64_t days = secs >= 0 ? secs / 86400 : -((-secs + 86399) / 86400);
        int64_t rest = secs - days * 86400;
        int y, m, d;
        civil_from_days(days, &y, &m, &d);
        snprintf(text_, sizeof(text_), "%04d-", y < 0 ? 0 : y > 9999 ? 9999 : y);
        two(text_ + 5, m);
        text_[7] = '-';
        two(text_ + 8, d);
        text_[10] = separator;
        two(text_ + 11, static_cast<int>(rest / 3600));
        text_[13] = ':';
        two(text_ + 14, static_cast<int>(rest / 60 % 60));
        text_[16] = ':';
        two(text_ + 17, static_cast<int>(rest % 60));
        text_[19] = '.';
        cached_s_ = secs;
        cached_sep_ = separator;
    }
    out.append(text_, 20);
    char digits[9];
    for (int i = 8; i >= 0; i--, frac /= 10) digits[i] = static_cast<char>('0' + frac % 10);
    out.append(digits, static_cast<size_t>(fraction_digits));
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
