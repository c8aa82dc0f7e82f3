// The outputs of a merged timeline: text for the terminal, JSON Lines, the
// summary, and the HTML report; each is a Sink that writes as entries come.
#pragma once

#include <cstdio>
#include <memory>
#include <string>

#include "tools/tavlolog/timeline.h"

namespace tavlolog {

// Buffered writing to a stream; the outputs format into it by hand, which
// keeps a merge of a large folder bound by the disk, not by printf.
class OutBuffer {
  public:
    explicit OutBuffer(FILE* out) : out_(out) { buf_.reserve(kSize + 4096); }
    ~OutBuffer() { flush(); }
    std::string& text() { return buf_; }
    void maybe_flush() {
        if (buf_.size() >= kSize) flush();
    }
    void flush();
    bool failed() const { return failed_; }

  private:
    static constexpr size_t kSize = 1 << 20;
    FILE* out_;
    std::string buf_;
    bool failed_ = false;
};

// "2026-03-04 07:06:49.123000" in the entry's own zone, cached per second.
class TimeFormat {
  public:
    // 26 characters: date, time, microseconds (separator ' ' or 'T').
    void local(std::string& out, int64_t instant_ns, int32_t offset_s, char separator, int fraction_digits);

  private:
    int64_t cached_s_ = INT64_MIN;
    char cached_sep_ = 0;
    char text_[24] = {};
};

// The name of a source in JSON and the summary ("kernel", "main", ...).
const char* source_name(Source s);
const char* kind_name(Kind k);

std::unique_ptr<Sink> make_text_output(FILE* out, bool colour);
std::unique_ptr<Sink> make_json_output(FILE* out);
// The summary is written when the sink is destroyed; gaps longer than gap_s count.
std::unique_ptr<Sink> make_summary(FILE* out, int64_t gap_s);
// The HTML report's sink; nullptr (errno set) when the file cannot be opened.
// Destroying the sink writes the page; *ok then tells whether that worked.
std::unique_ptr<Sink> make_html_output(const char* path, const char* title, bool* ok);

}  // namespace tavlolog
